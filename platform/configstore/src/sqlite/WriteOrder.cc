#include "WriteOrder.h"

#include <algorithm>
#include <numeric>

namespace TavoConfigStore {
namespace sqlite {

sqlite3_int64 WriteSequence::Next() {
  if (!loaded_) {
    next_ = conn_.Int("SELECT next FROM sequence", "reading the write sequence");
    loaded_ = true;
  }
  dirty_ = true;
  return next_++;
}

void WriteSequence::Flush() {
  if (!dirty_) return;
  sqlite3_stmt* s = conn_.Cached("UPDATE sequence SET next = ?1", "storing the write sequence");
  Resetter reset(s);
  if (sqlite3_bind_int64(s, 1, next_) != SQLITE_OK || sqlite3_step(s) != SQLITE_DONE) {
    conn_.Fail("storing the write sequence");
  }
  dirty_ = false;
}

ObjectPtr DecodeRow(const Connection& conn, ConfigStoreObjectId id, sqlite3_stmt* s,
                    objectmodel::Arena* arena) {
  return objectmodel::DecodeOrDamaged(std::move(id), Connection::Column(s, 2), arena, conn.Where());
}

void ReadObjects(const Connection& conn, sqlite3_stmt* s, const std::string& key,
                 const std::string& group, const std::string& component,
                 std::vector<ObjectPtr>* out, std::vector<sqlite3_int64>* seqs,
                 objectmodel::Arena* arena, const char* what) {
  Resetter reset(s);
  std::string instance;  // keeps its capacity from one object to the next
  int rc;
  while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
    if (seqs != nullptr) seqs->push_back(sqlite3_column_int64(s, 0));
    instance.assign(Connection::Column(s, 1));
    out->push_back(DecodeRow(conn, ConfigStoreObjectId(key, group, component, instance), s, arena));
  }
  if (rc != SQLITE_DONE) conn.Fail(what);
}

void InWriteOrder(const std::vector<sqlite3_int64>& seqs, std::vector<ObjectPtr>* objects) {
  std::vector<std::size_t> order(seqs.size());
  std::iota(order.begin(), order.end(), 0);
  std::sort(order.begin(), order.end(),
            [&seqs](std::size_t a, std::size_t b) { return seqs[a] < seqs[b]; });
  std::vector<ObjectPtr> sorted;
  sorted.reserve(order.size());
  for (std::size_t i : order) sorted.push_back(std::move((*objects)[i]));
  objects->swap(sorted);
}

}  // namespace sqlite
}  // namespace TavoConfigStore
