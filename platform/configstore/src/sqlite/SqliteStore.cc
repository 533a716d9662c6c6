// The SQLite backend: a table per collection, each object a row of its
// instance id and its body (object/Format.h) in one BLOB. Schema.h has the
// tables, which of them holds which collection, and the upgrades from formats
// 1 and 2; History.h the versions the store keeps of itself; StoreFile.h how
// the file is made and watched; WriteOrder.h the order objects list in.
//
// Durability: WAL with synchronous=FULL, which fsyncs the log at every
// commit. synchronous=NORMAL would already keep a committed transaction
// through a process kill (the log is in the OS page cache), but could lose the
// last commits on power loss or an OS crash. Configuration writes are rare and
// a setting that silently reverts after a power cut is worse than an fsync, so
// the store pays for it; this is also SQLite's own default.
//
// A file of zero bytes is what SQLite sees as an empty database, so it is
// treated as a new, empty store and gets the schema. Any other file that does
// not carry our application id and a known format is refused untouched.
//
// A process that may read but not write the file gets a read-only
// connection; for that SQLite needs the -wal and -shm to exist already, so
// they are kept when the last connection closes.

#include <sqlite3.h>

#include <algorithm>
#include <chrono>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "../Backend.h"
#include "../HistorySource.h"
#include "../TransactionLevels.h"
#include "../object/Objects.h"
#include "Connection.h"
#include "History.h"
#include "Schema.h"
#include "StoreFile.h"
#include "TavoConfigStore/ConfigStore.h"
#include "WriteOrder.h"

namespace TavoConfigStore {
namespace {

using sqlite::Collections;
using sqlite::Connection;
using sqlite::ObjectPtr;
using sqlite::Resetter;

// Pages of 16 KiB for new stores: an object with a few 256-byte blobs takes
// well over 1 KiB, so a 4 KiB page holds only two or three of them and leaves
// much of itself empty, and a listing reads (one system call each) and
// writes several times as many pages. The cost is that the smallest write
// puts 16 KiB pages into the log rather than 4 KiB ones.
constexpr int kPageSize = 16384;

// How often WaitForChange looks: a look is one lstat of the path and one
// read of the shared-memory index, so a watcher costs next to nothing and
// still answers within a twentieth of a second.
constexpr std::chrono::milliseconds kChangePoll(50);

class SqliteStore final : public Backend, public HistorySource {
 public:
  // Every message names the store, never with a password that a URL-like
  // path may hold.
  SqliteStore(const std::string& path, const SqliteStoreOptions& options)
      : file_(path, "configuration store " + RedactLocator(path)),
        conn_("configuration store " + RedactLocator(path)),
        options_(options) {
    if (path.empty()) {
      throw ConfigStoreException("configuration store: empty path", kErrorNoStorePath);
    }
    Open(false);
  }

  std::string Where() const override { return conn_.Where(); }

  ObjectPtr Get(const ConfigStoreObjectId& id) override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!Open(false)) return nullptr;
    // A collection, once made, is never dropped: finding it and then its
    // object need not share a snapshot.
    Collections::Collection* c = collections_.Find(id, false);
    if (c == nullptr) return nullptr;
    sqlite3_stmt* s = collections_.Statement(c, Collections::kListOne);
    Resetter reset(s);
    conn_.Bind(s, 1, id.InstanceId());
    const int rc = sqlite3_step(s);
    if (rc == SQLITE_DONE) return nullptr;
    if (rc != SQLITE_ROW) conn_.Fail("reading an object");
    return sqlite::DecodeRow(conn_, ConfigStoreObjectId(id), s, nullptr);
  }

  void Set(const ConfigStoreObject& object) override {
    // Encoded outside the lock into a buffer that keeps its capacity, so a
    // run of writes allocates nothing here.
    thread_local std::string body;
    body.clear();
    objectmodel::EncodeObject(object, &body);
    std::lock_guard<std::mutex> lock(mu_);
    OpenForWriting();
    // A write may touch several tables and the sequence.
    InTransaction("BEGIN IMMEDIATE", "starting a write", "committing a write", [&] {
      Collections::Collection* c = collections_.Find(object.Id(), true);
      history_.BeforeChange(c->id, true);
      changed_ = true;
      sqlite3_stmt* s = collections_.Statement(c, Collections::kPut);
      Resetter reset(s);
      if (sqlite3_bind_int64(s, 1, sequence_.Next()) != SQLITE_OK) conn_.Fail("binding a value");
      conn_.Bind(s, 2, object.Id().InstanceId());
      conn_.Bind(s, 3, body);
      if (sqlite3_step(s) != SQLITE_DONE) conn_.Fail("writing an object");
    });
  }

