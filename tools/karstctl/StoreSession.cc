#include "StoreSession.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <stdexcept>

#include "Errors.h"
#include "HistoryCommands.h"
#include "StoreErrors.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/StoreHistory.h"

namespace karstctl {

namespace {

// Which of the variables DefaultStorePath reads gave the default, in its
// order.
std::string DefaultChosenBy() {
  const char* path = std::getenv("TAVO_CONFIGSTORE_PATH");
  if (path != nullptr && *path != '\0') return "TAVO_CONFIGSTORE_PATH";
  const char* state = std::getenv("XDG_STATE_HOME");
  return state != nullptr && *state == '/' ? "default under XDG_STATE_HOME" : "default under HOME";
}

}  // namespace

StoreSession::StoreSession(const Invocation& invocation)
    : use_(invocation.command->store), waitMs_(invocation.waitMs) {
  if (invocation.kept) {
    if (use_ != StoreUse::kRead) {
      throw UsageError("--version N reads a kept version; '" + invocation.command->words[0] +
                       "' does not read the catalogue");
    }
    version_ = ParseVersionNumber(*invocation.kept, "--version");
  }
  if (use_ == StoreUse::kNone) return;
  locator_ = invocation.store ? *invocation.store : TavoConfigStore::DefaultStorePath();
  chosenBy_ = invocation.store ? "--store" : DefaultChosenBy();
  try {
    if (TavoConfigStore::KindOfLocator(locator_) == TavoConfigStore::LocatorKind::kEtcd) {
      etcd_ = TavoConfigStore::ParseEtcdLocator(locator_);
      // A locator's timeout is at least 1 ms, and so is this one.
      if (waitMs_) etcd_->timeoutMs = std::max(*waitMs_, 1);
    }
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    // A locator that cannot be used is a mistake in the command line or the
    // environment, like a bad option.
    if (e.Code() == TavoConfigStore::kErrorBadLocator) throw UsageError(DescribeStoreError(e));
    throw;
  }
}

void StoreSession::Open() {
  OpenCurrent();
  if (version_ == 0) return;
  TavoConfigStore::SetGlobalStore(TavoConfigStore::OpenVersion(
      TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace), version_));
}

void StoreSession::OpenCurrent() {
  if (etcd_) {
    TavoConfigStore::SetGlobalStore(TavoConfigStore::NewEtcdStore(*etcd_));
    return;
  }
  struct stat info;
  if (use_ == StoreUse::kRead && lstat(locator_.c_str(), &info) != 0 &&
      (errno == ENOENT || errno == ENOTDIR)) {
    throw std::runtime_error("no store at " + TavoConfigStore::RedactLocator(locator_));
  }
  TavoConfigStore::SqliteStoreOptions options;
  if (waitMs_) options.busyTimeoutMs = *waitMs_;
  TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(locator_, options));
}

// Closes the connection, so a caller running several commands in one
// process gets each one's own store.
StoreSession::~StoreSession() { TavoConfigStore::SetGlobalStore(nullptr); }

}  // namespace karstctl
