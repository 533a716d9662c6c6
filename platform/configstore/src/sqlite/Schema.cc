#include "Schema.h"

#include <vector>

#include "History.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace sqlite {
namespace {

[[noreturn]] void NotAStore(const Connection& conn, const std::string& why) {
  throw ConfigStoreException(conn.Where() + ": not a configuration store (" + why + ")",
                             kErrorNotAStore);
}

void CreateFormat2Tables(Connection& conn, const char* what) {
  conn.Exec(
      "CREATE TABLE collections(id INTEGER PRIMARY KEY, key BLOB NOT NULL, grp BLOB NOT NULL, "
      "component BLOB NOT NULL, UNIQUE (key, grp, component))",
      what);
  conn.Exec("CREATE TABLE sequence(next INTEGER NOT NULL)", what);
}

void SetFormat(Connection& conn, const char* what) {
  conn.Exec("PRAGMA user_version = " + std::to_string(kFormat), what);
}

}  // namespace

std::string TableOf(sqlite3_int64 collection) { return "c" + std::to_string(collection); }

std::string CreateTableSql(sqlite3_int64 collection) {
  return "CREATE TABLE " + TableOf(collection) +
         "(seq INTEGER NOT NULL, instance BLOB NOT NULL UNIQUE, body BLOB NOT NULL)";
}

Found Inspect(Connection& conn) {
  // The first read of the file: a non-database fails here (SQLITE_NOTADB).
  const long long appId = conn.Int("PRAGMA application_id", "reading the store header");
  const long long version = conn.Int("PRAGMA user_version", "reading the store header");
  const char* what = "reading the schema";
  const long long entries = conn.Int("SELECT count(*) FROM sqlite_master", what);
  if (appId == 0 && version == 0 && entries == 0) return Found::kEmpty;
  if (appId != kApplicationId) NotAStore(conn, "a SQLite database of another application");
  if (version == 1) {
    if (conn.Int("SELECT count(*) FROM sqlite_master WHERE type = 'table' AND name = 'objects'",
                 what) != 1) {
      NotAStore(conn, "no objects table");
    }
    return Found::kFormat1;
  }
  if (version != 2 && version != kFormat) {
    throw ConfigStoreException(conn.Where() + ": unknown schema version " +
                                   std::to_string(version) + " (this library reads versions 1 to " +
                                   std::to_string(kFormat) + ")",
                               kErrorNotAStore);
  }
  if (conn.Int("SELECT count(*) FROM sqlite_master WHERE type = 'table' AND name IN "
               "('collections', 'sequence')",
               what) != 2) {
    NotAStore(conn, "no collections or sequence table");
  }
  if (version == 2) return Found::kFormat2;
  if (conn.Int("SELECT count(*) FROM sqlite_master WHERE type = 'table' AND name IN "
               "('history', 'versions', 'version_tables')",
               what) != 3) {
    NotAStore(conn, "no history tables");
  }
  return Found::kCurrent;
}

void CreateSchema(Connection& conn) {
  const char* what = "creating the schema";
  CreateFormat2Tables(conn, what);
  conn.Exec("INSERT INTO sequence VALUES(1)", what);
  CreateHistoryTables(conn, what);
  conn.Exec("PRAGMA application_id = " + std::to_string(kApplicationId), what);
  SetFormat(conn, what);
}

// Each collection's objects move to a table of their own with their seq,
// so write order and the next seq carry over; a crash or an error anywhere
// leaves the transaction, and with it the file, as it was. The file then
// goes on to format 3 in the same transaction.
void UpgradeFormat1(Connection& conn) {
  const char* what = "upgrading the store from format 1";
  CreateFormat2Tables(conn, what);
  conn.Exec("INSERT INTO sequence SELECT coalesce(max(seq), 0) + 1 FROM objects", what);
  conn.Exec(
      "INSERT INTO collections(key, grp, component) SELECT key, grp, component FROM objects "
      "GROUP BY key, grp, component ORDER BY min(seq)",
      what);
  std::vector<sqlite3_int64> ids;
  {
    sqlite3_stmt* list = conn.Cached("SELECT id FROM collections ORDER BY id", what);
    Resetter reset(list);
    int rc;
    while ((rc = sqlite3_step(list)) == SQLITE_ROW) ids.push_back(sqlite3_column_int64(list, 0));
    if (rc != SQLITE_DONE) conn.Fail(what);
  }
  for (const sqlite3_int64 id : ids) {
    conn.Exec(CreateTableSql(id), what);
    conn.Exec("INSERT INTO " + TableOf(id) +
                  "(seq, instance, body) SELECT o.seq, o.instance, o.body FROM objects o, "
                  "collections c WHERE c.id = " +
                  std::to_string(id) +
                  " AND o.key = c.key AND o.grp = c.grp AND o.component = c.component "
                  "ORDER BY o.seq",
              what);
  }
  conn.Exec("DROP TABLE objects", what);
  UpgradeFormat2(conn);
}

