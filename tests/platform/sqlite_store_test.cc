// The SQLite backend's own behaviour: the file, other connections and other
// processes, damaged or foreign files, locking.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "FileBytes.h"
#include "SqliteStoreTesting.h"
#include "TavoConfigStore/ConfigStore.h"
#include "store_test_util.h"

namespace TavoConfigStore {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using testutil::All;
using testutil::CodeOf;
using testutil::Describe;
using testutil::Dump;
using testutil::Filter;
using testutil::Instances;
using testutil::Obj;
using testutil::ScratchDir;
using testutil::Set;

using testfiles::ReadFile;
using testfiles::WriteFile;

std::string RandomBytes(std::size_t n, unsigned seed) {
  std::mt19937 rng(seed);
  std::string s(n, '\0');
  for (char& c : s) c = static_cast<char>(rng() & 0xff);
  return s;
}

// Runs SQL through a connection of its own, as another program would.
void RawExec(const std::string& path, const std::string& sql) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
  char* error = nullptr;
  EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, &error), SQLITE_OK)
      << (error ? error : "");
  sqlite3_free(error);
  sqlite3_close(db);
}

std::string RawText(const std::string& path, const std::string& sql) {
  sqlite3* db = nullptr;
  std::string out;
  if (sqlite3_open(path.c_str(), &db) == SQLITE_OK) {
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v2(db, sql.c_str(), -1, &s, nullptr) == SQLITE_OK &&
        sqlite3_step(s) == SQLITE_ROW) {
      out = reinterpret_cast<const char*>(sqlite3_column_text(s, 0));
    }
    sqlite3_finalize(s);
  }
  sqlite3_close(db);
  return out;
}

// The store's error for "path", or a failure when it opens.
ConfigStoreException OpenError(const std::string& path) {
  try {
    NewSqliteStore(path);
  } catch (const ConfigStoreException& e) {
    return e;
  }
  ADD_FAILURE() << "opened " << path;
  return ConfigStoreException("", 0);
}

std::shared_ptr<ConfigStoreObject> Sample(const std::string& instance) {
  auto o = Obj("pool", "storage", "tavo", instance);
  o->SetValue("name", std::string("sample\0\xff", 8));
  o->SetValue("size", -1234567890123LL);
  auto sub = o->CreateSubObject(SubObjectId("blobs", "b1"));
  sub->SetValue("hash", std::string("\x01\x02\x03", 3));
  sub->SetValue("count", 3LL);
  o->CreateSubObject(SubObjectId("blobs", "b2"));
  return o;
}

// Runs "body" in a child process; returns its wait status.
template <typename F>
int InChild(F&& body) {
  const pid_t pid = fork();
  if (pid == 0) {
    try {
      body();
    } catch (...) {
      _exit(3);
    }
    _exit(0);
  }
  int status = -1;
  waitpid(pid, &status, 0);
  return status;
}

class SqliteStoreTest : public ::testing::Test {
 protected:
  std::string PathOf(const std::string& name) const { return dir_.Path() + "/" + name; }

  ScratchDir dir_;
};

TEST_F(SqliteStoreTest, PersistsAcrossConnectionsInItsOwnSchema) {
  const std::string path = PathOf("new/dirs/store.db");
  std::vector<std::string> expected;
  {
    auto store = NewSqliteStore(path);
    Set(*store, Sample("a"));
    store->BeginTransaction();
    Set(*store, Sample("b"));
    Set(*store, Sample("a"));  // moves to the end
    store->CommitTransaction();
    store->BeginTransaction();
    Set(*store, Sample("lost"));
    store->DeleteObjects(Filter("", "", "", "b"));
    store->AbortTransaction();
    expected = Dump(*store);
  }
  ASSERT_EQ(expected.size(), 2u);
  EXPECT_EQ(expected[0], Describe(*Sample("b")));
  EXPECT_EQ(expected[1], Describe(*Sample("a")));

  EXPECT_EQ(RawText(path, "PRAGMA user_version"), "1");
  EXPECT_EQ(RawText(path, "PRAGMA application_id"), std::to_string(0x5441564f));
  EXPECT_EQ(RawText(path, "PRAGMA journal_mode"), "wal");
  EXPECT_EQ(RawText(path, "SELECT count(*) FROM objects"), "2");

  auto reopened = NewSqliteStore(path);
  EXPECT_EQ(Dump(*reopened), expected);
  auto a = reopened->GetObject(ConfigStoreObjectId("pool", "storage", "tavo", "a"));
  ASSERT_NE(a, nullptr);
  EXPECT_EQ(Describe(*a), Describe(*Sample("a")));
}

