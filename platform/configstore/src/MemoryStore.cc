// The in-memory backend: the store's semantics without a file, for tests.

#include <map>
#include <mutex>
#include <tuple>
#include <vector>

#include "Backend.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TransactionLevels.h"
#include "object/Objects.h"

namespace TavoConfigStore {
namespace {

using IdKey = std::tuple<std::string, std::string, std::string, std::string>;

IdKey KeyOf(const ConfigStoreObjectId& id) {
  return {id.Key(), id.Group(), id.Component(), id.InstanceId()};
}

// An object as written: kept encoded, as the other backends keep it.
struct Stored {
  ConfigStoreObjectId id;
  std::string body;
};

std::shared_ptr<ConfigStoreObject> Read(const Stored& stored) {
  return objectmodel::DecodeObject(stored.id, stored.body, nullptr);
}

struct State {
  std::uint64_t nextSeq = 1;
  // Write order; what is stored never changes, so a snapshot shares it.
  std::map<std::uint64_t, std::shared_ptr<const Stored>> bySeq;
  std::map<IdKey, std::uint64_t> index;
};

class MemoryStore final : public Backend {
 public:
  std::string Where() const override { return "memory store"; }

  std::shared_ptr<ConfigStoreObject> Get(const ConfigStoreObjectId& id) override {
    std::lock_guard<std::mutex> lock(mu_);
    auto it = state_.index.find(KeyOf(id));
    if (it == state_.index.end()) return nullptr;
    return Read(*state_.bySeq.at(it->second));
  }

  void Set(const ConfigStoreObject& object) override {
    auto copy = std::make_shared<Stored>(Stored{object.Id(), std::string()});
    objectmodel::EncodeObject(object, &copy->body);
    std::lock_guard<std::mutex> lock(mu_);
    const std::uint64_t seq = state_.nextSeq++;
    auto [it, added] = state_.index.try_emplace(KeyOf(object.Id()), seq);
    if (!added) {
      state_.bySeq.erase(it->second);  // a rewritten object moves to the end
      it->second = seq;
    }
    state_.bySeq.emplace(seq, std::move(copy));
  }

  void Delete(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    for (auto it = state_.bySeq.begin(); it != state_.bySeq.end();) {
      if (filter.Matches(it->second->id)) {
        state_.index.erase(KeyOf(it->second->id));
        it = state_.bySeq.erase(it);
      } else {
        ++it;
      }
    }
  }

  std::vector<std::shared_ptr<ConfigStoreObject>> List(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    std::vector<std::shared_ptr<ConfigStoreObject>> out;
    for (const auto& [seq, stored] : state_.bySeq) {
      if (filter.Matches(stored->id)) out.push_back(Read(*stored));
    }
    return out;
  }

  // Every level saves the whole state, which the writes never touch in
  // place; the outermost commit has nothing more to make durable.
  void BeginTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    levels_.Begin(state_);
  }

  void CommitTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!levels_.Open()) NoTransactionToCommit();
    levels_.Commit();
  }

  void AbortTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (levels_.Open()) state_ = levels_.Abort();
  }

 private:
  std::mutex mu_;
  State state_;
  TransactionLevels<State> levels_;
};

}  // namespace

std::shared_ptr<ConfigStore> NewMemoryStore() { return std::make_shared<MemoryStore>(); }

}  // namespace TavoConfigStore
