#include "SqliteSchema.h"

#include <vector>

#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace schema {
namespace {

struct Statement {
  sqlite3_stmt* s = nullptr;
  ~Statement() { sqlite3_finalize(s); }
};

[[noreturn]] void Fail(sqlite3* db, const std::string& where, const char* what) {
  throw ConfigStoreException(where + ": " + what + ": " + sqlite3_errmsg(db),
                             sqlite3_extended_errcode(db));
}

void Prepare(sqlite3* db, const std::string& where, const std::string& sql, const char* what,
             Statement* out) {
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &out->s, nullptr) != SQLITE_OK) {
    Fail(db, where, what);
  }
}

void Exec(sqlite3* db, const std::string& where, const std::string& sql, const char* what) {
  Statement st;
  Prepare(db, where, sql, what, &st);
  int rc;
  while ((rc = sqlite3_step(st.s)) == SQLITE_ROW) {
  }
  if (rc != SQLITE_DONE) Fail(db, where, what);
}

long long QueryInt(sqlite3* db, const std::string& where, const std::string& sql,
                   const char* what) {
  Statement st;
  Prepare(db, where, sql, what, &st);
  if (sqlite3_step(st.s) != SQLITE_ROW) Fail(db, where, what);
  return sqlite3_column_int64(st.s, 0);
}

bool HasTable(sqlite3* db, const std::string& where, const char* name) {
  return QueryInt(db, where,
                  std::string("SELECT count(*) FROM sqlite_master WHERE type = 'table' AND "
                              "name = '") +
                      name + "'",
                  "reading the schema") == 1;
}

[[noreturn]] void NotAStore(const std::string& where, const std::string& why) {
  throw ConfigStoreException(where + ": not a configuration store (" + why + ")", kErrorNotAStore);
}

void CreateFormat2Tables(sqlite3* db, const std::string& where, const char* what) {
  Exec(db, where,
       "CREATE TABLE collections(id INTEGER PRIMARY KEY, key BLOB NOT NULL, grp BLOB NOT NULL, "
       "component BLOB NOT NULL, UNIQUE (key, grp, component))",
       what);
  Exec(db, where, "CREATE TABLE sequence(next INTEGER NOT NULL)", what);
}

}  // namespace

std::string TableOf(sqlite3_int64 collection) { return "c" + std::to_string(collection); }

std::string CreateTableSql(sqlite3_int64 collection) {
  return "CREATE TABLE " + TableOf(collection) +
         "(seq INTEGER NOT NULL, instance BLOB NOT NULL UNIQUE, body BLOB NOT NULL)";
}

Found Inspect(sqlite3* db, const std::string& where) {
  // The first read of the file: a non-database fails here (SQLITE_NOTADB).
  const long long appId = QueryInt(db, where, "PRAGMA application_id", "reading the store header");
  const long long version = QueryInt(db, where, "PRAGMA user_version", "reading the store header");
  const long long entries =
      QueryInt(db, where, "SELECT count(*) FROM sqlite_master", "reading the schema");
  if (appId == 0 && version == 0 && entries == 0) return Found::kEmpty;
  if (appId != kApplicationId) NotAStore(where, "a SQLite database of another application");
  if (version == 1) {
    if (!HasTable(db, where, "objects")) NotAStore(where, "no objects table");
    return Found::kFormat1;
  }
  if (version != kFormat) {
    throw ConfigStoreException(where + ": unknown schema version " + std::to_string(version) +
                                   " (this library reads versions 1 and " +
                                   std::to_string(kFormat) + ")",
                               kErrorNotAStore);
  }
  if (!HasTable(db, where, "collections") || !HasTable(db, where, "sequence")) {
    NotAStore(where, "no collections or sequence table");
  }
  return Found::kCurrent;
}

void Create(sqlite3* db, const std::string& where) {
  const char* what = "creating the schema";
  CreateFormat2Tables(db, where, what);
  Exec(db, where, "INSERT INTO sequence VALUES(1)", what);
  Exec(db, where, "PRAGMA application_id = " + std::to_string(kApplicationId), what);
  Exec(db, where, "PRAGMA user_version = " + std::to_string(kFormat), what);
}

// Each collection's objects move to a table of their own with their seq,
// so write order and the next seq carry over; a crash or an error anywhere
// leaves the transaction, and with it the file, as it was.
void UpgradeFormat1(sqlite3* db, const std::string& where) {
  const char* what = "upgrading the store from format 1";
  CreateFormat2Tables(db, where, what);
  Exec(db, where, "INSERT INTO sequence SELECT coalesce(max(seq), 0) + 1 FROM objects", what);
  Exec(db, where,
       "INSERT INTO collections(key, grp, component) SELECT key, grp, component FROM objects "
       "GROUP BY key, grp, component ORDER BY min(seq)",
       what);
  std::vector<sqlite3_int64> ids;
  {
    Statement list;
    Prepare(db, where, "SELECT id FROM collections ORDER BY id", what, &list);
    int rc;
    while ((rc = sqlite3_step(list.s)) == SQLITE_ROW)
      ids.push_back(sqlite3_column_int64(list.s, 0));
    if (rc != SQLITE_DONE) Fail(db, where, what);
  }
  for (const sqlite3_int64 id : ids) {
    Exec(db, where, CreateTableSql(id), what);
    Exec(db, where,
         "INSERT INTO " + TableOf(id) +
             "(seq, instance, body) SELECT o.seq, o.instance, o.body FROM objects o, "
             "collections c WHERE c.id = " +
             std::to_string(id) +
             " AND o.key = c.key AND o.grp = c.grp AND o.component = c.component ORDER BY o.seq",
         what);
  }
  Exec(db, where, "DROP TABLE objects", what);
  Exec(db, where, "PRAGMA user_version = " + std::to_string(kFormat), what);
}

}  // namespace schema
}  // namespace TavoConfigStore
