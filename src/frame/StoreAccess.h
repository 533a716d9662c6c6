#ifndef KARST_FRAME_STORE_ACCESS_H_
#define KARST_FRAME_STORE_ACCESS_H_

#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"

namespace TavoKarst {

using StorePtr = std::shared_ptr<TavoConfigStore::ConfigStore>;
using ObjectPtr = std::shared_ptr<TavoConfigStore::ConfigStoreObject>;

// The store every operation works on; the caller holds it for its call only.
StorePtr OpenStore();

// (key, "storage", "tavo") with an empty instance id: the whole collection.
TavoConfigStore::ConfigStoreObjectId CollectionId(const std::string& key);
// The id of one object of the collection.
TavoConfigStore::ConfigStoreObjectId ObjectId(const std::string& key,
                                              const std::string& instanceId);
std::shared_ptr<TavoConfigStore::FilterSpecObject> CollectionFilter(const std::string& key);

// A new, empty object to be written under (key, instanceId).
ObjectPtr NewObject(const std::string& key, const std::string& instanceId);
void WriteObject(TavoConfigStore::ConfigStore& store, const ObjectPtr& object);

// The named string value, or "" when the object lacks it. The read's own
// result is deliberately not examined.
std::string ReadString(const TavoConfigStore::StoreObject& object, const std::string& name);

// A new exception with the caught one's message, code and detail.
TavoConfigStore::ConfigStoreException CopyOf(const TavoConfigStore::ConfigStoreException& e);

// Delete every object of one collection inside the caller's transaction. With
// "ignoreErrors" a store error is swallowed; otherwise a copy is thrown.
void ClearPolicies(const StorePtr& store, bool ignoreErrors);
void ClearDatastores(const StorePtr& store, bool ignoreErrors);

}  // namespace TavoKarst

#endif  // KARST_FRAME_STORE_ACCESS_H_
