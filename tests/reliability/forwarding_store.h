// A store that forwards every call to another one after showing it to a hook,
// which may end the process or throw in the call's place. Installed with
// SetGlobalStore, it puts a crash or a fault in front of any single store call
// the library makes, while the real SQLite store does the work.

#ifndef KARST_TESTS_RELIABILITY_FORWARDING_STORE_H_
#define KARST_TESTS_RELIABILITY_FORWARDING_STORE_H_

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"

namespace karst_reliability {

class ForwardingStore final : public TavoConfigStore::ConfigStore {
 public:
  // Sees the operation's name and its position among all calls (from 1).
  using Hook = std::function<void(const char* operation, int index)>;

  ForwardingStore(std::shared_ptr<TavoConfigStore::ConfigStore> inner, Hook hook)
      : inner_(std::move(inner)), hook_(std::move(hook)) {}

  int Calls() const { return calls_; }
  // Every call in order; a call the inner store failed reads "name!code".
  const std::vector<std::string>& Log() const { return log_; }
  void SetHook(Hook hook) { hook_ = std::move(hook); }
  void ResetCount() {
    calls_ = 0;
    log_.clear();
  }
  TavoConfigStore::ConfigStore& Inner() { return *inner_; }

  std::shared_ptr<TavoConfigStore::ConfigStoreObject> GetObject(
      const TavoConfigStore::ConfigStoreObjectId& id) override {
    return Forward("GetObject", [&] { return inner_->GetObject(id); });
  }
  void SetObject(const std::shared_ptr<TavoConfigStore::ConfigStoreObject>& object,
                 std::int32_t& flags) override {
    Forward("SetObject", [&] { inner_->SetObject(object, flags); });
  }
  void DeleteObjects(const std::shared_ptr<TavoConfigStore::FilterSpecObject>& filter) override {
    Forward("DeleteObjects", [&] { inner_->DeleteObjects(filter); });
  }
  std::vector<std::shared_ptr<TavoConfigStore::ConfigStoreObject>> GetObjects(
      const std::shared_ptr<TavoConfigStore::FilterSpecObject>& filter) override {
    return Forward("GetObjects", [&] { return inner_->GetObjects(filter); });
  }
  void BeginTransaction() override {
    Forward("BeginTransaction", [&] { inner_->BeginTransaction(); });
  }
  void CommitTransaction() override {
    Forward("CommitTransaction", [&] { inner_->CommitTransaction(); });
  }
  void AbortTransaction() override {
    Forward("AbortTransaction", [&] { inner_->AbortTransaction(); });
  }

 private:
  // Shows the call to the hook, then runs it; a store error the inner store
  // throws is logged as "operation!code" and passed on.
  template <typename Call>
  auto Forward(const char* operation, Call call) -> decltype(call()) {
    log_.emplace_back(operation);
    const std::size_t entry = log_.size() - 1;
    ++calls_;
    if (hook_) hook_(operation, calls_);
    try {
      return call();
    } catch (const TavoConfigStore::ConfigStoreException& e) {
      log_[entry] += "!" + std::to_string(e.Code());
      throw;
    }
  }

  std::shared_ptr<TavoConfigStore::ConfigStore> inner_;
  Hook hook_;
  int calls_ = 0;
  std::vector<std::string> log_;
};

}  // namespace karst_reliability

#endif  // KARST_TESTS_RELIABILITY_FORWARDING_STORE_H_
