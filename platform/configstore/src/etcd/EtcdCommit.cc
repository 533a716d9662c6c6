#include "EtcdCommit.h"

#include <algorithm>
#include <cstdio>
#include <mutex>
#include <random>
#include <utility>

#include "EtcdTxn.h"

namespace TavoConfigStore {
namespace {

using etcdlayout::Header;
using etcdlayout::Keys;
using etcdlayout::OrderKind;
using etcdserverpb::Compare;
using etcdserverpb::TxnRequest;

constexpr std::int64_t kLeaseSeconds = 60;
constexpr int kCommitAttempts = 5;
// Every commit rewrites the history's head, so a switch also loses to
// commits that changed only other collections; it is then sent again on
// the new state, at most this many times.
constexpr int kSwitchAttempts = 50;

std::string NewId() {
  static std::mutex mu;
  static std::mt19937_64 random{std::random_device{}()};
  std::lock_guard<std::mutex> lock(mu);
  char text[17];
  std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(random()));
  return text;
}

// The collection's pointer is as "current" has it (absent when it is null).
void AddCompareVersion(TxnRequest* txn, const std::string& pointer, const Current* current) {
  AddCompareRevision(txn, pointer, current ? current->version : 0);
}

Generations GenerationsOf(const Pointers& pointers) {
  Generations gens;
  for (const auto& [name, current] : pointers.byCollection) gens.emplace(name, current.gen);
  return gens;
}

// Records the catalogue after a switch as the next version: "after" is each
// collection's generation then, "dropped" the generations the switch stops
// pointing at, deleted unless a kept version names them.
void AddVersion(TxnRequest* txn, const Keys& keys, const HistoryState& history,
                const Generations& after, std::set<std::string> dropped) {
  const VersionRecord record = NewVersion(history.newest + 1, after);
  AddHistoryChange(txn, keys, history, record.about.number, history.depth, &record, after,
                   std::move(dropped));
}

// The writer of generation "gen" is alive: its lease has not run out, and
// the generation has not been made current.
void AddWriterAlive(TxnRequest* txn, const Keys& keys, const std::string& gen) {
  Compare* alive = txn->add_compare();
  alive->set_key(keys.Writers() + gen);
  alive->set_target(Compare::VERSION);
  alive->set_result(Compare::GREATER);
}

std::vector<const std::pair<const std::string, Put>*> InWriteOrder(const Pending& pending) {
  std::vector<const std::pair<const std::string, Put>*> puts;
  for (const auto& entry : pending.puts) puts.push_back(&entry);
  std::sort(puts.begin(), puts.end(),
            [](const auto* a, const auto* b) { return a->second.seq < b->second.seq; });
  return puts;
}

// What the transaction did to "collection"; nothing when it left it alone
// (a collection a move of the earlier layout carries over).
const Pending& PendingFor(const PendingCollections& pending, const std::string& collection) {
  static const Pending kUntouched;
  auto it = pending.find(collection);
  return it == pending.end() ? kUntouched : it->second;
}

}  // namespace

void EtcdCommit::Conflict(const std::string& collection) const {
  ConfigStoreObjectId id("", "", "");
  etcdlayout::ParseCollection(collection, &id);
  throw ConfigStoreException(client_.Where() + ": another writer changed the collection \"" +
                                 id.Key() + "\" since this transaction read it",
                             kErrorConflict);
}

