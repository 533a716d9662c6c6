// Test-only access to the SQLite backend's connection, so tests can shorten
// the busy timeout or disturb a transaction the way SQLite itself might.

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_STORE_TESTING_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_STORE_TESTING_H_

#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/Export.h"

struct sqlite3;

namespace TavoConfigStore {

// The connection behind a store from NewSqliteStore; null for any other store.
CONFIGSTORE_EXPORT sqlite3* SqliteConnectionForTesting(ConfigStore& store);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_STORE_TESTING_H_
