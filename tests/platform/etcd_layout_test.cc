// Stores that share one cluster under prefixes of their own: whatever the
// prefixes (one inside another, siblings, any bytes), no store reads, writes
// or collects another's keys. And a catalogue that an earlier version laid
// out directly under "/<prefix>/" is read where it is and moved under the
// store's own root, whole, by its first write.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "EtcdCluster.h"
#include "EtcdKeys.h"
#include "Records.h"
#include "StoreObjects.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/EtcdStore.h"
#include "TavoKarst/KarstLib.h"

namespace TavoConfigStore {
namespace {

using karst_test::EtcdCluster;
using karst_test::EtcdKeys;
using karst_test::Filter;
using karst_test::Set;
using karst_test::SharedEtcdCluster;
using karst_test::StoreRoot;
using karst_test::Valued;
using karst_test::ValuesOf;

std::shared_ptr<ConfigStore> StoreAt(const std::string& prefix) {
  EtcdStoreOptions options;
  options.endpoints = {SharedEtcdCluster().Endpoint(0)};
  options.prefix = prefix;
  return NewEtcdStore(options);
}

// Writers on every store at once, after a dead writer left a generation in
// each (the same id everywhere): replaces and small changes in place. Each
// store ends with exactly its own catalogue and without its leftovers, and
// no key lies outside the stores' roots.
TEST(EtcdLayoutTest, NeighbouringStoresKeepToTheirOwnKeys) {
  const std::vector<std::string> prefixes = {"m",
                                             "m/r",
                                             "m/r/x",
                                             "m/p",
                                             "m/g",
                                             "m/",
                                             "m/r/",
                                             "mr",
                                             std::string("m\0", 2),
                                             std::string("m/\0p/", 5),
                                             "m/\1",
                                             "m/\1\1"};
  const EtcdKeys raw(SharedEtcdCluster().Endpoint(0));
  const std::string dead = "0123456789abcdef";
  for (const std::string& prefix : prefixes) {
    const std::string root = StoreRoot(prefix);
    raw.Put(root + "r/" + dead, "k");
    raw.Put(root + "g/" + dead + "/x" + '\0' + "0000", "junk");
  }

  std::vector<std::thread> writers;
  for (const std::string& prefix : prefixes) {
    writers.emplace_back([prefix] {
      auto store = StoreAt(prefix);
      for (int round = 0; round < 4; ++round) {
        store->BeginTransaction();
        store->DeleteObjects(Filter("k", "g", "c"));
        for (int i = 0; i <= round; ++i) Set(*store, Valued("o" + std::to_string(i), prefix));
        store->CommitTransaction();
        Set(*store, Valued("last", prefix + std::to_string(round)));  // in place
      }
    });
  }
  for (std::thread& writer : writers) writer.join();

  for (const std::string& prefix : prefixes) {
    SCOPED_TRACE(::testing::PrintToString(prefix));
    EXPECT_EQ(ValuesOf(*StoreAt(prefix)),
              (std::vector<std::string>{"o0=" + prefix, "o1=" + prefix, "o2=" + prefix,
                                        "o3=" + prefix, "last=" + prefix + "3"}));
    EXPECT_THAT(raw.List(StoreRoot(prefix) + "g/" + dead), ::testing::IsEmpty());
    EXPECT_THAT(raw.List(StoreRoot(prefix) + "r/" + dead), ::testing::IsEmpty());
  }
  for (const auto& kv : raw.List("/m")) {
    int owners = 0;
    for (const std::string& prefix : prefixes) owners += kv.first.rfind(StoreRoot(prefix), 0) == 0;
    EXPECT_EQ(owners, 1) << ::testing::PrintToString(kv.first);
  }

  // A store cleared leaves its neighbours as they were.
  auto m = StoreAt("m");
  m->DeleteObjects(Filter("k", "g", "c"));
  EXPECT_THAT(ValuesOf(*m), ::testing::IsEmpty());
  EXPECT_EQ(ValuesOf(*StoreAt("m/r")).size(), 5u);
}

// The keys and values of the fixture, in the order they were written.
std::vector<std::pair<std::string, std::string>> LegacyFixture() {
  auto fromHex = [](const std::string& hex) {
    std::string out;
    for (std::size_t i = 0; i + 1 < hex.size(); i += 2) {
      out += static_cast<char>(std::stoi(hex.substr(i, 2), nullptr, 16));
    }
    return out;
  };
  std::ifstream in(KARST_FIXTURES_DIR "/etcd-layout1.hex");
  std::vector<std::pair<std::string, std::string>> keys;
  for (std::string line; std::getline(in, line);) {
    if (line.empty() || line[0] == '#') continue;
    std::istringstream fields(line);
    std::string key, value;
    fields >> key >> value;
    keys.emplace_back(fromHex(key), fromHex(value));
  }
  return keys;
}

std::pair<std::string, std::string> HashOf(const std::shared_ptr<ConfigStore>& store) {
  SetGlobalStore(store);
  auto hash = TavoKarst::KarstLib::GetDbHash();
  SetGlobalStore(nullptr);
  return hash;
}

// The keys under "/legacy/" that lie outside both stores' own roots.
std::vector<std::string> OldKeys(const EtcdKeys& raw) {
  std::vector<std::string> old;
  for (const auto& kv : raw.List("/legacy/")) {
    if (kv.first.rfind(StoreRoot("legacy"), 0) != 0 &&
        kv.first.rfind(StoreRoot("legacy/r"), 0) != 0) {
      old.push_back(kv.first);
    }
  }
  return old;
}

TEST(EtcdLayoutTest, AnEarlierLayoutIsReadInPlaceAndMovedByTheFirstWrite) {
  const EtcdKeys raw(SharedEtcdCluster().Endpoint(0));
  std::vector<std::string> nestedKeys;
  for (const auto& [key, value] : LegacyFixture()) {
    raw.Put(key, value);
    // Under "/legacy/r/" lie the nested store's keys and the outer one's
    // registrations ("/legacy/r/<16 hex digits>").
    if (key.rfind("/legacy/r/", 0) == 0 && key.size() != std::string("/legacy/r/").size() + 16) {
      nestedKeys.push_back(key);
    }
  }
  // Catalogue digests as the earlier version reported them.
  const std::pair<std::string, std::string> outer{"42207bee", "14fc1308"};
  const std::pair<std::string, std::string> nested{"6c045307", "f9823ad1"};
  auto reader = StoreAt("legacy");
  EXPECT_EQ(HashOf(reader), outer);
  EXPECT_EQ(HashOf(StoreAt("legacy/r")), nested);

  // The first write moves the whole catalogue: the collection it replaces
  // and the one it leaves alone. A reader that read the old layout before
  // follows, and the nested store's keys stay where they were.
  auto writer = StoreAt("legacy");
  SetGlobalStore(writer);
  const std::vector<TavoKarst::KarstDatastoreInfo> datastores{
      karst_test::Datastore("ds://moved", "CORRA", "pol-0001")};
  TavoKarst::KarstLib::AddDatastoreInfo(datastores);
  SetGlobalStore(reader);
  EXPECT_EQ(TavoKarst::KarstLib::ListDatastoreInfo(), datastores);
  EXPECT_EQ(TavoKarst::KarstLib::ListPolicyInfo().size(), 3u);
  EXPECT_EQ(TavoKarst::KarstLib::GetDbHash().first, outer.first);
  SetGlobalStore(nullptr);
  EXPECT_EQ(OldKeys(raw), nestedKeys);
  EXPECT_EQ(HashOf(StoreAt("legacy/r")), nested);

  auto inner = StoreAt("legacy/r");
  SetGlobalStore(inner);
  TavoKarst::KarstLib::AddPolicyInfo(TavoKarst::KarstLib::ListPolicyInfo());
  SetGlobalStore(nullptr);
  EXPECT_THAT(OldKeys(raw), ::testing::IsEmpty());
  EXPECT_EQ(HashOf(StoreAt("legacy/r")), nested);
  EXPECT_EQ(HashOf(StoreAt("legacy")).first, outer.first);
}

}  // namespace
}  // namespace TavoConfigStore