TEST_F(SqliteStoreTest, CommittedWritesOfOtherProcessesSurvive) {
  const std::string path = PathOf("store.db");
  auto parent = NewSqliteStore(path);
  Set(*parent, Sample("parent"));

  // Commits, then dies without any cleanup while a second transaction is open.
  int status = InChild([&] {
    auto store = NewSqliteStore(path);
    store->BeginTransaction();
    Set(*store, Sample("child"));
    store->CommitTransaction();
    store->BeginTransaction();
    Set(*store, Sample("uncommitted"));
    store->DeleteObjects(Filter("", "", "", "parent"));
    kill(getpid(), SIGKILL);
  });
  ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;
  EXPECT_THAT(Instances(parent->GetObjects(All())), ElementsAre("parent", "child"));
  EXPECT_THAT(Instances(NewSqliteStore(path)->GetObjects(All())), ElementsAre("parent", "child"));
  // The dead writer's lock is gone.
  parent->BeginTransaction();
  parent->CommitTransaction();

  // Two processes writing at once wait for each other and lose nothing.
  std::vector<pid_t> children;
  for (const char* who : {"x", "y"}) {
    const pid_t pid = fork();
    if (pid == 0) {
      try {
        auto store = NewSqliteStore(path);
        for (int i = 0; i < 15; ++i) {
          store->BeginTransaction();
          Set(*store, Obj("k", who, "c", std::to_string(i)));
          store->CommitTransaction();
          Set(*store, Obj("k", who, "single", std::to_string(i)));
        }
      } catch (...) {
        _exit(3);
      }
      _exit(0);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) {
    int childStatus = -1;
    waitpid(pid, &childStatus, 0);
    EXPECT_TRUE(WIFEXITED(childStatus) && WEXITSTATUS(childStatus) == 0) << childStatus;
  }
  EXPECT_EQ(parent->GetObjects(Filter("k", "x", "", "")).size(), 30u);
  EXPECT_EQ(parent->GetObjects(Filter("k", "y", "", "")).size(), 30u);
}

TEST_F(SqliteStoreTest, OtherConnectionsSeeOnlyCommittedData) {
  const std::string path = PathOf("store.db");
  auto writer = NewSqliteStore(path);
  auto reader = NewSqliteStore(path);
  Set(*writer, Sample("x"));
  EXPECT_THAT(Instances(reader->GetObjects(All())), ElementsAre("x"));

  writer->BeginTransaction();
  Set(*writer, Sample("y"));
  writer->DeleteObjects(Filter("", "", "", "x"));
  // Readers are not blocked by the writer and see the state before it.
  EXPECT_EQ(reader->GetObject(Sample("y")->Id()), nullptr);
  EXPECT_NE(reader->GetObject(Sample("x")->Id()), nullptr);
  EXPECT_THAT(Instances(reader->GetObjects(All())), ElementsAre("x"));
  writer->CommitTransaction();
  EXPECT_THAT(Instances(reader->GetObjects(All())), ElementsAre("y"));
  EXPECT_EQ(reader->GetObject(Sample("x")->Id()), nullptr);

  writer->BeginTransaction();
  Set(*writer, Sample("z"));
  writer->AbortTransaction();
  EXPECT_THAT(Instances(reader->GetObjects(All())), ElementsAre("y"));

  // Writes of the other connection become visible to this one's next read.
  Set(*reader, Sample("from reader"));
  EXPECT_THAT(Instances(writer->GetObjects(All())), ElementsAre("y", "from reader"));
}

TEST_F(SqliteStoreTest, GetStoreOpensTheEnvironmentPath) {
  const std::string path = PathOf("a/b/c/configstore.db");
  const char* saved = std::getenv("TAVO_CONFIGSTORE_PATH");
  const std::string savedValue = saved ? saved : "";
  ASSERT_EQ(setenv("TAVO_CONFIGSTORE_PATH", path.c_str(), 1), 0);
  EXPECT_EQ(DefaultStorePath(), path);
  auto store = ConfigStore::GetStore(sGlobalNamespace);
  Set(*store, Sample("via env"));
  EXPECT_EQ(ConfigStore::GetStore(sGlobalNamespace), store);  // cached per thread
  EXPECT_TRUE(std::filesystem::is_regular_file(path));
  EXPECT_THAT(Instances(NewSqliteStore(path)->GetObjects(All())), ElementsAre("via env"));
  EXPECT_EQ(CodeOf([] { ConfigStore::GetStore("elsewhere"); }), kErrorUnknownNamespace);

  // Another path, another connection.
  const std::string other = PathOf("other/configstore.db");
  ASSERT_EQ(setenv("TAVO_CONFIGSTORE_PATH", other.c_str(), 1), 0);
  auto second = ConfigStore::GetStore(sGlobalNamespace);
  EXPECT_NE(second, store);
  EXPECT_TRUE(second->GetObjects(All()).empty());

  if (saved) {
    setenv("TAVO_CONFIGSTORE_PATH", savedValue.c_str(), 1);
  } else {
    unsetenv("TAVO_CONFIGSTORE_PATH");
  }
}

TEST_F(SqliteStoreTest, RefusesFilesThatAreNotStoresAndLeavesThemAlone) {
  struct Case {
    std::string name;
    std::int32_t code;
    std::string says;
  };
  std::vector<Case> cases;

  WriteFile(PathOf("random"), RandomBytes(8192, 1));
  cases.push_back({"random", SQLITE_NOTADB, "not a database"});

  // The right magic string, then garbage.
  WriteFile(PathOf("garbled"), std::string("SQLite format 3\0", 16) + RandomBytes(4080, 2));
  cases.push_back({"garbled", SQLITE_NOTADB, "not a database"});

  RawExec(PathOf("foreign"), "CREATE TABLE t(x); INSERT INTO t VALUES('theirs');");
  cases.push_back({"foreign", kErrorNotAStore, "not a configuration store"});

  RawExec(PathOf("foreign-id"), "PRAGMA application_id = 4242;");
  cases.push_back({"foreign-id", kErrorNotAStore, "not a configuration store"});

  RawExec(PathOf("foreign-version"), "PRAGMA user_version = 7;");
  cases.push_back({"foreign-version", kErrorNotAStore, "not a configuration store"});

  // Ours, but written by a later schema.
  NewSqliteStore(PathOf("future"));
  RawExec(PathOf("future"), "PRAGMA user_version = 2;");
  cases.push_back({"future", kErrorNotAStore, "unknown schema version 2"});

  // Our id and version, but no table.
  RawExec(PathOf("hollow"), "PRAGMA application_id = 1413568079; PRAGMA user_version = 1;");
  cases.push_back({"hollow", kErrorNotAStore, "no objects table"});

  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string path = PathOf(c.name);
    const std::string before = ReadFile(path);
    ASSERT_FALSE(before.empty());
    const ConfigStoreException e = OpenError(path);
    EXPECT_EQ(e.Code(), c.code) << e.what();
    EXPECT_THAT(e.Message(), HasSubstr(path));
    EXPECT_THAT(e.Message(), HasSubstr(c.says));
    EXPECT_EQ(ReadFile(path), before);
    EXPECT_FALSE(std::filesystem::exists(path + "-wal"));
    // Refused the same way again: nothing was half set up.
    EXPECT_EQ(OpenError(path).Code(), c.code);
  }
  EXPECT_EQ(RawText(PathOf("foreign"), "SELECT x FROM t"), "theirs");

  // A directory where the file should be.
  std::filesystem::create_directory(PathOf("dir.db"));
  EXPECT_EQ(OpenError(PathOf("dir.db")).Code(), SQLITE_CANTOPEN);
}