// The catalogue found becomes version 1, so that the first write after the
// upgrade can be taken back as any later one can.
void UpgradeFormat2(Connection& conn) {
  const char* what = "upgrading the store from format 2";
  CreateHistoryTables(conn, what);
  History(conn).Record();
  SetFormat(conn, what);
}

sqlite3_stmt* Collections::Statement(Collection* c, Op op) {
  sqlite3_stmt*& s = c->statements[op];
  if (s == nullptr) {
    static const char* const kSql[kOps] = {
        "INSERT OR REPLACE INTO %(seq, instance, body) VALUES(?1, ?2, ?3)",
        "SELECT seq, instance, body FROM % ORDER BY rowid",
        "SELECT seq, instance, body FROM % WHERE instance = ?1", "DELETE FROM %",
        "DELETE FROM % WHERE instance = ?1"};
    std::string sql = kSql[op];
    sql.replace(sql.find('%'), 1, TableOf(c->id));
    s = conn_.Prepare(sql);
  }
  return s;
}

Collections::Collection* Collections::Remember(Key&& key, sqlite3_int64 id) {
  auto [it, added] = known_.try_emplace(std::move(key));
  if (added) {
    it->second.id = id;
    std::tie(it->second.key, it->second.group, it->second.component) = it->first;
  }
  return &it->second;
}

void Collections::BindParts(sqlite3_stmt* s, const ConfigStoreObjectId& id, bool emptyIsNull) {
  const std::string* parts[] = {&id.Key(), &id.Group(), &id.Component()};
  for (int i = 0; i < 3; ++i) {
    if (emptyIsNull && parts[i]->empty()) {
      sqlite3_bind_null(s, i + 1);
    } else {
      conn_.Bind(s, i + 1, *parts[i]);
    }
  }
}

sqlite3_int64 Collections::RunOnParts(std::string_view sql, const ConfigStoreObjectId& id,
                                      const char* what) {
  sqlite3_stmt* s = conn_.Cached(sql, what);
  Resetter reset(s);
  BindParts(s, id, false);
  const int rc = sqlite3_step(s);
  if (rc != SQLITE_ROW && rc != SQLITE_DONE) conn_.Fail(what);
  return rc == SQLITE_ROW ? sqlite3_column_int64(s, 0) : 0;
}

Collections::Collection* Collections::Find(const ConfigStoreObjectId& id, bool create) {
  if (last_ != nullptr && last_->key == id.Key() && last_->group == id.Group() &&
      last_->component == id.Component()) {
    return last_;
  }
  Key key(id.Key(), id.Group(), id.Component());
  auto it = known_.find(key);
  if (it != known_.end()) return last_ = &it->second;
  sqlite3_int64 table =
      RunOnParts("SELECT id FROM collections WHERE key = ?1 AND grp = ?2 AND component = ?3", id,
                 "finding a collection");
  if (table == 0) {
    if (!create) return nullptr;
    RunOnParts("INSERT INTO collections(key, grp, component) VALUES(?1, ?2, ?3)", id,
               "adding a collection");
    table = sqlite3_last_insert_rowid(conn_.Db());
    conn_.Exec(CreateTableSql(table), "adding a collection");
  }
  return last_ = Remember(std::move(key), table);
}

std::vector<Collections::Collection*> Collections::Matching(const ConfigStoreObjectId& filter) {
  std::vector<Collection*> out;
  if (!filter.Key().empty() && !filter.Group().empty() && !filter.Component().empty()) {
    if (Collection* c = Find(filter, false)) out.push_back(c);
    return out;
  }
  sqlite3_stmt* q = conn_.Cached(
      "SELECT id, key, grp, component FROM collections WHERE (?1 IS NULL OR key = ?1) AND "
      "(?2 IS NULL OR grp = ?2) AND (?3 IS NULL OR component = ?3) ORDER BY id",
      "finding collections");
  Resetter reset(q);
  BindParts(q, filter, true);
  int rc;
  while ((rc = sqlite3_step(q)) == SQLITE_ROW) {
    Key key(Connection::Column(q, 1), Connection::Column(q, 2), Connection::Column(q, 3));
    out.push_back(Remember(std::move(key), sqlite3_column_int64(q, 0)));
  }
  if (rc != SQLITE_DONE) conn_.Fail("finding collections");
  return out;
}

void Collections::Forget() {
  for (auto& entry : known_) {
    for (sqlite3_stmt* s : entry.second.statements) sqlite3_finalize(s);
  }
  known_.clear();
  last_ = nullptr;
}

}  // namespace sqlite
}  // namespace TavoConfigStore
