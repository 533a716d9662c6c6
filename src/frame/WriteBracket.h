#ifndef KARST_FRAME_WRITE_BRACKET_H_
#define KARST_FRAME_WRITE_BRACKET_H_

#include "frame/StoreAccess.h"

namespace TavoKarst {

// Runs "changes(store)" inside one store transaction. A ConfigStoreException
// from opening the store up to the commit abandons the transaction (when a
// store was obtained) and reaches the caller as a copy; any other exception
// passes unchanged with neither commit nor abort.
template <typename Changes>
void RunInWriteBracket(Changes&& changes) {
  StorePtr store;
  try {
    store = OpenStore();
    store->BeginTransaction();
    changes(store);
    store->CommitTransaction();
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    if (store) {
      try {
        store->AbortTransaction();
      } catch (const TavoConfigStore::ConfigStoreException&) {
        // The caller is better served by the error that ended the write
        // than by a failure to abandon it.
      }
    }
    throw CopyOf(e);
  }
}

// Replaces one whole collection: clears it (errors raised) and writes the
// object "build" makes of each record, in input order, in one transaction.
template <typename Record, typename Build>
void ReplaceCollection(void (*clear)(const StorePtr&, bool), const std::vector<Record>& records,
                       Build build) {
  RunInWriteBracket([&](const StorePtr& store) {
    clear(store, false);
    for (const Record& record : records) WriteObject(*store, build(record));
  });
}

}  // namespace TavoKarst

#endif  // KARST_FRAME_WRITE_BRACKET_H_
