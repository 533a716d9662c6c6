// The versions the SQLite and etcd stores keep of themselves: each kept
// version reads as the store did right after its commit, whatever shape of
// write came after it; no more than the depth are kept, in versions or in
// tables and generations; a rollback brings a kept version back as a new
// one, and one not kept changes nothing. On etcd, a catalogue that forgets
// versions leaves a neighbour nested inside it alone.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <functional>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "EtcdCluster.h"
#include "EtcdKeys.h"
#include "Files.h"
#include "RawSqlite.h"
#include "StoreObjects.h"
#include "TavoConfigStore/StoreHistory.h"

namespace TavoConfigStore {
namespace {

using karst_test::CodeOf;
using karst_test::Filter;
using karst_test::Set;
using karst_test::Valued;
using karst_test::ValuesOf;

// Both collections, "k" first.
std::vector<std::string> Everything(ConfigStore& store) {
  auto all = ValuesOf(store, Filter("k"));
  for (const std::string& v : ValuesOf(store, Filter("k2"))) all.push_back("k2:" + v);
  return all;
}

void Replace(ConfigStore& store, const std::string& key, const std::vector<std::string>& values) {
  store.BeginTransaction();
  store.DeleteObjects(Filter(key));
  for (const std::string& v : values) Set(store, Valued(v, v, key));
  store.CommitTransaction();
}

// The generations etcd holds for the store at "prefix": objects or heads.
std::size_t Generations(const std::string& prefix) {
  const std::string area = karst_test::StoreRoot(prefix) + "g/";
  std::set<std::string> gens;
  for (const std::string& key :
       karst_test::EtcdKeys(karst_test::SharedEtcdCluster().Endpoint(0)).Keys(area)) {
    gens.insert(key.substr(area.size(), 16));
  }
  return gens.size();
}

std::string UniquePrefix() {
  static int stores = 0;
  return "history" + std::to_string(++stores);
}

class StoreHistoryTest : public ::testing::TestWithParam<std::string> {
 protected:
  bool Etcd() const { return GetParam() == "etcd"; }
  std::string Path() const { return dir_.File("store.db"); }
  std::shared_ptr<ConfigStore> Open() const {
    return Etcd() ? OpenStore(karst_test::SharedEtcdCluster().Locator(prefix_))
                  : NewSqliteStore(Path());
  }
  // The copies of collections the store holds: besides the five tables of
  // a SQLite store's schema, one table a collection and kept copy; on etcd,
  // one generation.
  long long Copies() {
    if (Etcd()) return static_cast<long long>(Generations(prefix_));
    return std::stoll(karst_test::RawDb(Path()).QueryText(
               "SELECT count(*) FROM sqlite_master WHERE type = 'table'")) -
           5;
  }
  // Runs "change", then checks that it made one new version and that every
  // version kept reads as the store read after its own commit.
  void Change(ConfigStore& store, const std::function<void()>& change) {
    change();
    const std::uint64_t newest = ListVersions(store).front().number;
    EXPECT_EQ(newest, states_.size() + 1) << "one version per committed change";
    states_.push_back(Everything(store));
    for (const StoreVersion& v : ListVersions(store)) {
      EXPECT_EQ(Everything(*OpenVersion(store_, v.number)), states_[v.number - 1])
          << "version " << v.number << " after change " << newest;
    }
  }

