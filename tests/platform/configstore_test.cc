// The configuration store: what every backend shares, run against each, then
// the SQLite backend's own behaviour (other connections and their locks,
// rollbacks SQLite makes by itself, foreign and damaged files, objects read
// lazily from their stored bytes) and the default store's cached connection.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <climits>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "EtcdCluster.h"
#include "FaultVfs.h"
#include "Files.h"
#include "RawSqlite.h"
#include "StoreObjects.h"
#include "TavoConfigStore/ConfigStore.h"

namespace TavoConfigStore {
namespace {

using namespace karst_test;  // NOLINT: the suite's own helpers
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

class StoreConformance : public ::testing::TestWithParam<std::string> {
 protected:
  void SetUp() override {
    if (GetParam() == "etcd") {
      // A catalogue of its own for each test.
      static int tests = 0;
      store_ = OpenStore(SharedEtcdCluster().Locator("conformance" + std::to_string(++tests)));
    } else {
      store_ = GetParam() == "memory" ? NewMemoryStore() : NewSqliteStore(dir_.File("store.db"));
    }
  }

  ScratchDir dir_;
  std::shared_ptr<ConfigStore> store_;  // closed before the folder goes
};

// "read" answers GetValue as "written" would, each value of either type.
void ExpectValuesAs(const StoreObject& read, const StoreObject& written) {
  for (const StoreValue& v : written.Values()) {
    std::string s;
    long long n = 0;
    const bool isString = v.value.index() == 0;
    EXPECT_EQ(read.GetValue(v.name.c_str(), &s), isString) << v.name;
    EXPECT_EQ(read.GetValue(v.name.c_str(), &n), !isString) << v.name;
    EXPECT_TRUE(v.value == (isString ? decltype(v.value)(s) : n)) << v.name;
  }
}

// "read" answers every accessor as "written" does: in place first, then whole.
void ExpectReadsAs(const ConfigStoreObject& read, const ConfigStoreObject& written) {
  ExpectValuesAs(read, written);
  for (const SubObjectEntry& e : written.SubObjects()) {
    const auto sub = read.GetSubObject(e.id);
    ASSERT_NE(sub, nullptr) << e.id.Array() << "/" << e.id.Key();
    ExpectValuesAs(*sub, *e.object);
    // A filter's key selects the array, its instance id the sub-object's key.
    for (const auto& f : {Filter(e.id.Array()), Filter("", "", "", e.id.Key()),
                          Filter(e.id.Array(), "", "", e.id.Key())}) {
      EXPECT_EQ(read.GetSubObjectInstances(f).size(), written.GetSubObjectInstances(f).size());
    }
  }
  EXPECT_EQ(read.GetSubObjectInstances(nullptr).size(), written.SubObjects().size());
  EXPECT_EQ(Describe(read), Describe(written));
}

TEST_P(StoreConformance, ValuesAndSubObjectsRoundTripByteExact) {
  std::string big(1 << 20, '\0');
  for (std::size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>((i * 131 + 7) % 256);
  const ConfigStoreObjectId id(std::string("k\0\xff", 3), "g\xc3\x28", "c", std::string("i\0", 2));
  auto o = std::make_shared<ConfigStoreObject>(id);
  o->SetValue("empty", std::string());
  o->SetValue("bytes", std::string("a\0\xff\xfe\x80\x00", 6));
  o->SetValue("big", big);
  o->SetValue("min", static_cast<long long>(LLONG_MIN));
  o->SetValue("max", static_cast<long long>(LLONG_MAX));
  o->SetValue("kind", std::string("was a string"));
  o->SetValue("kind", -1LL);  // changes kind, keeps its place
  // Many sub-objects in two arrays.
  for (int i = 0; i < 20; ++i) {
    auto sub = o->CreateSubObject(SubObjectId(i % 3 ? "blobs" : "other", "s" + std::to_string(i)));
    sub->SetValue("blob", std::string(i, static_cast<char>(i)));
    sub->SetValue("n", static_cast<long long>(-i));
  }
  o->CreateSubObject(SubObjectId(std::string("a\0", 2), "\xff"))->SetValue("v", big);
  o->CreateSubObject(SubObjectId("blobs", "s2"))->SetValue("replaced", 1LL);  // in s2's place
  // Many values in one sub-object, one set again.
  auto many = o->CreateSubObject(SubObjectId("many", ""));
  for (long long v = 0; v < 200; ++v) many->SetValue(("v" + std::to_string(v)).c_str(), v);
  many->SetValue("v3", std::string("set again"));
  Set(*store_, o);
  // A neighbour that differs only after a NUL, and one with few sub-objects.
  Set(*store_, Obj("k", id.Group(), "c", id.InstanceId()));
  auto small = Obj(id.Key(), "g", "c", "small");
  small->CreateSubObject(SubObjectId("blobs", "b"))->SetValue("v", big);
  Set(*store_, small);

  const auto read = store_->GetObject(id);
  ASSERT_NE(read, nullptr);
  ExpectReadsAs(*read, *o);
  const auto listed = store_->GetObjects(Filter(id.Key()));
  ASSERT_EQ(listed.size(), 2u);
  ExpectReadsAs(*listed[0], *o);
  ExpectReadsAs(*listed[1], *small);
  std::string s;
  EXPECT_FALSE(read->GetValue("byte", &s));                            // a prefix is another name
  EXPECT_EQ(read->GetSubObject(SubObjectId("blobs", "s0")), nullptr);  // s0 is in "other"
  long long n = 0;
  EXPECT_TRUE(read->GetSubObject(SubObjectId("many", ""))->GetValue("v199", &n) && n == 199);
}

TEST_P(StoreConformance, FiltersMatchInWriteOrder) {
  for (const char* id : {"a/g/c/1", "a/g/c/2", "b/g/c/3", "a/h/c/4", "a/g/d/5", "a/g/c/", "b/g/c/7",
                         "c/g/c/8", "c/g/c/9", "a/g/c/1"}) {  // rewriting "1" moves it to the end
    const std::string s(id);
    Set(*store_, Obj(s.substr(0, 1), s.substr(2, 1), s.substr(4, 1), s.substr(6)));
  }
  // Empty filter parts match anything; elsewhere the empty instance id is
  // an identifier like any other.
  const struct {
    const char* parts[4];
    std::vector<std::string> expected;
  } cases[] = {
      {{"", "", "", ""}, {"2", "3", "4", "5", "", "7", "8", "9", "1"}},
      {{"a", "", "", ""}, {"2", "4", "5", "", "1"}},
      {{"a", "g", "c", ""}, {"2", "", "1"}},
      {{"a", "g", "c", "2"}, {"2"}},
      {{"", "g", "c", ""}, {"2", "3", "", "7", "8", "9", "1"}},
      {{"", "", "d", ""}, {"5"}},
      {{"", "", "", "7"}, {"7"}},
  };
  for (const auto& c : cases) {
    EXPECT_THAT(List(*store_, Filter(c.parts[0], c.parts[1], c.parts[2], c.parts[3])),
                ElementsAreArray(c.expected));
  }
  EXPECT_NE(store_->GetObject(ConfigStoreObjectId("a", "g", "c", "")), nullptr);
  EXPECT_EQ(store_->GetObject(ConfigStoreObjectId("b", "g", "c", "")), nullptr);

  // Deletions take only what matches, with rows of other collections between.
  store_->DeleteObjects(Filter("a", "g"));
  store_->DeleteObjects(Filter("", "", "", "4"));
  store_->DeleteObjects(Filter("c", "g", "c", "9"));
  store_->DeleteObjects(Filter("none"));
  Set(*store_, Obj("c", "g", "c", "late"));
  EXPECT_THAT(List(*store_), ElementsAre("3", "7", "8", "late"));
  store_->DeleteObjects(Filter());
  EXPECT_THAT(List(*store_), ElementsAre());
}

TEST_P(StoreConformance, TransactionsCommitOrRestoreExactlyAndMisuseFails) {
  for (const char* instance : {"1", "2", "3"}) {
    auto o = Obj("k", "g", "c", instance);
    o->SetValue("v", std::string(instance));
    o->CreateSubObject(SubObjectId("arr", instance))->SetValue("n", 1LL);
    Set(*store_, o);
  }
  const std::vector<std::string> before = Dump(*store_);
  auto replaced = Obj("k", "g", "c", "1");
  replaced->SetValue("v", std::string("replaced"));
  for (const bool commit : {false, true}) {
    store_->BeginTransaction();
    Set(*store_, replaced);
    store_->DeleteObjects(Filter("k", "g", "c", "2"));
    Set(*store_, Obj("k", "g", "c", "4"));
    Set(*store_, Obj("k", "g", "c", "5"));
    store_->DeleteObjects(Filter("k", "g", "c", "5"));
    // The transaction reads its own writes, and what it left alone.
    EXPECT_THAT(List(*store_), ElementsAre("3", "1", "4"));
    EXPECT_EQ(store_->GetObject(ConfigStoreObjectId("k", "g", "c", "2")), nullptr);
    EXPECT_EQ(store_->GetObject(ConfigStoreObjectId("k", "g", "c", "5")), nullptr);
    EXPECT_NE(store_->GetObject(ConfigStoreObjectId("k", "g", "c", "3")), nullptr);
    if (commit) {
      store_->CommitTransaction();
    } else {
      store_->AbortTransaction();
      EXPECT_EQ(Dump(*store_), before);
    }
    store_->AbortTransaction();  // none open: does nothing
  }
  EXPECT_EQ(Describe(*store_->GetObject(replaced->Id())), Describe(*replaced));

  // Misuse fails with its code and leaves an open transaction alone.
  EXPECT_EQ(CodeOf([&] { store_->CommitTransaction(); }), kErrorNoTransaction);
  store_->BeginTransaction();
  Set(*store_, Obj("k", "g", "c", "inside"));
  std::int32_t flags = 0;
  EXPECT_EQ(CodeOf([&] { store_->SetObject(nullptr, flags); }), kErrorNullArgument);
  EXPECT_EQ(CodeOf([&] { store_->DeleteObjects(nullptr); }), kErrorNullArgument);
  EXPECT_EQ(CodeOf([&] { store_->GetObjects(nullptr); }), kErrorNullArgument);
  store_->AbortTransaction();
  EXPECT_THAT(List(*store_), ElementsAre("3", "1", "4"));
}

// An inner transaction's abort undoes its own writes only; its commit keeps
// them for the outer one to commit or abort.
TEST_P(StoreConformance, TransactionsNest) {
  Set(*store_, Obj("k", "g", "c", "before"));
  for (const bool commitOuter : {false, true}) {
    store_->BeginTransaction();
    Set(*store_, Obj("k", "g", "c", "outer"));
    store_->BeginTransaction();
    Set(*store_, Obj("fresh", "g", "c", "undone"));
    store_->BeginTransaction();  // committed into the one then aborted
    store_->DeleteObjects(Filter("k", "g", "c", "before"));
    store_->CommitTransaction();
    store_->AbortTransaction();
    store_->BeginTransaction();
    Set(*store_, Obj("fresh", "g", "c", "inner"));
    store_->CommitTransaction();
    EXPECT_THAT(List(*store_), ElementsAre("before", "outer", "inner"));
    if (commitOuter) {
      store_->CommitTransaction();
    } else {
      store_->AbortTransaction();
      EXPECT_THAT(List(*store_), ElementsAre("before"));
    }
  }
  EXPECT_EQ(CodeOf([&] { store_->CommitTransaction(); }), kErrorNoTransaction);
  EXPECT_THAT(List(*store_), ElementsAre("before", "outer", "inner"));
}

TEST_P(StoreConformance, ObjectsHandedOutAreCopies) {
  auto make = [] {
    auto o = Obj("k", "g", "c", "i");
    o->SetValue("count", 1LL);
    o->SetValue("kept", std::string("as it was"));
    for (int i = 0; i < 20; ++i) o->CreateSubObject(SubObjectId("arr", std::to_string(i)));
    return o;
  };
  auto written = make();
  Set(*store_, written);
  const std::vector<std::string> stored = Dump(*store_);
  auto read = store_->GetObjects(Filter()).at(0);
  const auto sub = read->GetSubObject(SubObjectId("arr", "1"));
  // Changing what was written or read changes only that copy; what was read
  // writes back whole.
  auto expected = make();
  // An assigned object is a copy too, identifier included, and only equal
  // identifiers compare equal.
  ConfigStoreObject assigned(ConfigStoreObjectId("other", "g", "c", "i"));
  EXPECT_FALSE(assigned.Id() == read->Id());
  assigned = *read;
  EXPECT_EQ(Describe(assigned), Describe(*read));
  EXPECT_TRUE(assigned.Id() == read->Id());
  for (const auto& changed : {written, read, expected}) {
    changed->GetSubObject(SubObjectId("arr", "1"))->SetValue("n", 3LL);
    changed->SetValue("count", std::string("now a string"));
    changed->SetValue("late", 1LL);
    changed->CreateSubObject(SubObjectId("arr", "2"))->SetValue("fresh", 1LL);
    std::string kept;
    EXPECT_TRUE(changed->GetValue("kept", &kept) && kept == "as it was");
  }
  EXPECT_EQ(Dump(*store_), stored);
  ExpectReadsAs(*read, *expected);
  Set(*store_, read);
  read.reset();
  EXPECT_THAT(Dump(*store_), ElementsAre(Describe(*expected)));
  // A sub-object outlives the object it came from and the store's copy.
  store_->DeleteObjects(Filter());
  long long n = 0;
  EXPECT_TRUE(sub->GetValue("n", &n) && n == 3);
  // A sub-object changed through what a read handed out is written back changed.
  Set(*store_, written);
  auto again = store_->GetObjects(Filter()).at(0);
  again->GetSubObject(SubObjectId("arr", "4"))->SetValue("n", 4LL);
  Set(*store_, again);
  again = store_->GetObjects(Filter()).at(0);
  EXPECT_TRUE(again->GetSubObject(SubObjectId("arr", "4"))->GetValue("n", &n) && n == 4);
}

INSTANTIATE_TEST_SUITE_P(Backends, StoreConformance, ::testing::Values("memory", "sqlite", "etcd"),
                         [](const auto& info) { return info.param; });

std::shared_ptr<ConfigStoreObject> Sample(const std::string& instance, int subs = 2) {
  auto o = Obj("pool", "storage", "tavo", instance);
  o->SetValue("name", std::string("sample\0\xff", 8));
  o->SetValue("size", -1234567890123LL);
  for (int i = 0; i < subs; ++i) {
    o->CreateSubObject(SubObjectId("blobs", "b" + std::to_string(i)))->SetValue("n", 0LL + i);
  }
  return o;
}

class SqliteStoreTest : public ::testing::Test {
 protected:
  std::string Path(const std::string& name = "store.db") const { return dir_.File(name); }

  ScratchDir dir_;
};

TEST_F(SqliteStoreTest, ConnectionsSeeOnlyCommittedWrites) {
  auto writer = NewSqliteStore(Path("new/dirs/store.db"));
  auto reader = NewSqliteStore(Path("new/dirs/store.db"));
  Set(*writer, Sample("x"));
  writer->BeginTransaction();
  Set(*writer, Sample("y"));
  writer->DeleteObjects(Filter("", "", "", "x"));
  // The reader is not blocked by the open write and sees the state before it.
  EXPECT_THAT(List(*reader), ElementsAre("x"));
  writer->CommitTransaction();
  EXPECT_THAT(List(*reader), ElementsAre("y"));
  Set(*reader, Sample("from reader"));
  EXPECT_THAT(List(*writer), ElementsAre("y", "from reader"));
  // Write order holds across collections, connections and transactions:
  // each write takes its place after whatever any connection committed.
  auto inTransaction = [&writer](const char* name) {
    writer->BeginTransaction();
    Set(*writer, Obj("other", "g", "c", name));
    writer->CommitTransaction();
  };
  inTransaction("w1");
  Set(*reader, Sample("r1"));
  Set(*reader, Sample("r2"));
  inTransaction("w2");
  // The same after a write in a transaction of its own, whose count a
  // later transaction must not reuse.
  Set(*writer, Sample("w3"));
  Set(*reader, Obj("other", "g", "c", "r3"));
  Set(*reader, Obj("other", "g", "c", "r4"));
  writer->BeginTransaction();
  Set(*writer, Sample("w4"));
  writer->CommitTransaction();
  EXPECT_THAT(List(*reader),
              ElementsAre("y", "from reader", "w1", "r1", "r2", "w2", "w3", "r3", "r4", "w4"));
}

// The catalogue is private whatever the umask: directories the store makes
// 0700, the file and its -wal and -shm 0600.
TEST_F(SqliteStoreTest, NewStoreIsPrivateUnderAnyUmask) {
  auto mode = [](const std::string& file) {
    struct stat st {};
    EXPECT_EQ(stat(file.c_str(), &st), 0) << file;
    return st.st_mode & 07777;
  };
  for (const mode_t mask : {022, 0}) {
    const mode_t old = umask(mask);
    const std::string top = Path("u" + std::to_string(mask)), path = top + "/a/store.db";
    Set(*NewSqliteStore(path), Sample("x"));
    umask(old);
    for (const auto& [file, expected] : {std::pair{top, 0700},
                                         {top + "/a", 0700},
                                         {path, 0600},
                                         {path + "-wal", 0600},
                                         {path + "-shm", 0600}}) {
      EXPECT_EQ(mode(file), static_cast<mode_t>(expected)) << file << " umask " << mask;
    }
    // Shared with a group by a chmod of the file: the next writer to open
    // the store gives the -wal and -shm the same mode, or the group could
    // not read it.
    chmod(path.c_str(), 0640);
    NewSqliteStore(path);
    for (const char* suffix : {"-wal", "-shm"}) EXPECT_EQ(mode(path + suffix), 0640u) << suffix;
  }
}

// A link at the store's name (or its log's) is refused, the target untouched:
// in a shared folder it would let another user choose where the catalogue
// goes. Other names are taken literally, never as a URI or in-memory store.
TEST_F(SqliteStoreTest, PathIsALiteralFileNeverALink) {
  WriteFile(Path("target"), "theirs");
  for (const auto& [link, store] : {std::pair{"link.db", "link.db"},
                                    {"dangling.db", "dangling.db"},
                                    {"log.db-wal", "log.db"}}) {
    const std::string target = link == std::string("dangling.db") ? Path("none") : Path("target");
    ASSERT_EQ(symlink(target.c_str(), Path(link).c_str()), 0);
    EXPECT_EQ(CodeOf([&] { Set(*NewSqliteStore(Path(store)), Sample("x")); }), kErrorSymlink)
        << link;
  }
  EXPECT_EQ(ReadFile(Path("target")), "theirs");
  EXPECT_FALSE(std::filesystem::exists(Path("none")));

  const std::string cwd = std::filesystem::current_path();
  std::filesystem::current_path(dir_.Path());
  for (const std::string name : {":memory:", "file:x.db?mode=memory"}) {
    Set(*NewSqliteStore(name), Sample(name));
    EXPECT_THAT(List(*NewSqliteStore(Path(name))), ElementsAre(name));
  }
  std::filesystem::current_path(cwd);
}

// Without a path and without a home there is no default: a store in the
// current folder would be a different, empty catalogue each time.
TEST(DefaultStorePathTest, FromTheEnvironmentOrNot) {
  struct Case {
    const char *explicitPath, *state, *home, *expected;  // expected null: throws
  };
  const Case cases[] = {{"/p/s.db", "/st", "/h", "/p/s.db"},
                        {"rel.db", nullptr, nullptr, "rel.db"},
                        {"", "/st", "/h", "/st/tavo/configstore.db"},
                        {nullptr, "st", "/h", "/h/.local/state/tavo/configstore.db"},
                        {nullptr, nullptr, "h", nullptr},
                        {nullptr, "", "", nullptr}};
  for (const Case& c : cases) {
    const std::pair<const char*, const char*> vars[] = {
        {"TAVO_CONFIGSTORE_PATH", c.explicitPath}, {"XDG_STATE_HOME", c.state}, {"HOME", c.home}};
    for (const auto& [name, value] : vars) {
      value ? setenv(name, value, 1) : unsetenv(name);
    }
    if (c.expected) {
      EXPECT_EQ(DefaultStorePath(), c.expected);
    } else {
      EXPECT_EQ(CodeOf([] { DefaultStorePath(); }), kErrorNoStorePath);
    }
  }
}

TEST_F(SqliteStoreTest, WriterWaitsForAnotherConnectionsLock) {
  auto store = NewSqliteStore(Path());
  store->BeginTransaction();  // creates the store
  store->CommitTransaction();
  RawDb other(Path());
  ASSERT_EQ(other.Exec("BEGIN IMMEDIATE"), SQLITE_OK);
  std::thread release([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_EQ(other.Exec("COMMIT"), SQLITE_OK);
  });
  const auto start = std::chrono::steady_clock::now();
  const std::int32_t code = CodeOf([&] { store->BeginTransaction(); });
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(250));
  release.join();
  ASSERT_EQ(code, 0);
  Set(*store, Sample("after the wait"));
  store->CommitTransaction();
  EXPECT_THAT(List(*NewSqliteStore(Path())), ElementsAre("after the wait"));
}

// A watcher sees another connection's commit within a poll or two, also one
// made before it began to wait, and times out when nothing is committed.
// Reading or waiting for a store that does not exist finds it empty and
// creates nothing; the file's appearance is the change.
TEST_F(SqliteStoreTest, WaitForChangeSeesOtherConnectionsCommits) {
  using std::chrono::milliseconds;
  auto watcher = NewSqliteStore(Path("new/store.db"));
  auto writer = NewSqliteStore(Path("new/store.db"));
  EXPECT_TRUE(writer->GetObjects(Filter()).empty());
  EXPECT_EQ(writer->GetObject(Sample("first")->Id()), nullptr);
  // How long a wait with that timeout took, and what it said.
  auto timed = [&watcher](int timeoutMs) {
    const auto start = std::chrono::steady_clock::now();
    const bool changed = watcher->WaitForChange(timeoutMs);
    return std::pair{changed, std::chrono::steady_clock::now() - start};
  };
  for (bool exists : {false, true}) {
    SCOPED_TRACE(exists ? "store exists" : "no store yet");
    const auto [quiet, quietTook] = timed(200);
    EXPECT_FALSE(quiet);
    EXPECT_GE(quietTook, milliseconds(200));
    EXPECT_EQ(std::filesystem::exists(Path("new")), exists);
    std::thread commit([&writer, exists] {
      std::this_thread::sleep_for(milliseconds(300));
      Set(*writer, Sample(exists ? "second" : "first"));
    });
    const auto [changed, took] = timed(10000);
    commit.join();
    EXPECT_TRUE(changed);
    EXPECT_GE(took, milliseconds(250));
    EXPECT_LT(took, milliseconds(2000));  // 300 ms and a poll, on a loaded machine
    watcher->WaitForChange(0);            // the rest of the write that created the file
  }
  Set(*writer, Sample("before the wait"));
  EXPECT_TRUE(watcher->WaitForChange(0));
  EXPECT_FALSE(watcher->WaitForChange(0));
  EXPECT_THAT(List(*watcher), ElementsAre("first", "second", "before the wait"));
  watcher->BeginTransaction();
  EXPECT_EQ(CodeOf([&] { watcher->WaitForChange(0); }), SQLITE_MISUSE);
  watcher->AbortTransaction();
}

// A store that cannot see other writers (the memory store, a host's own)
// waits the whole time and says "read again", so that a caller watching it
// polls rather than spins.
TEST(MemoryStoreTest, WaitForChangeWaitsAndSaysReadAgain) {
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(NewMemoryStore()->WaitForChange(100));
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(100));
}

// The watcher follows the path, not the file: a store moved over it (as a
// deploy does) or removed and made again is a change, and reads then see
// the file that is there, never pages the old file left in the log.
TEST_F(SqliteStoreTest, WaitForChangeFollowsTheFileAtThePath) {
  auto watcher = NewSqliteStore(Path());
  Set(*NewSqliteStore(Path()), Sample("old"));
  ASSERT_TRUE(watcher->WaitForChange(0));
  ASSERT_THAT(List(*watcher), ElementsAre("old"));
  Set(*NewSqliteStore(Path()), Sample("in the log"));  // the watcher's connection keeps the log
  auto seesOnly = [&watcher](const std::vector<std::string>& names) {
    EXPECT_TRUE(watcher->WaitForChange(10000));
    EXPECT_EQ(List(*watcher), names);
    EXPECT_FALSE(watcher->WaitForChange(100));
  };
  Set(*NewSqliteStore(Path("new.db")), Sample("moved"));
  std::filesystem::rename(Path("new.db"), Path());
  seesOnly({"moved"});
  std::filesystem::remove(Path());
  seesOnly({});
  Set(*NewSqliteStore(Path()), Sample("again"));
  seesOnly({"again"});
}

// After an I/O error SQLite rolls the transaction back by itself. A write
// after that would be committed alone at once, beyond the caller's Abort,
// and a Commit reporting success would lose the earlier writes silently.
TEST_F(SqliteStoreTest, RefusesToCarryOnAfterSqliteRolledBack) {
  FaultVfs::Install();
  auto store = NewSqliteStore(Path());
  Set(*store, Sample("kept"));
  const auto before = Dump(*store);
  auto big = Sample("big");
  big->SetValue("fills the page cache", std::string(8 << 20, 'x'));
  for (const bool commit : {true, false}) {
    store->BeginTransaction();
    Set(*store, Sample("lost"));
    FaultVfs::Arm({IoFault::kFail, io::kWrite, 1, true});
    const std::int32_t failed = CodeOf([&] { Set(*store, big); });
    FaultVfs::Disarm();
    ASSERT_EQ(failed & 0xff, SQLITE_IOERR) << failed;
    EXPECT_EQ(CodeOf([&] { Set(*store, Sample("after")); }), SQLITE_ABORT_ROLLBACK);
    EXPECT_EQ(CodeOf([&] { store->DeleteObjects(Filter()); }), SQLITE_ABORT_ROLLBACK);
    if (commit) {
      EXPECT_EQ(CodeOf([&] { store->CommitTransaction(); }), SQLITE_ABORT_ROLLBACK);
      EXPECT_EQ(CodeOf([&] { store->CommitTransaction(); }), kErrorNoTransaction);
    } else {
      store->AbortTransaction();
    }
    EXPECT_EQ(Dump(*NewSqliteStore(Path())), before);
  }
  store->BeginTransaction();
  Set(*store, Sample("next"));
  store->CommitTransaction();
  EXPECT_THAT(List(*store), ElementsAre("kept", "next"));
}

// Truncated, garbled and foreign files in general are refused at the
// library's level; these are the store's own checks of its schema.
TEST_F(SqliteStoreTest, RefusesFilesThatAreNotStoresAndLeavesThemAlone) {
  NewSqliteStore(Path("future"));
  WriteFile(Path("random"), std::string(8192, 'Z'));
  const struct {
    const char* name;
    const char* sql;
    std::int32_t code;
  } cases[] = {
      {"random", "", SQLITE_NOTADB},
      {"foreign-id", "PRAGMA application_id = 4242;", kErrorNotAStore},
      {"foreign-version", "PRAGMA user_version = 7;", kErrorNotAStore},
      {"future", "PRAGMA user_version = 4;", kErrorNotAStore},
      {"no-table", "PRAGMA application_id = 1413568079; PRAGMA user_version = 1;", kErrorNotAStore},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    if (*c.sql) RawDb(Path(c.name), SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE).Exec(c.sql);
    const std::string before = ReadFile(Path(c.name));
    for (int attempt = 0; attempt < 2; ++attempt) {  // nothing was half set up
      EXPECT_EQ(CodeOf([&] { NewSqliteStore(Path(c.name)); }), c.code);
    }
    EXPECT_EQ(ReadFile(Path(c.name)), before);
    EXPECT_FALSE(std::filesystem::exists(Path(c.name) + "-wal"));
  }
}

// A damaged body fails the reads of its own object only: the object is
// still fetched and listed, and every read of its contents (and writing it
// back) throws kErrorCorruptObject, while its neighbour reads intact.
TEST_F(SqliteStoreTest, DamagedBodiesFailOnlyTheirOwnReads) {
  auto store = NewSqliteStore(Path());
  const auto sample = Sample("s"), neighbour = Sample("t");
  Set(*store, sample);
  Set(*store, neighbour);
  RawDb raw(Path());
  raw.Exec("PRAGMA synchronous = OFF");
  const std::string table = raw.QueryText("SELECT 'c' || id FROM collections");
  const std::string body =
      raw.QueryText("SELECT hex(body) FROM " + table + " WHERE instance = CAST('s' AS BLOB)");
  // The code every read of the object throws, 0 when none does; a mix fails.
  auto contents = [](const ConfigStoreObject& o) {
    std::string text;
    const std::int32_t codes[] = {CodeOf([&] { o.GetValue("name", &text); }),
                                  CodeOf([&] { o.GetSubObject(SubObjectId("arr", "0")); }),
                                  CodeOf([&] { o.GetSubObjectInstances(nullptr); })};
    EXPECT_TRUE(codes[0] == codes[1] && codes[1] == codes[2]) << codes[0] << codes[1] << codes[2];
    return codes[0];
  };
  auto reads = [&](const std::string& hex) {
    EXPECT_EQ(raw.Exec("UPDATE " + table + " SET body = X'" + hex +
                       "' WHERE instance = CAST('s' AS BLOB)"),
              SQLITE_OK);
    const auto got = store->GetObject(sample->Id());
    const auto listed = store->GetObjects(Filter());
    EXPECT_EQ(listed.size(), 2u);
    EXPECT_EQ(Describe(*listed.at(1)), Describe(*neighbour));
    const std::int32_t code = contents(*got);
    EXPECT_EQ(contents(*listed.at(0)), code) << hex;
    EXPECT_TRUE(code == 0 || code == kErrorCorruptObject) << hex << ": " << code;
    if (code != 0) {
      std::int32_t flags = 0;
      EXPECT_EQ(CodeOf([&] { store->SetObject(got, flags); }), kErrorCorruptObject);
    }
    return code != 0;
  };
  std::vector<std::string> damaged = {
      body + "00",
      "02" + body.substr(2),                 // unknown format
      "01FFFFFFFF0F",                        // more values than bytes
      "0101016E0700",                        // unknown kind
      "0101016E0080808080808080808080807F",  // a length wider than 64 bits
      "0101016E01FFFFFFFFFFFFFFFFFFFF01",    // an eleven-byte integer
      "0101016E01FFFFFFFFFFFFFFFFFF7F00",    // complete but for a too wide integer
  };
  for (std::size_t n = 0; n < body.size(); n += 2) damaged.push_back(body.substr(0, n));
  for (const std::string& hex : damaged) EXPECT_TRUE(reads(hex)) << hex;

  // Random damage either still decodes or is reported by every read.
  std::mt19937 rng(7);
  int reported = 0;
  for (int round = 0; round < 300; ++round) {
    std::string hex = body;
    hex[rng() % hex.size()] = "0123456789ABCDEF"[rng() % 16];
    hex[rng() % hex.size()] = "0123456789ABCDEF"[rng() % 16];
    reported += reads(hex);
  }
  EXPECT_GT(reported, 0);
  EXPECT_FALSE(reads(body));
}

// The lazily built parts of an object read from the store may be built by
// several threads at once, each taking the lazy paths in another order; the
// objects of one listing share where their sub-objects are built.
TEST_F(SqliteStoreTest, ThreadsMayReadObjectsTogether) {
  auto store = NewSqliteStore(Path());
  const auto written = Sample("t", 40);
  Set(*store, written);
  // "s<i>-<n>" has n sub-objects; 200 take more room than the listing's
  // objects share in one block.
  for (int i = 0; i < 30; ++i) {
    const int subs = i == 7 ? 200 : i % 5;
    Set(*store, Sample("s" + std::to_string(i) + "-" + std::to_string(subs), subs));
  }
  const std::function<bool(const ConfigStoreObject&)> checks[] = {
      [&](const ConfigStoreObject& o) { return Describe(o) == Describe(*written); },
      [](const ConfigStoreObject& o) { return o.GetSubObjectInstances(nullptr).size() == 40; },
      [](const ConfigStoreObject& o) {
        std::string s;
        return o.GetValue("name", &s) && s == std::string("sample\0\xff", 8);
      },
      [](const ConfigStoreObject& o) { return !!o.GetSubObject(SubObjectId("blobs", "b39")); },
  };
  for (int round = 0; round < 20; ++round) {
    const auto read = store->GetObject(written->Id());
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
      threads.emplace_back([&, t] {
        for (int k = 0; k < 4; ++k) failures += !checks[(t + k) % 4](*read);
      });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(failures, 0);
  }
  const auto listed = store->GetObjects(Filter("pool"));
  ASSERT_EQ(listed.size(), 31u);
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (std::size_t k = 0; k < listed.size(); ++k) {
        const ConfigStoreObject& o = *listed[(k * 7 + t * 5) % listed.size()];
        const std::string& id = o.Id().InstanceId();
        const int subs = id == "t" ? 40 : std::stoi(id.substr(id.find('-') + 1));
        const auto instances = o.GetSubObjectInstances(nullptr);
        long long last = -1;
        wrong += static_cast<int>(instances.size()) != subs ||
                 (subs != 0 && !(instances.back()->GetValue("n", &last) && last == subs - 1));
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
}

// GetStore's per-thread connection follows TAVO_CONFIGSTORE_PATH. A
// transaction open on it is abandoned when an exception unwinds past the
// last handle given out, and kept when a handle is merely dropped.
TEST_F(SqliteStoreTest, DefaultStoreAbandonsTransactionsOnlyWhenUnwinding) {
  EXPECT_EQ(CodeOf([] { ConfigStore::GetStore("elsewhere"); }), kErrorUnknownNamespace);
  UseStoreAt(Path("a.db"));
  try {
    auto store = ConfigStore::GetStore(sGlobalNamespace);
    store->BeginTransaction();
    Set(*store, Sample("unwound"));
    throw std::runtime_error("not a store error");
  } catch (const std::runtime_error&) {
  }
  EXPECT_EQ(RawDb(Path("a.db")).Exec("BEGIN IMMEDIATE; ROLLBACK;"), SQLITE_OK);  // no lock held
  ConfigStore::GetStore(sGlobalNamespace)->BeginTransaction();
  Set(*ConfigStore::GetStore(sGlobalNamespace), Sample("kept"));
  ConfigStore::GetStore(sGlobalNamespace)->CommitTransaction();
  UseStoreAt(Path("b.db"));
  Set(*ConfigStore::GetStore(sGlobalNamespace), Sample("b"));
  EXPECT_THAT(List(*NewSqliteStore(Path("a.db"))), ElementsAre("kept"));
  EXPECT_THAT(List(*NewSqliteStore(Path("b.db"))), ElementsAre("b"));
}

}  // namespace
}  // namespace TavoConfigStore
