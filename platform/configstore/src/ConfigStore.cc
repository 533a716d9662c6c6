#include "TavoConfigStore/ConfigStore.h"

#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <mutex>

#include "TavoConfigStore/CallProbe.h"

namespace TavoConfigStore {

const std::string sGlobalNamespace = "global";

namespace {
std::atomic<bool> gInstalled{false};
std::mutex gInstalledMu;
std::shared_ptr<ConfigStore> gInstalledStore;

std::shared_ptr<ConfigStore> InstalledStore() {
  if (!gInstalled.load(std::memory_order_acquire)) return nullptr;
  std::lock_guard<std::mutex> lock(gInstalledMu);
  return gInstalledStore;
}

// One SQLite connection per thread keeps GetStore cheap without sharing a
// connection between threads.
struct CachedConnection {
  pid_t pid = 0;
  std::string path;
  std::shared_ptr<ConfigStore> store;
};

std::shared_ptr<ConfigStore> DefaultStore() {
  thread_local CachedConnection cache;
  std::string path = DefaultStorePath();
  if (cache.store && cache.pid == getpid() && cache.path == path) return cache.store;
  if (cache.store && cache.pid != getpid()) {
    // A connection inherited through fork() belongs to the parent: closing
    // it here could disturb the parent's locks and WAL, so it is abandoned.
    new std::shared_ptr<ConfigStore>(std::move(cache.store));
  }
  cache.store = NewSqliteStore(path);
  cache.pid = getpid();
  cache.path = std::move(path);
  return cache.store;
}
}  // namespace

ConfigStore::~ConfigStore() = default;

std::shared_ptr<ConfigStore> ConfigStore::GetStore(const std::string& nameSpace) {
  NotifyCall("GetStore");
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
  std::string base = (home != nullptr && *home != '\0') ? home : ".";
  return base + "/.local/state/tavo/configstore.db";
}

}  // namespace TavoConfigStore
