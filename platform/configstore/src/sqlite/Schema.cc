#include "Schema.h"

#include <vector>

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
  if (version != kFormat) {
    throw ConfigStoreException(
        conn.Where() + ": unknown schema version " + std::to_string(version) +
            " (this library reads versions 1 and " + std::to_string(kFormat) + ")",
        kErrorNotAStore);
  }
  if (conn.Int("SELECT count(*) FROM sqlite_master WHERE type = 'table' AND name IN "
               "('collections', 'sequence')",
               what) != 2) {
    NotAStore(conn, "no collections or sequence table");
  }
  return Found::kCurrent;
}

void CreateSchema(Connection& conn) {
  const char* what = "creating the schema";
  CreateFormat2Tables(conn, what);
  conn.Exec("INSERT INTO sequence VALUES(1)", what);
  conn.Exec("PRAGMA application_id = " + std::to_string(kApplicationId), what);
  conn.Exec("PRAGMA user_version = " + std::to_string(kFormat), what);
}

// Each collection's objects move to a table of their own with their seq,
// so write order and the next seq carry over; a crash or an error anywhere
// leaves the transaction, and with it the file, as it was.
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
  conn.Exec("PRAGMA user_version = " + std::to_string(kFormat), what);
}

}  // namespace sqlite
}  // namespace TavoConfigStore
