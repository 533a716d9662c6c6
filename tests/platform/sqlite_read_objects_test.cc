// Objects as the SQLite backend hands them out: read in place from their
// stored body, built lazily, and listed by identifier ranges. Each test holds
// them to what an object built by hand, or the in-memory backend, does.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <climits>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"
#include "store_test_util.h"

namespace TavoConfigStore {
namespace {

using ::testing::ElementsAre;
using testutil::All;
using testutil::Describe;
using testutil::DescribeValues;
using testutil::Dump;
using testutil::Filter;
using testutil::Instances;
using testutil::Obj;
using testutil::ScratchDir;
using testutil::Set;

// Values of both kinds, NULs, an empty string, and "subs" sub-objects spread
// over two arrays.
std::shared_ptr<ConfigStoreObject> Rich(const std::string& instance, int subs) {
  auto o = Obj("k", "g", "c", instance);
  o->SetValue("name", std::string("n\0me", 4));
  o->SetValue("empty", std::string());
  o->SetValue("min", static_cast<long long>(LLONG_MIN));
  o->SetValue("count", 7LL);
  for (int i = 0; i < subs; ++i) {
    auto sub = o->CreateSubObject(SubObjectId(i % 3 ? "blobs" : "other", "s" + std::to_string(i)));
    sub->SetValue("blob", std::string(200 + i, static_cast<char>(i)));
    sub->SetValue("n", static_cast<long long>(-i));
  }
  return o;
}

class SqliteReadObjectsTest : public ::testing::Test {
 protected:
  void SetUp() override { store_ = NewSqliteStore(dir_.Path() + "/store.db"); }

  std::shared_ptr<ConfigStoreObject> Read(const std::shared_ptr<ConfigStoreObject>& o) {
    Set(*store_, o);
    auto back = store_->GetObject(o->Id());
    EXPECT_NE(back, nullptr);
    return back;
  }

