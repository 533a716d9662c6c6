#ifndef KARST_FRAME_COLLECTION_LIST_H_
#define KARST_FRAME_COLLECTION_LIST_H_

#include <string>
#include <vector>

#include "frame/StoreAccess.h"

namespace TavoKarst {

// Reads every object of one collection, in the store's order, into records.
// A ConfigStoreException while one object is read drops that record alone;
// anything thrown while opening the store or fetching the collection, and any
// other exception type, passes unchanged and no partial list is returned.
template <typename Record, typename ReadRecord>
std::vector<Record> ListCollection(const std::string& key, ReadRecord readRecord) {
  std::vector<Record> result;
  StorePtr store = OpenStore();
  std::vector<ObjectPtr> objects = store->GetObjects(CollectionFilter(key));
  result.reserve(objects.size());
  for (ObjectPtr& object : objects) {
    try {
      result.push_back(readRecord(*object));
    } catch (const TavoConfigStore::ConfigStoreException&) {
      // An unreadable record is left out; the rest of the catalogue is listed.
    }
    object.reset();
  }
  return result;
}

}  // namespace TavoKarst

#endif  // KARST_FRAME_COLLECTION_LIST_H_
