// The etcd backend: a store that many hosts share through one cluster.
//
// Transactions are kept here until the outermost commit and then applied in
// one of two ways (EtcdLayout.h has the keys):
//  - small changes (one etcd request's worth, no collection cleared) go in
//    place into the current generations, in one etcd transaction;
//  - anything else writes each changed collection whole into a new
//    generation, in as many requests as it takes, and then makes the new
//    generations current in one small etcd transaction that compares each
//    collection's version and that the writer's lease is still alive. Until
//    that switch no reader sees any of it; after it every reader sees all of
//    it. Readers read the pointers and the objects at one revision.
// A commit that finds a collection changed by another writer since this
// transaction read it fails with kErrorConflict: what it would write may
// depend on what it read. A transaction that only wrote a collection
// (a replace: clear, then write) is applied again to the new state instead,
// since its outcome does not depend on what was there.

#include <grpcpp/grpcpp.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <deque>
#include <future>
#include <map>
#include <mutex>
#include <optional>
#include <random>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "../Backend.h"
#include "../object/Objects.h"
#include "EtcdClient.h"
#include "EtcdLayout.h"
#include "EtcdWire.h"
#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {
namespace {

using etcdlayout::Header;
using etcdlayout::Keys;
using etcdlayout::OrderKind;
using etcdserverpb::Compare;
using etcdserverpb::RangeRequest;
using etcdserverpb::RequestOp;
using etcdserverpb::TxnRequest;

constexpr std::int64_t kLeaseSeconds = 60;
// A listing of at least this many objects is read in two halves at once.
constexpr std::size_t kSplitObjects = 256;
constexpr int kCommitAttempts = 5;
constexpr int kCompactedCode = kErrorEtcdBase + static_cast<int>(grpc::StatusCode::OUT_OF_RANGE);
constexpr int kDeadlineCode =
    kErrorEtcdBase + static_cast<int>(grpc::StatusCode::DEADLINE_EXCEEDED);
constexpr int kUnavailableCode = kErrorEtcdBase + static_cast<int>(grpc::StatusCode::UNAVAILABLE);
constexpr int kLeaseGoneCode = kErrorEtcdBase + static_cast<int>(grpc::StatusCode::NOT_FOUND);
constexpr int kDeniedCode = kErrorEtcdBase + static_cast<int>(grpc::StatusCode::PERMISSION_DENIED);

std::string NewId() {
  static std::mutex mu;
  static std::mt19937_64 random{std::random_device{}()};
  std::lock_guard<std::mutex> lock(mu);
  char text[17];
  std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(random()));
  return text;
}

// A pointer's value: the generation, then the token of the commit that wrote
// it, by which a writer recognises its own commit after an unclear reply.
std::string PointerValue(const std::string& gen, const std::string& token) {
  return gen + '\0' + token;
}
std::string GenerationOf(std::string_view pointerValue) {
  return std::string(pointerValue.substr(0, pointerValue.find('\0')));
}
std::string TokenOf(std::string_view pointerValue) {
  const std::size_t zero = pointerValue.find('\0');
  return zero == std::string_view::npos ? std::string()
                                        : std::string(pointerValue.substr(zero + 1));
}

struct Order {
  std::int64_t revision = 0;
  std::uint64_t index = 0;
  bool operator<(const Order& other) const {
    return revision != other.revision ? revision < other.revision : index < other.index;
  }
};

// A collection as the cluster has it at one revision.
struct Current {
  std::string gen;
  std::int64_t version = 0;  // the pointer's mod revision; 0: no such collection
  std::string token;
};

struct Pointers {
  std::int64_t revision = 0;
  std::map<std::string, Current> byCollection;
  // The layout they were read in: the store's own, or that of an earlier
  // version whose catalogue the store's first write has not moved yet.
  const Keys* keys = nullptr;
  // Read by a commit only: generations at that revision whose writer died
  // before making them current (registered, no live writer, no pointer).
  // Nothing can make such a generation current any more.
  std::vector<std::string> orphans;
};

const Current* Find(const Pointers& pointers, const std::string& collection) {
  auto it = pointers.byCollection.find(collection);
  return it == pointers.byCollection.end() ? nullptr : &it->second;
}

// One stored object of a generation, its bytes still in the reply.
struct Entry {
  std::string instance;
  Order order;
  std::string_view body;
  std::string joined;  // a body stored in several parts, put together
  std::string damage;  // why the object cannot be read, if it cannot
};

// The replies a read of one collection's objects keeps; entries point into
// them.
struct Replies {
  etcdwire::Reply first;
  etcdwire::Reply second;  // the second half of a split listing
};

struct Put {
  std::uint64_t seq = 0;
  std::string body;
};

// What an open transaction did to one collection.
struct Pending {
  bool cleared = false;
  std::set<std::string> deleted;
  std::map<std::string, Put> puts;
  bool Touched() const { return cleared || !deleted.empty() || !puts.empty(); }
};

struct TxnState {
  std::map<std::string, Pending> collections;
  std::uint64_t nextSeq = 0;
};

void AddCompareVersion(TxnRequest* txn, const std::string& key, const Current& current) {
  Compare* compare = txn->add_compare();
  compare->set_key(key);
  if (current.version == 0) {
    compare->set_target(Compare::VERSION);
    compare->set_result(Compare::EQUAL);
    compare->set_version(0);
  } else {
    compare->set_target(Compare::MOD);
    compare->set_result(Compare::EQUAL);
    compare->set_mod_revision(current.version);
  }
}

void AddPut(std::vector<RequestOp>* ops, std::string key, std::string value,
            std::int64_t lease = 0) {
  auto* put = ops->emplace_back().mutable_request_put();
  put->set_key(std::move(key));
  put->set_value(std::move(value));
  put->set_lease(lease);
}

void AddDelete(std::vector<RequestOp>* ops, std::string key, std::string rangeEnd = {}) {
  auto* del = ops->emplace_back().mutable_request_delete_range();
  del->set_key(std::move(key));
  del->set_range_end(std::move(rangeEnd));
}

void AddDeletePrefix(std::vector<RequestOp>* ops, const std::string& prefix) {
  AddDelete(ops, prefix, PrefixEnd(prefix));
}

