// The store every host component shares: the one a host installed, or else
// the default store, opened once per thread and process.

#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <exception>
#include <mutex>

#include "TavoConfigStore/ConfigStore.h"

namespace TavoConfigStore {
namespace {

std::atomic<bool> gInstalled{false};
std::mutex gInstalledMu;
std::shared_ptr<ConfigStore> gInstalledStore;

std::shared_ptr<ConfigStore> InstalledStore() {
  if (!gInstalled.load(std::memory_order_acquire)) return nullptr;
  std::lock_guard<std::mutex> lock(gInstalledMu);
  return gInstalledStore;
}

// One connection to the default store per thread keeps GetStore cheap
// without sharing a SQLite connection between threads.
struct CachedConnection {
  pid_t pid = 0;
  std::string path;
  std::shared_ptr<ConfigStore> store;
  // The handles given out share one count, so the store sees the last go.
  std::weak_ptr<ConfigStore> handles;
};

// A caller whose exception (std::bad_alloc, say) escapes between Begin and
// Commit leaves the cached connection's transaction open: its write lock
// would keep every other writer out, and its half-done writes would be what
// this thread reads, until the thread happens to write again. So when the
// last handle goes because an exception is unwinding past it, the open
// transaction is abandoned: nobody is left who could end it. A handle that
// is merely dropped (GetStore(ns)->BeginTransaction(), then a new GetStore
// for each later call) keeps its transaction.
std::shared_ptr<ConfigStore> NewHandle(CachedConnection& cache) {
  const int unwinding = std::uncaught_exceptions();
  std::shared_ptr<ConfigStore> store = cache.store;
  const pid_t pid = cache.pid;
  std::shared_ptr<ConfigStore> handle(store.get(), [store, pid, unwinding](ConfigStore*) {
    if (std::uncaught_exceptions() <= unwinding || getpid() != pid) return;
    try {
      store->AbortTransaction();  // does nothing without an open transaction
    } catch (...) {
      // Nothing better to do during unwinding; the next Begin reports it.
    }
  });
  cache.handles = handle;
  return handle;
}

std::shared_ptr<ConfigStore> DefaultStore() {
  thread_local CachedConnection cache;
  std::string path = DefaultStorePath();
  if (cache.store && cache.pid == getpid() && cache.path == path) {
    if (std::shared_ptr<ConfigStore> handle = cache.handles.lock()) return handle;
    return NewHandle(cache);
  }
  if (cache.store && cache.pid != getpid()) {
    // A connection inherited through fork() belongs to the parent: closing
    // it here could disturb the parent's locks and WAL, so it is abandoned.
    new std::shared_ptr<ConfigStore>(std::move(cache.store));
  }
  cache.store = OpenStore(path);
  cache.pid = getpid();
  cache.path = std::move(path);
  return NewHandle(cache);
}

}  // namespace

std::shared_ptr<ConfigStore> ConfigStore::GetStore(const std::string& nameSpace) {
  if (nameSpace != sGlobalNamespace) {
    throw ConfigStoreException("configuration store: unknown namespace \"" + nameSpace + "\"",
                               kErrorUnknownNamespace);
  }
  if (auto installed = InstalledStore()) return installed;
  return DefaultStore();
}

void SetGlobalStore(std::shared_ptr<ConfigStore> store) {
  std::lock_guard<std::mutex> lock(gInstalledMu);
  gInstalled.store(store != nullptr, std::memory_order_release);
  gInstalledStore = std::move(store);
}

std::string DefaultStorePath() {
  const char* explicitPath = std::getenv("TAVO_CONFIGSTORE_PATH");
  if (explicitPath != nullptr && *explicitPath != '\0') return explicitPath;
  const char* state = std::getenv("XDG_STATE_HOME");
  if (state != nullptr && *state == '/') return std::string(state) + "/tavo/configstore.db";
  const char* home = std::getenv("HOME");
  if (home != nullptr && *home == '/')
    return std::string(home) + "/.local/state/tavo/configstore.db";
  // A store in whatever directory the process happens to run in would be a
  // different, empty catalogue each time.
  throw ConfigStoreException(
      "configuration store: no store path: set TAVO_CONFIGSTORE_PATH, XDG_STATE_HOME or HOME",
      kErrorNoStorePath);
}

}  // namespace TavoConfigStore
