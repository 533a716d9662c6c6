// What every backend shares: the checks of a caller's arguments, made here
// once before a backend sees them, so that a backend's operations take
// references to what is there.

#ifndef TAVOCONFIGSTORE_SRC_BACKEND_H_
#define TAVOCONFIGSTORE_SRC_BACKEND_H_

#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"
#include "object/DamagedObject.h"

namespace TavoConfigStore {

class Backend : public ConfigStore {
 public:
  std::shared_ptr<ConfigStoreObject> GetObject(const ConfigStoreObjectId& id) final {
    return Get(id);
  }
  void SetObject(const std::shared_ptr<ConfigStoreObject>& object, std::int32_t& /*flags*/) final {
    if (!object) Refuse("SetObject");
    // Writing a damaged object back would store what is left of it.
    DamagedObject::RefuseWrite(*object);
    Set(*object);
  }
  void DeleteObjects(const std::shared_ptr<FilterSpecObject>& filter) final {
    if (!filter) Refuse("DeleteObjects");
    Delete(*filter);
  }
  std::vector<std::shared_ptr<ConfigStoreObject>> GetObjects(
      const std::shared_ptr<FilterSpecObject>& filter) final {
    if (!filter) Refuse("GetObjects");
    return List(*filter);
  }

 protected:
  // The store, for messages: "SQLite store PATH", "etcd HOST:PORT,...".
  virtual std::string Where() const = 0;
  virtual std::shared_ptr<ConfigStoreObject> Get(const ConfigStoreObjectId& id) = 0;
  virtual void Set(const ConfigStoreObject& object) = 0;
  virtual void Delete(const FilterSpecObject& filter) = 0;
  virtual std::vector<std::shared_ptr<ConfigStoreObject>> List(const FilterSpecObject& filter) = 0;

  [[noreturn]] void NoTransactionToCommit() const {
    throw ConfigStoreException(Where() + ": no transaction to commit", kErrorNoTransaction);
  }

 private:
  [[noreturn]] void Refuse(const char* operation) const {
    throw ConfigStoreException(Where() + ": " + operation + " of null", kErrorNullArgument);
  }
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_BACKEND_H_