void EtcdCommit::Apply(const PendingCollections& pending, const ObservedVersions& observed) {
  Touched changed;
  for (const auto& [name, changes] : pending) {
    if (changes.Touched()) changed.push_back(name);
  }
  if (changed.empty()) return;
  Pointers lostTo;  // as read before the last attempt, which lost its switch
  int lost = 0;
  int passed = 0;
  for (bool retry = false;; retry = true) {
    // The pointers, the history, and the generations a dead writer left, in
    // one read. A catalogue an earlier version wrote moves under the
    // store's own root with the first write, every collection of it in
    // this commit's switch.
    const Pointers base = reader_.ReadPointers(std::string(), true);
    const bool move = base.keys != &reader_.OwnKeys();
    bool readAny = false;
    bool overtaken = false;  // another writer changed a collection this one writes
    Touched touched;
    for (const std::string& name : changed) {
      const Current* current = base.Find(name);
      const std::int64_t version = current ? current->version : 0;
      auto seen = observed.find(name);
      if (seen != observed.end()) {
        readAny = true;
        if (seen->second != version) Conflict(name);
      }
      const Current* before = lostTo.Find(name);
      overtaken = overtaken || version != (before ? before->version : 0);
      // Clearing or deleting from a collection that does not exist
      // changes nothing.
      if (current || !pending.at(name).puts.empty()) touched.push_back(name);
    }
    if (touched.empty()) return;
    // Only a transaction that read none of what it writes can simply be
    // applied to what another writer made of it; one that lost only to
    // writers of other collections is sent again as it is.
    if (retry && (overtaken ? readAny || ++lost == kCommitAttempts : ++passed == kSwitchAttempts)) {
      Conflict(touched.front());
    }
    if (move) {
      for (const auto& entry : base.byCollection) touched.push_back(entry.first);
      std::sort(touched.begin(), touched.end());
      touched.erase(std::unique(touched.begin(), touched.end()), touched.end());
    }
    const std::string token = NewId();
    if (!move && FitsInPlace(pending, touched, base)
            ? CommitInPlace(pending, touched, base, token)
            : CommitGenerations(pending, touched, base, token)) {
      return;
    }
    lostTo = base;
  }
}

bool EtcdCommit::FitsInPlace(const PendingCollections& pending, const Touched& touched,
                             const Pointers& now) const {
  std::size_t ops = 0;
  std::size_t bytes = 0;
  for (const std::string& name : touched) {
    const Pending& changes = pending.at(name);
    const Current* current = now.Find(name);
    const bool exists = current != nullptr;
    // A generation a kept version names is never changed: such a
    // collection gets a new one.
    if (exists && (changes.cleared || now.history.Names(current->gen))) return false;
    ops += 2 + (exists ? 0 : 2) + changes.deleted.size() + changes.puts.size() * 2;
    for (const auto& [key, put] : changes.puts) {
      if (put.body.size() > etcdlayout::kPartBytes) return false;
      bytes += put.body.size() + 2 * key.size() + 128;
    }
  }
  return ops <= etcdlayout::kBatchOps && bytes <= etcdlayout::kBatchBytes;
}

bool EtcdCommit::CommitInPlace(const PendingCollections& pending, const Touched& touched,
                               const Pointers& now, const std::string& token) {
  const Keys& keys = reader_.OwnKeys();
  TxnRequest txn;
  Generations after = GenerationsOf(now);
  for (const std::string& name : touched) {
    const Pending& changes = pending.at(name);
    const Current* current = now.Find(name);
    AddCompareVersion(&txn, keys.Pointer(name), current);
    const std::string gen = current ? current->gen : NewId();
    after[name] = gen;
    AddPut(&txn, keys.Pointer(name), etcdlayout::PointerValue(gen, token));
    if (!current) {
      AddPut(&txn, keys.Generation(gen), name);
      AddPut(&txn, keys.Registered() + gen, name);
    }
    for (const std::string& instance : changes.deleted) {
      if (current && !changes.puts.count(instance)) {
        AddDeletePrefix(&txn, keys.Object(gen, instance));
      }
    }
    for (const auto* put : InWriteOrder(changes)) {
      const std::string object = keys.Object(gen, put->first);
      Header header;
      header.kind = OrderKind::kOwnRevision;
      header.index = put->second.seq;
      AddPut(&txn, object + Keys::PartSuffix(0), etcdlayout::FirstPart(header, put->second.body));
      // Later parts of a larger object this one replaces.
      if (current) AddDelete(&txn, object + Keys::PartSuffix(1), etcdlayout::PrefixEnd(object));
    }
  }
  AddVersion(&txn, keys, now.history, after, {});
  return Switch(txn, touched.front(), token);
}

