#ifndef TAVOCONFIGSTORE_FORWARDING_STORE_H_
#define TAVOCONFIGSTORE_FORWARDING_STORE_H_

#include <cstdint>
#include <memory>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/Export.h"

namespace TavoConfigStore {

// A store that passes every operation to another one. A host decorates any
// backend by deriving from it and overriding only the operations it cares
// about (to count, trace or refuse calls), then installs the decorator with
// SetGlobalStore.
class CONFIGSTORE_EXPORT ForwardingStore : public ConfigStore {
 public:
  // REQUIRES: "target" is not null.
  explicit ForwardingStore(std::shared_ptr<ConfigStore> target);
  ~ForwardingStore() override;

  ConfigStore& Target() const noexcept { return *target_; }

  std::shared_ptr<ConfigStoreObject> GetObject(const ConfigStoreObjectId& id) override;
  void SetObject(const std::shared_ptr<ConfigStoreObject>& object, std::int32_t& flags) override;
  void DeleteObjects(const std::shared_ptr<FilterSpecObject>& filter) override;
  std::vector<std::shared_ptr<ConfigStoreObject>> GetObjects(
      const std::shared_ptr<FilterSpecObject>& filter) override;
  void BeginTransaction() override;
  void CommitTransaction() override;
  void AbortTransaction() override;
  bool WaitForChange(int timeoutMs) override;

 private:
  std::shared_ptr<ConfigStore> target_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_FORWARDING_STORE_H_
