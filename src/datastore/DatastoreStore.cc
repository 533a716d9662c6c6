#include "datastore/DatastoreStore.h"

#include "frame/CollectionList.h"
#include "frame/FixedNames.h"
#include "frame/WriteBracket.h"

namespace TavoKarst {

namespace {
KarstDatastoreInfo ReadDatastore(const TavoConfigStore::ConfigStoreObject& object) {
  KarstDatastoreInfo datastore;
  datastore.url = ReadString(object, kUrlValue);
  datastore.datastore_namespace = ReadString(object, kDatastoreNamespaceValue);
  datastore.drp_policy_id = ReadString(object, kDrpPolicyIdValue);
  return datastore;
}

ObjectPtr BuildDatastoreObject(const KarstDatastoreInfo& datastore) {
  ObjectPtr object = NewObject(kDatastoresKey, datastore.url);
  object->SetValue(kUrlValue.c_str(), datastore.url);
  object->SetValue(kDatastoreNamespaceValue.c_str(), datastore.datastore_namespace);
  object->SetValue(kDrpPolicyIdValue.c_str(), datastore.drp_policy_id);
  return object;
}
}  // namespace

void StoreDatastores(const std::vector<KarstDatastoreInfo>& datastores) {
  ReplaceCollection(ClearDatastores, datastores, BuildDatastoreObject);
}

std::vector<KarstDatastoreInfo> ListDatastores() {
  return ListCollection<KarstDatastoreInfo>(kDatastoresKey, ReadDatastore);
}

}  // namespace TavoKarst
