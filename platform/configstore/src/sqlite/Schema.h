// The tables of the SQLite store, format 3, and which of them holds which
// collection:
//
//   collections(id INTEGER PRIMARY KEY, key BLOB, grp BLOB, component BLOB),
//               UNIQUE (key, grp, component)
//   c<id>(seq INTEGER, instance BLOB UNIQUE, body BLOB)
//               one table per collection: its objects by instance id
//   sequence(next INTEGER)  one row: the seq the next write gets
//
// A table per collection makes a listing one scan of its own table in rowid
// order, which is write order (SQLite gives a new row one above the largest
// rowid), and a clear of the collection SQLite's drop of the table's pages;
// its index entries carry only the instance id. seq counts writes across the
// whole store, so objects of several collections still list in write order.
// seq is a column of its own, not the rowid: rows inserted with a rowid of
// the caller's choosing would not be known to append, and SQLite then splits
// pages in half as for inserts in the middle, which made a replace write
// about ten times the pages.
//
// Format 3 adds the history of versions (History.h); format 2 had none.
// Format 1 kept every object in one table, objects(seq, key, grp, component,
// instance, body). A writer upgrades a file of either in place, in one
// transaction.
//
// Internal to the library.

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_SCHEMA_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_SCHEMA_H_

#include <array>
#include <map>
#include <string>
#include <tuple>
#include <vector>

#include "Connection.h"
#include "TavoConfigStore/ConfigStoreObjectId.h"

namespace TavoConfigStore {
namespace sqlite {

constexpr int kApplicationId = 0x5441564f;  // "TAVO"
constexpr int kFormat = 3;

enum class Found { kEmpty, kFormat1, kFormat2, kCurrent };

// What the file holds; throws ConfigStoreException (kErrorNotAStore, or the
// SQLite error) for anything not a store of a known format. Call inside a
// transaction, so that the reads agree.
Found Inspect(Connection& conn);

// Call inside a write transaction.
void CreateSchema(Connection& conn);
void UpgradeFormat1(Connection& conn);
void UpgradeFormat2(Connection& conn);

// The table that holds a collection now, and the statement that makes it.
std::string TableOf(sqlite3_int64 collection);
std::string CreateTableSql(sqlite3_int64 collection);

// Which table holds which collection, and each table's statements, prepared
// on first use. A collection, once made, is never dropped, so what is known
// here stays true, except for collections made inside a transaction that is
// then undone: Forget drops everything, and it is found again.
class Collections {
 public:
  enum Op { kPut, kList, kListOne, kClear, kErase, kOps };

  struct Collection {
    sqlite3_int64 id = 0;
    std::string key, group, component;
    std::array<sqlite3_stmt*, kOps> statements{};
  };

  explicit Collections(Connection& conn) : conn_(conn) {}

  // The collection of the identifier's key, group and component; when there
  // is none, with "create" a new one (its row and its table), else null.
  Collection* Find(const ConfigStoreObjectId& id, bool create);
  // The collections whose key, group and component a filter matches (an
  // empty part matches any), in the order they were made.
  std::vector<Collection*> Matching(const ConfigStoreObjectId& filter);
  // The statement of "op" on the collection's table:
  //   kPut      (seq ?1, instance ?2, body ?3)
  //   kList     rows of seq, instance, body in write order
  //   kListOne  the same for instance ?1
  //   kClear    every row;  kErase  the row of instance ?1
  sqlite3_stmt* Statement(Collection* c, Op op);
  void Forget();

 private:
  using Key = std::tuple<std::string, std::string, std::string>;
  // The collection of "key", known from now on as table "id" if it was not.
  Collection* Remember(Key&& key, sqlite3_int64 id);
  // Binds the key, group and component of "id" to ?1, ?2 and ?3; with
  // "emptyIsNull" an empty part as NULL, which the filter query takes as any.
  void BindParts(sqlite3_stmt* s, const ConfigStoreObjectId& id, bool emptyIsNull);
  // Runs "sql" on the parts of "id": the first column of its row, or 0.
  sqlite3_int64 RunOnParts(std::string_view sql, const ConfigStoreObjectId& id, const char* what);

  Connection& conn_;
  std::map<Key, Collection> known_;
  Collection* last_ = nullptr;  // the one used last, checked before the map
};

}  // namespace sqlite
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_SCHEMA_H_