  ScratchDir dir_;
  std::shared_ptr<ConfigStore> store_;
};

TEST_F(SqliteReadObjectsTest, ReadValuesAnswerAsTheWrittenObject) {
  // 3 sub-objects are built when decoded; 40 are built on first access.
  for (int subs : {0, 3, 40}) {
    SCOPED_TRACE(subs);
    const auto written = Rich("r" + std::to_string(subs), subs);
    const auto read = Read(written);
    const auto listed = store_->GetObjects(Filter("k", "g", "c", ""));
    ASSERT_EQ(listed.size(), 1u);
    for (const auto& o : {read, listed[0]}) {
      std::string s = "untouched";
      long long n = 99;
      EXPECT_TRUE(o->GetValue("name", &s));
      EXPECT_EQ(s, std::string("n\0me", 4));
      EXPECT_TRUE(o->GetValue("empty", &s));
      EXPECT_EQ(s, "");
      EXPECT_TRUE(o->GetValue("min", &n));
      EXPECT_EQ(n, LLONG_MIN);
      // Wrong kind, or a name only equal up to a NUL or a prefix: nothing.
      s = "untouched";
      n = 99;
      EXPECT_FALSE(o->GetValue("min", &s));
      EXPECT_FALSE(o->GetValue("name", &n));
      EXPECT_FALSE(o->GetValue("nam", &s));
      EXPECT_FALSE(o->GetValue("names", &s));
      EXPECT_FALSE(o->GetValue("", &s));
      EXPECT_EQ(s, "untouched");
      EXPECT_EQ(n, 99);

      auto blobs = o->GetSubObjectInstances(Filter("blobs", "", "", ""));
      auto expected = written->GetSubObjectInstances(Filter("blobs", "", "", ""));
      ASSERT_EQ(blobs.size(), expected.size());
      for (std::size_t i = 0; i < blobs.size(); ++i) {
        EXPECT_EQ(DescribeValues(blobs[i]->Values()), DescribeValues(expected[i]->Values()));
      }
      EXPECT_EQ(o->GetSubObjectInstances(nullptr).size(), static_cast<std::size_t>(subs));
      EXPECT_EQ(o->GetSubObjectInstances(Filter("", "", "", "s1")).size(), subs > 1 ? 1u : 0u);
      EXPECT_EQ(o->GetSubObject(SubObjectId("blobs", "s0")), nullptr);  // s0 is in "other"
      if (subs > 0) {
        auto last = o->GetSubObject(
            SubObjectId((subs - 1) % 3 ? "blobs" : "other", "s" + std::to_string(subs - 1)));
        ASSERT_NE(last, nullptr);
        EXPECT_TRUE(last->GetValue("n", &n));
        EXPECT_EQ(n, -(subs - 1));
      }
      // Asked for after the in-place reads, the vectors hold the same.
      EXPECT_EQ(Describe(*o), Describe(*written));
    }
    store_->DeleteObjects(All());
  }
}

TEST_F(SqliteReadObjectsTest, ChangesToAReadObjectAreItsOwnAndCanBeWrittenBack) {
  for (int subs : {3, 40}) {
    SCOPED_TRACE(subs);
    auto expected = Rich("x", subs);
    auto read = Read(expected);

    // A sub-object is the same object on every access, and changes stick.
    auto sub = read->GetSubObject(SubObjectId("blobs", "s1"));
    ASSERT_NE(sub, nullptr);
    EXPECT_EQ(read->GetSubObject(SubObjectId("blobs", "s1")), sub);
    EXPECT_EQ(read->GetSubObjectInstances(Filter("", "", "", "s1"))[0], sub);
    sub->SetValue("blob", std::string("changed"));
    sub->SetValue("added", 5LL);
    expected->GetSubObject(SubObjectId("blobs", "s1"))->SetValue("blob", std::string("changed"));
    expected->GetSubObject(SubObjectId("blobs", "s1"))->SetValue("added", 5LL);
    std::string s;
    EXPECT_TRUE(read->GetSubObject(SubObjectId("blobs", "s1"))->GetValue("blob", &s));
    EXPECT_EQ(s, "changed");

    // Values change in place, new ones go last.
    read->SetValue("count", std::string("now a string"));
    read->SetValue("late", 1LL);
    expected->SetValue("count", std::string("now a string"));
    expected->SetValue("late", 1LL);
    long long n = 0;
    EXPECT_FALSE(read->GetValue("count", &n));
    EXPECT_TRUE(read->GetValue("count", &s));
    EXPECT_EQ(s, "now a string");

    // A new sub-object replaces one with the same id in its place, and the
    // earlier sub-objects stay the read ones.
    read->CreateSubObject(SubObjectId("blobs", "s2"))->SetValue("fresh", 1LL);
    expected->CreateSubObject(SubObjectId("blobs", "s2"))->SetValue("fresh", 1LL);
    EXPECT_EQ(read->GetSubObject(SubObjectId("blobs", "s1")), sub);
    EXPECT_EQ(Describe(*read), Describe(*expected));

    // Nothing of this reached the store until written.
    EXPECT_NE(Describe(*store_->GetObject(read->Id())), Describe(*expected));
    Set(*store_, read);
    EXPECT_EQ(Describe(*store_->GetObject(read->Id())), Describe(*expected));
    store_->DeleteObjects(All());
  }
}

TEST_F(SqliteReadObjectsTest, SubObjectsAndCopiesOutliveTheObject) {
  const auto written = Rich("o", 5);
  std::shared_ptr<StoreObject> sub;
  std::vector<std::shared_ptr<StoreObject>> all;
  std::unique_ptr<ConfigStoreObject> copy;
  std::shared_ptr<ConfigStoreObject> clone;
  {
    auto listed = store_->GetObjects(All());
    ASSERT_TRUE(listed.empty());
    Set(*store_, written);
    listed = store_->GetObjects(All());
    ASSERT_EQ(listed.size(), 1u);
    sub = listed[0]->GetSubObject(SubObjectId("blobs", "s4"));
    all = listed[0]->GetSubObjectInstances(nullptr);
    copy = std::make_unique<ConfigStoreObject>(*listed[0]);
    clone = listed[0]->Clone();
    // The copy shares sub-objects, as a member-wise copy does; the clone not.
    EXPECT_EQ(copy->GetSubObject(SubObjectId("blobs", "s4")), sub);
    EXPECT_NE(clone->GetSubObject(SubObjectId("blobs", "s4")), sub);
    listed[0]->SetValue("name", std::string("changed after copying"));
  }
  store_->DeleteObjects(All());
  std::string s;
  ASSERT_NE(sub, nullptr);
  EXPECT_TRUE(sub->GetValue("blob", &s));
  EXPECT_EQ(s, std::string(204, '\x04'));
  ASSERT_EQ(all.size(), 5u);
  EXPECT_EQ(DescribeValues(all[0]->Values()),
            DescribeValues(written->GetSubObjectInstances(nullptr)[0]->Values()));
  EXPECT_EQ(Describe(*copy), Describe(*written));
  EXPECT_EQ(Describe(*clone), Describe(*written));
  // Changing the clone or a copied value leaves the others alone.
  clone->GetSubObject(SubObjectId("blobs", "s4"))->SetValue("n", 100LL);
  long long n = 0;
  EXPECT_TRUE(sub->GetValue("n", &n));
  EXPECT_EQ(n, -4);
  StoreObject detached = *sub;
  detached.SetValue("n", 1LL);
  EXPECT_TRUE(sub->GetValue("n", &n));
  EXPECT_EQ(n, -4);
}

TEST_F(SqliteReadObjectsTest, ThreadsMayReadOneObjectTogether) {
  for (int subs : {4, 40}) {
    const auto written = Rich("t", subs);
    const std::string expected = Describe(*written);
    for (int round = 0; round < 20; ++round) {
      const auto read = Read(written);
      std::vector<std::thread> threads;
      std::vector<int> failures(4, 0);
      for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
          // Each thread takes the lazy paths in a different order.
          for (int k = 0; k < 4; ++k) {
            switch ((t + k) % 4) {
              case 0:
                failures[t] += Describe(*read) != expected;
                break;
              case 1:
                failures[t] +=
                    read->GetSubObjectInstances(nullptr).size() != static_cast<std::size_t>(subs);
                break;
              case 2: {
                std::string s;
                failures[t] += !read->GetValue("name", &s) || s != std::string("n\0me", 4);
                break;
              }
              default:
                failures[t] += read->GetSubObject(SubObjectId("blobs", "s1")) == nullptr;
            }
          }
        });
      }
      for (auto& thread : threads) thread.join();
      EXPECT_THAT(failures, ElementsAre(0, 0, 0, 0));
    }
  }
}

