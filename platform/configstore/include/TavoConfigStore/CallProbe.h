#ifndef TAVOCONFIGSTORE_CALL_PROBE_H_
#define TAVOCONFIGSTORE_CALL_PROBE_H_

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "TavoConfigStore/Export.h"

namespace TavoConfigStore {

// Test seam: sees every store call of the process before it runs and may
// throw in its place. Operations are named "GetStore", the seven store
// operations ("GetObject", "SetObject", "DeleteObjects", "GetObjects",
// "BeginTransaction", "CommitTransaction", "AbortTransaction") and the object
// operations ("SetValue", "GetValue", "CreateSubObject", "GetSubObject",
// "GetSubObjectInstances"). Both backends report their calls.
class CONFIGSTORE_EXPORT CallProbe {
 public:
  virtual ~CallProbe();
  virtual void OnCall(const char* operation) = 0;
};

// Installs "probe" for the whole process; null removes it.
CONFIGSTORE_EXPORT void InstallCallProbe(std::shared_ptr<CallProbe> probe);

// Called by the store at each operation; does nothing without a probe.
CONFIGSTORE_EXPORT void NotifyCall(const char* operation);

// A probe that logs every call and makes chosen calls fail: the Nth call
// (counted from 1) of an operation throws, once or from then on.
class CONFIGSTORE_EXPORT FaultInjector : public CallProbe {
 public:
  // Throws ConfigStoreException(message, code).
  void FailStoreError(const std::string& operation, int nth, const std::string& message,
                      std::int32_t code, bool persistent = false);
  // Runs "thrower", which is to throw something else (std::bad_alloc, say).
  void FailWith(const std::string& operation, int nth, std::function<void()> thrower,
                bool persistent = false);
  // Forgets every planned fault; counts and log stay.
  void ClearFaults();

  // Every call seen so far, failed ones included, in order.
  std::vector<std::string> Calls() const;
  // The calls among "operations" only.
  std::vector<std::string> Calls(const std::vector<std::string>& operations) const;
  int Count(const std::string& operation) const;
  void ClearLog();

  void OnCall(const char* operation) override;

 private:
  struct Fault {
    std::string operation;
    int nth;
    bool persistent;
    std::function<void()> thrower;
  };
  mutable std::mutex mu_;
  std::vector<Fault> faults_;
  std::vector<std::string> log_;
  std::map<std::string, int, std::less<>> counts_;
};

// The seven store operations plus GetStore: the sequence a caller makes
// against the store, without the object-level calls.
CONFIGSTORE_EXPORT const std::vector<std::string>& StoreOperations();

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_CALL_PROBE_H_
