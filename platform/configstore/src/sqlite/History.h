// The versions a SQLite store keeps (format 3), in three tables beside the
// collections:
//
//   history(depth INTEGER, next INTEGER)   one row: how many versions to
//                                          keep, the number the next gets
//   versions(number INTEGER PRIMARY KEY, time INTEGER, host BLOB, user BLOB)
//   version_tables(version, collection, tbl)  which table held each
//                                          collection in each version
//
// A version shares the tables of the current state until a write would
// change one of them: then that table is renamed out of the way (to
// h<version>_<collection>) for the versions that hold it, and the collection
// gets a new table under its own name, empty for a clear (a replace begins
// with one) and a copy of the old one for anything else. A replace thus
// costs a rename and a table creation instead of the clear, and no row is
// copied; the oldest version's tables are dropped when it is forgotten, as
// the clear would have freed them. With depth 0 no table is held by a
// version and every write goes to the current tables as before.
//
// Internal to the library.

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_HISTORY_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_HISTORY_H_

#include <cstdint>
#include <set>
#include <string>
#include <vector>

#include "Connection.h"
#include "TavoConfigStore/ConfigStoreObjectId.h"
#include "TavoConfigStore/StoreHistory.h"
#include "WriteOrder.h"

namespace TavoConfigStore {
namespace sqlite {

constexpr unsigned kDefaultDepth = 10;

// Call inside a write transaction. The tables and the row of a store that
// has no version yet; the first commit makes version 1.
void CreateHistoryTables(Connection& conn, const char* what);

class History {
 public:
  explicit History(Connection& conn) : conn_(conn) {}

  // Before the first change of a collection's table in a write transaction:
  // when a kept version holds the table, moves it out of the way and makes
  // the collection a new one (a copy when "keepRows"). True when the table
  // is new and empty, so a clear has nothing left to do.
  bool BeforeChange(sqlite3_int64 collection, bool keepRows);
  // At the commit of a transaction that changed something: the new state
  // becomes the newest version, and the versions beyond the depth go.
  void Record();
  // What this transaction moved is unknown again (it was undone).
  void Forget() {
    moved_.clear();
    pruned_ = false;
  }

  std::vector<StoreVersion> Versions();
  unsigned Depth();
  // Call inside a write transaction.
  void SetDepth(unsigned depth);
  std::uint64_t Newest();

  // The objects of version "number" that "filter" matches (an empty part,
  // the instance id included, matches any), in write order. Throws
  // kErrorNoSuchVersion for a version not kept.
  std::vector<ObjectPtr> Objects(std::uint64_t number, const ConfigStoreObjectId& filter);

 private:
  // The table of each collection in version "number" that "filter" matches,
  // in the order the collections were made.
  struct Table {
    std::string key, group, component, name;
  };
  std::vector<Table> TablesOf(std::uint64_t number, const ConfigStoreObjectId& filter);
  // Forgets the versions up to "last", and drops the tables only they held.
  void ForgetUpTo(long long last);

  Connection& conn_;
  std::set<sqlite3_int64> moved_;  // collections with a new table in this transaction
  bool pruned_ = false;            // the oldest version went in this transaction
};

}  // namespace sqlite
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_HISTORY_H_
