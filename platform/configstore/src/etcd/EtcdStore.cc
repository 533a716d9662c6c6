// The etcd backend: a store that many hosts share through one cluster.
//
// A transaction is kept here, as what it did to each collection
// (EtcdCommit.h) over what it read, until the outermost commit applies it.
// Reads inside a transaction see its own changes; reads outside it read the
// pointers and the objects at one revision (EtcdReader.h). Objects read from
// a listing the store keeps for later reads view their bodies there; others
// get copies, so that the replies they came in can go.

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <utility>
#include <vector>

#include "../Backend.h"
#include "../HistorySource.h"
#include "../TransactionLevels.h"
#include "../object/Objects.h"
#include "EtcdClient.h"
#include "EtcdCommit.h"
#include "EtcdHistory.h"
#include "EtcdLayout.h"
#include "EtcdListingCache.h"
#include "EtcdReader.h"
#include "EtcdWatch.h"
#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {
namespace {

// What an open transaction did, at one level of nesting.
struct TxnState {
  PendingCollections collections;
  std::uint64_t nextSeq = 0;
};

// The collection a filter names exactly, or "" when it leaves a part open.
std::string ExactCollection(const ConfigStoreObjectId& id) {
  if (id.Key().empty() || id.Group().empty() || id.Component().empty()) return std::string();
  return etcdlayout::CollectionOf(id);
}

bool CollectionMatches(const FilterSpecObject& filter, const std::string& name) {
  ConfigStoreObjectId id("", "", "");
  if (!etcdlayout::ParseCollection(name, &id)) return false;
  id.SetInstanceId(filter.Id().InstanceId());
  return filter.Matches(id);
}

std::shared_ptr<ConfigStoreObject> DecodePut(const ConfigStoreObjectId& id, const Put& put) {
  return objectmodel::DecodeObject(id, put.body, nullptr);
}

class EtcdStore final : public Backend, public HistorySource {
 public:
  explicit EtcdStore(const EtcdStoreOptions& options)
      : client_(options),
        reader_(client_, options.prefix, ListingCache::For(options)),
        commit_(client_, reader_),
        history_(client_, reader_) {}

  ~EtcdStore() override { feed_.reset(); }

  std::string Where() const override { return client_.Where(); }

  std::shared_ptr<ConfigStoreObject> Get(const ConfigStoreObjectId& id) override {
    std::lock_guard<std::mutex> lock(mu_);
    const std::string collection = etcdlayout::CollectionOf(id);
    if (const Pending* pending = PendingOf(collection)) {
      auto put = pending->puts.find(id.InstanceId());
      if (put != pending->puts.end()) return DecodePut(id, put->second);
      if (pending->cleared || pending->deleted.count(id.InstanceId())) return nullptr;
    }
    const EtcdClient::Call call(client_);
    return EtcdReader::Snapshot([&]() -> std::shared_ptr<ConfigStoreObject> {
      std::shared_ptr<const Listing> listing;
      const Pointers pointers = reader_.ReadCollection(collection, &id.InstanceId(), &listing);
      Observe(collection, pointers);
      return listing->entries.empty() ? nullptr
                                      : Decode(id, listing->entries.front(), listing, nullptr);
    });
  }

  void Set(const ConfigStoreObject& object) override {
    Put put;
    objectmodel::EncodeObject(object, &put.body);
    std::lock_guard<std::mutex> lock(mu_);
    InTransaction([&] {
      Pending& pending = txn_.collections[etcdlayout::CollectionOf(object.Id())];
      put.seq = txn_.nextSeq++;
      // Erased first: a replaced object moves to the end of the write order.
      pending.puts.erase(object.Id().InstanceId());
      pending.puts.emplace(object.Id().InstanceId(), std::move(put));
    });
  }

  void Delete(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    InTransaction([&] {
      const ConfigStoreObjectId& want = filter.Id();
      // A collection named in full is not looked up: the commit finds out
      // whether it exists. A caller that goes on past a failed deletion
      // (the library's Reset) must not commit as if it had asked for none.
      const std::string exact = ExactCollection(want);
      std::set<std::string> names;
      if (exact.empty()) {
        names = Matching(filter, EtcdReader::Snapshot([&] { return reader_.ReadPointers(exact); }));
      } else {
        names.insert(exact);
      }
      for (const std::string& name : names) {
        Pending& pending = txn_.collections[name];
        if (want.InstanceId().empty()) {
          pending = Pending();
          pending.cleared = true;
        } else {
          pending.deleted.insert(want.InstanceId());
          pending.puts.erase(want.InstanceId());
        }
      }
    });
  }

  std::vector<std::shared_ptr<ConfigStoreObject>> List(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    const EtcdClient::Call call(client_);
    return EtcdReader::Snapshot([&] { return ListMatching(filter); });
  }

  void BeginTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    // A transaction's requests share one wait for members that do not
    // answer: a caller that goes on after a failure (a reset clearing one
    // collection after another) still ends within about one timeout.
    if (!levels_.Open()) txnCall_.emplace(client_);
    levels_.Begin(txn_);
  }

