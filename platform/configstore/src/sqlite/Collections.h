// Which table holds which collection (Schema.h), and each table's statements,
// prepared on first use. A collection, once made, is never dropped, so what
// is known here stays true, except for collections made inside a transaction
// that is then undone: Forget drops everything, and it is found again.

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_COLLECTIONS_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_COLLECTIONS_H_

#include <array>
#include <map>
#include <string>
#include <tuple>
#include <vector>

#include "Connection.h"
#include "TavoConfigStore/ConfigStoreObjectId.h"

namespace TavoConfigStore {
namespace sqlite {

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
  Collection* Remember(Key&& key, sqlite3_int64 id);

  Connection& conn_;
  std::map<Key, Collection> known_;
  Collection* last_ = nullptr;  // the one used last, checked before the map
};

}  // namespace sqlite
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_COLLECTIONS_H_
