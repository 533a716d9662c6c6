// The SQLite backend: one row per object, its identifier in four indexed BLOB
// columns and its values and sub-objects encoded (ObjectCodec) in a fifth.
//
//   objects(seq INTEGER PRIMARY KEY, key BLOB, grp BLOB, component BLOB,
//           instance BLOB, body BLOB), UNIQUE (key, grp, component, instance)
//
// "seq" is the rowid: a new row gets one above the largest present, so
// ordering by seq is write order, and INSERT OR REPLACE moves a rewritten
// object to the end.
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
// not carry our application id and schema version is refused untouched.
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

#include <array>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "DamagedObject.h"
#include "ObjectCodec.h"
#include "TavoConfigStore/ConfigStore.h"

namespace TavoConfigStore {
namespace {

constexpr int kApplicationId = 0x5441564f;  // "TAVO"
constexpr int kSchemaVersion = 1;
// Pages of 16 KiB for new stores: an object with a few 256-byte blobs takes
// well over 1 KiB, so a 4 KiB page holds only two or three of them and leaves
// much of itself empty, and a listing reads (one system call each) and
// writes several times as many pages. The cost is that the smallest write
// puts 16 KiB pages into the log rather than 4 KiB ones.
constexpr int kPageSize = 16384;

// A filter's shape: which identifier parts it constrains, one bit per part in
// the order of the statement parameters ?1..?4.
constexpr unsigned kAllParts = 0xf;
constexpr std::size_t kShapes = 16;
const char* const kColumns[] = {"key", "grp", "component", "instance"};

unsigned ShapeOf(const ConfigStoreObjectId& id) {
  return (id.Key().empty() ? 0u : 1u) | (id.Group().empty() ? 0u : 2u) |
         (id.Component().empty() ? 0u : 4u) | (id.InstanceId().empty() ? 0u : 8u);
}

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

class SqliteStore final : public ConfigStore {
 public:
  SqliteStore(const std::string& path, const SqliteStoreOptions& options)
      : path_(path), options_(options) {
    if (path.empty()) {
      throw ConfigStoreException("configuration store: empty path", kErrorNoStorePath);
    }
    Open(false);
  }

  std::shared_ptr<ConfigStoreObject> GetObject(const ConfigStoreObjectId& id) override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!Open(false)) return nullptr;
    Resetter reset(get_);
    BindId(get_, id, kAllParts);
    const int rc = sqlite3_step(get_);
    if (rc == SQLITE_DONE) return nullptr;
    if (rc != SQLITE_ROW) Fail("reading an object");
    return Decode(ConfigStoreObjectId(id), get_, 0);
  }

  void SetObject(const std::shared_ptr<ConfigStoreObject>& object,
                 std::int32_t& /*flags*/) override {
    if (!object) throw ConfigStoreException(Where() + ": SetObject of null", kErrorNullArgument);
    DamagedObject::RefuseWrite(*object);
    // Encoded outside the lock into a buffer that keeps its capacity, so a
    // run of writes allocates nothing here.
    thread_local std::string body;
    body.clear();
    codec::EncodeObject(*object, &body);
    std::lock_guard<std::mutex> lock(mu_);
    OpenForWriting();
    Resetter reset(put_);
    BindId(put_, object->Id(), kAllParts);
    Bind(put_, 5, body);
    if (sqlite3_step(put_) != SQLITE_DONE) Fail("writing an object");
  }

  void DeleteObjects(const std::shared_ptr<FilterSpecObject>& filter) override {
    if (!filter)
      throw ConfigStoreException(Where() + ": DeleteObjects of null", kErrorNullArgument);
    std::lock_guard<std::mutex> lock(mu_);
    OpenForWriting();
    const unsigned shape = ShapeOf(filter->Id());
    sqlite3_stmt*& s = deletes_[shape];
    if (s == nullptr) {
      if (ByRange(shape)) {
        // As for listing: found through the index, a collection's rows
        // would be visited in index order, one random table page after
        // another (a read each, once the collection outgrows the page cache).
        // Deleting between the lowest and highest seq of the matches goes
        // through the table in order. One statement, so the deletion stays a
        // single write.
        const std::string where = Where(shape, false);
        s = Prepare("DELETE FROM objects WHERE seq BETWEEN (SELECT min(seq) FROM objects WHERE " +
                    where + ") AND (SELECT max(seq) FROM objects WHERE " + where + ") AND " +
                    Where(shape, true));
      } else {
        s = Prepare(shape == 0 ? "DELETE FROM objects"
                               : "DELETE FROM objects WHERE " + Where(shape, false));
      }
    }
    Resetter reset(s);
    BindId(s, filter->Id(), shape);
    if (sqlite3_step(s) != SQLITE_DONE) Fail("deleting objects");
  }

