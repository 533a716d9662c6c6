#include "StoreSession.h"

#include <sys/stat.h>

#include <cerrno>
#include <stdexcept>
#include <string>

#include "TavoConfigStore/ConfigStore.h"

namespace karstctl {

StoreSession::StoreSession(const Invocation& invocation, StoreUse use) {
  const std::string path =
      invocation.store ? *invocation.store : TavoConfigStore::DefaultStorePath();
  struct stat info;
  if (use == StoreUse::kRead && lstat(path.c_str(), &info) != 0 &&
      (errno == ENOENT || errno == ENOTDIR)) {
    throw std::runtime_error("no store at " + path);
  }
  TavoConfigStore::SqliteStoreOptions options;
  if (invocation.waitMs) options.busyTimeoutMs = *invocation.waitMs;
  TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(path, options));
}

// Closes the connection, so a caller running several commands in one
// process gets each one's own store.
StoreSession::~StoreSession() { TavoConfigStore::SetGlobalStore(nullptr); }

}  // namespace karstctl