TxnRequest TxnOf(std::vector<RequestOp>* ops) {
  TxnRequest txn;
  for (RequestOp& op : *ops) *txn.add_success() = std::move(op);
  ops->clear();
  return txn;
}

// Writes a new generation's objects in transactions of at most kBatchOps
// puts and kBatchBytes. The first batch, which registers the generation, is
// written alone; after it up to kBatchesInFlight are on their way at once
// while the next is built. Their order does not matter (no reader looks at a
// generation before the switch), and etcd syncs batches that arrive together
// to disk together.
class BatchWriter {
 public:
  static constexpr std::size_t kBatchesInFlight = 4;

  explicit BatchWriter(EtcdClient& client) : client_(client) {}
  // Waits for every batch still on its way: what is abandoned after a
  // failure must not be written afterwards by a batch of its own.
  ~BatchWriter() {
    for (std::future<void>& batch : inFlight_) batch.wait();
  }
  BatchWriter(const BatchWriter&) = delete;
  BatchWriter& operator=(const BatchWriter&) = delete;

  // Adds a put that takes about "size" bytes of a request.
  void Put(std::string key, std::string value, std::size_t size, std::int64_t lease = 0) {
    if (bytes_ + size > etcdlayout::kBatchBytes) Send();
    AddPut(&ops_, std::move(key), std::move(value), lease);
    bytes_ += size;
    if (ops_.size() >= static_cast<std::size_t>(etcdlayout::kBatchOps) ||
        bytes_ >= etcdlayout::kBatchBytes) {
      Send();
    }
  }

  // Sends what is left and waits for every batch; throws the first failure.
  void Finish() {
    Send();
    while (!inFlight_.empty()) Collect();
  }

 private:
  void Send() {
    if (ops_.empty()) return;
    TxnRequest txn = TxnOf(&ops_);
    bytes_ = 0;
    if (!registered_) {
      client_.Txn(txn, true);
      registered_ = true;
      return;
    }
    if (inFlight_.size() >= kBatchesInFlight) Collect();
    inFlight_.push_back(
        std::async(std::launch::async, [this, txn = std::move(txn)] { client_.Txn(txn, true); }));
  }

  void Collect() {
    std::future<void> oldest = std::move(inFlight_.front());
    inFlight_.pop_front();
    oldest.get();
  }

  EtcdClient& client_;
  std::vector<RequestOp> ops_;
  std::size_t bytes_ = 0;
  bool registered_ = false;
  std::deque<std::future<void>> inFlight_;
};

// Wakes WaitForChange when another writer commits: a watch on the pointers,
// which every commit rewrites, read by a thread of its own.
class ChangeFeed {
 public:
  ChangeFeed(EtcdClient& client, std::string key, std::int64_t startRevision)
      : client_(client), key_(std::move(key)), next_(startRevision) {
    thread_ = std::thread([this] { Run(); });
  }
  ~ChangeFeed() {
    {
      std::lock_guard<std::mutex> lock(mu_);
      stopping_ = true;
      if (context_) context_->TryCancel();
    }
    changed_.notify_all();
    thread_.join();
  }

  bool Wait(int timeoutMs) {
    std::unique_lock<std::mutex> lock(mu_);
    changed_.wait_for(lock, std::chrono::milliseconds(timeoutMs), [this] { return seen_; });
    const bool seen = seen_;
    seen_ = false;
    return seen;
  }

 private:
  void Run() {
    while (true) {
      auto context = std::make_shared<grpc::ClientContext>();
      std::size_t member = 0;
      etcdserverpb::Watch::Stub* stub = nullptr;
      try {
        stub = &client_.WatchStub(key_, context.get(), &member);
      } catch (const ConfigStoreException&) {
        // Credentials refused or cluster away: the wait below says "look
        // again", and the caller's read reports the failure.
      }
      {
        std::lock_guard<std::mutex> lock(mu_);
        if (stopping_) return;
        context_ = context;
      }
      if (stub != nullptr) Follow(*stub, context.get(), member);
      {
        std::unique_lock<std::mutex> lock(mu_);
        context_.reset();
        if (stopping_) return;
        // A lost stream may have missed a change: say so, and the caller's
        // next read shows what the cluster holds (or why it cannot).
        seen_ = true;
        changed_.notify_all();
        changed_.wait_for(lock, std::chrono::milliseconds(500), [this] { return stopping_; });
        if (stopping_) return;
      }
    }
  }

  // Reads the watch's events until the stream ends; a stream that broke
  // sends the next watch to another member.
  void Follow(etcdserverpb::Watch::Stub& stub, grpc::ClientContext* context, std::size_t member) {
    auto stream = stub.Watch(context);
    etcdserverpb::WatchRequest request;
    auto* create = request.mutable_create_request();
    create->set_key(key_);
    create->set_range_end(PrefixEnd(key_));
    create->set_start_revision(next_);
    etcdserverpb::WatchResponse response;
    if (stream->Write(request)) {
      while (stream->Read(&response)) {
        if (response.compact_revision() > 0) next_ = response.compact_revision();
        if (response.events_size() > 0) {
          next_ = response.events(response.events_size() - 1).kv().mod_revision() + 1;
        }
        if (response.events_size() > 0 || response.compact_revision() > 0) Signal();
        if (response.canceled()) break;
      }
    }
    context->TryCancel();
    const grpc::Status status = stream->Finish();
    if (status.error_code() != grpc::StatusCode::CANCELLED) client_.StreamLost(member);
  }

  void Signal() {
    std::lock_guard<std::mutex> lock(mu_);
    seen_ = true;
    changed_.notify_all();
  }

  EtcdClient& client_;
  std::string key_;
  std::int64_t next_;
  std::mutex mu_;
  std::condition_variable changed_;
  bool seen_ = false;
  bool stopping_ = false;
  std::shared_ptr<grpc::ClientContext> context_;
  std::thread thread_;
};