// Random writes, deletions and transactions on both backends; after each step
// every kind of filter must list the same objects in the same order. Several
// collections share the table and interleave, so listings by a collection
// meet both contiguous and scattered rows.
TEST_F(SqliteReadObjectsTest, ListingsMatchTheMemoryBackend) {
  auto memory = NewMemoryStore();
  std::mt19937 rng(11);
  const std::vector<std::string> keys = {"a", "b", ""};
  const std::vector<std::string> groups = {"g", "h"};
  auto pick = [&](const std::vector<std::string>& from) { return from[rng() % from.size()]; };
  auto randomFilter = [&] {
    const std::string parts[4] = {rng() % 3 ? pick(keys) : "", rng() % 2 ? pick(groups) : "",
                                  rng() % 4 ? "c" : "", rng() % 5 ? "" : std::to_string(rng() % 6)};
    return Filter(parts[0], parts[1], parts[2], parts[3]);
  };
  for (int step = 0; step < 400; ++step) {
    const unsigned op = rng() % 10;
    if (op < 6) {
      // A run of writes to one collection, as a catalogue replace makes.
      const std::string key = pick({"a", "b"});
      const std::string group = pick(groups);
      for (unsigned i = 0, n = 1 + rng() % 4; i < n; ++i) {
        auto o = Obj(key, group, "c", std::to_string(rng() % 6));
        o->SetValue("step", static_cast<long long>(step));
        Set(*store_, o);
        Set(*memory, o);
      }
    } else if (op < 8) {
      const auto filter = randomFilter();
      store_->DeleteObjects(filter);
      memory->DeleteObjects(filter);
    } else {
      // Listings inside a transaction see its writes and deletions.
      store_->BeginTransaction();
      memory->BeginTransaction();
      auto o = Obj(pick({"a", "b"}), pick(groups), "c", "t" + std::to_string(step % 3));
      Set(*store_, o);
      Set(*memory, o);
      const auto doomed = randomFilter();
      store_->DeleteObjects(doomed);
      memory->DeleteObjects(doomed);
      const auto filter = randomFilter();
      ASSERT_EQ(Instances(store_->GetObjects(filter)), Instances(memory->GetObjects(filter)));
      if (op == 8) {
        store_->CommitTransaction();
        memory->CommitTransaction();
      } else {
        store_->AbortTransaction();
        memory->AbortTransaction();
      }
    }
    for (int f = 0; f < 6; ++f) {
      const auto filter = randomFilter();
      const auto id = filter->Id();
      ASSERT_EQ(Dump(*store_).size(), Dump(*memory).size()) << "step " << step;
      auto fromSqlite = store_->GetObjects(filter);
      auto fromMemory = memory->GetObjects(filter);
      ASSERT_EQ(fromSqlite.size(), fromMemory.size())
          << "step " << step << " filter " << id.Key() << "|" << id.Group() << "|" << id.Component()
          << "|" << id.InstanceId();
      for (std::size_t i = 0; i < fromSqlite.size(); ++i) {
        ASSERT_EQ(Describe(*fromSqlite[i]), Describe(*fromMemory[i])) << "step " << step;
      }
    }
  }
}