  karst_test::ScratchDir dir_;
  const std::string prefix_ = UniquePrefix();
  std::shared_ptr<ConfigStore> store_ = Open();
  std::vector<std::vector<std::string>> states_;  // [n - 1]: after version n
};

TEST_P(StoreHistoryTest, KeptVersionsReadAsCommittedUnderEveryKindOfWrite) {
  ConfigStore& store = *store_;
  SetHistoryDepth(store, 4);
  Change(store, [&] { Replace(store, "k", {"a", "b"}); });
  Change(store, [&] { Replace(store, "k2", {"x"}); });
  Change(store, [&] { Set(store, Valued("c", "c1")); });  // a single write, no clear
  Change(store, [&] { Set(store, Valued("a", "a2")); });  // an object rewritten
  Change(store, [&] { store.DeleteObjects(Filter("k", "g", "c", "b")); });
  Change(store, [&] {
    store.BeginTransaction();
    Set(store, Valued("d", "d"));
    store.BeginTransaction();  // undone: the clear must not reach any version
    store.DeleteObjects(Filter());
    store.AbortTransaction();
    store.CommitTransaction();
  });
  Change(store, [&] { Replace(store, "k", {}); });

  // Neither a read in a transaction nor an aborted write is a change.
  store.BeginTransaction();
  Everything(store);
  store.CommitTransaction();
  store.BeginTransaction();
  Set(store, Valued("e"));
  store.AbortTransaction();
  EXPECT_EQ(ListVersions(store).front().number, states_.size());

  // A loop of replaces keeps the depth, in versions and in copies: those
  // of the versions kept, the current ones among them.
  for (int i = 0; i < 12; ++i) {
    Change(store, [&] { Replace(store, i % 3 ? "k" : "k2", {std::to_string(i)}); });
    ASSERT_EQ(ListVersions(store).size(), 4u);
    EXPECT_LE(Copies(), 2 * 4);
  }
  EXPECT_EQ(CodeOf([&] { OpenVersion(store_, 1); }), kErrorNoSuchVersion);

  // Another connection sees the same history, and a smaller depth at once.
  auto other = Open();
  EXPECT_EQ(HistoryDepth(*other), 4u);
  SetHistoryDepth(*other, 0);
  EXPECT_TRUE(ListVersions(store).empty());
  EXPECT_EQ(Copies(), 2);
  const std::uint64_t newest = NewestVersion(store);
  Replace(store, "k", {"z"});
  EXPECT_TRUE(ListVersions(store).empty());
  EXPECT_EQ(NewestVersion(store), newest + 1) << "numbers go on when none is kept";

  // A deep history forgets at once too, however many copies that frees (on
  // etcd, more than one transaction may hold).
  SetHistoryDepth(store, 100);
  for (int i = 0; i < 100; ++i) Replace(store, i % 2 ? "k" : "k2", {std::to_string(i)});
  SetHistoryDepth(store, 0);
  EXPECT_TRUE(ListVersions(store).empty());
  EXPECT_EQ(Copies(), 2);
}

TEST_P(StoreHistoryTest, RollbackMakesAKeptVersionCurrentAsANewOne) {
  ConfigStore& store = *store_;
  Change(store, [&] { Replace(store, "k", {"a", "b", "c"}); });
  Change(store, [&] { Replace(store, "k2", {"x", "y"}); });
  Change(store, [&] { Replace(store, "k", {"d"}); });
  Change(store, [&] { Set(store, Valued("a", "a2")); });

  Change(store, [&] { EXPECT_EQ(Rollback(store, 2), 5u); });
  EXPECT_EQ(NewestVersion(store), 5u);
  EXPECT_EQ(Everything(store), states_[1]) << "objects and their order as version 2 had them";

  // A version not kept: nothing changes, not even the version count.
  for (const std::uint64_t unkept : {0ull, 6ull, 99ull}) {
    EXPECT_EQ(CodeOf([&] { Rollback(store, unkept); }), kErrorNoSuchVersion) << unkept;
    EXPECT_EQ(Everything(store), states_[1]);
    EXPECT_EQ(ListVersions(store).front().number, 5u);
  }
  // A kept version is read, never written.
  auto version = OpenVersion(store_, 3);
  EXPECT_EQ(CodeOf([&] { Set(*version, Valued("q")); }), SQLITE_READONLY);
  EXPECT_EQ(CodeOf([&] { version->DeleteObjects(Filter()); }), SQLITE_READONLY);
  EXPECT_EQ(Everything(*version), states_[2]);
}

INSTANTIATE_TEST_SUITE_P(Backends, StoreHistoryTest, ::testing::Values("sqlite", "etcd"),
                         [](const auto& info) { return info.param; });

// A catalogue nested inside another ("m/r" in "m") keeps its versions and
// its generations while the outer one forgets its own, version after
// version and all at once.
TEST(StoreHistoryEtcd, ForgettingLeavesANestedCatalogueAlone) {
  const std::string outer = UniquePrefix();
  const std::string inner = outer + "/r";
  auto m = OpenStore(karst_test::SharedEtcdCluster().Locator(outer));
  auto r = OpenStore(karst_test::SharedEtcdCluster().Locator(inner));
  SetHistoryDepth(*m, 1);
  for (const char* v : {"a", "b", "c"}) Replace(*r, "k", {v});
  for (int i = 0; i < 5; ++i) Replace(*m, "k", {std::to_string(i)});
  SetHistoryDepth(*m, 0);
  ASSERT_EQ(ListVersions(*r).size(), 3u);
  EXPECT_EQ(Generations(inner), 3u);
  for (const StoreVersion& v : ListVersions(*r)) {
    const std::string value(1, static_cast<char>('a' + v.number - 1));
    EXPECT_EQ(ValuesOf(*OpenVersion(r, v.number), Filter("k")),
              std::vector<std::string>{value + "=" + value});
  }
  EXPECT_EQ(Generations(outer), 1u);
}

TEST(StoreHistoryOtherStores, KeepNoHistory) {
  auto memory = NewMemoryStore();
  EXPECT_EQ(CodeOf([&] { ListVersions(*memory); }), kErrorNoHistory);
  EXPECT_EQ(CodeOf([&] { Rollback(*memory, 1); }), kErrorNoHistory);
}

}  // namespace
}  // namespace TavoConfigStore