class EtcdStore final : public Backend {
 public:
  explicit EtcdStore(const EtcdStoreOptions& options)
      : client_(options), keys_(options.prefix), legacyKeys_(Keys::Legacy(options.prefix)) {}

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
    return Reading([&]() -> std::shared_ptr<ConfigStoreObject> {
      std::vector<Entry> entries;
      Replies replies;
      const Pointers pointers = ReadCollection(collection, &id.InstanceId(), &replies, &entries);
      const Current* current = Find(pointers, collection);
      Observe(collection, current ? *current : Current());
      if (entries.empty()) return nullptr;
      return Decode(id, entries.front());
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
      const Pointers pointers =
          exact.empty() ? Reading([&] { return VisiblePointers(std::string()); }) : Pointers();
      std::set<std::string> names = Matching(filter, pointers);
      if (!exact.empty()) names.insert(exact);
      for (const std::string& name : names) {
        Pending& pending = txn_.collections[name];
        if (want.InstanceId().empty()) {
          pending.cleared = true;
          pending.deleted.clear();
          pending.puts.clear();
        } else {
          pending.deleted.insert(want.InstanceId());
          pending.puts.erase(want.InstanceId());
        }
      }
    });
  }

  std::vector<std::shared_ptr<ConfigStoreObject>> List(const FilterSpecObject& filter) override {
    std::lock_guard<std::mutex> lock(mu_);
    return Reading([&] { return Listing(filter); });
  }

  void BeginTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (depth_ > 0) saved_.push_back(txn_);
    ++depth_;
  }

  void CommitTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (depth_ == 0) {
      throw ConfigStoreException(client_.Where() + ": no transaction to commit",
                                 kErrorNoTransaction);
    }
    if (depth_ > 1) {
      saved_.pop_back();
      --depth_;
      return;
    }
    // A failed commit leaves the transaction open, for the caller to abort.
    Reaching([&] { Apply(); });
    Reset();
  }

  void AbortTransaction() override {
    std::lock_guard<std::mutex> lock(mu_);
    if (depth_ == 0) return;
    if (depth_ > 1) {
      txn_ = std::move(saved_.back());
      saved_.pop_back();
      --depth_;
      return;
    }
    Reset();
  }

  bool WaitForChange(int timeoutMs) override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (!feed_) {
        // Changes after this revision count: anything before it the caller
        // has read already.
        const Pointers now = ReadPointers(std::string());
        feed_ = std::make_unique<ChangeFeed>(client_, keys_.Pointers(), now.revision + 1);
      }
    }
    return feed_->Wait(timeoutMs);
  }

 private:
  // ---- Reading ------------------------------------------------------------

  // Runs a read again when etcd compacted away the revision it was reading
  // at between its requests.
  template <typename Read>
  auto Reading(const Read& read) -> decltype(read()) {
    return Reaching([&] {
      for (int attempt = 1;; ++attempt) {
        try {
          return read();
        } catch (const ConfigStoreException& e) {
          if (e.Code() != kCompactedCode || attempt == 3) throw;
        }
      }
    });
  }

  // A transaction that found no member answering fails its later requests
  // at once with that error: each would wait out the timeout again, and it
  // cannot commit without the cluster. So a caller that goes on after a
  // failure (a reset clearing one collection after another) still ends
  // within about one timeout.
  //
  // The requests of one call share one wait (EtcdClient::Call): a member
  // that did not answer one of them costs the call its wait once.
  template <typename Call>
  auto Reaching(const Call& call) -> decltype(call()) {
    if (depth_ > 0 && unreachable_) throw ConfigStoreException(*unreachable_);
    const EtcdClient::Call counted(client_);
    try {
      return call();
    } catch (const ConfigStoreException& e) {
      if (depth_ > 0 && (e.Code() == kDeadlineCode || e.Code() == kUnavailableCode)) {
        unreachable_ = e;
      }
      throw;
    }
  }

  // The collection a filter names exactly, or "" when it leaves a part open.
  static std::string ExactCollection(const ConfigStoreObjectId& id) {
    if (id.Key().empty() || id.Group().empty() || id.Component().empty()) return std::string();
    return etcdlayout::CollectionOf(id);
  }

  static bool CollectionMatches(const FilterSpecObject& filter, const std::string& name) {
    ConfigStoreObjectId id("", "", "");
    if (!etcdlayout::ParseCollection(name, &id)) return false;
    id.SetInstanceId(filter.Id().InstanceId());
    return filter.Matches(id);
  }

  // The pointer of "collection", or of every collection when it is "", as
  // the cluster has them now under the store's own root.
  Pointers ReadPointers(const std::string& collection) {
    etcdwire::Reply reply;
    client_.Read(PointersRequest(keys_, collection), &reply);
    return PointersOf(keys_, reply.ranges[0], reply.revision);
  }

  // The same for a reader: the catalogue an earlier version wrote, while no
  // write has moved it under the store's own root yet.
  Pointers VisiblePointers(const std::string& collection) {
    std::optional<Pointers> legacy = LegacyPointers();
    if (!legacy) return ReadPointers(collection);
    if (!collection.empty()) {
      for (auto it = legacy->byCollection.begin(); it != legacy->byCollection.end();) {
        it = it->first == collection ? std::next(it) : legacy->byCollection.erase(it);
      }
    }
    return std::move(*legacy);
  }

  // The catalogue at the root earlier versions used, when there is one and
  // nothing is under the store's own root yet. Asked once a store while
  // there is none; while there is, at every read, as any write moves it.
  std::optional<Pointers> LegacyPointers() {
    if (layout_ == Layout::kCurrent) return std::nullopt;
    TxnRequest txn;
    RangeRequest* own = txn.add_success()->mutable_request_range();
    *own = PointersRequest(keys_, std::string());
    own->set_keys_only(true);
    own->set_limit(1);
    *txn.add_success()->mutable_request_range() = PointersRequest(legacyKeys_, std::string());
    etcdwire::Reply reply;
    try {
      client_.Read(txn, &reply);
    } catch (const ConfigStoreException& e) {
      // A role granted on the store's own root alone: whatever lies at the
      // old root is not this user's catalogue.
      if (e.Code() != kDeniedCode) throw;
      layout_ = Layout::kCurrent;
      return std::nullopt;
    }
    if (reply.ranges.size() != 2) {
      client_.Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unexpected reply"), "read");
    }
    Pointers legacy = PointersOf(legacyKeys_, reply.ranges[1], reply.revision);
    // The old root may hold other stores' keys (those of "m/p/x" lie under
    // "m"'s "p/"): only a collection's name with a generation's id is a
    // pointer.
    for (auto it = legacy.byCollection.begin(); it != legacy.byCollection.end();) {
      ConfigStoreObjectId id("", "", "");
      const bool pointer =
          etcdlayout::ParseCollection(it->first, &id) && etcdlayout::IsGenerationId(it->second.gen);
      it = pointer ? std::next(it) : legacy.byCollection.erase(it);
    }
    if (!reply.ranges[0].kvs.empty() || legacy.byCollection.empty()) {
      layout_ = Layout::kCurrent;
      return std::nullopt;
    }
    layout_ = Layout::kLegacy;
    return legacy;
  }

  static RangeRequest PointersRequest(const Keys& keys, const std::string& collection) {
    RangeRequest request;
    if (collection.empty()) {
      request.set_key(keys.Pointers());
      request.set_range_end(PrefixEnd(keys.Pointers()));
    } else {
      request.set_key(keys.Pointer(collection));
    }
    return request;
  }

  static Pointers PointersOf(const Keys& keys, const etcdwire::Range& range,
                             std::int64_t revision) {
    Pointers pointers;
    pointers.revision = revision;
    pointers.keys = &keys;
    for (const etcdwire::KeyValue& kv : range.kvs) {
      Current current;
      current.gen = GenerationOf(kv.value);
      current.token = TokenOf(kv.value);
      current.version = kv.modRevision;
      pointers.byCollection.emplace(kv.key.substr(keys.Pointers().size()), std::move(current));
    }
    return pointers;
  }

  // The pointer of one collection and, when it has one, the objects of its
  // generation (or its one object "instance"), at one revision. The
  // generation the collection pointed at last time is asked for with the
  // pointer, in one request; a second is needed only when a commit has
  // moved the pointer since.
  //
  // A whole generation listed before is asked for in two halves at once,
  // split at an object's key remembered from then: etcd reads and sends
  // the two side by side. Two replies of the same revision are one snapshot;
  // otherwise the generation is read again at the first one's.
  Pointers ReadCollection(const std::string& collection, const std::string* instance,
                          Replies* replies, std::vector<Entry>* entries) {
    Pointers pointers;
    auto last = lastGen_.find(collection);
    if (layout_ != Layout::kCurrent) {
      pointers = VisiblePointers(collection);
      if (pointers.keys == &legacyKeys_) {
        if (const Current* current = Find(pointers, collection)) {
          ReadGeneration(legacyKeys_, current->gen, instance, pointers.revision, &replies->first,
                         entries);
        }
        return pointers;
      }
    } else if (last == lastGen_.end()) {
      pointers = ReadPointers(collection);
    } else {
      const std::string& gen = last->second.gen;
      const std::string* split =
          instance == nullptr && !last->second.split.empty() ? &last->second.split : nullptr;
      TxnRequest txn;
      *txn.add_success()->mutable_request_range() = PointersRequest(keys_, collection);
      RangeRequest* head = txn.add_success()->mutable_request_range();
      *head = GenerationRequest(keys_, gen, instance);
      std::future<void> rest;
      if (split) {
        RangeRequest tail = *head;
        tail.set_key(*split);
        head->set_range_end(*split);
        rest = std::async(std::launch::async, [this, tail = std::move(tail), replies] {
          client_.Read(tail, &replies->second);
        });
      }
      client_.Read(txn, &replies->first);
      if (rest.valid()) rest.get();
      const etcdwire::Reply& reply = replies->first;
      if (reply.ranges.size() != 2) {
        client_.Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unexpected reply"), "read");
      }
      pointers = PointersOf(keys_, reply.ranges[0], reply.revision);
      const Current* current = Find(pointers, collection);
      if (current && current->gen == gen &&
          (!split || replies->second.revision == reply.revision)) {
        std::vector<const etcdwire::Range*> ranges{&reply.ranges[1]};
        if (split) ranges.push_back(&replies->second.ranges[0]);
        ParseGeneration(keys_, gen, ranges, entries);
        if (!instance) RememberSplit(collection, *entries);
        return pointers;
      }
    }
    const Current* current = Find(pointers, collection);
    if (!current) {
      lastGen_.erase(collection);
    } else {
      LastRead& remembered = lastGen_[collection];
      if (remembered.gen != current->gen) remembered = LastRead{current->gen, std::string()};
      ReadGeneration(keys_, current->gen, instance, pointers.revision, &replies->first, entries);
      if (!instance) RememberSplit(collection, *entries);
    }
    return pointers;
  }

  // The key of the object half-way through a listing of the collection's
  // current generation; none for a small one, where a second request would
  // cost more than it saves.
  void RememberSplit(const std::string& collection, const std::vector<Entry>& entries) {
    LastRead& last = lastGen_[collection];
    last.split = entries.size() < kSplitObjects
                     ? std::string()
                     : keys_.Object(last.gen, entries[entries.size() / 2].instance);
  }

  static RangeRequest GenerationRequest(const Keys& keys, const std::string& gen,
                                        const std::string* instance) {
    RangeRequest request;
    request.set_key(instance ? keys.Object(gen, *instance) : keys.Generation(gen));
    request.set_range_end(PrefixEnd(request.key()));
    return request;
  }

  // The objects of a generation (or its one object "instance") at
  // "revision", in the order the cluster keeps the keys. Their bytes stay
  // in "*reply".
  void ReadGeneration(const Keys& keys, const std::string& gen, const std::string* instance,
                      std::int64_t revision, etcdwire::Reply* reply, std::vector<Entry>* entries) {
    RangeRequest request = GenerationRequest(keys, gen, instance);
    request.set_revision(revision);
    client_.Read(request, reply);
    ParseGeneration(keys, gen, {&reply->ranges[0]}, entries);
  }

  // The objects in "ranges", consecutive ranges of one generation's keys
  // that split it between objects.
  static void ParseGeneration(const Keys& keys, const std::string& gen,
                              const std::vector<const etcdwire::Range*>& ranges,
                              std::vector<Entry>* entries) {
    std::int64_t headRevision = 0;
    for (const etcdwire::Range* range : ranges) {
      ParseRange(keys, gen, *range, entries, &headRevision);
    }
    for (Entry& entry : *entries) {
      if (entry.order.revision == -1) entry.order.revision = headRevision;
    }
  }

  static void ParseRange(const Keys& keys, const std::string& gen, const etcdwire::Range& range,
                         std::vector<Entry>* entries, std::int64_t* headRevision) {
    const std::string base = keys.Generation(gen);
    // Keys are compared as views against a suffix made once: a string built
    // per key cost a listing more than half the instructions of receiving it.
    const std::string firstPart = Keys::PartSuffix(0);
    std::string want;
    const std::vector<etcdwire::KeyValue>& kvs = range.kvs;
    for (std::size_t i = 0; i < kvs.size(); ++i) {
      std::string_view key(kvs[i].key);
      key.remove_prefix(base.size());
      if (key.empty()) {
        *headRevision = kvs[i].createRevision;
        continue;
      }
      const std::size_t zero = key.find('\0');
      Entry entry;
      Header header;
      std::string_view value(kvs[i].value);
      if (zero == std::string_view::npos) continue;  // not an object's key
      const std::string_view escaped = key.substr(0, zero);
      if (escaped.find('\1') == std::string_view::npos) {
        entry.instance.assign(escaped);  // nothing escaped
      } else if (!etcdlayout::Unescape(escaped, &entry.instance)) {
        continue;  // not an object's key: nothing of ours to report
      }
      if (key.substr(zero + 1) != firstPart) {
        entry.damage = "a part of an object without its first part";
      } else if (!etcdlayout::ReadHeader(&value, &header)) {
        entry.damage = "unreadable object header";
      } else {
        entry.body = value;
        if (header.parts > 1) entry.joined.assign(value);
        for (std::uint64_t part = 1; part < header.parts && entry.damage.empty(); ++part) {
          want.assign(key.substr(0, zero + 1)).append(Keys::PartSuffix(part));
          if (i + 1 < kvs.size() && kvs[i + 1].key.substr(base.size()) == want) {
            entry.joined += kvs[++i].value;
          } else {
            entry.damage = "part " + std::to_string(part) + " of the object is missing";
          }
        }
        if (header.parts > 1) entry.body = entry.joined;
        entry.order.index = header.index;
        entry.order.revision = header.kind == OrderKind::kWritten       ? header.revision
                               : header.kind == OrderKind::kOwnRevision ? kvs[i].modRevision
                                                                        : -1;  // set below
      }
      // Parts past the ones the header announced belong to nothing.
      while (i + 1 < kvs.size() &&
             kvs[i + 1].key.substr(base.size(), zero + 1) == key.substr(0, zero + 1)) {
        ++i;
      }
      entries->push_back(std::move(entry));
    }
  }

  std::shared_ptr<ConfigStoreObject> Decode(const ConfigStoreObjectId& collection,
                                            const Entry& entry,
                                            objectmodel::Arena* arena = nullptr) {
    ConfigStoreObjectId id(collection.Key(), collection.Group(), collection.Component());
    id.SetInstanceId(entry.instance);
    if (!entry.damage.empty()) {
      return std::make_shared<DamagedObject>(
          std::move(id),
          ConfigStoreException(client_.Where() + ": " + entry.damage, kErrorCorruptObject));
    }
    return objectmodel::DecodeOrDamaged(std::move(id), entry.body, arena, client_.Where());
  }

  static std::shared_ptr<ConfigStoreObject> DecodePut(const ConfigStoreObjectId& id,
                                                      const Put& put) {
    return objectmodel::DecodeObject(id, put.body, nullptr);
  }

  // What the open transaction did to a collection, if anything.
  const Pending* PendingOf(const std::string& collection) const {
    if (depth_ == 0) return nullptr;
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
    if (depth_ > 0) {
      for (const auto& entry : txn_.collections) {
        if (CollectionMatches(filter, entry.first)) names.insert(entry.first);
      }
    }
    return names;
  }

  void Observe(const std::string& collection, const Current& current) {
    if (depth_ > 0) observed_.emplace(collection, current.version);
  }

  std::vector<std::shared_ptr<ConfigStoreObject>> Listing(const FilterSpecObject& filter) {
    const ConfigStoreObjectId& want = filter.Id();
    const std::string* instance = want.InstanceId().empty() ? nullptr : &want.InstanceId();
    const std::string exact = ExactCollection(want);
    Replies replies;
    std::vector<Entry> entries;
    const Pointers pointers = exact.empty() ? VisiblePointers(exact)
                                            : ReadCollection(exact, instance, &replies, &entries);

    struct Listed {
      Order order;
      std::shared_ptr<ConfigStoreObject> object;
    };
    std::vector<Listed> listed;
    objectmodel::Arena arena;
    for (const std::string& name : Matching(filter, pointers)) {
      ConfigStoreObjectId collection("", "", "");
      etcdlayout::ParseCollection(name, &collection);
      const Current* current = Find(pointers, name);
      Observe(name, current ? *current : Current());
      const Pending* pending = PendingOf(name);
      if (current && !(pending && pending->cleared)) {
        if (name != exact) {
          entries.clear();
          ReadGeneration(*pointers.keys, current->gen, instance, pointers.revision, &replies.first,
                         &entries);
        }
        for (const Entry& entry : entries) {
          if (pending &&
              (pending->deleted.count(entry.instance) || pending->puts.count(entry.instance))) {
            continue;
          }
          listed.push_back({entry.order, Decode(collection, entry, &arena)});
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
    std::stable_sort(listed.begin(), listed.end(),
                     [](const Listed& a, const Listed& b) { return a.order < b.order; });
    std::vector<std::shared_ptr<ConfigStoreObject>> out;
    out.reserve(listed.size());
    for (Listed& l : listed) out.push_back(std::move(l.object));
    return out;
  }

  // ---- Transactions -------------------------------------------------------

  template <typename Change>
  void InTransaction(const Change& change) {
    if (depth_ > 0) {
      change();
      return;
    }
    depth_ = 1;
    const EtcdClient::Call counted(client_);
    try {
      change();
      Apply();
    } catch (...) {
      Reset();
      throw;
    }
    Reset();
  }

  void Reset() {
    depth_ = 0;
    txn_ = TxnState();
    saved_.clear();
    observed_.clear();
    unreachable_.reset();
  }

  [[noreturn]] void Conflict(const std::string& collection) const {
    ConfigStoreObjectId id("", "", "");
    etcdlayout::ParseCollection(collection, &id);
    throw ConfigStoreException(client_.Where() + ": another writer changed the collection \"" +
                                   id.Key() + "\" since this transaction read it",
                               kErrorConflict);
  }

  void Apply() {
    std::vector<std::string> pendingNames;
    for (const auto& [name, pending] : txn_.collections) {
      if (pending.Touched()) pendingNames.push_back(name);
    }
    if (pendingNames.empty()) return;
    for (int attempt = 1;; ++attempt) {
      // A catalogue an earlier version wrote moves under the store's own
      // root with the first write, every collection of it in this commit's
      // switch.
      const std::optional<Pointers> legacy = LegacyPointers();
      Pointers now = ReadCommitState();
      const Pointers& base = legacy ? *legacy : now;
      bool readAny = false;
      std::vector<std::string> touched;
      for (const std::string& name : pendingNames) {
        const Current* current = Find(base, name);
        auto seen = observed_.find(name);
        if (seen != observed_.end()) {
          readAny = true;
          if (seen->second != (current ? current->version : 0)) Conflict(name);
        }
        // Clearing or deleting from a collection that does not exist
        // changes nothing.
        if (current || !txn_.collections.at(name).puts.empty()) touched.push_back(name);
      }
      if (touched.empty()) return;
      if (legacy) {
        for (const auto& entry : legacy->byCollection) touched.push_back(entry.first);
        std::sort(touched.begin(), touched.end());
        touched.erase(std::unique(touched.begin(), touched.end()), touched.end());
      }
      const std::string token = NewId();
      if (!legacy && FitsInPlace(touched, now)
              ? CommitInPlace(touched, now, token)
              : CommitGenerations(touched, base, token, now.orphans)) {
        return;
      }
      // Another writer got in between: only a transaction that read none of
      // what it writes can simply be applied to what is there now.
      if (readAny || attempt == kCommitAttempts) Conflict(touched.front());
    }
  }

  bool FitsInPlace(const std::vector<std::string>& touched, const Pointers& now) const {
    std::size_t ops = 0;
    std::size_t bytes = 0;
    for (const std::string& name : touched) {
      const Pending& pending = txn_.collections.at(name);
      const bool exists = Find(now, name) != nullptr;
      if (pending.cleared && exists) return false;
      ops += 2 + (exists ? 0 : 2) + pending.deleted.size() + pending.puts.size() * 2;
      for (const auto& [key, put] : pending.puts) {
        if (put.body.size() > etcdlayout::kPartBytes) return false;
        bytes += put.body.size() + 2 * key.size() + 128;
      }
    }
    return ops <= static_cast<std::size_t>(etcdlayout::kBatchOps) &&
           bytes <= etcdlayout::kBatchBytes;
  }

  static std::vector<const std::pair<const std::string, Put>*> InWriteOrder(
      const Pending& pending) {
    std::vector<const std::pair<const std::string, Put>*> puts;
    for (const auto& entry : pending.puts) puts.push_back(&entry);
    std::sort(puts.begin(), puts.end(),
              [](const auto* a, const auto* b) { return a->second.seq < b->second.seq; });
    return puts;
  }

  static std::string FirstPart(const Header& header, std::string_view body) {
    std::string value;
    value.reserve(body.size() + 24);
    etcdlayout::AppendHeader(header, &value);
    value.append(body);
    return value;
  }

  bool CommitInPlace(const std::vector<std::string>& touched, const Pointers& now,
                     const std::string& token) {
    TxnRequest txn;
    std::vector<RequestOp> ops;
    for (const std::string& name : touched) {
      const Pending& pending = txn_.collections.at(name);
      const Current* current = Find(now, name);
      AddCompareVersion(&txn, keys_.Pointer(name), current ? *current : Current());
      const std::string gen = current ? current->gen : NewId();
      AddPut(&ops, keys_.Pointer(name), PointerValue(gen, token));
      if (!current) {
        AddPut(&ops, keys_.Generation(gen), name);
        AddPut(&ops, keys_.Registered() + gen, name);
      }
      for (const std::string& instance : pending.deleted) {
        if (current && !pending.puts.count(instance))
          AddDeletePrefix(&ops, keys_.Object(gen, instance));
      }
      for (const auto* put : InWriteOrder(pending)) {
        const std::string object = keys_.Object(gen, put->first);
        Header header;
        header.kind = OrderKind::kOwnRevision;
        header.index = put->second.seq;
        AddPut(&ops, object + Keys::PartSuffix(0), FirstPart(header, put->second.body));
        // Later parts of a larger object this one replaces.
        if (current) AddDelete(&ops, object + Keys::PartSuffix(1), PrefixEnd(object));
      }
    }
    for (RequestOp& op : ops) *txn.add_success() = std::move(op);
    return Switch(txn, touched.front(), token);
  }

  // Sends the transaction that makes a commit visible and tells whether it
  // took effect. When the reply is lost, or a resent request finds its own
  // first attempt has changed the versions it compares, the pointer of a
  // collection it writes ("witness", "" when it writes none) holds this
  // commit's token exactly when it did.
  bool Switch(const TxnRequest& txn, const std::string& witness, const std::string& token,
              std::int64_t lease = 0) {
    try {
      return client_.Txn(txn, true).succeeded() || Holds(witness, token);
    } catch (const ConfigStoreException&) {
      bool committed = false;
      try {
        // The call has waited its time for the switch; telling its outcome
        // may take a little more.
        client_.AllowSettling();
        // A switch compares on its writer's key: once the lease that key
        // lives on is revoked, a request still on its way can no longer be
        // applied, and the pointer tells for certain.
        if (lease != 0) client_.LeaseRevoke(lease);
        committed = Holds(witness, token);
      } catch (const ConfigStoreException&) {
        // Unknown either way: report the first failure.
      }
      if (committed) return true;
      throw;
    }
  }

  bool Holds(const std::string& witness, const std::string& token) {
    if (witness.empty()) return false;
    const Pointers now = ReadPointers(witness);
    const Current* current = Find(now, witness);
    return current != nullptr && current->token == token;
  }

  // The writer of generation "gen" is alive: its lease has not run out, and
  // the generation has not been made current.
  void AddWriterAlive(TxnRequest* txn, const std::string& gen) const {
    Compare* alive = txn->add_compare();
    alive->set_key(keys_.Writers() + gen);
    alive->set_target(Compare::VERSION);
    alive->set_result(Compare::GREATER);
    alive->set_version(0);
  }

  void WriteObject(const std::string& gen, const std::string& instance, Header header,
                   std::string_view body, BatchWriter* batches) {
    const std::string object = keys_.Object(gen, instance);
    header.parts = std::max<std::size_t>(
        1, (body.size() + etcdlayout::kPartBytes - 1) / etcdlayout::kPartBytes);
    for (std::size_t part = 0; part < header.parts; ++part) {
      const std::string_view piece =
          body.substr(part * etcdlayout::kPartBytes, etcdlayout::kPartBytes);
      batches->Put(object + Keys::PartSuffix(part),
                   part == 0 ? FirstPart(header, piece) : std::string(piece),
                   piece.size() + object.size() + 32);
    }
  }

  // What the open transaction did to "collection"; nothing when it left it
  // alone (a collection an upgrade carries over).
  const Pending& PendingFor(const std::string& collection) const {
    static const Pending kUntouched;
    auto it = txn_.collections.find(collection);
    return it == txn_.collections.end() ? kUntouched : it->second;
  }

  // "base" holds the collections as they are now: under the store's own
  // root, or under the old one when this commit moves them (then "touched"
  // holds every one of them).
  bool CommitGenerations(const std::vector<std::string>& touched, const Pointers& base,
                         const std::string& token, const std::vector<std::string>& orphans) {
    const bool upgrade = base.keys != &keys_;
    const std::int64_t lease = TakeLease();
    std::map<std::string, std::string> fresh;  // collection -> its new generation
    // The registrations go with the first batch of objects, in one
    // transaction: a generation never has objects without being registered,
    // so a later writer finds whatever a dead one left.
    for (const std::string& name : touched) fresh[name] = NewId();
    // Removes the new generations, unless a switch sent earlier took effect
    // after all (a request may be applied after its sender gave up on it).
    // The switch removes the writer keys, so it is compared on them; false
    // when they are gone.
    auto abandon = [&] {
      TxnRequest undo;
      std::vector<RequestOp> deletes;
      for (const auto& [name, gen] : fresh) {
        AddWriterAlive(&undo, gen);
        AddDeletePrefix(&deletes, keys_.Generation(gen));
        AddDelete(&deletes, keys_.Registered() + gen);
        AddDelete(&deletes, keys_.Writers() + gen);
      }
      for (RequestOp& op : deletes) *undo.add_success() = std::move(op);
      try {
        const bool removed = client_.Txn(undo, true).succeeded();
        client_.LeaseRevoke(lease);
        return removed;
      } catch (const ConfigStoreException&) {
        // The lease runs out and a later writer removes what is left.
        return true;
      }
    };

    std::map<std::string, bool> empty;
    try {
      // Left before "abandon" runs, so that no batch is still on its way.
      BatchWriter batches(client_);
      for (const auto& [name, gen] : fresh) {
        const std::size_t size = keys_.Writers().size() + gen.size() + name.size() + 32;
        batches.Put(keys_.Writers() + gen, name, size, lease);
        batches.Put(keys_.Registered() + gen, name, size);
      }
      auto lastKeepAlive = leaseRenewed_;
      for (const std::string& name : touched) {
        const Pending& pending = PendingFor(name);
        const Current* current = Find(base, name);
        const std::string& gen = fresh[name];
        std::size_t written = 0;
        if (current && !pending.cleared) {
          etcdwire::Reply reply;
          std::vector<Entry> entries;
          ReadGeneration(*base.keys, current->gen, nullptr, base.revision, &reply, &entries);
          for (const Entry& entry : entries) {
            if (pending.deleted.count(entry.instance) || pending.puts.count(entry.instance))
              continue;
            if (!entry.damage.empty()) continue;  // unreadable: nothing to carry over
            Header header;
            header.kind = OrderKind::kWritten;
            header.revision = entry.order.revision;
            header.index = entry.order.index;
            WriteObject(gen, entry.instance, header, entry.body, &batches);
            ++written;
          }
        }
        for (const auto* put : InWriteOrder(pending)) {
          Header header;
          header.kind = OrderKind::kHeadRevision;
          header.index = put->second.seq;
          WriteObject(gen, put->first, header, put->second.body, &batches);
          ++written;
          if (std::chrono::steady_clock::now() - lastKeepAlive >
              std::chrono::seconds(kLeaseSeconds / 4)) {
            client_.LeaseKeepAlive(lease);
            lastKeepAlive = std::chrono::steady_clock::now();
          }
        }
        empty[name] = written == 0;
      }
      batches.Finish();
    } catch (...) {
      abandon();
      throw;
    }

    TxnRequest txn;
    std::vector<RequestOp> ops;
    std::string anyWritten;
    for (const std::string& name : touched) {
      const Current* current = Find(base, name);
      const std::string& gen = fresh[name];
      AddCompareVersion(&txn, base.keys->Pointer(name), current ? *current : Current());
      if (upgrade) AddCompareVersion(&txn, keys_.Pointer(name), Current());
      AddWriterAlive(&txn, gen);
      if (empty[name]) {
        AddDelete(&ops, keys_.Pointer(name));
        AddDeletePrefix(&ops, keys_.Generation(gen));
        AddDelete(&ops, keys_.Registered() + gen);
      } else {
        AddPut(&ops, keys_.Pointer(name), PointerValue(gen, token));
        AddPut(&ops, keys_.Generation(gen), name);
        anyWritten = name;
      }
      if (upgrade) {
        // Its generations go after the switch, key by key (RemoveLegacy).
        AddDelete(&ops, base.keys->Pointer(name));
      } else if (current) {
        AddDeletePrefix(&ops, keys_.Generation(current->gen));
        AddDelete(&ops, keys_.Registered() + current->gen);
      }
      AddDelete(&ops, keys_.Writers() + gen);
    }
    for (RequestOp& op : ops) *txn.add_success() = std::move(op);
    ops.clear();
    if (!Switch(txn, anyWritten, token, lease)) {
      return !abandon() && Holds(anyWritten, token);
    }
    // The switch removed this commit's writer keys: the lease holds nothing
    // now and serves the next commit.
    lease_ = lease;
    if (upgrade) layout_ = Layout::kCurrent;
    try {
      RemoveOrphans(orphans);
      if (upgrade) RemoveLegacy(base);
    } catch (const ConfigStoreException&) {
      // Tidying only: the commit stands, and a later writer tidies up.
    }
    return true;
  }

  // The lease for a commit's writer keys. The one the last commit used is
  // renewed rather than a new one granted: a grant and a revocation are each
  // a write etcd syncs to disk, a renewal is not. A commit hands the lease
  // back only once its switch has removed its writer keys; one that failed
  // keeps it (and revokes it or lets it run out), as a writer key still on a
  // lease that goes on being renewed would keep its generation from ever
  // being tidied.
  std::int64_t TakeLease() {
    const std::int64_t kept = std::exchange(lease_, 0);
    const auto now = std::chrono::steady_clock::now();
    if (kept != 0) {
      try {
        client_.LeaseKeepAlive(kept);
        leaseRenewed_ = now;
        return kept;
      } catch (const ConfigStoreException& e) {
        // Run out or revoked: a new one. Anything else is the cluster's.
        if (e.Code() != kLeaseGoneCode) throw;
      }
    }
    const std::int64_t lease = client_.LeaseGrant(kLeaseSeconds);
    leaseRenewed_ = now;
    return lease;
  }

  // The pointers, and the generations a dead writer left, in one read.
  Pointers ReadCommitState() {
    TxnRequest snapshot;
    *snapshot.add_success()->mutable_request_range() = PointersRequest(keys_, std::string());
    for (const std::string& prefix : {keys_.Registered(), keys_.Writers()}) {
      RangeRequest* range = snapshot.add_success()->mutable_request_range();
      range->set_key(prefix);
      range->set_range_end(PrefixEnd(prefix));
      range->set_keys_only(true);
    }
    etcdwire::Reply reply;
    client_.Read(snapshot, &reply);
    if (reply.ranges.size() != 3) {
      client_.Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unexpected reply"), "read");
    }
    Pointers now = PointersOf(keys_, reply.ranges[0], reply.revision);
    std::set<std::string> live;
    for (const etcdwire::KeyValue& kv : reply.ranges[2].kvs) {
      live.insert(std::string(kv.key.substr(keys_.Writers().size())));
    }
    for (const auto& [name, current] : now.byCollection) live.insert(current.gen);
    for (const etcdwire::KeyValue& kv : reply.ranges[1].kvs) {
      std::string gen(kv.key.substr(keys_.Registered().size()));
      if (!live.count(gen)) now.orphans.push_back(std::move(gen));
    }
    return now;
  }

  // Deletes the generations of a catalogue an upgrade moved, which nothing
  // points at any more. Only keys of the old layout's shapes go: the head,
  // each object's parts and the registration. A store whose prefix lies
  // inside the old root (one at "m/g/<gen>" beside "m") keeps all of its
  // keys: after their \0 comes "p/", "g/", "r/" or "w/", never a part's
  // four hexadecimal digits alone.
  void RemoveLegacy(const Pointers& moved) {
    std::vector<RequestOp> ops;
    auto flush = [&](std::size_t limit) {
      if (ops.size() >= limit) client_.Txn(TxnOf(&ops), true);
    };
    for (const auto& [name, current] : moved.byCollection) {
      const std::string head = moved.keys->Generation(current.gen);
      RangeRequest request;
      request.set_key(head);
      request.set_range_end(PrefixEnd(head));
      request.set_keys_only(true);
      etcdwire::Reply reply;
      client_.Read(request, &reply);
      for (const etcdwire::KeyValue& kv : reply.ranges[0].kvs) {
        const std::string_view rest = std::string_view(kv.key).substr(head.size());
        const std::size_t zero = rest.find('\0');
        const bool object =
            zero != std::string_view::npos && rest.size() == zero + 5 &&
            rest.find_first_not_of("0123456789abcdef", zero + 1) == std::string_view::npos;
        if (!rest.empty() && !object) continue;
        AddDelete(&ops, std::string(kv.key));
        flush(etcdlayout::kBatchOps);
      }
      AddDelete(&ops, moved.keys->Registered() + current.gen);
      flush(etcdlayout::kBatchOps);
    }
    flush(1);
  }

  void RemoveOrphans(const std::vector<std::string>& orphans) {
    std::vector<RequestOp> ops;
    for (const std::string& gen : orphans) {
      AddDeletePrefix(&ops, keys_.Generation(gen));
      AddDelete(&ops, keys_.Registered() + gen);
      if (ops.size() >= static_cast<std::size_t>(etcdlayout::kBatchOps))
        client_.Txn(TxnOf(&ops), true);
    }
    if (!ops.empty()) client_.Txn(TxnOf(&ops), true);
  }

  std::mutex mu_;
  EtcdClient client_;
  Keys keys_;
  Keys legacyKeys_;
  // Whether the old root may still hold this store's catalogue
  // (LegacyPointers).
  enum class Layout { kUnknown, kLegacy, kCurrent } layout_ = Layout::kUnknown;
  int depth_ = 0;
  TxnState txn_;
  std::vector<TxnState> saved_;  // the state at each inner Begin
  // Collections this transaction read, with the version it saw (0: none).
  std::map<std::string, std::int64_t> observed_;
  // The generation each collection read pointed at then, and where to split
  // a listing of it (ReadCollection).
  struct LastRead {
    std::string gen;
    std::string split;
  };
  std::map<std::string, LastRead> lastGen_;
  std::unique_ptr<ChangeFeed> feed_;
  // The lease of this store's last successful commit (0: none), left to run
  // out when the store goes, and when it was last renewed.
  std::int64_t lease_ = 0;
  std::chrono::steady_clock::time_point leaseRenewed_;
  std::optional<ConfigStoreException> unreachable_;  // met by the open transaction
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
