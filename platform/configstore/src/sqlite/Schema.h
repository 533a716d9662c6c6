// The tables of the SQLite store, format 2:
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
// Format 1 kept every object in one table, objects(seq, key, grp, component,
// instance, body); a writer upgrades such a file in place, in one
// transaction.
//
// Internal to the library.

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_SCHEMA_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_SCHEMA_H_

#include <string>

#include "Connection.h"

namespace TavoConfigStore {
namespace sqlite {

constexpr int kApplicationId = 0x5441564f;  // "TAVO"
constexpr int kFormat = 2;

enum class Found { kEmpty, kFormat1, kCurrent };

// What the file holds; throws ConfigStoreException (kErrorNotAStore, or the
// SQLite error) for anything not a store of a known format. Call inside a
// transaction, so that the reads agree.
Found Inspect(Connection& conn);

// Call inside a write transaction.
void CreateSchema(Connection& conn);
void UpgradeFormat1(Connection& conn);

// The table of a collection, and the statement that creates it.
std::string TableOf(sqlite3_int64 collection);
std::string CreateTableSql(sqlite3_int64 collection);

}  // namespace sqlite
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_SCHEMA_H_
