#ifndef TAVOCONFIGSTORE_CONFIG_STORE_H_
#define TAVOCONFIGSTORE_CONFIG_STORE_H_

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStoreException.h"
#include "TavoConfigStore/ConfigStoreObjectId.h"
#include "TavoConfigStore/Export.h"
#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {

// The namespace every host component shares.
extern CONFIGSTORE_EXPORT const std::string sGlobalNamespace;

// The host's configuration store. Every operation reports failure by throwing
// ConfigStoreException.
//
// Semantics common to both backends:
//  - Objects come back in the order in which they were written. SetObject of
//    an identifier that is stored already replaces the object whole, its
//    sub-objects included, and the object moves to the end of that order.
//  - An empty instance id is an ordinary identifier: it can be stored and
//    fetched. In a filter, an empty part matches anything.
//  - Inside a transaction the caller sees its own writes; AbortTransaction
//    restores exactly the state at BeginTransaction. Commit without a
//    transaction fails; Abort without one does nothing.
//  - Transactions nest: Begin while one is open starts an inner one (a
//    savepoint). Committing the inner one keeps its writes as part of the
//    outer one, aborting it undoes only its own writes; nothing is durable or
//    visible to others until the outermost Commit. So a caller can bracket
//    several operations that each begin and commit their own transaction.
//  - Outside a transaction each write is committed at once.
class CONFIGSTORE_EXPORT ConfigStore {
 public:
  // The store for "nameSpace" (only sGlobalNamespace is served). This is the
  // store installed with SetGlobalStore, or else the SQLite store at
  // DefaultStorePath(); the SQLite connection is cached per thread and
  // process, so calling this on every operation is cheap. When the last
  // handle to the cached connection is released by an exception unwinding
  // past it, a transaction still open on it is abandoned (AbortTransaction).
  static std::shared_ptr<ConfigStore> GetStore(const std::string& nameSpace);

  virtual ~ConfigStore();

  // The object with that identifier, or null when there is none. An object
  // whose stored encoding is damaged is returned all the same, and every read
  // of its values or sub-objects (and a SetObject of it) throws
  // ConfigStoreException with kErrorCorruptObject; the same goes for the
  // objects of GetObjects, so damage to one object fails only its reads.
  virtual std::shared_ptr<ConfigStoreObject> GetObject(const ConfigStoreObjectId& id) = 0;
  // Writes a copy of the object with its values and sub-objects. "flags" is
  // reserved and must be 0.
  virtual void SetObject(const std::shared_ptr<ConfigStoreObject>& object, std::int32_t& flags) = 0;
  virtual void DeleteObjects(const std::shared_ptr<FilterSpecObject>& filter) = 0;
  // Every object the filter matches, in write order, read from one snapshot.
  virtual std::vector<std::shared_ptr<ConfigStoreObject>> GetObjects(
      const std::shared_ptr<FilterSpecObject>& filter) = 0;
  virtual void BeginTransaction() = 0;
  virtual void CommitTransaction() = 0;
  virtual void AbortTransaction() = 0;

  // Waits until another connection may have changed the store, or until
  // "timeoutMs" has passed. True when a change was seen (or when the backend
  // cannot tell, so a caller should read again); false on a quiet timeout.
  // Not for use inside a transaction. The base version sleeps and says true.
  virtual bool WaitForChange(int timeoutMs);
};

// How a SQLite store waits for another process's write lock.
struct SqliteStoreOptions {
  // A writer (and a reader during another's crash recovery) waits this long
  // for the lock before failing with SQLITE_BUSY.
  int busyTimeoutMs = 10000;
};

// Backends. Each call returns a new, independent connection.
//
// The SQLite store takes "path" literally (no URI, no ":memory:"). A store
// that does not exist reads as empty and is created by the first write, with
// missing directories made 0700 and the file, its -wal and -shm 0600 (the
// umask may remove bits only). A path whose last component is a symbolic
// link is refused. A file the process may read but not write is opened
// read-only: reads work, writes fail with SQLite's SQLITE_READONLY.
// WaitForChange follows the path: another file moved there, or the file
// removed (and perhaps made again), is a change, and the store lets go of
// the old file and reads whatever is at the path from then on.
CONFIGSTORE_EXPORT std::shared_ptr<ConfigStore> NewSqliteStore(const std::string& path);
CONFIGSTORE_EXPORT std::shared_ptr<ConfigStore> NewSqliteStore(const std::string& path,
                                                               const SqliteStoreOptions& options);
CONFIGSTORE_EXPORT std::shared_ptr<ConfigStore> NewMemoryStore();

// A store locator is an etcd locator ("etcd://" or "etcds://", see
// EtcdStore.h) or the path of a SQLite store, nothing in between.
enum class LocatorKind { kPath, kEtcd };

// The kind of "locator". Anything else that looks like a URL is refused with
// ConfigStoreException(kErrorBadLocator) rather than taken as a path: a
// scheme and a slash ("http:/", "ETCD://", "etcdx://"), or "etcd" or
// "etcds" followed by ':' or "//", in any case. "./" in front makes such a
// name a path. Only the start is looked at: ParseEtcdLocator reads the rest.
CONFIGSTORE_EXPORT LocatorKind KindOfLocator(const std::string& locator);

// "locator" as every message shows it: the password of a "user:password@"
// replaced by "***", whatever else the locator holds.
CONFIGSTORE_EXPORT std::string RedactLocator(const std::string& locator);

// The store a locator names (see KindOfLocator): an etcd store or a SQLite
// store. A locator that cannot be used throws kErrorBadLocator, and nothing
// is created.
CONFIGSTORE_EXPORT std::shared_ptr<ConfigStore> OpenStore(const std::string& locator);

// $TAVO_CONFIGSTORE_PATH (a path or an etcd locator), else
// $XDG_STATE_HOME/tavo/configstore.db, else
// $HOME/.local/state/tavo/configstore.db (each of the last two only when the
// variable holds an absolute path). Without any of them there is no default:
// throws ConfigStoreException with kErrorNoStorePath rather than guess.
CONFIGSTORE_EXPORT std::string DefaultStorePath();

// Makes GetStore return "store" for the whole process (null restores the
// default SQLite store). For hosts that embed their own store or decorate one
// (see ForwardingStore.h).
CONFIGSTORE_EXPORT void SetGlobalStore(std::shared_ptr<ConfigStore> store);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_CONFIG_STORE_H_
