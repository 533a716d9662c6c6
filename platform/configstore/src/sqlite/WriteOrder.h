// Write order in the SQLite store: every object written gets the next "seq"
// of the whole store, so a rewritten object moves to the end and objects of
// several collections list in the order they were written. Here are the
// counter that hands out seqs and the reading of rows back into objects in
// that order, for the current tables and a kept version's alike.
//
// Internal to the library.

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_WRITE_ORDER_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_WRITE_ORDER_H_

#include <memory>
#include <string>
#include <vector>

#include "../object/Objects.h"
#include "Connection.h"

namespace TavoConfigStore {
namespace sqlite {

using ObjectPtr = std::shared_ptr<ConfigStoreObject>;

// The store's row sequence(next): read once per write transaction, counted
// here, and stored back before its commit.
class WriteSequence {
 public:
  explicit WriteSequence(Connection& conn) : conn_(conn) {}

  // The seq of the next object written. Call inside a write transaction.
  sqlite3_int64 Next();
  // Stores the count back if it moved; call before the commit.
  void Flush();
  // The transaction is over, committed or undone: others may write before
  // the next one, which reads the sequence again.
  void Forget() { loaded_ = dirty_ = false; }

 private:
  Connection& conn_;
  bool loaded_ = false;  // next_ was read within the open write
  bool dirty_ = false;   // and has been used since
  sqlite3_int64 next_ = 0;
};

// The object of a row (seq, instance, body) of a statement that has just
// stepped; a damaged body gives an object whose reads throw the damage.
ObjectPtr DecodeRow(const Connection& conn, ConfigStoreObjectId id, sqlite3_stmt* s,
                    objectmodel::Arena* arena);

// Appends the objects of every row (seq, instance, body) that "s" yields, all
// of the collection "key", "group", "component", to "out", and their seqs to
// "seqs" when it is not null; resets "s". A failed step is a failure of "what".
void ReadObjects(const Connection& conn, sqlite3_stmt* s, const std::string& key,
                 const std::string& group, const std::string& component,
                 std::vector<ObjectPtr>* out, std::vector<sqlite3_int64>* seqs,
                 objectmodel::Arena* arena, const char* what);

// Objects of several collections, each its seq in "seqs", merged into write
// order.
void InWriteOrder(const std::vector<sqlite3_int64>& seqs, std::vector<ObjectPtr>* objects);

}  // namespace sqlite
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_WRITE_ORDER_H_
