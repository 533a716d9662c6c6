#ifndef KARST_DATASTORE_DATASTORE_STORE_H_
#define KARST_DATASTORE_DATASTORE_STORE_H_

#include <vector>

#include "TavoKarst/KarstLib.h"

namespace TavoKarst {

// Replaces the datastore collection with "datastores" in one transaction.
void StoreDatastores(const std::vector<KarstDatastoreInfo>& datastores);

// Every stored datastore in the store's order; unreadable ones are left out.
std::vector<KarstDatastoreInfo> ListDatastores();

}  // namespace TavoKarst

#endif  // KARST_DATASTORE_DATASTORE_STORE_H_
