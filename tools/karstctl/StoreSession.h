#ifndef KARSTCTL_STORE_SESSION_H_
#define KARSTCTL_STORE_SESSION_H_

#include <cstdint>
#include <optional>
#include <string>

#include "Args.h"
#include "TavoConfigStore/EtcdStore.h"

namespace karstctl {

// The store one command works on: the --store locator or else the default
// one, a SQLite file or an etcd locator, used as the command's StoreUse says.
// Constructing it touches nothing but reads the locator (for a command that
// uses a store), so one that cannot be used (a bad etcd locator, or a URL
// that is none) is reported as a UsageError before any input is read or
// anything created. Open installs the store as the library's for as long as
// this object lives, with --wait as the lock timeout of a file or the
// request timeout of etcd. For a read, a file path with nothing there fails
// with "no store at PATH" (std::runtime_error) instead of reading as an
// empty catalogue; on etcd an empty catalogue is simply empty. With
// --version N (reading commands only) the store installed is kept version N
// of the store, read-only. Store failures throw ConfigStoreException.
class StoreSession {
 public:
  explicit StoreSession(const Invocation& invocation);
  ~StoreSession();
  StoreSession(const StoreSession&) = delete;
  StoreSession& operator=(const StoreSession&) = delete;

  void Open();
  // Whether the command was given --version N.
  bool ReadsVersion() const { return version_ != 0; }

  // The locator in use, and what chose it: "--store", the environment
  // variable that named it or that the default is derived from.
  const std::string& Locator() const { return locator_; }
  const std::string& ChosenBy() const { return chosenBy_; }
  bool IsEtcd() const { return etcd_.has_value(); }

 private:
  void OpenCurrent();

  StoreUse use_;
  std::string locator_;
  std::string chosenBy_;
  std::optional<TavoConfigStore::EtcdStoreOptions> etcd_;
  std::optional<int> waitMs_;
  std::uint64_t version_ = 0;  // 0: the current catalogue
};

}  // namespace karstctl

#endif  // KARSTCTL_STORE_SESSION_H_
