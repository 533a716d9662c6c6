// The SQLite backend: a table per collection, each object a row of its
// instance id and its values and sub-objects encoded (ObjectCodec) in one
// BLOB; SqliteSchema.h has the tables and the upgrade from format 1.
//
// Write order: every object written gets the next "seq" of the whole store,
// so a rewritten object moves to the end and objects of several collections
// list in the order they were written.
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
// The file is the catalogue, so it is handled as a secret: created 0600 in
// directories made 0700, never through a symbolic link, and not at all by a
// reader (a store nobody wrote reads as empty). A process that may read but
// not write it gets a read-only connection; for that SQLite needs the -wal
// and -shm to exist already, so they are kept when the last connection
// closes.

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <tuple>
#include <utility>
#include <vector>

#include "Backend.h"
#include "SqliteSchema.h"
#include "TavoConfigStore/ConfigStore.h"
#include "object/Objects.h"

namespace TavoConfigStore {
namespace {

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

// Owns the connection, so that it is closed even when the store's
// constructor throws after opening it.
struct Connection {
  sqlite3* db = nullptr;
  ~Connection() {
    if (db == nullptr) return;
    while (sqlite3_stmt* s = sqlite3_next_stmt(db, nullptr)) sqlite3_finalize(s);
    sqlite3_close(db);  // rolls back an open transaction
  }
};

// Resets a statement on leaving scope: a statement left mid-result would keep
// its read transaction, and with it a stale snapshot, open.
class Resetter {
 public:
  explicit Resetter(sqlite3_stmt* s) : s_(s) {}
  ~Resetter() { sqlite3_reset(s_); }
  Resetter(const Resetter&) = delete;
  Resetter& operator=(const Resetter&) = delete;

 private:
  sqlite3_stmt* s_;
};

// A statement used only while opening.
struct OneShot {
  sqlite3_stmt* s = nullptr;
  ~OneShot() { sqlite3_finalize(s); }
};

class SqliteStore final : public Backend {
 public:
  SqliteStore(const std::string& path, const SqliteStoreOptions& options)
      : path_(path), where_("configuration store " + RedactLocator(path)), options_(options) {
    if (path.empty()) {
      throw ConfigStoreException("configuration store: empty path", kErrorNoStorePath);
    }
    Open(false);
  }

  std::shared_ptr<ConfigStoreObject> Get(const ConfigStoreObjectId& id) override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!Open(false)) return nullptr;
    // A collection, once made, is never dropped: finding it and then its
    // object need not share a snapshot.
    Collection* c = FindCollection(id.Key(), id.Group(), id.Component(), false);
    if (c == nullptr) return nullptr;
    sqlite3_stmt* s = StatementOf(c, kListOne);
    Resetter reset(s);
    Bind(s, 1, id.InstanceId());
    const int rc = sqlite3_step(s);
    if (rc == SQLITE_DONE) return nullptr;
    if (rc != SQLITE_ROW) Fail("reading an object");
    return Decode(ConfigStoreObjectId(id), s, 2);
  }

  void Set(const ConfigStoreObject& object) override {
    // Encoded outside the lock into a buffer that keeps its capacity, so a
    // run of writes allocates nothing here.
    thread_local std::string body;
    body.clear();
    objectmodel::EncodeObject(object, &body);
    std::lock_guard<std::mutex> lock(mu_);
    OpenForWriting();
    Write([&] {
      const ConfigStoreObjectId& id = object.Id();
      Collection* c = FindCollection(id.Key(), id.Group(), id.Component(), true);
      sqlite3_stmt* s = StatementOf(c, kPut);
      Resetter reset(s);
      if (sqlite3_bind_int64(s, 1, NextSeq()) != SQLITE_OK) Fail("binding a value");
      Bind(s, 2, id.InstanceId());
      Bind(s, 3, body);
      if (sqlite3_step(s) != SQLITE_DONE) Fail("writing an object");
    });
  }

