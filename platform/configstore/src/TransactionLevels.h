// Nested transactions, kept the same way by every backend. Each open level
// holds what an abort of that level must bring back; the outermost level is
// the store's own transaction, each level begun inside it a savepoint of it.
//  - Begin opens a level, saving the state as it is now.
//  - Commit of an inner level drops what it saved: its writes become part of
//    the level around it. Commit of the outermost makes them durable, which
//    is the backend's to do before calling Commit.
//  - Abort of a level gives back what it saved, for the backend to restore.
// A backend whose storage keeps the saved states itself (SQLite's
// savepoints) saves nothing here and uses the levels only to count.

#ifndef TAVOCONFIGSTORE_SRC_TRANSACTION_LEVELS_H_
#define TAVOCONFIGSTORE_SRC_TRANSACTION_LEVELS_H_

#include <utility>
#include <vector>

namespace TavoConfigStore {

// The state of a backend whose storage keeps its savepoints itself.
struct KeptByTheStorage {};

template <typename State = KeptByTheStorage>
class TransactionLevels {
 public:
  bool Open() const { return !saved_.empty(); }
  bool Nested() const { return saved_.size() > 1; }

  void Begin(State now = State()) { saved_.push_back(std::move(now)); }
  void Commit() { saved_.pop_back(); }
  State Abort() {
    State before = std::move(saved_.back());
    saved_.pop_back();
    return before;
  }
  // Every level ends at once: the outermost was rolled back, by the backend
  // or by the storage on its own.
  void Clear() { saved_.clear(); }

 private:
  std::vector<State> saved_;  // outermost first
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_TRANSACTION_LEVELS_H_
