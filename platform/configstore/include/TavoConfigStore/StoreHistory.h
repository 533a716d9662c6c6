#ifndef TAVOCONFIGSTORE_STORE_HISTORY_H_
#define TAVOCONFIGSTORE_STORE_HISTORY_H_

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/Export.h"

namespace TavoConfigStore {

// The history a store keeps of itself. A version is the state of the whole
// store after one committed change: a committed transaction that wrote
// something, or a single write outside one. Versions are numbered upwards
// from 1 and a number is never given out twice. The store keeps its last
// "depth" versions (the current state is the newest of them) and forgets
// older ones as new ones come; depth 0 keeps none.
//
// Only stores returned by NewSqliteStore, NewEtcdStore and OpenStore (for a
// path or an etcd locator) keep a history. Every function below throws ConfigStoreException with
// kErrorNoHistory for any other store, kErrorNoSuchVersion for a version the
// store does not keep (any longer), or the store's own error.

// One kept version: who made it and when.
struct StoreVersion {
  std::uint64_t number = 0;
  std::int64_t unixTimeMs = 0;  // when it was committed, by the writer's clock
  std::string host;             // the writer's host name
  std::string user;             // the writer's user name (or numeric uid)
};

// The kept versions, newest first. A store nobody has written yet has none.
CONFIGSTORE_EXPORT std::vector<StoreVersion> ListVersions(ConfigStore& store);

// The number of the newest version, also when none is kept (depth 0); 0
// before the first write.
CONFIGSTORE_EXPORT std::uint64_t NewestVersion(ConfigStore& store);

// How many versions the store keeps: 10 unless SetHistoryDepth changed it.
CONFIGSTORE_EXPORT unsigned HistoryDepth(ConfigStore& store);

// Keeps the last "depth" versions from now on; a smaller depth forgets the
// versions beyond it at once. Kept in the store, so every writer keeps the
// same number.
CONFIGSTORE_EXPORT void SetHistoryDepth(ConfigStore& store, unsigned depth);

// A read-only store holding version "number" as it was committed: GetObject
// and GetObjects answer from it, writes throw SQLITE_READONLY, and its
// transactions do nothing (so code that brackets its reads still runs on
// it). It keeps "store" open as long as it lives. Reads fail with
// kErrorNoSuchVersion once the store has forgotten the version.
CONFIGSTORE_EXPORT std::shared_ptr<ConfigStore> OpenVersion(
    const std::shared_ptr<ConfigStore>& store, std::uint64_t number);

// Makes version "number" the current state, every collection with the
// objects it held then, in their write order, in one transaction; this is a
// change like any other and so becomes a new version. A version no longer
// kept throws kErrorNoSuchVersion and changes nothing. Returns the number of
// the new version.
CONFIGSTORE_EXPORT std::uint64_t Rollback(ConfigStore& store, std::uint64_t number);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_STORE_HISTORY_H_
