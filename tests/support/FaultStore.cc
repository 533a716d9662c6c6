#include "FaultStore.h"

#include <unistd.h>

#include <new>
#include <utility>

#include "TavoConfigStore/ConfigStoreException.h"

namespace karst_test {

using TavoConfigStore::ConfigStore;
using TavoConfigStore::ConfigStoreObject;
using TavoConfigStore::ConfigStoreObjectId;
using TavoConfigStore::FilterSpecObject;
using TavoConfigStore::StoreObject;
using TavoConfigStore::SubObjectId;

namespace {

// An object of type "Base" that reports its value reads to the store that
// handed it out. It must not outlive the store.
template <typename Base>
class ReportsValueReads : public Base {
 public:
  template <typename... Args>
  explicit ReportsValueReads(FaultStore* store, Args&&... args)
      : Base(std::forward<Args>(args)...), store_(store) {}
  bool GetValue(const char* name, std::string* value) const override {
    store_->OnCall("GetValue");
    return Base::GetValue(name, value);
  }
  bool GetValue(const char* name, long long* value) const override {
    store_->OnCall("GetValue");
    return Base::GetValue(name, value);
  }

 protected:
  FaultStore* store_;
};

std::shared_ptr<StoreObject> WatchSub(FaultStore* store, const std::shared_ptr<StoreObject>& sub) {
  return sub ? std::make_shared<ReportsValueReads<StoreObject>>(store, *sub) : nullptr;
}

// A copy of a stored object that reports its reads, and those of its
// sub-objects, to the store that handed it out.
class WatchedObject final : public ReportsValueReads<ConfigStoreObject> {
 public:
  WatchedObject(FaultStore* store, const ConfigStoreObject& object)
      : ReportsValueReads(store, object) {}
  std::shared_ptr<StoreObject> GetSubObject(const SubObjectId& id) const override {
    store_->OnCall("GetSubObject");
    return WatchSub(store_, ConfigStoreObject::GetSubObject(id));
  }
  std::vector<std::shared_ptr<StoreObject>> GetSubObjectInstances(
      const std::shared_ptr<FilterSpecObject>& filter) const override {
    store_->OnCall("GetSubObjectInstances");
    std::vector<std::shared_ptr<StoreObject>> out =
        ConfigStoreObject::GetSubObjectInstances(filter);
    for (auto& sub : out) sub = WatchSub(store_, sub);
    return out;
  }
};

std::function<void()> ThrowerFor(FaultKind kind) {
  if (kind == FaultKind::kBadAlloc) return [] { throw std::bad_alloc(); };
  if (kind == FaultKind::kProcessDeath) return [] { _exit(kDeathStatus); };
  return [] { throw TavoConfigStore::ConfigStoreException(kFaultMessage, kFaultCode); };
}

}  // namespace

const char* Describe(FaultKind kind) {
  static const char* const kNames[] = {"store error once", "store error from then on", "bad_alloc",
                                       "process death"};
  return kNames[static_cast<int>(kind)];
}

FaultStore::FaultStore(std::shared_ptr<ConfigStore> target) : ForwardingStore(std::move(target)) {}

void FaultStore::Fail(const std::string& operation, int nth, FaultKind kind) {
  FailWith(operation, nth, ThrowerFor(kind), kind == FaultKind::kStoreErrorFromThenOn);
}

void FaultStore::FailWith(const std::string& operation, int nth, std::function<void()> thrower,
                          bool persistent) {
  std::lock_guard<std::mutex> lock(mu_);
  faults_.push_back(Fault{operation, nth, persistent, std::move(thrower)});
}

void FaultStore::FailAtCall(int nth, FaultKind kind) { Fail("", nth, kind); }

void FaultStore::ClearFaults() {
  std::lock_guard<std::mutex> lock(mu_);
  faults_.clear();
}

std::vector<std::string> FaultStore::Calls() const {
  std::lock_guard<std::mutex> lock(mu_);
  return log_;
}

void FaultStore::ClearLog() {
  std::lock_guard<std::mutex> lock(mu_);
  log_.clear();
  counts_.clear();
}

bool FaultStore::TransactionOpen() const {
  std::lock_guard<std::mutex> lock(mu_);
  return open_;
}

void FaultStore::OnCall(const char* operation) {
  std::function<void()> thrower;
  {
    std::lock_guard<std::mutex> lock(mu_);
    log_.emplace_back(operation);
    const int seen = ++counts_[log_.back()];
    const int overall = static_cast<int>(log_.size());
    for (Fault& f : faults_) {
      if (f.operation.empty() && overall == f.nth) {
        // From here on the fault belongs to the operation it met, so "from
        // then on" means that operation's later calls.
        f.operation = operation;
        f.nth = seen;
      }
      if (f.operation == operation && (seen == f.nth || (f.persistent && seen > f.nth))) {
        thrower = f.thrower;
        break;
      }
    }
  }
  if (thrower) thrower();
}

std::shared_ptr<ConfigStoreObject> FaultStore::Watch(std::shared_ptr<ConfigStoreObject> object) {
  return object ? std::make_shared<WatchedObject>(this, *object) : nullptr;
}

std::shared_ptr<ConfigStoreObject> FaultStore::GetObject(const ConfigStoreObjectId& id) {
  OnCall("GetObject");
  return Watch(ForwardingStore::GetObject(id));
}

void FaultStore::SetObject(const std::shared_ptr<ConfigStoreObject>& object, std::int32_t& flags) {
  OnCall("SetObject");
  ForwardingStore::SetObject(object, flags);
}

void FaultStore::DeleteObjects(const std::shared_ptr<FilterSpecObject>& filter) {
  OnCall("DeleteObjects");
  ForwardingStore::DeleteObjects(filter);
}

std::vector<std::shared_ptr<ConfigStoreObject>> FaultStore::GetObjects(
    const std::shared_ptr<FilterSpecObject>& filter) {
  OnCall("GetObjects");
  std::vector<std::shared_ptr<ConfigStoreObject>> out = ForwardingStore::GetObjects(filter);
  for (auto& object : out) object = Watch(object);
  return out;
}

void FaultStore::BeginTransaction() {
  OnCall("BeginTransaction");
  ForwardingStore::BeginTransaction();
  std::lock_guard<std::mutex> lock(mu_);
  open_ = true;
}

void FaultStore::CommitTransaction() {
  OnCall("CommitTransaction");
  ForwardingStore::CommitTransaction();
  std::lock_guard<std::mutex> lock(mu_);
  open_ = false;
}

void FaultStore::AbortTransaction() {
  OnCall("AbortTransaction");
  {
    std::lock_guard<std::mutex> lock(mu_);
    open_ = false;
  }
  ForwardingStore::AbortTransaction();
}

ScopedFaultStore::ScopedFaultStore(std::shared_ptr<ConfigStore> target)
    : store_(std::make_shared<FaultStore>(std::move(target))) {
  TavoConfigStore::SetGlobalStore(store_);
}

ScopedFaultStore::~ScopedFaultStore() { TavoConfigStore::SetGlobalStore(nullptr); }

}  // namespace karst_test