  void Delete(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    OpenForWriting();
    InTransaction("BEGIN IMMEDIATE", "starting a write", "committing a write", [&] {
      const std::string& instance = filter.Id().InstanceId();
      for (Collections::Collection* c : collections_.Matching(filter.Id())) {
        changed_ = true;
        // A table a kept version holds is left to it; a clear then has
        // nothing more to do.
        if (history_.BeforeChange(c->id, !instance.empty())) continue;
        // Without an instance id, the whole table: SQLite then frees its
        // pages at once instead of deleting row by row.
        sqlite3_stmt* s =
            collections_.Statement(c, instance.empty() ? Collections::kClear : Collections::kErase);
        Resetter reset(s);
        if (!instance.empty()) conn_.Bind(s, 1, instance);
        if (sqlite3_step(s) != SQLITE_DONE) conn_.Fail("deleting objects");
      }
    });
  }

  std::vector<ObjectPtr> List(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    std::vector<ObjectPtr> out;
    if (!Open(false)) return out;
    // Outside a transaction, one of its own pins one snapshot for the whole
    // listing.
    InTransaction("BEGIN", "starting a read", "ending a read", [&] {
      const std::string& instance = filter.Id().InstanceId();
      const std::vector<Collections::Collection*> matching = collections_.Matching(filter.Id());
      std::vector<sqlite3_int64> seqs;
      objectmodel::Arena arena;
      for (Collections::Collection* c : matching) {
        sqlite3_stmt* s = collections_.Statement(
            c, instance.empty() ? Collections::kList : Collections::kListOne);
        if (!instance.empty()) conn_.Bind(s, 1, instance);
        sqlite::ReadObjects(conn_, s, c->key, c->group, c->component, &out,
                            matching.size() > 1 ? &seqs : nullptr, &arena, "listing objects");
      }
      if (matching.size() > 1) sqlite::InWriteOrder(seqs, &out);
    });
    return out;
  }

