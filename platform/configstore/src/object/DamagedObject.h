// An object whose stored body cannot be decoded. It is listed under its
// identifier like any other, and every read of its contents throws the
// decoding error, so that only the reads of this one object fail.

#ifndef TAVOCONFIGSTORE_SRC_OBJECT_DAMAGED_OBJECT_H_
#define TAVOCONFIGSTORE_SRC_OBJECT_DAMAGED_OBJECT_H_

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "TavoConfigStore/ConfigStoreException.h"
#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {

class DamagedObject final : public ConfigStoreObject {
 public:
  DamagedObject(ConfigStoreObjectId&& id, const ConfigStoreException& error)
      : ConfigStoreObject(std::move(id)), error_(error) {}

  bool GetValue(const char* /*name*/, std::string* /*value*/) const override { throw error_; }
  bool GetValue(const char* /*name*/, long long* /*value*/) const override { throw error_; }
  std::shared_ptr<StoreObject> GetSubObject(const SubObjectId& /*id*/) const override {
    throw error_;
  }
  std::vector<std::shared_ptr<StoreObject>> GetSubObjectInstances(
      const std::shared_ptr<FilterSpecObject>& /*filter*/) const override {
    throw error_;
  }

  // Writing one back would store it empty: what is left of it is refused.
  static void RefuseWrite(const ConfigStoreObject& object) {
    if (const auto* damaged = dynamic_cast<const DamagedObject*>(&object)) throw damaged->error_;
  }

 private:
  ConfigStoreException error_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_OBJECT_DAMAGED_OBJECT_H_
