#include "frame/StoreAccess.h"

#include "frame/FixedNames.h"

namespace TavoKarst {

using TavoConfigStore::ConfigStore;
using TavoConfigStore::ConfigStoreException;
using TavoConfigStore::ConfigStoreObject;
using TavoConfigStore::ConfigStoreObjectId;
using TavoConfigStore::FilterSpecObject;

StorePtr OpenStore() { return ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace); }

ConfigStoreObjectId CollectionId(const std::string& key) {
  return ConfigStoreObjectId(key, std::string("storage"), kTavoComponent);
}

ConfigStoreObjectId ObjectId(const std::string& key, const std::string& instanceId) {
  ConfigStoreObjectId id = CollectionId(key);
  id.SetInstanceId(instanceId);
  return id;
}

std::shared_ptr<FilterSpecObject> CollectionFilter(const std::string& key) {
  return std::make_shared<FilterSpecObject>(CollectionId(key));
}

ObjectPtr NewObject(const std::string& key, const std::string& instanceId) {
  return std::make_shared<ConfigStoreObject>(ObjectId(key, instanceId));
}

void WriteObject(ConfigStore& store, const ObjectPtr& object) {
  std::int32_t flags = 0;
  store.SetObject(object, flags);
}

std::string ReadString(const TavoConfigStore::StoreObject& object, const std::string& name) {
  std::string value;
  object.GetValue(name.c_str(), &value);
  return value;
}

ConfigStoreException CopyOf(const ConfigStoreException& e) {
  return ConfigStoreException(e.Message(), e.Code(), e.Detail());
}

namespace {
void ClearCollection(const StorePtr& store, const std::string& key, bool ignoreErrors) {
  try {
    store->DeleteObjects(CollectionFilter(key));
  } catch (const ConfigStoreException& e) {
    if (!ignoreErrors) throw CopyOf(e);
  }
}
}  // namespace

void ClearPolicies(const StorePtr& store, bool ignoreErrors) {
  ClearCollection(store, kPoliciesKey, ignoreErrors);
}

void ClearDatastores(const StorePtr& store, bool ignoreErrors) {
  ClearCollection(store, kDatastoresKey, ignoreErrors);
}

}  // namespace TavoKarst
