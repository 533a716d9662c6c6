#include "History.h"

#include "../HistorySource.h"
#include "Schema.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace sqlite {
namespace {

void Step(Connection& conn, sqlite3_stmt* s, const char* what) {
  if (sqlite3_step(s) != SQLITE_DONE) conn.Fail(what);
}

void BindInt(Connection& conn, sqlite3_stmt* s, int index, long long value, const char* what) {
  if (sqlite3_bind_int64(s, index, value) != SQLITE_OK) conn.Fail(what);
}

}  // namespace

void CreateHistoryTables(Connection& conn, const char* what) {
  conn.Exec("CREATE TABLE history(depth INTEGER NOT NULL, next INTEGER NOT NULL)", what);
  conn.Exec("INSERT INTO history VALUES(" + std::to_string(kDefaultDepth) + ", 1)", what);
  conn.Exec(
      "CREATE TABLE versions(number INTEGER PRIMARY KEY, time INTEGER NOT NULL, host BLOB NOT "
      "NULL, user BLOB NOT NULL)",
      what);
  conn.Exec(
      "CREATE TABLE version_tables(version INTEGER NOT NULL, collection INTEGER NOT NULL, tbl "
      "TEXT NOT NULL, PRIMARY KEY (version, collection))",
      what);
}

bool History::BeforeChange(sqlite3_int64 collection, bool keepRows) {
  if (!moved_.insert(collection).second) return false;
  const char* what = "keeping a version";
  if (!pruned_) {
    // The version this transaction makes will push the oldest kept one
    // out: its tables go now, so that the writes to come reuse their pages
    // as they would reuse those of a cleared table (an abort brings them
    // back with the rest). Dropped at the commit instead, they made a
    // replace of 10,000 policies cost 1.64 times one keeping no versions
    // rather than 1.31 times.
    pruned_ = true;
    const long long depth = conn_.Int("SELECT depth FROM history", what);
    const long long next = conn_.Int("SELECT next FROM history", what);
    if (depth > 0 && next > depth) ForgetUpTo(next - depth);
  }
  const std::string table = TableOf(collection);
  sqlite3_stmt* q = conn_.Cached("SELECT max(version) FROM version_tables WHERE tbl = ?1", what);
  long long holder = 0;
  {
    Resetter reset(q);
    if (sqlite3_bind_text(q, 1, table.data(), static_cast<int>(table.size()), SQLITE_STATIC) !=
        SQLITE_OK) {
      conn_.Fail(what);
    }
    if (sqlite3_step(q) != SQLITE_ROW) conn_.Fail(what);
    holder = sqlite3_column_int64(q, 0);
  }
  if (holder == 0) return false;
  // The newest version that holds the table names it: a later version
  // holding a table of this collection holds a newer one.
  const std::string kept = "h" + std::to_string(holder) + "_" + std::to_string(collection);
  conn_.Exec("ALTER TABLE " + table + " RENAME TO " + kept, what);
  conn_.Exec("UPDATE version_tables SET tbl = '" + kept + "' WHERE tbl = '" + table + "'", what);
  conn_.Exec(CreateTableSql(collection), what);
  if (!keepRows) return true;
  conn_.Exec("INSERT INTO " + table + "(seq, instance, body) SELECT seq, instance, body FROM " +
                 kept + " ORDER BY rowid",
             what);
  return false;
}

void History::Record() {
  const char* what = "recording a version";
  const long long number = conn_.Int("SELECT next FROM history", what);
  const long long depth = conn_.Int("SELECT depth FROM history", what);
  conn_.Run("UPDATE history SET next = next + 1", what);
  Forget();
  if (depth == 0) return;
  sqlite3_stmt* s = conn_.Cached("INSERT INTO versions VALUES(?1, ?2, ?3, ?4)", what);
  {
    Resetter reset(s);
    // Bound without a copy: the strings must outlive the step.
    const StoreVersion made = NewVersionBy(static_cast<std::uint64_t>(number));
    BindInt(conn_, s, 1, number, what);
    BindInt(conn_, s, 2, made.unixTimeMs, what);
    conn_.Bind(s, 3, made.host);
    conn_.Bind(s, 4, made.user);
    Step(conn_, s, what);
  }
  s = conn_.Cached(
      "INSERT INTO version_tables SELECT ?1, id, 'c' || id FROM collections ORDER BY id", what);
  {
    Resetter reset(s);
    BindInt(conn_, s, 1, number, what);
    Step(conn_, s, what);
  }
  if (number > depth) ForgetUpTo(number - depth);
}