TEST_F(SqliteStoreTest, ZeroByteFileIsANewEmptyStore) {
  const std::string path = PathOf("empty.db");
  WriteFile(path, "");
  ASSERT_TRUE(std::filesystem::exists(path));
  {
    auto store = NewSqliteStore(path);
    EXPECT_TRUE(store->GetObjects(All()).empty());
    Set(*store, Sample("first"));
  }
  EXPECT_EQ(RawText(path, "PRAGMA user_version"), "1");
  EXPECT_THAT(Instances(NewSqliteStore(path)->GetObjects(All())), ElementsAre("first"));
}

TEST_F(SqliteStoreTest, WritersWaitForTheLockThenFailBusy) {
  const std::string path = PathOf("store.db");
  auto holder = NewSqliteStore(path);
  auto waiter = NewSqliteStore(path);
  sqlite3* waiterDb = SqliteConnectionForTesting(*waiter);
  ASSERT_NE(waiterDb, nullptr);
  EXPECT_EQ(SqliteConnectionForTesting(*NewMemoryStore()), nullptr);
  sqlite3_busy_timeout(waiterDb, 150);

  holder->BeginTransaction();
  Set(*holder, Sample("held"));
  const auto start = std::chrono::steady_clock::now();
  std::string message;
  try {
    waiter->BeginTransaction();
  } catch (const ConfigStoreException& e) {
    EXPECT_EQ(e.Code() & 0xff, SQLITE_BUSY);
    message = e.Message();
  }
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(100));
  EXPECT_THAT(message, HasSubstr(path));
  EXPECT_EQ(CodeOf([&] { Set(*waiter, Sample("w")); }) & 0xff, SQLITE_BUSY);
  EXPECT_EQ(CodeOf([&] { waiter->DeleteObjects(All()); }) & 0xff, SQLITE_BUSY);
  // The failed Begin left no transaction behind; reading still works.
  EXPECT_EQ(CodeOf([&] { waiter->CommitTransaction(); }), kErrorNoTransaction);
  EXPECT_TRUE(waiter->GetObjects(All()).empty());

  // With time enough, the waiter gets the lock once the holder commits.
  sqlite3_busy_timeout(waiterDb, 5000);
  std::thread release([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    holder->CommitTransaction();
  });
  waiter->BeginTransaction();
  release.join();
  Set(*waiter, Sample("w"));
  waiter->CommitTransaction();
  EXPECT_THAT(Instances(holder->GetObjects(All())), ElementsAre("held", "w"));
}