  // The outermost transaction is SQLite's; each one begun inside it is a
  // savepoint, so an inner abort undoes only its own writes.
  void BeginTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (levels_.Open()) {
      RefuseWriteAfterRollback();
      conn_.Run("SAVEPOINT nested", "starting a nested transaction");
    } else {
      OpenForWriting();
      // IMMEDIATE takes the write lock now, so a writer waits here (busy
      // timeout) instead of failing on its first write with a stale snapshot.
      conn_.Run("BEGIN IMMEDIATE", "starting a transaction");
      changed_ = false;
    }
    levels_.Begin(changed_);
  }

  void CommitTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!levels_.Open()) NoTransactionToCommit();
    if (conn_.Idle()) {
      // SQLite rolled back by itself after an error (full disk, I/O error):
      // the caller's writes, at every level, are gone and must not be
      // reported as committed.
      EndAll();
      throw ConfigStoreException(
          Where() + ": the transaction was rolled back after an earlier error; nothing committed",
          SQLITE_ABORT_ROLLBACK);
    }
    if (levels_.Nested()) {
      conn_.Run("RELEASE nested", "ending a nested transaction");
      levels_.Commit();
      return;
    }
    sequence_.Flush();
    try {
      RecordVersion();
      conn_.Run("COMMIT", "committing");
    } catch (...) {
      // A failed COMMIT may leave the transaction open (then Abort ends it).
      if (conn_.Idle()) EndAll();
      throw;
    }
    levels_.Commit();
    sequence_.Forget();
  }

  void AbortTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!levels_.Open()) return;
    // SQLite may already have rolled back by itself; there is nothing left.
    if (conn_.Idle()) return EndAll();
    // Collections made inside what is undone are gone again.
    if (levels_.Nested()) {
      collections_.Forget();
      history_.Forget();
      conn_.Run("ROLLBACK TO nested", "undoing a nested transaction");
      conn_.Run("RELEASE nested", "undoing a nested transaction");
      changed_ = levels_.Abort();
      return;
    }
    Forget();
    try {
      conn_.Run("ROLLBACK", "rolling back");
    } catch (...) {
      if (conn_.Idle()) levels_.Clear();
      throw;
    }
    levels_.Clear();
  }

  // ---- HistorySource ------------------------------------------------------

  std::string HistoryWhere() const override { return Where(); }

  std::vector<StoreVersion> Versions() override {
    std::lock_guard<std::mutex> lock(mu_);
    std::vector<StoreVersion> out;
    if (!Open(false)) return out;
    InTransaction("BEGIN", "starting a read", "ending a read", [&] { out = history_.Versions(); });
    return out;
  }

  unsigned Depth() override {
    std::lock_guard<std::mutex> lock(mu_);
    unsigned depth = sqlite::kDefaultDepth;
    if (!Open(false)) return depth;
    InTransaction("BEGIN", "starting a read", "ending a read", [&] { depth = history_.Depth(); });
    return depth;
  }

  void SetDepth(unsigned depth) override {
    std::lock_guard<std::mutex> lock(mu_);
    OpenForWriting();
    InTransaction("BEGIN IMMEDIATE", "starting a write", "committing a write",
                  [&] { history_.SetDepth(depth); });
  }

  std::uint64_t Newest() override {
    std::lock_guard<std::mutex> lock(mu_);
    std::uint64_t newest = 0;
    if (!Open(false)) return newest;
    InTransaction("BEGIN", "starting a read", "ending a read", [&] { newest = history_.Newest(); });
    return newest;
  }

  std::vector<ObjectPtr> ListVersion(std::uint64_t number,
                                     const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!Open(false)) {
      throw ConfigStoreException(NotKeptMessage(Where(), number), kErrorNoSuchVersion);
    }
    std::vector<ObjectPtr> out;
    InTransaction("BEGIN", "starting a read", "ending a read",
                  [&] { out = history_.Objects(number, filter.Id()); });
    return out;
  }

  // Any commit by another connection since this one connected or last
  // looked counts, so a change between a caller's read and this call is not
  // missed. The lock is held only while looking, never while sleeping.
  bool WaitForChange(int timeoutMs) override {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    for (;;) {
      {
        std::lock_guard<std::mutex> lock(mu_);
        if (levels_.Open()) {
          // Our write lock would keep out the very change waited for.
          throw ConfigStoreException(Where() + ": WaitForChange inside a transaction",
                                     SQLITE_MISUSE);
        }
        if (ChangedSinceLastLook()) return true;
      }
      const auto left = deadline - std::chrono::steady_clock::now();
      if (left <= left.zero()) return false;
      std::this_thread::sleep_for(std::min<std::chrono::steady_clock::duration>(left, kChangePoll));
    }
  }

 private:
  // ---- Connecting ---------------------------------------------------------

  // Connects to the store file when there is one; with "create", makes it
  // first. False when there is none and "create" is not set: a reader of a
  // store nobody has written yet sees it empty, and leaves nothing behind.
  bool Open(bool create) {
    if (conn_.IsOpen()) return true;
    if (!file_.Exists()) {
      if (!create) return false;
      file_.Create();
    }
    file_.Exists("-wal");
    file_.Exists("-shm");
    file_.NoteConnected();
    conn_.Open(file_.SqliteName(), options_.busyTimeoutMs);
    try {
      Configure();
    } catch (...) {
      Forget();
      conn_.Close();
      throw;
    }
    return true;
  }

  void Configure() {
    // The -wal and -shm stay when the last connection closes, so that a
    // reader without write access to the directory can still open the
    // store; the log is truncated at that close (journal_size_limit).
    int persist = 1;
    sqlite3_file_control(conn_.Db(), "main", SQLITE_FCNTL_PERSIST_WAL, &persist);
    // Takes effect only on a file without tables yet; an existing store
    // keeps the page size it was created with.
    conn_.Exec("PRAGMA page_size=" + std::to_string(kPageSize), "setting the page size");

    // Look first under a read lock, and only take the write lock when the
    // schema has to be created; checking again under it settles a race with
    // another process creating the same store.
    sqlite::Found found = sqlite::Found::kCurrent;
    const char* header = "reading the store header";
    InTransaction("BEGIN", header, header, [&] { found = sqlite::Inspect(conn_); });
    if (found != sqlite::Found::kCurrent) {
      // A file of format 1 is upgraded by the first writer that opens it; a
      // reader that may not write cannot, and gets SQLite's error.
      const char* what =
          found == sqlite::Found::kEmpty ? "creating the store" : "upgrading the store";
      InTransaction("BEGIN IMMEDIATE", what, what, [&] {
        found = sqlite::Inspect(conn_);
        if (found == sqlite::Found::kEmpty) sqlite::CreateSchema(conn_);
        if (found == sqlite::Found::kFormat1) sqlite::UpgradeFormat1(conn_);
        if (found == sqlite::Found::kFormat2) sqlite::UpgradeFormat2(conn_);
      });
    }
    // Only now, once the file is known to be ours: switching to WAL rewrites
    // the header. The mode is persistent, so this is a no-op after creation;
    // should the file system refuse WAL, the store carries on in rollback mode.
    conn_.Exec("PRAGMA journal_mode=WAL", "setting the journal mode");
    conn_.Exec("PRAGMA synchronous=FULL", "setting the sync mode");
    conn_.Exec("PRAGMA journal_size_limit=67108864", "setting the log size limit");
    seenVersion_ = DataVersion();
    if (!ReadOnly()) file_.FollowModeInCompanions();
  }

  // Closes the connection to a file no longer at the path, with everything
  // prepared on it; the next use connects to whatever is there then.
  void Disconnect() {
    // SQLite neither checkpoints nor empties the log when the last
    // connection to a moved or deleted file closes, and a log left with
    // that file's pages would be read as part of the next file at the path.
    // Best effort, without waiting for a lock: another connection to the
    // old file may still hold one.
    sqlite3_busy_timeout(conn_.Db(), 0);
    sqlite3_wal_checkpoint_v2(conn_.Db(), nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
    Forget();
    conn_.Close();
  }

  bool ReadOnly() const { return sqlite3_db_readonly(conn_.Db(), "main") == 1; }

  void OpenForWriting() {
    Open(true);
    RefuseWriteAfterRollback();
    if (!levels_.Open() && ReadOnly()) {
      throw ConfigStoreException(
          Where() + ": opened read-only (no write permission on the file or its directory)",
          SQLITE_READONLY);
    }
  }

  // ---- Transactions -------------------------------------------------------

  // Runs "body" inside the caller's transaction, or else in one of its own
  // begun with "begin", which a failure rolls back.
  template <typename Body>
  void InTransaction(std::string_view begin, const char* starting, const char* ending,
                     Body&& body) {
    if (!conn_.Idle()) return body();
    sequence_.Forget();  // counted in a transaction that is over
    conn_.Run(begin, starting);
    try {
      body();
      sequence_.Flush();
      RecordVersion();
      conn_.Run("COMMIT", ending);
    } catch (...) {
      conn_.RollbackQuietly();
      Forget();
      throw;
    }
    sequence_.Forget();
  }

  // Once SQLite has rolled the caller's transaction back by itself (full
  // disk, I/O error, interrupt), a write would be committed on its own at
  // once, outside the transaction the caller still takes to be open, and
  // AbortTransaction could no longer undo it. Refused until the caller ends
  // the transaction.
  void RefuseWriteAfterRollback() const {
    if (levels_.Open() && conn_.Idle()) {
      throw ConfigStoreException(
          Where() +
              ": the transaction was rolled back after an earlier error; nothing is "
              "written until it is ended",
          SQLITE_ABORT_ROLLBACK);
    }
  }

  // The transaction is over at every level, its writes undone.
  void EndAll() {
    levels_.Clear();
    Forget();
  }

  void Forget() {
    collections_.Forget();
    history_.Forget();
    sequence_.Forget();
    changed_ = false;
  }

  // ---- History ------------------------------------------------------------

  // Before the outermost commit: what it commits becomes a version.
  void RecordVersion() {
    if (!changed_) return;
    history_.Record();
    changed_ = false;
  }

  // ---- Changes by others --------------------------------------------------

  // Without a connection there was no file when last looked: its appearance
  // is the change, and connecting (never creating) sets the new baseline.
  // Another file at the path, or none, is a change too: the connection
  // follows the path, not the file it first found there.
  bool ChangedSinceLastLook() {
    if (conn_.IsOpen() && file_.Replaced()) {
      Disconnect();
      Open(false);
      return true;
    }
    if (!conn_.IsOpen()) return Open(false);
    const sqlite3_int64 version = DataVersion();
    if (version == seenVersion_) return false;
    seenVersion_ = version;
    return true;
  }

  // Moves only when another connection commits, not on this one's writes.
  sqlite3_int64 DataVersion() { return conn_.Int("PRAGMA data_version", "looking for changes"); }

  // NOMUTEX turns off SQLite's own locking; this keeps a store that is shared
  // between threads anyway (SetGlobalStore) from corrupting the connection.
  std::mutex mu_;
  sqlite::StoreFile file_;
  Connection conn_;
  Collections collections_{conn_};
  SqliteStoreOptions options_;
  sqlite::History history_{conn_};
  sqlite::WriteSequence sequence_{conn_};
  // Each level keeps whether the transaction had changed anything when the
  // level began, which an abort of the level brings back.
  TransactionLevels<bool> levels_;
  bool changed_ = false;           // the open write changed something: a new version
  sqlite3_int64 seenVersion_ = 0;  // data_version when WaitForChange last looked
};

}  // namespace

std::shared_ptr<ConfigStore> NewSqliteStore(const std::string& path) {
  return std::make_shared<SqliteStore>(path, SqliteStoreOptions());
}

std::shared_ptr<ConfigStore> NewSqliteStore(const std::string& path,
                                            const SqliteStoreOptions& options) {
  return std::make_shared<SqliteStore>(path, options);
}

}  // namespace TavoConfigStore