  void CommitTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (!levels_.Open()) NoTransactionToCommit();
    if (levels_.Nested()) return levels_.Commit();
    // A failed commit leaves the transaction open, for the caller to abort.
    commit_.Apply(txn_.collections, observed_);
    Reset();
  }

  void AbortTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (levels_.Nested()) {
      txn_ = levels_.Abort();
    } else if (levels_.Open()) {
      Reset();
    }
  }

  bool WaitForChange(int timeoutMs) override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (!feed_) {
        // Changes after this revision count: anything before it the caller
        // has read already.
        const Pointers now = reader_.ReadPointers(std::string());
        feed_ =
            std::make_unique<ChangeFeed>(client_, reader_.OwnKeys().Pointers(), now.revision + 1);
      }
    }
    return feed_->Wait(timeoutMs);
  }

  std::string HistoryWhere() const override { return client_.Where(); }
  std::vector<StoreVersion> Versions() override {
    return OnHistory([&] { return history_.Versions(); });
  }
  unsigned Depth() override {
    return OnHistory([&] { return history_.Depth(); });
  }
  void SetDepth(unsigned depth) override {
    OnHistory([&] { history_.SetDepth(depth); });
  }
  std::uint64_t Newest() override {
    return OnHistory([&] { return history_.Newest(); });
  }
  std::vector<std::shared_ptr<ConfigStoreObject>> ListVersion(
      std::uint64_t number, const FilterSpecObject& filter) override {
    return OnHistory([&] { return history_.ListVersion(number, filter); });
  }

 private:
  // Inside an open transaction, its requests' wait is the transaction's.
  template <typename Read>
  auto OnHistory(const Read& read) -> decltype(read()) {
    std::lock_guard<std::mutex> lock(mu_);
    std::optional<EtcdClient::Call> call;
    if (!levels_.Open()) call.emplace(client_);
    return read();
  }

  // An object of "listing", kept by it when the store keeps the listing,
  // else copied into "arena" (null: memory of its own).
  std::shared_ptr<ConfigStoreObject> Decode(const ConfigStoreObjectId& collection,
                                            const Entry& entry,
                                            const std::shared_ptr<const Listing>& listing,
                                            objectmodel::Arena* arena) const {
    ConfigStoreObjectId id(collection.Key(), collection.Group(), collection.Component());
    id.SetInstanceId(entry.instance);
    return ObjectOf(std::move(id), entry, listing->kept ? listing : nullptr, arena,
                    client_.Where());
  }

  // What the open transaction did to a collection, if anything (outside a
  // transaction "txn_" is empty).
  const Pending* PendingOf(const std::string& collection) const {
    auto it = txn_.collections.find(collection);
    return it == txn_.collections.end() ? nullptr : &it->second;
  }

  // The collections a filter names: stored ones, and those the open
  // transaction has written.
  std::set<std::string> Matching(const FilterSpecObject& filter, const Pointers& pointers) const {
    std::set<std::string> names;
    for (const auto& entry : pointers.byCollection) {
      if (CollectionMatches(filter, entry.first)) names.insert(entry.first);
    }
    for (const auto& entry : txn_.collections) {
      if (CollectionMatches(filter, entry.first)) names.insert(entry.first);
    }
    return names;
  }

  // A transaction that read a collection commits only if nobody changed it.
  void Observe(const std::string& collection, const Pointers& pointers) {
    const Current* current = pointers.Find(collection);
    if (levels_.Open()) observed_.emplace(collection, current ? current->version : 0);
  }

  std::vector<std::shared_ptr<ConfigStoreObject>> ListMatching(const FilterSpecObject& filter) {
    const ConfigStoreObjectId& want = filter.Id();
    const std::string* instance = want.InstanceId().empty() ? nullptr : &want.InstanceId();
    const std::string exact = ExactCollection(want);
    std::shared_ptr<const Listing> listing;
    const Pointers pointers = exact.empty() ? reader_.ReadPointers(exact)
                                            : reader_.ReadCollection(exact, instance, &listing);
    std::vector<Listed> listed;
    objectmodel::Arena arena;
    for (const std::string& name : Matching(filter, pointers)) {
      ConfigStoreObjectId collection("", "", "");
      etcdlayout::ParseCollection(name, &collection);
      Observe(name, pointers);
      const Current* current = pointers.Find(name);
      const Pending* pending = PendingOf(name);
      if (current && !(pending && pending->cleared)) {
        if (name != exact) listing = reader_.ReadListing(pointers, name, instance);
        for (const Entry& entry : listing->entries) {
          if (!pending ||
              (!pending->deleted.count(entry.instance) && !pending->puts.count(entry.instance))) {
            listed.push_back({entry.order, Decode(collection, entry, listing, &arena)});
          }
        }
      }
      if (pending == nullptr) continue;
      for (const auto& [key, put] : pending->puts) {
        if (instance && key != *instance) continue;
        collection.SetInstanceId(key);
        // Not committed yet: after everything that is.
        listed.push_back({Order{INT64_MAX, put.seq}, DecodePut(collection, put)});
      }
    }
    return InWriteOrder(std::move(listed));
  }

  // Runs "change" in the open transaction, or in one of its own.
  template <typename Change>
  void InTransaction(const Change& change) {
    if (levels_.Open()) {
      change();
      return;
    }
    levels_.Begin();
    const EtcdClient::Call call(client_);
    try {
      change();
      commit_.Apply(txn_.collections, observed_);
    } catch (...) {
      Reset();
      throw;
    }
    Reset();
  }

  void Reset() {
    levels_.Clear();
    txn_ = TxnState();
    observed_.clear();
    txnCall_.reset();
  }

  std::mutex mu_;
  EtcdClient client_;
  EtcdReader reader_;
  EtcdCommit commit_;
  EtcdHistory history_;
  TransactionLevels<TxnState> levels_;
  TxnState txn_;
  ObservedVersions observed_;
  std::optional<EtcdClient::Call> txnCall_;  // the open transaction's wait
  std::unique_ptr<ChangeFeed> feed_;
};

}  // namespace

std::shared_ptr<ConfigStore> NewEtcdStore(const EtcdStoreOptions& options) {
  if (options.endpoints.empty() || options.prefix.empty()) {
    throw ConfigStoreException("etcd store: needs at least one endpoint and a prefix",
                               kErrorBadLocator);
  }
  return std::make_shared<EtcdStore>(options);
}

}  // namespace TavoConfigStore