void History::ForgetUpTo(long long last) {
  const char* what = "forgetting old versions";
  sqlite3_stmt* s = conn_.Cached("DELETE FROM versions WHERE number <= ?1", what);
  {
    Resetter reset(s);
    BindInt(conn_, s, 1, last, what);
    Step(conn_, s, what);
  }
  if (sqlite3_changes(conn_.Db()) == 0) return;
  s = conn_.Cached("DELETE FROM version_tables WHERE version <= ?1", what);
  {
    Resetter reset(s);
    BindInt(conn_, s, 1, last, what);
    Step(conn_, s, what);
  }
  std::vector<std::string> unused;
  s = conn_.Cached(
      "SELECT name FROM sqlite_master WHERE type = 'table' AND name GLOB 'h[0-9]*' AND name NOT IN "
      "(SELECT tbl FROM version_tables)",
      what);
  {
    Resetter reset(s);
    int rc;
    while ((rc = sqlite3_step(s)) == SQLITE_ROW) unused.emplace_back(Connection::Column(s, 0));
    if (rc != SQLITE_DONE) conn_.Fail(what);
  }
  for (const std::string& table : unused) {
    // Emptied first, by a DELETE without a condition, which frees the pages
    // in one step that cannot fail halfway. DROP TABLE also changes the
    // schema, so SQLite would keep the original of every page it writes in
    // a statement journal (a temporary file) to undo a failure halfway; and
    // where SQLite is built to zero freed pages (secure_delete, as Debian
    // builds it) that is every page of the table: 14.9 MiB written and read
    // again per replace of 10,000 policies, a third of its writes.
    conn_.Exec("DELETE FROM " + table, what);
    conn_.Exec("DROP TABLE " + table, what);
  }
}

std::vector<StoreVersion> History::Versions() {
  const char* what = "listing versions";
  std::vector<StoreVersion> out;
  sqlite3_stmt* s =
      conn_.Cached("SELECT number, time, host, user FROM versions ORDER BY number DESC", what);
  Resetter reset(s);
  int rc;
  while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
    StoreVersion v;
    v.number = static_cast<std::uint64_t>(sqlite3_column_int64(s, 0));
    v.unixTimeMs = sqlite3_column_int64(s, 1);
    v.host = Connection::Column(s, 2);
    v.user = Connection::Column(s, 3);
    out.push_back(std::move(v));
  }
  if (rc != SQLITE_DONE) conn_.Fail(what);
  return out;
}

unsigned History::Depth() {
  return static_cast<unsigned>(conn_.Int("SELECT depth FROM history", "reading the history depth"));
}

void History::SetDepth(unsigned depth) {
  const char* what = "setting the history depth";
  sqlite3_stmt* s = conn_.Cached("UPDATE history SET depth = ?1", what);
  {
    Resetter reset(s);
    BindInt(conn_, s, 1, depth, what);
    Step(conn_, s, what);
  }
  const long long newest = static_cast<long long>(Newest());
  if (newest > static_cast<long long>(depth)) ForgetUpTo(newest - depth);
}

std::uint64_t History::Newest() {
  return static_cast<std::uint64_t>(
      conn_.Int("SELECT next - 1 FROM history", "reading the newest version"));
}

std::vector<History::Table> History::TablesOf(std::uint64_t number,
                                              const ConfigStoreObjectId& filter) {
  const char* what = "reading a version";
  sqlite3_stmt* s = conn_.Cached("SELECT count(*) FROM versions WHERE number = ?1", what);
  {
    Resetter reset(s);
    BindInt(conn_, s, 1, static_cast<long long>(number), what);
    if (sqlite3_step(s) != SQLITE_ROW) conn_.Fail(what);
    if (sqlite3_column_int64(s, 0) == 0) {
      throw ConfigStoreException(NotKeptMessage(conn_.Where(), number), kErrorNoSuchVersion);
    }
  }
  s = conn_.Cached(
      "SELECT c.key, c.grp, c.component, v.tbl FROM version_tables v JOIN collections c ON "
      "c.id = v.collection WHERE v.version = ?1 AND (?2 IS NULL OR c.key = ?2) AND (?3 IS NULL "
      "OR c.grp = ?3) AND (?4 IS NULL OR c.component = ?4) ORDER BY c.id",
      what);
  Resetter reset(s);
  BindInt(conn_, s, 1, static_cast<long long>(number), what);
  const std::string* parts[] = {&filter.Key(), &filter.Group(), &filter.Component()};
  for (int i = 0; i < 3; ++i) {
    if (parts[i]->empty()) {
      sqlite3_bind_null(s, i + 2);
    } else {
      conn_.Bind(s, i + 2, *parts[i]);
    }
  }
  std::vector<Table> out;
  int rc;
  while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
    out.push_back({std::string(Connection::Column(s, 0)), std::string(Connection::Column(s, 1)),
                   std::string(Connection::Column(s, 2)), std::string(Connection::Column(s, 3))});
  }
  if (rc != SQLITE_DONE) conn_.Fail(what);
  return out;
}

std::vector<ObjectPtr> History::Objects(std::uint64_t number, const ConfigStoreObjectId& filter) {
  const char* what = "reading a version";
  const std::string& instance = filter.InstanceId();
  const std::vector<Table> tables = TablesOf(number, filter);
  std::vector<ObjectPtr> out;
  std::vector<sqlite3_int64> seqs;
  objectmodel::Arena arena;
  for (const Table& t : tables) {
    // Prepared for this read alone: a kept table's name changes as versions
    // come and go.
    std::unique_ptr<sqlite3_stmt, int (*)(sqlite3_stmt*)> s(
        conn_.Prepare("SELECT seq, instance, body FROM " + t.name +
                          (instance.empty() ? " ORDER BY rowid" : " WHERE instance = ?1"),
                      what),
        sqlite3_finalize);
    if (!instance.empty()) conn_.Bind(s.get(), 1, instance);
    ReadObjects(conn_, s.get(), t.key, t.group, t.component, &out, &seqs, &arena, what);
  }
  if (tables.size() > 1) InWriteOrder(seqs, &out);
  return out;
}

}  // namespace sqlite
}  // namespace TavoConfigStore
