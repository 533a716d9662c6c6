#include "EtcdReader.h"

#include <future>
#include <set>
#include <tuple>
#include <utility>

#include "../object/DamagedObject.h"
#include "../object/Objects.h"

namespace TavoConfigStore {
namespace {

using etcdlayout::Header;
using etcdlayout::Keys;
using etcdlayout::OrderKind;
using etcdserverpb::RangeRequest;

// A listing of at least this many objects is read in two halves at once.
constexpr std::size_t kSplitObjects = 256;

RangeRequest* AddRange(etcdserverpb::TxnRequest* txn, const std::string& key, bool prefix) {
  RangeRequest* range = txn->add_success()->mutable_request_range();
  range->set_key(key);
  if (prefix) range->set_range_end(etcdlayout::PrefixEnd(key));
  return range;
}

RangeRequest GenerationRequest(const Keys& keys, const std::string& gen,
                               const std::string* instance) {
  RangeRequest request;
  request.set_key(instance ? keys.Object(gen, *instance) : keys.Generation(gen));
  request.set_range_end(etcdlayout::PrefixEnd(request.key()));
  return request;
}

Pointers PointersOf(const Keys& keys, const etcdwire::Range& range, std::int64_t revision) {
  Pointers pointers;
  pointers.revision = revision;
  pointers.keys = &keys;
  const std::string area = keys.Pointers();
  for (const etcdwire::KeyValue& kv : range.kvs) {
    Current current;
    std::tie(current.gen, current.token) = etcdlayout::ParsePointer(kv.value);
    current.value.assign(kv.value);
    current.version = kv.modRevision;
    pointers.byCollection.emplace(Keys::NameIn(area, kv.key), std::move(current));
  }
  return pointers;
}

// The objects in "range", consecutive keys of generation "base"; "*head" is
// set to the create revision of the generation's head when it is among them.
void ParseRange(const std::string& base, const etcdwire::Range& range, std::vector<Entry>* entries,
                std::int64_t* head) {
  const std::vector<etcdwire::KeyValue>& kvs = range.kvs;
  std::string_view stem;
  std::string_view next;
  std::size_t part = 0;
  for (std::size_t i = 0; i < kvs.size(); ++i) {
    // Keys are compared as views: a string built per key cost a listing
    // more than half the instructions of receiving it.
    const std::string_view rest = kvs[i].key.substr(base.size());
    if (rest.empty()) {
      *head = kvs[i].createRevision;
      continue;
    }
    Entry entry;
    if (!etcdlayout::ParseObjectKey(rest, &stem, &part) ||
        !etcdlayout::Unescape(stem.substr(0, stem.size() - 1), &entry.instance)) {
      continue;  // not an object's key: nothing of ours to report
    }
    // The object's keys: those that share its stem. Parts past the ones
    // its header announces belong to nothing.
    std::size_t end = i + 1;
    while (end < kvs.size() && kvs[end].key.substr(base.size(), stem.size()) == stem) ++end;
    std::string_view value = kvs[i].value;
    Header header;
    if (part != 0) {
      entry.damage = "a part of an object without its first part";
    } else if (!etcdlayout::ReadHeader(&value, &header)) {
      entry.damage = "unreadable object header";
    } else {
      entry.body = value;
      for (std::uint64_t p = 1; p < header.parts && entry.damage.empty(); ++p) {
        if (i + p < end &&
            etcdlayout::ParseObjectKey(kvs[i + p].key.substr(base.size()), &next, &part) &&
            part == p) {
          if (p == 1) entry.joined.assign(value);
          entry.joined += kvs[i + p].value;
          entry.body = entry.joined;
        } else {
          entry.damage = "part " + std::to_string(p) + " of the object is missing";
        }
      }
      entry.order.index = header.index;
      entry.order.revision = header.kind == OrderKind::kWritten       ? header.revision
                             : header.kind == OrderKind::kOwnRevision ? kvs[i].modRevision
                                                                      : -1;  // the head's
    }
    i = end - 1;
    entries->push_back(std::move(entry));
  }
}

// The objects in "ranges", consecutive ranges of one generation's keys that
// split it between objects.
void ParseGeneration(const Keys& keys, const std::string& gen,
                     const std::vector<const etcdwire::Range*>& ranges,
                     std::vector<Entry>* entries) {
  std::int64_t head = 0;
  const std::string base = keys.Generation(gen);
  for (const etcdwire::Range* range : ranges) ParseRange(base, *range, entries, &head);
  for (Entry& entry : *entries) {
    if (entry.order.revision == -1) entry.order.revision = head;
  }
}

template <typename Keep>
void KeepOnly(Pointers* pointers, const Keep& keep) {
  auto& all = pointers->byCollection;
  for (auto it = all.begin(); it != all.end();) it = keep(*it) ? std::next(it) : all.erase(it);
}

}  // namespace

std::shared_ptr<ConfigStoreObject> ObjectOf(ConfigStoreObjectId id, const Entry& entry,
                                            const std::shared_ptr<const void>& owner,
                                            objectmodel::Arena* arena, const std::string& where) {
  if (!entry.damage.empty()) {
    return std::make_shared<DamagedObject>(
        std::move(id), ConfigStoreException(where + ": " + entry.damage, kErrorCorruptObject));
  }
  if (owner != nullptr) return objectmodel::ViewOrDamaged(std::move(id), entry.body, owner, where);
  return objectmodel::DecodeOrDamaged(std::move(id), entry.body, arena, where);
}

EtcdReader::EtcdReader(EtcdClient& client, std::string_view prefix,
                       std::shared_ptr<ListingCache> cache)
    : client_(client), cache_(std::move(cache)), keys_(prefix), legacyKeys_(Keys::Legacy(prefix)) {}

Pointers EtcdReader::ReadPointers(const std::string& collection, bool orphans) {
  // While the old root may hold the catalogue, every pointer under both
  // roots: the store's own root holding any means the catalogue was moved.
  const bool legacy = layout_ != Layout::kCurrent;
  etcdserverpb::TxnRequest txn;
  AddRange(&txn, keys_.Pointers() + (legacy ? std::string() : collection),
           legacy || collection.empty());
  if (legacy) AddRange(&txn, legacyKeys_.Pointers(), true);
  if (orphans) {
    AddRange(&txn, keys_.History(), true);
    AddRange(&txn, keys_.Registered(), true)->set_keys_only(true);
    AddRange(&txn, keys_.Writers(), true)->set_keys_only(true);
  }
  etcdwire::Reply reply;
  try {
    client_.Txn(txn, &reply);
  } catch (const ConfigStoreException& e) {
    // A role granted on the store's own root alone: whatever lies at the
    // old root is not this user's catalogue.
    if (!legacy || e.Code() != EtcdCode(grpc::StatusCode::PERMISSION_DENIED)) throw;
    layout_ = Layout::kCurrent;
    return ReadPointers(collection, orphans);
  }
  Pointers pointers = PointersOf(keys_, reply.ranges[0], reply.revision);
  if (orphans) {
    const std::string writers = keys_.Writers();
    const std::string registered = keys_.Registered();
    std::set<std::string_view> live;
    for (const etcdwire::KeyValue& kv : reply.ranges.back().kvs) {
      live.insert(Keys::NameIn(writers, kv.key));
    }
    for (const auto& [name, current] : pointers.byCollection) live.insert(current.gen);
    pointers.history = ParseHistory(keys_, reply.ranges[reply.ranges.size() - 3]);
    for (const auto& [number, kept] : pointers.history.kept) {
      for (const auto& entry : kept.gens) live.insert(entry.second);
    }
    for (const etcdwire::KeyValue& kv : reply.ranges[reply.ranges.size() - 2].kvs) {
      const std::string_view gen = Keys::NameIn(registered, kv.key);
      if (!live.count(gen)) pointers.orphans.emplace_back(gen);
    }
  }
  if (!legacy) return pointers;
  Pointers old = PointersOf(legacyKeys_, reply.ranges[1], reply.revision);
  // The old root may hold other stores' keys (those of "m/p/x" lie under
  // "m"'s "p/"): only a collection's name with a generation's id is a
  // pointer.
  ConfigStoreObjectId id("", "", "");
  KeepOnly(&old, [&](const auto& entry) {
    return etcdlayout::ParseCollection(entry.first, &id) &&
           etcdlayout::IsGenerationId(entry.second.gen);
  });
  const bool moved = !pointers.byCollection.empty() || old.byCollection.empty();
  layout_ = moved ? Layout::kCurrent : Layout::kLegacy;
  if (!moved) {
    old.orphans = std::move(pointers.orphans);
    old.history = std::move(pointers.history);
  }
  Pointers& visible = moved ? pointers : old;
  if (!collection.empty()) {
    KeepOnly(&visible, [&](const auto& entry) { return entry.first == collection; });
  }
  return std::move(visible);
}

Pointers EtcdReader::ReadCollection(const std::string& collection, const std::string* instance,
                                    std::shared_ptr<const Listing>* out) {
  if (instance == nullptr && cache_ && layout_ != Layout::kLegacy) {
    if (std::shared_ptr<const Listing> kept = cache_->Find(collection)) {
      // Only what lies under the store's own root is kept, and a catalogue
      // once there stays there.
      layout_ = Layout::kCurrent;
      return ReadKept(collection, std::move(kept), out);
    }
  }
  auto listing = std::make_shared<Listing>();
  *out = listing;
  Replies* replies = &listing->replies;
  std::vector<Entry>* entries = &listing->entries;
  Pointers pointers;
  auto last = lastRead_.find(collection);
  if (layout_ != Layout::kCurrent || last == lastRead_.end()) {
    pointers = ReadPointers(collection);
  } else {
    const std::string gen = last->second.gen;
    const std::string* split =
        instance == nullptr && !last->second.split.empty() ? &last->second.split : nullptr;
    etcdserverpb::TxnRequest txn;
    AddRange(&txn, keys_.Pointer(collection), false);
    RangeRequest* head = txn.add_success()->mutable_request_range();
    *head = GenerationRequest(keys_, gen, instance);
    std::future<void> rest;
    if (split) {
      RangeRequest tail = *head;
      tail.set_key(*split);
      head->set_range_end(*split);
      rest = std::async(std::launch::async, [this, tail = std::move(tail), replies] {
        client_.Range(tail, &replies->second);
      });
    }
    client_.Txn(txn, &replies->first);
    if (rest.valid()) rest.get();
    const etcdwire::Reply& reply = replies->first;
    pointers = PointersOf(keys_, reply.ranges[0], reply.revision);
    const Current* current = pointers.Find(collection);
    // Two replies of the same revision are one snapshot; otherwise the
    // generation is read again at the first one's.
    if (current && current->gen == gen && (!split || replies->second.revision == reply.revision)) {
      std::vector<const etcdwire::Range*> ranges{&reply.ranges[1]};
      if (split) ranges.push_back(&replies->second.ranges[0]);
      ParseGeneration(keys_, gen, ranges, entries);
      Remember(collection, gen, instance ? nullptr : entries);
      if (!instance) Keep(collection, *current, listing);
      return pointers;
    }
    if (current) {
      // The replies hold another generation's keys, or an older snapshot.
      listing = std::make_shared<Listing>();
      *out = listing;
      replies = &listing->replies;
      entries = &listing->entries;
    }
  }
  const Current* current = pointers.Find(collection);
  if (!current) {
    lastRead_.erase(collection);
    if (cache_ && pointers.keys == &keys_) cache_->Drop(collection);
    return pointers;
  }
  ReadGeneration(*pointers.keys, current->gen, instance, pointers.revision, &replies->first,
                 entries);
  if (pointers.keys == &keys_) {
    Remember(collection, current->gen, instance ? nullptr : entries);
    if (!instance) Keep(collection, *current, listing);
  }
  return pointers;
}

Pointers EtcdReader::ReadKept(const std::string& collection, std::shared_ptr<const Listing> kept,
                              std::shared_ptr<const Listing>* out) {
  // The pointer alone, in the cheapest request etcd answers linearizably: a
  // read-only transaction that compared the pointer and read it cost the
  // members 14-22% more (etcd reads each compare's key as well). Only a
  // changed pointer costs a second request, for its generation.
  RangeRequest request;
  request.set_key(keys_.Pointer(collection));
  auto listing = std::make_shared<Listing>();
  *out = listing;
  client_.Range(request, &listing->replies.first);
  const etcdwire::Reply& reply = listing->replies.first;
  Pointers pointers = PointersOf(keys_, reply.ranges[0], reply.revision);
  const Current* current = pointers.Find(collection);
  if (!current) {
    lastRead_.erase(collection);
    cache_->Drop(collection);
    return pointers;
  }
  // The value too, which holds a random token of the commit: a cluster put
  // up afresh behind the same members may have reached the same revision.
  if (current->version == kept->version && current->value == kept->pointer) {
    *out = std::move(kept);
    return pointers;
  }
  // A commit in place changed the generation, a replace made another
  // current: either is read as the pointer's reply found it.
  listing = std::make_shared<Listing>();
  *out = listing;
  ReadGeneration(keys_, current->gen, nullptr, pointers.revision, &listing->replies.first,
                 &listing->entries);
  Remember(collection, current->gen, &listing->entries);
  Keep(collection, *current, listing);
  return pointers;
}

std::shared_ptr<const Listing> EtcdReader::ReadListing(const Pointers& pointers,
                                                       const std::string& collection,
                                                       const std::string* instance) {
  const Current* current = pointers.Find(collection);
  const bool own = pointers.keys == &keys_;
  if (instance == nullptr && cache_ && own) {
    std::shared_ptr<const Listing> kept = cache_->Find(collection);
    if (kept && kept->version == current->version && kept->pointer == current->value) return kept;
  }
  auto listing = std::make_shared<Listing>();
  ReadGeneration(*pointers.keys, current->gen, instance, pointers.revision, &listing->replies.first,
                 &listing->entries);
  if (instance == nullptr && own) Keep(collection, *current, listing);
  return listing;
}

void EtcdReader::Keep(const std::string& collection, const Current& current,
                      const std::shared_ptr<Listing>& listing) {
  if (!cache_) return;
  // The entries hold what the ranges' views were needed for.
  for (etcdwire::Reply* reply : {&listing->replies.first, &listing->replies.second}) {
    reply->ranges.clear();
    reply->ranges.shrink_to_fit();
  }
  if (!cache_->Fits(listing->Bytes())) {
    cache_->Drop(collection);
    return;
  }
  listing->kept = true;
  listing->gen = current.gen;
  listing->pointer = current.value;
  listing->version = current.version;
  cache_->Keep(collection, listing);
}

void EtcdReader::ReadGeneration(const Keys& keys, const std::string& gen,
                                const std::string* instance, std::int64_t revision,
                                etcdwire::Reply* reply, std::vector<Entry>* entries) {
  RangeRequest request = GenerationRequest(keys, gen, instance);
  request.set_revision(revision);
  client_.Range(request, reply);
  ParseGeneration(keys, gen, {&reply->ranges[0]}, entries);
}

// A listing ("listed") of a large generation is split at the object half-way
// through it; a small one is not, as a second request would cost more than
// it saves.
void EtcdReader::Remember(const std::string& collection, const std::string& gen,
                          const std::vector<Entry>* listed) {
  LastRead& last = lastRead_[collection];
  if (last.gen != gen) last = LastRead{gen, std::string()};
  if (listed == nullptr) return;
  last.split = listed->size() < kSplitObjects
                   ? std::string()
                   : keys_.Object(gen, (*listed)[listed->size() / 2].instance);
}

}  // namespace TavoConfigStore
