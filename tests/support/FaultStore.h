// A store decorator for tests: logs every call it sees and makes chosen calls
// fail. It wraps any backend, so the same faults reach the in-memory store and
// the SQLite store alike.
//
// Calls are named after the store operations ("GetObject", "SetObject",
// "DeleteObjects", "GetObjects", "BeginTransaction", "CommitTransaction",
// "AbortTransaction") and the reads of the objects it hands out ("GetValue",
// "GetSubObject", "GetSubObjectInstances", on stored objects and their
// sub-objects alike). A planned fault runs in place of the call; the call is
// logged all the same.

#ifndef KARST_TESTS_SUPPORT_FAULT_STORE_H_
#define KARST_TESTS_SUPPORT_FAULT_STORE_H_

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/ForwardingStore.h"

namespace karst_test {

// The code and message of a store error planned by a test.
inline constexpr std::int32_t kFaultCode = 7001;
inline constexpr const char* kFaultMessage = "planned store failure";

enum class FaultKind {
  kStoreErrorOnce,        // ConfigStoreException(kFaultMessage, kFaultCode) at that call
  kStoreErrorFromThenOn,  // the same at that call and every later call of that operation
  kBadAlloc,              // std::bad_alloc at that call
  kProcessDeath,          // _exit(kDeathStatus) at that call, before it reaches the store
};
inline constexpr int kDeathStatus = 77;
const char* Describe(FaultKind kind);

class FaultStore : public TavoConfigStore::ForwardingStore {
 public:
  explicit FaultStore(std::shared_ptr<TavoConfigStore::ConfigStore> target);

  // The "nth" call (counted from 1 since the last ClearLog) of "operation"
  // fails as "kind" says.
  void Fail(const std::string& operation, int nth, FaultKind kind);
  // The "nth" call runs "thrower" instead, once or from then on.
  void FailWith(const std::string& operation, int nth, std::function<void()> thrower,
                bool persistent = false);
  // The "nth" call of any operation (counted over all calls) fails as "kind"
  // says: the sweep's fault point. "From then on" covers the later calls of
  // the operation that call was.
  void FailAtCall(int nth, FaultKind kind);
  void ClearFaults();

  // Every call since the last ClearLog, in order, failed ones included.
  std::vector<std::string> Calls() const;
  void ClearLog();

  // True between a BeginTransaction that returned and the next Commit or
  // Abort that reached the store.
  bool TransactionOpen() const;

  std::shared_ptr<TavoConfigStore::ConfigStoreObject> GetObject(
      const TavoConfigStore::ConfigStoreObjectId& id) override;
  void SetObject(const std::shared_ptr<TavoConfigStore::ConfigStoreObject>& object,
                 std::int32_t& flags) override;
  void DeleteObjects(const std::shared_ptr<TavoConfigStore::FilterSpecObject>& filter) override;
  std::vector<std::shared_ptr<TavoConfigStore::ConfigStoreObject>> GetObjects(
      const std::shared_ptr<TavoConfigStore::FilterSpecObject>& filter) override;
  void BeginTransaction() override;
  void CommitTransaction() override;
  void AbortTransaction() override;

  // Logs "operation" and runs the fault planned for it, if any. Public for
  // the objects this store hands out.
  void OnCall(const char* operation);

 private:
  struct Fault {
    std::string operation;  // empty: any operation, counted over all calls
    int nth;
    bool persistent;
    std::function<void()> thrower;
  };
  std::shared_ptr<TavoConfigStore::ConfigStoreObject> Watch(
      std::shared_ptr<TavoConfigStore::ConfigStoreObject> object);

  mutable std::mutex mu_;
  std::vector<Fault> faults_;
  std::vector<std::string> log_;
  std::map<std::string, int, std::less<>> counts_;
  bool open_ = false;
};

// Installs a FaultStore over "target" as the process's store while alive.
class ScopedFaultStore {
 public:
  explicit ScopedFaultStore(std::shared_ptr<TavoConfigStore::ConfigStore> target);
  ~ScopedFaultStore();
  ScopedFaultStore(const ScopedFaultStore&) = delete;
  ScopedFaultStore& operator=(const ScopedFaultStore&) = delete;
  FaultStore& operator*() const { return *store_; }
  FaultStore* operator->() const { return store_.get(); }

 private:
  std::shared_ptr<FaultStore> store_;
};

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_FAULT_STORE_H_
