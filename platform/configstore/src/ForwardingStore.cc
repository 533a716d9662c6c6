#include "TavoConfigStore/ForwardingStore.h"

#include <utility>

namespace TavoConfigStore {

ForwardingStore::ForwardingStore(std::shared_ptr<ConfigStore> target)
    : target_(std::move(target)) {}

ForwardingStore::~ForwardingStore() = default;

std::shared_ptr<ConfigStoreObject> ForwardingStore::GetObject(const ConfigStoreObjectId& id) {
  return target_->GetObject(id);
}

void ForwardingStore::SetObject(const std::shared_ptr<ConfigStoreObject>& object,
                                std::int32_t& flags) {
  target_->SetObject(object, flags);
}

void ForwardingStore::DeleteObjects(const std::shared_ptr<FilterSpecObject>& filter) {
  target_->DeleteObjects(filter);
}

std::vector<std::shared_ptr<ConfigStoreObject>> ForwardingStore::GetObjects(
    const std::shared_ptr<FilterSpecObject>& filter) {
  return target_->GetObjects(filter);
}

void ForwardingStore::BeginTransaction() { target_->BeginTransaction(); }
void ForwardingStore::CommitTransaction() { target_->CommitTransaction(); }
void ForwardingStore::AbortTransaction() { target_->AbortTransaction(); }
bool ForwardingStore::WaitForChange(int timeoutMs) { return target_->WaitForChange(timeoutMs); }

}  // namespace TavoConfigStore
