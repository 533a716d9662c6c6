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
  const std::vector<std::string>& Log() const { return log_; }
  void SetHook(Hook hook) { hook_ = std::move(hook); }
  void ResetCount() {
    calls_ = 0;
    log_.clear();
  }
  TavoConfigStore::ConfigStore& Inner() { return *inner_; }

  std::shared_ptr<TavoConfigStore::ConfigStoreObject> GetObject(
      const TavoConfigStore::ConfigStoreObjectId& id) override {
    Before("GetObject");
    return inner_->GetObject(id);
  }
  void SetObject(const std::shared_ptr<TavoConfigStore::ConfigStoreObject>& object,
                 std::int32_t& flags) override {
    Before("SetObject");
    inner_->SetObject(object, flags);
  }
  void DeleteObjects(const std::shared_ptr<TavoConfigStore::FilterSpecObject>& filter) override {
    Before("DeleteObjects");
    inner_->DeleteObjects(filter);
  }
  std::vector<std::shared_ptr<TavoConfigStore::ConfigStoreObject>> GetObjects(
      const std::shared_ptr<TavoConfigStore::FilterSpecObject>& filter) override {
    Before("GetObjects");
    return inner_->GetObjects(filter);
  }
  void BeginTransaction() override {
    Before("BeginTransaction");
    inner_->BeginTransaction();
  }
  void CommitTransaction() override {
    Before("CommitTransaction");
    inner_->CommitTransaction();
  }
  void AbortTransaction() override {
    Before("AbortTransaction");
    inner_->AbortTransaction();
  }

 private:
  void Before(const char* operation) {
    log_.emplace_back(operation);
    ++calls_;
    if (hook_) hook_(operation, calls_);
  }

  std::shared_ptr<TavoConfigStore::ConfigStore> inner_;
  Hook hook_;
  int calls_ = 0;
  std::vector<std::string> log_;
};

}  // namespace karst_reliability

#endif  // KARST_TESTS_RELIABILITY_FORWARDING_STORE_H_