  std::vector<std::shared_ptr<ConfigStoreObject>> GetObjects(
      const std::shared_ptr<FilterSpecObject>& filter) override {
    if (!filter) throw ConfigStoreException(Where() + ": GetObjects of null", kErrorNullArgument);
    std::lock_guard<std::mutex> lock(mu_);
    std::vector<std::shared_ptr<ConfigStoreObject>> out;
    if (!Open(false)) return out;
    const unsigned shape = ShapeOf(filter->Id());
    // Outside a transaction, an explicit read transaction pins one snapshot
    // for the whole listing.
    const bool ownRead = sqlite3_get_autocommit(db_) != 0;
    if (ownRead) Step(begin_, "starting a read");
    try {
      sqlite3_stmt* s = ListStatement(filter->Id(), shape);
      if (s != nullptr) {
        Resetter reset(s);
        // The parts the filter fixes are the filter's; the others pass
        // through scratch strings that keep their capacity, so each part is
        // allocated once, by the identifier.
        const ConfigStoreObjectId& fixed = filter->Id();
        std::string parts[4] = {fixed.Key(), fixed.Group(), fixed.Component(), fixed.InstanceId()};
        codec::BodyArena arena;
        int rc;
        while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
          for (int c = 0; c < 4; ++c) {
            if ((shape & (1u << c)) == 0) AssignColumn(s, c, &parts[c]);
          }
          out.push_back(
              Decode(ConfigStoreObjectId(parts[0], parts[1], parts[2], parts[3]), s, 4, &arena));
        }
        if (rc != SQLITE_DONE) Fail("listing objects");
      }
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
      throw ConfigStoreException(
          Where() + ": the transaction was rolled back after an earlier error; nothing committed",
          SQLITE_ABORT_ROLLBACK);
    }
    if (depth_ > 1) {
      Step(release_, "ending a nested transaction");
      --depth_;
      return;
    }
    Resetter reset(commit_);
    if (sqlite3_step(commit_) != SQLITE_DONE) {
      // A failed COMMIT may leave the transaction open (then Abort ends it).
      depth_ = sqlite3_get_autocommit(db_) == 0 ? 1 : 0;
      Fail("committing");
    }
    depth_ = 0;
  }

  void AbortTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (depth_ == 0) return;
    // SQLite may already have rolled back by itself; there is nothing left.
    if (sqlite3_get_autocommit(db_)) {
      depth_ = 0;
      return;
    }
    if (depth_ > 1) {
      Step(rollbackTo_, "undoing a nested transaction");
      Step(release_, "undoing a nested transaction");
      --depth_;
      return;
    }
    Resetter reset(rollback_);
    const int rc = sqlite3_step(rollback_);
    depth_ = sqlite3_get_autocommit(db_) == 0 ? 1 : 0;
    if (rc != SQLITE_DONE) Fail("rolling back");
  }

 private:
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
        throw ConfigStoreException(
            Where() + ": " + file + " is a symbolic link; the store does not follow links",
            kErrorSymlink);
      }
      return true;
    }
    if (errno == ENOENT || errno == ENOTDIR) return false;
    throw ConfigStoreException(Where() + ": cannot look up " + file + ": " + std::strerror(errno),
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
        throw ConfigStoreException(
            Where() + ": cannot create directory " + dir + ": " + std::strerror(errno),
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
    bool isNew;
    try {
      isNew = Inspect();
    } catch (...) {
      RollbackQuietly();
      throw;
    }
    Step(commit_, "reading the store header");
    if (isNew) {
      Step(beginImmediate_, "creating the store");
      try {
        if (Inspect()) CreateSchema();
      } catch (...) {
        RollbackQuietly();
        throw;
      }
      Step(commit_, "creating the store");
    }
    // Only now, once the file is known to be ours: switching to WAL rewrites
    // the header. The mode is persistent, so this is a no-op after creation;
    // should the file system refuse WAL, the store carries on in rollback mode.
    ExecOnce("PRAGMA journal_mode=WAL", "setting the journal mode");
    ExecOnce("PRAGMA synchronous=FULL", "setting the sync mode");
    ExecOnce("PRAGMA journal_size_limit=67108864", "setting the log size limit");

    get_ = Prepare(
        "SELECT body FROM objects WHERE key = ?1 AND grp = ?2 AND component = ?3 AND "
        "instance = ?4");
    put_ = Prepare(
        "INSERT OR REPLACE INTO objects(key, grp, component, instance, body) "
        "VALUES(?1, ?2, ?3, ?4, ?5)");
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

  std::string Where() const { return "configuration store " + path_; }

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

  long long QueryInt(const char* sql, const char* what) {
    OneShot once;
    if (sqlite3_prepare_v2(db_, sql, -1, &once.s, nullptr) != SQLITE_OK) Fail(what);
    const int rc = sqlite3_step(once.s);
    if (rc != SQLITE_ROW) Fail(what);
    return sqlite3_column_int64(once.s, 0);
  }

  void RollbackQuietly() {
    if (sqlite3_get_autocommit(db_)) return;
    sqlite3_step(rollback_);
    sqlite3_reset(rollback_);
  }

  // True for a new database, false for one of our stores; throws for
  // anything else. Runs inside a transaction so the three reads agree.
  bool Inspect() {
    // The first read of the file: a non-database fails here (SQLITE_NOTADB).
    const long long appId = QueryInt("PRAGMA application_id", "reading the store header");
    const long long version = QueryInt("PRAGMA user_version", "reading the store header");
    const long long entries = QueryInt("SELECT count(*) FROM sqlite_master", "reading the schema");
    if (appId == 0 && version == 0 && entries == 0) return true;
    if (appId != kApplicationId) {
      throw ConfigStoreException(
          Where() + ": not a configuration store (a SQLite database of another application)",
          kErrorNotAStore);
    }
    if (version != kSchemaVersion) {
      throw ConfigStoreException(Where() + ": unknown schema version " + std::to_string(version) +
                                     " (this library reads version " +
                                     std::to_string(kSchemaVersion) + ")",
                                 kErrorNotAStore);
    }
    if (QueryInt("SELECT count(*) FROM sqlite_master WHERE type = 'table' AND name = 'objects'",
                 "reading the schema") != 1) {
      throw ConfigStoreException(Where() + ": not a configuration store (no objects table)",
                                 kErrorNotAStore);
    }
    return false;
  }

  void CreateSchema() {
    ExecOnce(
        "CREATE TABLE objects(seq INTEGER PRIMARY KEY, key BLOB NOT NULL, grp BLOB NOT NULL, "
        "component BLOB NOT NULL, instance BLOB NOT NULL, body BLOB NOT NULL)",
        "creating the schema");
    ExecOnce("CREATE UNIQUE INDEX objects_id ON objects(key, grp, component, instance)",
             "creating the schema");
    ExecOnce(("PRAGMA application_id = " + std::to_string(kApplicationId)).c_str(),
             "creating the schema");
    ExecOnce(("PRAGMA user_version = " + std::to_string(kSchemaVersion)).c_str(),
             "creating the schema");
  }

  // "key = ?1 AND grp = ?2 ..." for the parts a filter shape constrains;
  // "plus" keeps SQLite from using the identifier index for those terms.
  static std::string Where(unsigned shape, bool plus) {
    std::string sql;
    for (unsigned part = 0; part < 4; ++part) {
      if ((shape & (1u << part)) == 0) continue;
      if (!sql.empty()) sql += " AND ";
      if (plus) sql += '+';
      sql += kColumns[part];
      sql += " = ?" + std::to_string(part + 1);
    }
    return sql;
  }

  // The statement for one filter shape, prepared on first use and kept.
  sqlite3_stmt* FilterStatement(std::array<sqlite3_stmt*, kShapes>* cache, unsigned shape,
                                const char* head, const char* tail, bool plus = false) {
    sqlite3_stmt*& s = (*cache)[shape];
    if (s == nullptr) {
      std::string sql = head;
      const std::string where = Where(shape, plus);
      if (!where.empty()) {
        sql += sql.find(" WHERE ") == std::string::npos ? " WHERE " : " AND ";
        sql += where;
      }
      sql += tail;
      s = Prepare(sql);
    }
    return s;
  }

  // Filters on a leading part of the identifier index, short of a whole
  // identifier, are served by seq ranges.
  static bool ByRange(unsigned shape) { return (shape & 1u) != 0 && shape != kAllParts; }

  struct Bounds {
    sqlite3_int64 low = 0;
    sqlite3_int64 high = 0;
    sqlite3_int64 count = 0;
  };

  // The lowest and highest seq of the objects the filter matches, and how
  // many there are; false when there are none.
  bool FindBounds(const ConfigStoreObjectId& id, unsigned shape, Bounds* out) {
    sqlite3_stmt* bounds =
        FilterStatement(&bounds_, shape, "SELECT min(seq), max(seq), count(*) FROM objects", "");
    Resetter reset(bounds);
    BindId(bounds, id, shape);
    if (sqlite3_step(bounds) != SQLITE_ROW) Fail("finding objects");
    if (sqlite3_column_type(bounds, 0) == SQLITE_NULL) return false;
    out->low = sqlite3_column_int64(bounds, 0);
    out->high = sqlite3_column_int64(bounds, 1);
    out->count = sqlite3_column_int64(bounds, 2);
    return true;
  }

  // The listing statement for a filter, bound and ready to step; null when
  // nothing can match. Call inside a read transaction.
  //
  // A filter on a leading part of the identifier index (a collection, say)
  // would have SQLite find the rows through the index and then sort them,
  // whole bodies included, by seq. Instead the index yields only the lowest
  // and highest seq of the matches, and the table is read in seq order
  // between them: no sort, and the pages come in file order. When the
  // matches fill that range (as a collection written in one go does), no
  // other row lies in it and the rows need no filtering.
  sqlite3_stmt* ListStatement(const ConfigStoreObjectId& id, unsigned shape) {
    static const char kSelect[] = "SELECT key, grp, component, instance, body FROM objects";
    if (!ByRange(shape)) {
      sqlite3_stmt* s = FilterStatement(&selects_, shape, kSelect, " ORDER BY seq");
      BindId(s, id, shape);
      return s;
    }
    // Both range statements are prepared before the bounds choose one, so
    // the set of prepared statements does not depend on how the rows lie.
    sqlite3_stmt* filtered = FilterStatement(
        &rangeSelects_, shape,
        "SELECT key, grp, component, instance, body FROM objects WHERE seq BETWEEN ?5 AND ?6",
        " ORDER BY seq", true);
    if (span_ == nullptr) {
      span_ = Prepare(
          "SELECT key, grp, component, instance, body FROM objects WHERE seq BETWEEN ?5 AND ?6 "
          "ORDER BY seq");
    }
    Bounds bounds;
    if (!FindBounds(id, shape, &bounds)) return nullptr;
    if (bounds.high - bounds.low + 1 == bounds.count) {
      BindRange(span_, bounds.low, bounds.high);
      return span_;
    }
    BindId(filtered, id, shape);
    BindRange(filtered, bounds.low, bounds.high);
    return filtered;
  }

  void BindRange(sqlite3_stmt* s, sqlite3_int64 low, sqlite3_int64 high) {
    if (sqlite3_bind_int64(s, 5, low) != SQLITE_OK || sqlite3_bind_int64(s, 6, high) != SQLITE_OK) {
      Fail("binding a value");
    }
  }

  // As a BLOB with its length: every byte, NUL included, survives, and BLOB
  // comparison is plain byte equality.
  void Bind(sqlite3_stmt* s, int index, const std::string& bytes) {
    if (sqlite3_bind_blob64(s, index, bytes.data(), bytes.size(), SQLITE_STATIC) != SQLITE_OK) {
      Fail("binding a value");
    }
  }

  void BindId(sqlite3_stmt* s, const ConfigStoreObjectId& id, unsigned shape) {
    const std::string* parts[] = {&id.Key(), &id.Group(), &id.Component(), &id.InstanceId()};
    for (unsigned part = 0; part < 4; ++part) {
      if (shape & (1u << part)) Bind(s, static_cast<int>(part) + 1, *parts[part]);
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
                                            codec::BodyArena* arena = nullptr) {
    const void* data = sqlite3_column_blob(s, column);
    const int size = sqlite3_column_bytes(s, column);
    try {
      return codec::DecodeObject(std::move(id), static_cast<const unsigned char*>(data),
                                 data == nullptr ? 0 : static_cast<std::size_t>(size), arena);
    } catch (const ConfigStoreException& e) {
      // The object still lists: a caller going through a collection loses
      // this one record, not the catalogue.
      return std::make_shared<DamagedObject>(
          std::move(id), ConfigStoreException(Where() + ": " + e.Message(), e.Code()));
    }
  }

  // NOMUTEX turns off SQLite's own locking; this keeps a store that is shared
  // between threads anyway (SetGlobalStore) from corrupting the connection.
  std::mutex mu_;
  std::string path_;
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
  sqlite3_stmt* get_ = nullptr;
  sqlite3_stmt* put_ = nullptr;
  std::array<sqlite3_stmt*, kShapes> selects_{};
  std::array<sqlite3_stmt*, kShapes> bounds_{};
  std::array<sqlite3_stmt*, kShapes> rangeSelects_{};
  sqlite3_stmt* span_ = nullptr;
  std::array<sqlite3_stmt*, kShapes> deletes_{};
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
