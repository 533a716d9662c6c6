// The public history functions: each finds the backend's HistorySource, and
// a kept version is seen through VersionView, a read-only store of its own.

#include "TavoConfigStore/StoreHistory.h"

#include <pwd.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>

#include "Backend.h"
#include "HistorySource.h"
#include "TransactionLevels.h"

namespace TavoConfigStore {
namespace {

HistorySource& SourceOf(ConfigStore& store) {
  auto* source = dynamic_cast<HistorySource*>(&store);
  if (source == nullptr) {
    throw ConfigStoreException(
        "configuration store: this kind of store keeps no history (SQLite and etcd stores do)",
        kErrorNoHistory);
  }
  return *source;
}

// Every object of every collection.
std::shared_ptr<FilterSpecObject> Everything() {
  return std::make_shared<FilterSpecObject>(ConfigStoreObjectId("", "", ""));
}

// One kept version as a store that may be read, never written. It holds the
// store it came from, so it stays usable as long as the caller keeps it.
class VersionView final : public Backend {
 public:
  VersionView(std::shared_ptr<ConfigStore> owner, HistorySource& source, std::uint64_t number)
      : owner_(std::move(owner)), source_(source), number_(number) {}

  std::string Where() const override {
    return "version " + std::to_string(number_) + " of " + source_.HistoryWhere();
  }

  std::shared_ptr<ConfigStoreObject> Get(const ConfigStoreObjectId& id) override {
    auto found = source_.ListVersion(number_, FilterSpecObject(id));
    // An empty instance id in a filter matches any; here it is an identifier.
    for (auto& object : found) {
      if (object->Id().InstanceId() == id.InstanceId()) return object;
    }
    return nullptr;
  }
  std::vector<std::shared_ptr<ConfigStoreObject>> List(const FilterSpecObject& filter) override {
    return source_.ListVersion(number_, filter);
  }
  void Set(const ConfigStoreObject&) override { ReadOnly(); }
  void Delete(const FilterSpecObject&) override { ReadOnly(); }

  // A version never changes, so a transaction on it has nothing to keep
  // apart; the levels are counted only so that a commit without a begin
  // fails as on any store.
  void BeginTransaction() override { levels_.Begin(); }
  void CommitTransaction() override {
    if (!levels_.Open()) NoTransactionToCommit();
    levels_.Commit();
  }
  void AbortTransaction() override {
    if (levels_.Open()) levels_.Abort();
  }

 private:
  [[noreturn]] void ReadOnly() const {
    throw ConfigStoreException(Where() + ": a kept version cannot be written", SQLITE_READONLY);
  }

  std::shared_ptr<ConfigStore> owner_;
  HistorySource& source_;
  std::uint64_t number_;
  TransactionLevels<> levels_;
};

}  // namespace

StoreVersion NewVersionBy(std::uint64_t number) {
  StoreVersion version;
  version.number = number;
  version.unixTimeMs = std::chrono::duration_cast<std::chrono::milliseconds>(
                           std::chrono::system_clock::now().time_since_epoch())
                           .count();
  char host[256] = {};
  if (gethostname(host, sizeof(host) - 1) == 0) version.host = host;
  passwd entry{}, *found = nullptr;
  char buffer[1024];
  const bool named =
      getpwuid_r(geteuid(), &entry, buffer, sizeof(buffer), &found) == 0 && found != nullptr;
  version.user = named ? found->pw_name : std::to_string(geteuid());
  return version;
}

std::string NotKeptMessage(const std::string& where, std::uint64_t number) {
  return where + ": version " + std::to_string(number) + " is not kept";
}

std::vector<StoreVersion> ListVersions(ConfigStore& store) { return SourceOf(store).Versions(); }

std::uint64_t NewestVersion(ConfigStore& store) { return SourceOf(store).Newest(); }

unsigned HistoryDepth(ConfigStore& store) { return SourceOf(store).Depth(); }

void SetHistoryDepth(ConfigStore& store, unsigned depth) { SourceOf(store).SetDepth(depth); }

std::shared_ptr<ConfigStore> OpenVersion(const std::shared_ptr<ConfigStore>& store,
                                         std::uint64_t number) {
  if (!store) {
    throw ConfigStoreException("configuration store: OpenVersion of null", kErrorNullArgument);
  }
  HistorySource& source = SourceOf(*store);
  // Looked for now, so that a version not kept fails here rather than at
  // the first read.
  const auto kept = source.Versions();
  if (std::none_of(kept.begin(), kept.end(),
                   [number](const StoreVersion& v) { return v.number == number; })) {
    throw ConfigStoreException(NotKeptMessage(source.HistoryWhere(), number), kErrorNoSuchVersion);
  }
  return std::make_shared<VersionView>(store, source, number);
}

// Read and written inside one transaction, which holds the store's write
// lock: no other writer can forget the version between the two.
std::uint64_t Rollback(ConfigStore& store, std::uint64_t number) {
  HistorySource& source = SourceOf(store);
  store.BeginTransaction();
  try {
    const auto objects = source.ListVersion(number, *Everything());
    store.DeleteObjects(Everything());
    std::int32_t flags = 0;
    for (const auto& object : objects) store.SetObject(object, flags);
    store.CommitTransaction();
  } catch (...) {
    try {
      store.AbortTransaction();
    } catch (...) {
      // The failure that ended the rollback is the one to report.
    }
    throw;
  }
  return source.Newest();
}

}  // namespace TavoConfigStore