// "base" holds the collections as they are now: under the store's own
// root, or under the old one when this commit moves them (then "touched"
// holds every one of them).
bool EtcdCommit::CommitGenerations(const PendingCollections& pending, const Touched& touched,
                                   const Pointers& base, const std::string& token) {
  const Keys& keys = reader_.OwnKeys();
  const bool move = base.keys != &keys;
  const std::int64_t lease = TakeLease();
  std::map<std::string, std::string> fresh;  // collection -> its new generation
  for (const std::string& name : touched) fresh[name] = NewId();
  std::map<std::string, bool> empty;
  try {
    // Left before the lease is given up, so that no batch is still on its
    // way.
    Batches batches(client_);
    // The registrations go with the first batch of objects, in one
    // transaction: a generation never has objects without being
    // registered, so a later writer finds whatever a dead one left.
    for (const auto& [name, gen] : fresh) {
      const std::size_t size = keys.Writers().size() + gen.size() + name.size() + 32;
      batches.Put(keys.Writers() + gen, name, size, lease);
      batches.Put(keys.Registered() + gen, name, size);
    }
    auto lastKeepAlive = leaseRenewed_;
    for (const std::string& name : touched) {
      const Pending& changes = PendingFor(pending, name);
      const Current* current = base.Find(name);
      const std::string& gen = fresh[name];
      bool written = false;
      if (current && !changes.cleared) {
        etcdwire::Reply reply;
        std::vector<Entry> entries;
        reader_.ReadGeneration(*base.keys, current->gen, nullptr, base.revision, &reply, &entries);
        for (const Entry& entry : entries) {
          // An unreadable object has nothing to carry over.
          if (changes.deleted.count(entry.instance) || changes.puts.count(entry.instance) ||
              !entry.damage.empty()) {
            continue;
          }
          const Header header{OrderKind::kWritten, entry.order.revision, entry.order.index, 1};
          WriteObject(keys, gen, entry.instance, header, entry.body, &batches);
          written = true;
        }
      }
      for (const auto* put : InWriteOrder(changes)) {
        const Header header{OrderKind::kHeadRevision, 0, put->second.seq, 1};
        WriteObject(keys, gen, put->first, header, put->second.body, &batches);
        written = true;
        if (std::chrono::steady_clock::now() - lastKeepAlive >
            std::chrono::seconds(kLeaseSeconds / 4)) {
          client_.LeaseKeepAlive(lease);
          lastKeepAlive = std::chrono::steady_clock::now();
        }
      }
      empty[name] = !written;
    }
    batches.Finish();
  } catch (...) {
    GiveUp(lease);
    throw;
  }

  // The switch, on the state "now": the same as "base" for the collections
  // it writes, which their compares hold to.
  std::string anyWritten;
  const auto switchOn = [&](const Pointers& now) {
    TxnRequest txn;
    Generations after = move ? Generations() : GenerationsOf(now);
    std::set<std::string> dropped;
    for (const std::string& name : touched) {
      const Current* current = base.Find(name);
      const std::string& gen = fresh[name];
      AddCompareVersion(&txn, base.keys->Pointer(name), current);
      if (move) AddCompareVersion(&txn, keys.Pointer(name), nullptr);
      AddWriterAlive(&txn, keys, gen);
      if (empty[name]) {
        AddDelete(&txn, keys.Pointer(name));
        AddDeletePrefix(&txn, keys.Generation(gen));
        AddDelete(&txn, keys.Registered() + gen);
        after.erase(name);
      } else {
        AddPut(&txn, keys.Pointer(name), etcdlayout::PointerValue(gen, token));
        AddPut(&txn, keys.Generation(gen), name);
        anyWritten = name;
        after[name] = gen;
      }
      if (move) {
        // Its generations go after the switch, key by key (RemoveLegacy).
        AddDelete(&txn, base.keys->Pointer(name));
      } else if (current) {
        dropped.insert(current->gen);
      }
      AddDelete(&txn, keys.Writers() + gen);
    }
    AddVersion(&txn, keys, now.history, after, std::move(dropped));
    return txn;
  };
  Pointers now = base;
  for (int attempt = 1; !Switch(switchOn(now), anyWritten, token, lease); ++attempt) {
    // Another writer got in first. When it left the collections this
    // commit writes alone, the generations written stand, and only the
    // switch is sent again, on the new state.
    Pointers again;
    bool unchanged = !move && attempt < kSwitchAttempts;
    try {
      if (unchanged) again = reader_.ReadPointers(std::string(), true);
    } catch (const ConfigStoreException&) {
      unchanged = false;
    }
    for (const std::string& name : touched) {
      if (!unchanged) break;
      const Current* was = base.Find(name);
      const Current* is = again.Find(name);
      unchanged = (was ? was->version : 0) == (is ? is->version : 0);
    }
    if (unchanged) {
      now = std::move(again);
      continue;
    }
    // Unless an earlier copy of the switch takes effect late: once the
    // lease is gone, the pointer tells.
    GiveUp(lease);
    return Holds(anyWritten, token);
  }
  // The switch removed this commit's writer keys: the lease holds nothing
  // now and serves the next commit.
  lease_ = lease;
  if (move) reader_.Moved();
  try {
    DeleteGenerations(client_, reader_.OwnKeys(), now.orphans);
    if (move) RemoveLegacy(base);
  } catch (const ConfigStoreException&) {
    // Tidying only: the commit stands, and a later writer tidies up.
  }
  return true;
}