  void Delete(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    OpenForWriting();
    Write([&] {
      const std::string& instance = filter.Id().InstanceId();
      for (Collection* c : MatchingCollections(filter.Id())) {
        // Without an instance id, the whole table: SQLite then frees its
        // pages at once instead of deleting row by row.
        sqlite3_stmt* s = StatementOf(c, instance.empty() ? kClear : kErase);
        Resetter reset(s);
        if (!instance.empty()) Bind(s, 1, instance);
        if (sqlite3_step(s) != SQLITE_DONE) Fail("deleting objects");
      }
    });
  }

  std::vector<std::shared_ptr<ConfigStoreObject>> List(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    std::vector<std::shared_ptr<ConfigStoreObject>> out;
    if (!Open(false)) return out;
    // Outside a transaction, an explicit read transaction pins one snapshot
    // for the whole listing.
    const bool ownRead = sqlite3_get_autocommit(db_) != 0;
    if (ownRead) Step(begin_, "starting a read");
    try {
      const std::string& instance = filter.Id().InstanceId();
      const std::vector<Collection*> matching = MatchingCollections(filter.Id());
      // Objects of several collections are merged into write order by seq.
      std::vector<sqlite3_int64> seqs;
      std::string id;  // keeps its capacity from one object to the next
      objectmodel::Arena arena;
      for (Collection* c : matching) {
        sqlite3_stmt* s = StatementOf(c, instance.empty() ? kList : kListOne);
        Resetter reset(s);
        if (!instance.empty()) Bind(s, 1, instance);
        int rc;
        while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
          if (matching.size() > 1) seqs.push_back(sqlite3_column_int64(s, 0));
          AssignColumn(s, 1, &id);
          out.push_back(
              Decode(ConfigStoreObjectId(c->key, c->group, c->component, id), s, 2, &arena));
        }
        if (rc != SQLITE_DONE) Fail("listing objects");
      }
      if (matching.size() > 1) InWriteOrder(seqs, &out);
    } catch (...) {
      if (ownRead) RollbackQuietly();
      throw;
    }
    if (ownRead) Step(commit_, "ending a read");
    return out;
  }

  // The outermost transaction is SQLite's; each one begun inside it is a
  // savepoint, so an inner abort undoes only its own writes.
  void BeginTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (depth_ > 0) {
      RefuseWriteAfterRollback();
      Step(savepoint_, "starting a nested transaction");
      ++depth_;
      return;
    }
    OpenForWriting();
    // IMMEDIATE takes the write lock now, so a writer waits here (busy
    // timeout) instead of failing on its first write with a stale snapshot.
    Step(beginImmediate_, "starting a transaction");
    depth_ = 1;
  }

  void CommitTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (depth_ == 0) {
      throw ConfigStoreException(Where() + ": no transaction to commit", kErrorNoTransaction);
    }
    if (sqlite3_get_autocommit(db_)) {
      // SQLite rolled back by itself after an error (full disk, I/O error):
      // the caller's writes, at every level, are gone and must not be
      // reported as committed.
      depth_ = 0;
      Forget();
      throw ConfigStoreException(
          Where() + ": the transaction was rolled back after an earlier error; nothing committed",
          SQLITE_ABORT_ROLLBACK);
    }
    if (depth_ > 1) {
      Step(release_, "ending a nested transaction");
      --depth_;
      return;
    }
    FlushSequence();
    Resetter reset(commit_);
    if (sqlite3_step(commit_) != SQLITE_DONE) {
      // A failed COMMIT may leave the transaction open (then Abort ends it).
      depth_ = sqlite3_get_autocommit(db_) == 0 ? 1 : 0;
      if (depth_ == 0) Forget();
      Fail("committing");
    }
    depth_ = 0;
    seqLoaded_ = false;  // others may write before our next transaction
  }

  void AbortTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (depth_ == 0) return;
    // SQLite may already have rolled back by itself; there is nothing left.
    if (sqlite3_get_autocommit(db_)) {
      depth_ = 0;
      Forget();
      return;
    }
    // A collection made inside what is undone is gone again.
    if (depth_ > 1) {
      ForgetCollections();
      Step(rollbackTo_, "undoing a nested transaction");
      Step(release_, "undoing a nested transaction");
      --depth_;
      return;
    }
    Forget();
    Resetter reset(rollback_);
    const int rc = sqlite3_step(rollback_);
    depth_ = sqlite3_get_autocommit(db_) == 0 ? 1 : 0;
    if (rc != SQLITE_DONE) Fail("rolling back");
  }

  // Any commit by another connection since this one connected or last
  // looked counts, so a change between a caller's read and this call is not
  // missed. The lock is held only while looking, never while sleeping.
  bool WaitForChange(int timeoutMs) override {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    for (;;) {
      {
        std::lock_guard<std::mutex> lock(mu_);
        if (depth_ > 0) {
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
  // Without a connection there was no file when last looked: its appearance
  // is the change, and connecting (never creating) sets the new baseline.
  // Another file at the path, or none, is a change too: the connection
  // follows the path, not the file it first found there.
  bool ChangedSinceLastLook() {
    if (db_ != nullptr && FileReplaced()) {
      Disconnect();
      Open(false);
      return true;
    }
    if (db_ == nullptr) return Open(false);
    const sqlite3_int64 version = DataVersion();
    if (version == seenVersion_) return false;
    seenVersion_ = version;
    return true;
  }

  // Moves only when another connection commits, not on this one's writes.
  sqlite3_int64 DataVersion() {
    Resetter reset(dataVersion_);
    if (sqlite3_step(dataVersion_) != SQLITE_ROW) Fail("looking for changes");
    return sqlite3_column_int64(dataVersion_, 0);
  }

  // Connects to the store file when there is one; with "create", makes it
  // first. False when there is none and "create" is not set: a reader of a
  // store nobody has written yet sees it empty, and leaves nothing behind.
  bool Open(bool create) {
    if (db_ != nullptr) return true;
    if (!Exists(path_)) {
      if (!create) return false;
      CreateFile();
    }
    Connect();
    return true;
  }

  void OpenForWriting() {
    Open(true);
    RefuseWriteAfterRollback();
    if (depth_ == 0 && sqlite3_db_readonly(db_, "main") == 1) {
      throw ConfigStoreException(
          Where() + ": opened read-only (no write permission on the file or its directory)",
          SQLITE_READONLY);
    }
  }

  // Whether something is at "file" that is not a symbolic link: following a
  // link planted in a shared directory would write the catalogue wherever
  // its owner chose.
  bool Exists(const std::string& file) const {
    struct stat st {};
    if (lstat(file.c_str(), &st) == 0) {
      if (S_ISLNK(st.st_mode)) {
        throw ConfigStoreException(Where() + ": " + RedactLocator(file) +
                                       " is a symbolic link; the store does not follow links",
                                   kErrorSymlink);
      }
      return true;
    }
    const int error = errno;
    if (error == ENOENT || error == ENOTDIR) return false;
    throw ConfigStoreException(
        Where() + ": cannot look up " + RedactLocator(file) + ": " + std::strerror(error),
        SQLITE_CANTOPEN);
  }

  // Missing directories 0700 and the file 0600, whatever the umask allows:
  // the catalogue is nobody else's to read. SQLite gives the -wal and -shm it
  // creates the mode of the database file.
  void CreateFile() {
    std::string dir;
    const std::size_t lastSlash = path_.rfind('/');
    std::size_t at = 0;
    while (lastSlash != std::string::npos && at < lastSlash) {
      const std::size_t next = path_.find('/', at + 1);
      dir = path_.substr(0, next);
      at = next;
      if (dir.empty() || dir.back() == '/') continue;  // "/" or "a//b"
      if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
        const int error = errno;
        // A folder's name could end inside a password the whole path hides.
        const bool hidden = RedactLocator(path_) != path_;
        throw ConfigStoreException(Where() + ": cannot create directory " +
                                       (hidden ? "on its path" : dir) + ": " + std::strerror(error),
                                   SQLITE_CANTOPEN);
      }
    }
    // Made under a name of its own and linked into place: closing a
    // descriptor of the store file itself would drop the POSIX locks of any
    // connection to it in this process (another thread may connect the
    // moment the name appears), and link() never replaces what another
    // process put there first.
    std::string temp = path_ + ".new-XXXXXX";
    const int fd = mkostemp(temp.data(), O_CLOEXEC);  // 0600
    if (fd < 0) {
      throw ConfigStoreException(Where() + ": cannot create: " + std::strerror(errno),
                                 SQLITE_CANTOPEN);
    }
    close(fd);
    const int linked = link(temp.c_str(), path_.c_str());
    const int linkErrno = errno;
    unlink(temp.c_str());
    if (linked != 0 && linkErrno != EEXIST) {
      throw ConfigStoreException(Where() + ": cannot create: " + std::strerror(linkErrno),
                                 SQLITE_CANTOPEN);
    }
  }

  // A relative name goes to SQLite as "./name": SQLite reads ":memory:" and,
  // in some builds, "file:..." as something other than a file name.
  std::string SqliteName() const { return path_[0] == '/' ? path_ : "./" + path_; }

  void Connect() {
    for (const char* suffix : {"-wal", "-shm"}) Exists(path_ + suffix);
    // Taken before opening: should the file be replaced in between, the
    // next look finds another file and connects again, rather than never.
    struct stat st {};
    connectedFile_ = lstat(path_.c_str(), &st) == 0 ? std::pair{st.st_dev, st.st_ino}
                                                    : std::pair<dev_t, ino_t>{};
    // Without SQLITE_OPEN_CREATE: the file exists, and should it vanish
    // meanwhile, SQLite must not make one with its own default mode.
    Connection conn;
    const int rc = sqlite3_open_v2(SqliteName().c_str(), &conn.db,
                                   SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
    if (conn.db == nullptr) {
      throw ConfigStoreException(Where() + ": cannot open: " + sqlite3_errstr(rc), rc);
    }
    db_ = conn.db;
    try {
      if (rc != SQLITE_OK) Fail("cannot open");
      Configure();
    } catch (...) {
      db_ = nullptr;  // closed with "conn"
      throw;
    }
    std::swap(conn_.db, conn.db);
  }

  // Whether the path names another file than the connected one, or none: a
  // deploy may move a new store over it, or remove it and create it again.
  // A failed look (a folder made unreadable) changes nothing.
  bool FileReplaced() const {
    struct stat st {};
    if (lstat(path_.c_str(), &st) != 0) return errno == ENOENT || errno == ENOTDIR;
    return std::pair{st.st_dev, st.st_ino} != connectedFile_;
  }

  // Closes the connection to a file no longer at the path, with everything
  // prepared on it; the next use connects to whatever is there then.
  void Disconnect() {
    // SQLite neither checkpoints nor empties the log when the last
    // connection to a moved or deleted file closes, and a log left with
    // that file's pages would be read as part of the next file at the path.
    // Best effort, without waiting for a lock: another connection to the
    // old file may still hold one.
    sqlite3_busy_timeout(db_, 0);
    sqlite3_wal_checkpoint_v2(db_, nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
    collections_.clear();  // their statements are finalized with the connection
    last_ = nullptr;
    collectionQueries_.fill(nullptr);
    for (sqlite3_stmt** s :
         {&begin_, &beginImmediate_, &commit_, &rollback_, &savepoint_, &release_, &rollbackTo_,
          &findCollection_, &addCollection_, &readSeq_, &writeSeq_, &dataVersion_}) {
      *s = nullptr;
    }
    seqLoaded_ = seqDirty_ = false;
    db_ = nullptr;
    Connection closing;
    std::swap(closing.db, conn_.db);
  }

  void Configure() {
    sqlite3_extended_result_codes(db_, 1);
    sqlite3_busy_timeout(db_, options_.busyTimeoutMs);
    // The -wal and -shm stay when the last connection closes, so that a
    // reader without write access to the directory can still open the
    // store; the log is truncated at that close (journal_size_limit).
    int persist = 1;
    sqlite3_file_control(db_, "main", SQLITE_FCNTL_PERSIST_WAL, &persist);

    // Takes effect only on a file without tables yet; an existing store
    // keeps the page size it was created with.
    ExecOnce(("PRAGMA page_size=" + std::to_string(kPageSize)).c_str(), "setting the page size");
    begin_ = Prepare("BEGIN");
    beginImmediate_ = Prepare("BEGIN IMMEDIATE");
    commit_ = Prepare("COMMIT");
    rollback_ = Prepare("ROLLBACK");
    savepoint_ = Prepare("SAVEPOINT nested");
    release_ = Prepare("RELEASE nested");
    rollbackTo_ = Prepare("ROLLBACK TO nested");

    // Look first under a read lock, and only take the write lock when the
    // schema has to be created; checking again under it settles a race with
    // another process creating the same store.
    Step(begin_, "reading the store header");
    schema::Found found;
    try {
      found = schema::Inspect(db_, Where());
    } catch (...) {
      RollbackQuietly();
      throw;
    }
    Step(commit_, "reading the store header");
    if (found != schema::Found::kCurrent) {
      // A file of format 1 is upgraded by the first writer that opens it; a
      // reader that may not write cannot, and gets SQLite's error.
      const char* what =
          found == schema::Found::kEmpty ? "creating the store" : "upgrading the store";
      Step(beginImmediate_, what);
      try {
        found = schema::Inspect(db_, Where());
        if (found == schema::Found::kEmpty) schema::Create(db_, Where());
        if (found == schema::Found::kFormat1) schema::UpgradeFormat1(db_, Where());
      } catch (...) {
        RollbackQuietly();
        throw;
      }
      Step(commit_, what);
    }
    // Only now, once the file is known to be ours: switching to WAL rewrites
    // the header. The mode is persistent, so this is a no-op after creation;
    // should the file system refuse WAL, the store carries on in rollback mode.
    ExecOnce("PRAGMA journal_mode=WAL", "setting the journal mode");
    ExecOnce("PRAGMA synchronous=FULL", "setting the sync mode");
    ExecOnce("PRAGMA journal_size_limit=67108864", "setting the log size limit");

    findCollection_ =
        Prepare("SELECT id FROM collections WHERE key = ?1 AND grp = ?2 AND component = ?3");
    addCollection_ = Prepare("INSERT INTO collections(key, grp, component) VALUES(?1, ?2, ?3)");
    readSeq_ = Prepare("SELECT next FROM sequence");
    writeSeq_ = Prepare("UPDATE sequence SET next = ?1");
    dataVersion_ = Prepare("PRAGMA data_version");
    seenVersion_ = DataVersion();
    FollowStoreMode();
  }

  // SQLite gives a new -wal and -shm the mode of the store file; after a
  // chmod of the file (to let a group read it, say) they follow it here, so
  // that whoever may read the file may read the store.
  void FollowStoreMode() const {
    if (sqlite3_db_readonly(db_, "main") == 1) return;
    struct stat store {};
    if (stat(path_.c_str(), &store) != 0) return;
    for (const char* suffix : {"-wal", "-shm"}) {
      const std::string file = path_ + suffix;
      struct stat st {};
      if (lstat(file.c_str(), &st) != 0 || st.st_uid != geteuid() ||
          (st.st_mode & 0777) == (store.st_mode & 0777)) {
        continue;
      }
      // By name, not through a descriptor: closing one would drop this
      // process's locks on the file. Never through a link. Best effort: the
      // owner reads the store either way.
      [[maybe_unused]] const int ignored =
          fchmodat(AT_FDCWD, file.c_str(), store.st_mode & 0777, AT_SYMLINK_NOFOLLOW);
    }
  }

  // Names the store in every message, never with a password that a
  // URL-like path may hold.
  std::string Where() const override { return where_; }

  // Once SQLite has rolled the caller's transaction back by itself (full
  // disk, I/O error, interrupt), a write would be committed on its own at
  // once, outside the transaction the caller still takes to be open, and
  // AbortTransaction could no longer undo it. Refused until the caller ends
  // the transaction.
  void RefuseWriteAfterRollback() const {
    if (depth_ > 0 && sqlite3_get_autocommit(db_)) {
      throw ConfigStoreException(
          Where() +
              ": the transaction was rolled back after an earlier error; nothing is "
              "written until it is ended",
          SQLITE_ABORT_ROLLBACK);
    }
  }

  // Throws the connection's current error; call before the statement is reset.
  [[noreturn]] void Fail(const std::string& what) const {
    throw ConfigStoreException(Where() + ": " + what + ": " + sqlite3_errmsg(db_),
                               sqlite3_extended_errcode(db_));
  }

  sqlite3_stmt* Prepare(const std::string& sql) {
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v3(db_, sql.c_str(), static_cast<int>(sql.size()) + 1,
                           SQLITE_PREPARE_PERSISTENT, &s, nullptr) != SQLITE_OK) {
      Fail("preparing \"" + sql + "\"");
    }
    return s;
  }

  // Runs a statement that returns no rows (or whose rows do not matter).
  void Step(sqlite3_stmt* s, const char* what) {
    Resetter reset(s);
    int rc;
    while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
    }
    if (rc != SQLITE_DONE) Fail(what);
  }

  void ExecOnce(const char* sql, const char* what) {
    OneShot once;
    if (sqlite3_prepare_v2(db_, sql, -1, &once.s, nullptr) != SQLITE_OK) Fail(what);
    Step(once.s, what);
  }

  void RollbackQuietly() {
    if (sqlite3_get_autocommit(db_)) return;
    sqlite3_step(rollback_);
    sqlite3_reset(rollback_);
  }

  // ---- Collections: a table each (see SqliteSchema.h) --------------------

  enum Op { kPut, kList, kListOne, kClear, kErase, kOps };

  struct Collection {
    sqlite3_int64 id = 0;
    std::string key, group, component;
    std::array<sqlite3_stmt*, kOps> statements{};  // prepared on first use
  };
  using CollectionKey = std::tuple<std::string, std::string, std::string>;

  sqlite3_stmt* StatementOf(Collection* c, Op op) {
    sqlite3_stmt*& s = c->statements[op];
    if (s == nullptr) {
      static const char* const kSql[kOps] = {
          "INSERT OR REPLACE INTO %(seq, instance, body) VALUES(?1, ?2, ?3)",
          "SELECT seq, instance, body FROM % ORDER BY rowid",
          "SELECT seq, instance, body FROM % WHERE instance = ?1", "DELETE FROM %",
          "DELETE FROM % WHERE instance = ?1"};
      std::string sql = kSql[op];
      sql.replace(sql.find('%'), 1, schema::TableOf(c->id));
      s = Prepare(sql);
    }
    return s;
  }

  Collection* Remember(CollectionKey&& key, sqlite3_int64 id) {
    Collection c;
    c.id = id;
    std::tie(c.key, c.group, c.component) = key;
    return &collections_.emplace(std::move(key), std::move(c)).first->second;
  }

  // The collection of that key, group and component; when there is none,
  // with "create" a new one (its row and its table), else null.
  Collection* FindCollection(const std::string& key, const std::string& group,
                             const std::string& component, bool create) {
    if (last_ != nullptr && last_->key == key && last_->group == group &&
        last_->component == component) {
      return last_;
    }
    CollectionKey k(key, group, component);
    auto it = collections_.find(k);
    if (it != collections_.end()) return last_ = &it->second;
    sqlite3_int64 id = 0;
    {
      Resetter reset(findCollection_);
      Bind(findCollection_, 1, key);
      Bind(findCollection_, 2, group);
      Bind(findCollection_, 3, component);
      const int rc = sqlite3_step(findCollection_);
      if (rc == SQLITE_ROW) {
        id = sqlite3_column_int64(findCollection_, 0);
      } else if (rc != SQLITE_DONE) {
        Fail("finding a collection");
      }
    }
    if (id == 0) {
      if (!create) return nullptr;
      Resetter reset(addCollection_);
      Bind(addCollection_, 1, key);
      Bind(addCollection_, 2, group);
      Bind(addCollection_, 3, component);
      if (sqlite3_step(addCollection_) != SQLITE_DONE) Fail("adding a collection");
      id = sqlite3_last_insert_rowid(db_);
      ExecOnce(schema::CreateTableSql(id).c_str(), "adding a collection");
    }
    return last_ = Remember(std::move(k), id);
  }

  // The collections a filter's key, group and component match (an empty
  // part matches any), in the order they were made.
  std::vector<Collection*> MatchingCollections(const ConfigStoreObjectId& filter) {
    const std::string* parts[] = {&filter.Key(), &filter.Group(), &filter.Component()};
    unsigned shape = 0;
    for (unsigned i = 0; i < 3; ++i) shape |= parts[i]->empty() ? 0u : 1u << i;
    std::vector<Collection*> out;
    if (shape == 7) {
      if (Collection* c = FindCollection(*parts[0], *parts[1], *parts[2], false)) out.push_back(c);
      return out;
    }
    sqlite3_stmt*& q = collectionQueries_[shape];
    if (q == nullptr) {
      static const char* const kColumns[] = {"key", "grp", "component"};
      std::string sql = "SELECT id, key, grp, component FROM collections";
      for (unsigned i = 0; i < 3; ++i) {
        if ((shape & (1u << i)) == 0) continue;
        sql += sql.find(" WHERE ") == std::string::npos ? " WHERE " : " AND ";
        sql += std::string(kColumns[i]) + " = ?" + std::to_string(i + 1);
      }
      q = Prepare(sql + " ORDER BY id");
    }
    Resetter reset(q);
    for (unsigned i = 0; i < 3; ++i) {
      if (shape & (1u << i)) Bind(q, static_cast<int>(i) + 1, *parts[i]);
    }
    CollectionKey k;
    int rc;
    while ((rc = sqlite3_step(q)) == SQLITE_ROW) {
      AssignColumn(q, 1, &std::get<0>(k));
      AssignColumn(q, 2, &std::get<1>(k));
      AssignColumn(q, 3, &std::get<2>(k));
      auto it = collections_.find(k);
      out.push_back(it != collections_.end()
                        ? &it->second
                        : Remember(CollectionKey(k), sqlite3_column_int64(q, 0)));
    }
    if (rc != SQLITE_DONE) Fail("finding collections");
    return out;
  }

  static void InWriteOrder(const std::vector<sqlite3_int64>& seqs,
                           std::vector<std::shared_ptr<ConfigStoreObject>>* objects) {
    std::vector<std::size_t> order(seqs.size());
    for (std::size_t i = 0; i < order.size(); ++i) order[i] = i;
    std::sort(order.begin(), order.end(),
              [&seqs](std::size_t a, std::size_t b) { return seqs[a] < seqs[b]; });
    std::vector<std::shared_ptr<ConfigStoreObject>> sorted;
    sorted.reserve(order.size());
    for (std::size_t i : order) sorted.push_back(std::move((*objects)[i]));
    objects->swap(sorted);
  }

  void ForgetCollections() {
    for (auto& entry : collections_) {
      for (sqlite3_stmt* s : entry.second.statements) sqlite3_finalize(s);
    }
    collections_.clear();
    last_ = nullptr;
  }

  void Forget() {
    ForgetCollections();
    seqLoaded_ = seqDirty_ = false;
  }

  // ---- Write order ------------------------------------------------------

  // The seq of the next object written: read once per write transaction,
  // counted here and stored back before its commit.
  sqlite3_int64 NextSeq() {
    if (!seqLoaded_) {
      Resetter reset(readSeq_);
      if (sqlite3_step(readSeq_) != SQLITE_ROW) Fail("reading the write sequence");
      nextSeq_ = sqlite3_column_int64(readSeq_, 0);
      seqLoaded_ = true;
    }
    seqDirty_ = true;
    return nextSeq_++;
  }

  void FlushSequence() {
    if (!seqDirty_) return;
    Resetter reset(writeSeq_);
    if (sqlite3_bind_int64(writeSeq_, 1, nextSeq_) != SQLITE_OK ||
        sqlite3_step(writeSeq_) != SQLITE_DONE) {
      Fail("storing the write sequence");
    }
    seqDirty_ = false;
  }

  // Runs "write" inside the caller's transaction, or else in one of its
  // own: a write may touch several tables and the sequence.
  template <typename Body>
  void Write(Body&& write) {
    if (depth_ > 0) {
      write();
      return;
    }
    Step(beginImmediate_, "starting a write");
    try {
      write();
      FlushSequence();
      Step(commit_, "committing a write");
    } catch (...) {
      RollbackQuietly();
      Forget();
      throw;
    }
    seqLoaded_ = false;
  }

  // As a BLOB with its length: every byte, NUL included, survives, and BLOB
  // comparison is plain byte equality.
  void Bind(sqlite3_stmt* s, int index, const std::string& bytes) {
    if (sqlite3_bind_blob64(s, index, bytes.data(), bytes.size(), SQLITE_STATIC) != SQLITE_OK) {
      Fail("binding a value");
    }
  }

  static void AssignColumn(sqlite3_stmt* s, int column, std::string* out) {
    // A zero-length BLOB comes back as a null pointer.
    const void* data = sqlite3_column_blob(s, column);
    if (data == nullptr) {
      out->clear();
    } else {
      out->assign(static_cast<const char*>(data), sqlite3_column_bytes(s, column));
    }
  }

  std::shared_ptr<ConfigStoreObject> Decode(ConfigStoreObjectId id, sqlite3_stmt* s, int column,
                                            objectmodel::Arena* arena = nullptr) {
    const void* data = sqlite3_column_blob(s, column);
    const std::string_view body(
        static_cast<const char*>(data),
        data == nullptr ? 0 : static_cast<std::size_t>(sqlite3_column_bytes(s, column)));
    return objectmodel::DecodeOrDamaged(std::move(id), body, arena, Where());
  }

  // NOMUTEX turns off SQLite's own locking; this keeps a store that is shared
  // between threads anyway (SetGlobalStore) from corrupting the connection.
  std::mutex mu_;
  std::string path_;
  std::string where_;
  Connection conn_;
  sqlite3* db_ = nullptr;
  SqliteStoreOptions options_;
  int depth_ = 0;  // open transactions: 0, or 1 plus the savepoints inside it
  sqlite3_stmt* begin_ = nullptr;
  sqlite3_stmt* beginImmediate_ = nullptr;
  sqlite3_stmt* commit_ = nullptr;
  sqlite3_stmt* rollback_ = nullptr;
  sqlite3_stmt* savepoint_ = nullptr;
  sqlite3_stmt* release_ = nullptr;
  sqlite3_stmt* rollbackTo_ = nullptr;
  sqlite3_stmt* findCollection_ = nullptr;
  sqlite3_stmt* addCollection_ = nullptr;
  sqlite3_stmt* readSeq_ = nullptr;
  sqlite3_stmt* writeSeq_ = nullptr;
  sqlite3_stmt* dataVersion_ = nullptr;
  std::array<sqlite3_stmt*, 8> collectionQueries_{};  // by which of key, group, component are set
  // The collections met so far, with their statements. Within a write
  // transaction this may hold collections made in it: undoing it forgets
  // them all.
  std::map<CollectionKey, Collection> collections_;
  Collection* last_ = nullptr;  // the one used last, checked before the map
  bool seqLoaded_ = false;      // nextSeq_ was read within the open write
  bool seqDirty_ = false;       // and has been used since
  sqlite3_int64 nextSeq_ = 0;
  sqlite3_int64 seenVersion_ = 0;          // data_version when WaitForChange last looked
  std::pair<dev_t, ino_t> connectedFile_;  // the file at the path when connecting
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