TEST_F(SqliteStoreTest, TransactionEndedBySqliteItself) {
  auto store = NewSqliteStore(PathOf("store.db"));
  sqlite3* db = SqliteConnectionForTesting(*store);
  Set(*store, Sample("kept"));

  // As SQLite does after a full disk or an I/O error.
  store->BeginTransaction();
  Set(*store, Sample("gone"));
  ASSERT_EQ(sqlite3_exec(db, "ROLLBACK", nullptr, nullptr, nullptr), SQLITE_OK);
  store->AbortTransaction();
  EXPECT_THAT(Instances(store->GetObjects(All())), ElementsAre("kept"));

  store->BeginTransaction();
  Set(*store, Sample("gone"));
  ASSERT_EQ(sqlite3_exec(db, "ROLLBACK", nullptr, nullptr, nullptr), SQLITE_OK);
  // Reporting success here would lose the writes silently.
  EXPECT_EQ(CodeOf([&] { store->CommitTransaction(); }), SQLITE_ABORT_ROLLBACK);
  EXPECT_EQ(CodeOf([&] { store->CommitTransaction(); }), kErrorNoTransaction);
  EXPECT_THAT(Instances(store->GetObjects(All())), ElementsAre("kept"));
  store->BeginTransaction();
  store->CommitTransaction();
}