// Sends the transaction that makes a commit visible and tells whether it
// took effect. When the reply is lost, or a resent request finds its own
// first attempt has changed the versions it compares, the pointer of a
// collection it writes ("witness", "" when it writes none) holds this
// commit's token exactly when it did.
bool EtcdCommit::Switch(const TxnRequest& txn, const std::string& witness, const std::string& token,
                        std::int64_t lease) {
  try {
    return client_.Txn(txn) || Holds(witness, token);
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

bool EtcdCommit::Holds(const std::string& witness, const std::string& token) {
  if (witness.empty()) return false;
  const Pointers pointers = reader_.ReadPointers(witness);
  const Current* current = pointers.Find(witness);
  return current != nullptr && current->token == token;
}

// Gives up a commit's new generations: with the lease revoked, their writer
// keys are gone, so that a switch still on its way can no longer take
// effect, and the next commit removes them as it removes a dead writer's.
void EtcdCommit::GiveUp(std::int64_t lease) {
  try {
    client_.LeaseRevoke(lease);
  } catch (const ConfigStoreException&) {
    // The lease runs out, and the generations go after that.
  }
}

// The lease for a commit's writer keys. The one the last commit used is
// renewed rather than a new one granted: a grant and a revocation are each
// a write etcd syncs to disk, a renewal is not. A commit hands the lease
// back only once its switch has removed its writer keys; one that failed
// keeps it (and revokes it or lets it run out), as a writer key still on a
// lease that goes on being renewed would keep its generation from ever
// being tidied.
std::int64_t EtcdCommit::TakeLease() {
  const std::int64_t kept = std::exchange(lease_, 0);
  leaseRenewed_ = std::chrono::steady_clock::now();
  if (kept != 0) {
    try {
      client_.LeaseKeepAlive(kept);
      return kept;
    } catch (const ConfigStoreException& e) {
      // Run out or revoked: a new one. Anything else is the cluster's.
      if (e.Code() != EtcdCode(grpc::StatusCode::NOT_FOUND)) throw;
    }
  }
  return client_.LeaseGrant(kLeaseSeconds);
}

// Deletes the generations of a catalogue a commit moved, which nothing
// points at any more. Only keys of the old layout's shapes go: the head,
// each object's parts and the registration. A store whose prefix lies
// inside the old root (one at "m/g/<gen>" beside "m") keeps all of its
// keys: after their \0 comes "p/", "g/", "r/" or "w/", never a part's four
// hexadecimal digits alone.
void EtcdCommit::RemoveLegacy(const Pointers& moved) {
  Batches batches(client_);
  for (const auto& [name, current] : moved.byCollection) {
    const std::string head = moved.keys->Generation(current.gen);
    etcdserverpb::RangeRequest request;
    request.set_key(head);
    request.set_range_end(etcdlayout::PrefixEnd(head));
    request.set_keys_only(true);
    etcdwire::Reply reply;
    client_.Range(request, &reply);
    for (const etcdwire::KeyValue& kv : reply.ranges[0].kvs) {
      const std::string_view rest = kv.key.substr(head.size());
      std::string_view stem;
      std::size_t part = 0;
      if (rest.empty() ||
          (etcdlayout::ParseObjectKey(rest, &stem, &part) && part != etcdlayout::kNoPart)) {
        batches.Delete(std::string(kv.key));
      }
    }
    batches.Delete(moved.keys->Registered() + current.gen);
  }
  batches.Finish();
}

}  // namespace TavoConfigStore