TEST(SqliteStorePageSize, NewStoresUseLargePagesAndOldOnesKeepTheirs) {
  ScratchDir dir;
  auto pageSize = [](const std::string& path) {
    sqlite3* db = nullptr;
    sqlite3_stmt* s = nullptr;
    long long size = -1;
    if (sqlite3_open(path.c_str(), &db) == SQLITE_OK &&
        sqlite3_prepare_v2(db, "PRAGMA page_size", -1, &s, nullptr) == SQLITE_OK &&
        sqlite3_step(s) == SQLITE_ROW) {
      size = sqlite3_column_int64(s, 0);
    }
    sqlite3_finalize(s);
    sqlite3_close(db);
    return size;
  };
  const std::string fresh = dir.Path() + "/fresh.db";
  Set(*NewSqliteStore(fresh), Rich("f", 2));
  EXPECT_EQ(pageSize(fresh), 16384);

  // A store made with 4 KiB pages, as earlier versions made them.
  const std::string old = dir.Path() + "/old.db";
  {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(old.c_str(), &db), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(db,
                           "PRAGMA page_size=4096; PRAGMA journal_mode=WAL;"
                           "CREATE TABLE objects(seq INTEGER PRIMARY KEY, key BLOB NOT NULL, "
                           "grp BLOB NOT NULL, component BLOB NOT NULL, instance BLOB NOT NULL, "
                           "body BLOB NOT NULL);"
                           "CREATE UNIQUE INDEX objects_id ON objects(key, grp, component, "
                           "instance);"
                           "PRAGMA application_id=1413568079; PRAGMA user_version=1;",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    sqlite3_close(db);
  }
  auto store = NewSqliteStore(old);
  for (int i = 0; i < 50; ++i) Set(*store, Rich(std::to_string(i), 4));
  EXPECT_EQ(store->GetObjects(Filter("k", "g", "c", "")).size(), 50u);
  EXPECT_EQ(pageSize(old), 4096);
}

}  // namespace
}  // namespace TavoConfigStore