TEST_F(SqliteStoreTest, DamagedBodiesFailAsCorruptObjects) {
  const std::string path = PathOf("store.db");
  auto store = NewSqliteStore(path);
  auto sample = Sample("s");
  Set(*store, sample);
  sqlite3* db = SqliteConnectionForTesting(*store);
  std::string body = RawText(path, "SELECT hex(body) FROM objects");
  ASSERT_FALSE(body.empty());
  {
    std::string bytes;
    for (std::size_t i = 0; i + 1 < body.size(); i += 2) {
      bytes.push_back(static_cast<char>(std::stoi(body.substr(i, 2), nullptr, 16)));
    }
    body = bytes;
  }
  sqlite3_stmt* update = nullptr;
  ASSERT_EQ(sqlite3_prepare_v2(db, "UPDATE objects SET body = ?1", -1, &update, nullptr),
            SQLITE_OK);
  auto put = [&](const std::string& bytes) {
    sqlite3_bind_blob(update, 1, bytes.data(), static_cast<int>(bytes.size()), SQLITE_TRANSIENT);
    EXPECT_EQ(sqlite3_step(update), SQLITE_DONE);
    sqlite3_reset(update);
  };
  auto get = [&] { store->GetObject(sample->Id()); };

  // Every cut short, extended, or with an impossible length or kind.
  std::vector<std::string> damaged;
  for (std::size_t n = 0; n < body.size(); ++n) damaged.push_back(body.substr(0, n));
  damaged.push_back(body + '\0');
  damaged.push_back("\x02" + body.substr(1));                     // unknown format
  damaged.push_back(std::string("\x01\xff\xff\xff\xff\x0f", 6));  // count beyond the end
  damaged.push_back(std::string("\x01\x01\x01n\x07\x00", 6));     // unknown kind
  // A string length wider than 64 bits, an integer varint of eleven bytes.
  damaged.push_back(std::string("\x01\x01\x01n\x00\x80\x80\x80\x80\x80\x80\x80\x80\x80\x7f", 15));
  damaged.push_back(
      std::string("\x01\x01\x01n\x01\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\x01", 16));
  // Complete but for an integer wider than 64 bits.
  damaged.push_back(
      std::string("\x01\x01\x01n\x01\xff\xff\xff\xff\xff\xff\xff\xff\xff\x7f\x00", 16));
  for (const std::string& bytes : damaged) {
    SCOPED_TRACE(testutil::Escape(bytes));
    put(bytes);
    EXPECT_EQ(CodeOf(get), kErrorCorruptObject);
    EXPECT_EQ(CodeOf([&] { store->GetObjects(All()); }), kErrorCorruptObject);
  }
  // A failed listing must not leave its read transaction open.
  store->BeginTransaction();
  store->AbortTransaction();

  // Random damage either still decodes or is reported; nothing else happens.
  std::mt19937 rng(7);
  int corrupt = 0;
  for (int round = 0; round < 400; ++round) {
    std::string bytes = body;
    for (int flips = 1 + round % 3; flips > 0; --flips) {
      bytes[rng() % bytes.size()] = static_cast<char>(rng() & 0xff);
    }
    put(bytes);
    try {
      get();
    } catch (const ConfigStoreException& e) {
      ASSERT_EQ(e.Code(), kErrorCorruptObject) << e.what();
      EXPECT_THAT(e.Message(), HasSubstr(path));
      ++corrupt;
    }
  }
  EXPECT_GT(corrupt, 0);

  put(body);
  sqlite3_finalize(update);
  EXPECT_EQ(Describe(*store->GetObject(sample->Id())), Describe(*sample));
}

TEST_F(SqliteStoreTest, StatementsArePreparedOnceAndNeverLeftRunning) {
  auto store = NewSqliteStore(PathOf("store.db"));
  sqlite3* db = SqliteConnectionForTesting(*store);
  auto round = [&](int i) {
    Set(*store, Sample(std::to_string(i)));
    store->GetObject(Sample(std::to_string(i))->Id());
    store->GetObjects(All());
    store->GetObjects(Filter("pool", "storage", "tavo", ""));
    store->BeginTransaction();
    store->DeleteObjects(Filter("", "", "", std::to_string(i - 1)));
    store->CommitTransaction();
    store->BeginTransaction();
    store->AbortTransaction();
  };
  auto count = [&] {
    int n = 0;
    for (sqlite3_stmt* s = sqlite3_next_stmt(db, nullptr); s; s = sqlite3_next_stmt(db, s)) {
      EXPECT_EQ(sqlite3_stmt_busy(s), 0) << sqlite3_sql(s);
      ++n;
    }
    return n;
  };
  round(0);
  const int prepared = count();
  for (int i = 1; i < 30; ++i) round(i);
  EXPECT_EQ(count(), prepared);
  EXPECT_THAT(Instances(store->GetObjects(All())), ElementsAre("29"));
}

}  // namespace
}  // namespace TavoConfigStore
