#include "EtcdHistory.h"

#include "../HistorySource.h"
#include "EtcdTxn.h"

namespace TavoConfigStore {
namespace {

// A depth changed by another writer between the read and the write sends
// the change again, at most this many times.
constexpr int kDepthAttempts = 10;

etcdserverpb::RangeRequest PrefixRange(const std::string& prefix) {
  etcdserverpb::RangeRequest request;
  request.set_key(prefix);
  request.set_range_end(etcdlayout::PrefixEnd(prefix));
  return request;
}

bool CollectionMatches(const FilterSpecObject& filter, const std::string& name,
                       ConfigStoreObjectId* id) {
  if (!etcdlayout::ParseCollection(name, id)) return false;
  id->SetInstanceId(filter.Id().InstanceId());
  return filter.Matches(*id);
}

}  // namespace

HistoryState EtcdHistory::Read() {
  etcdwire::Reply reply;
  client_.Range(PrefixRange(reader_.OwnKeys().History()), &reply);
  return ParseHistory(reader_.OwnKeys(), reply.ranges[0]);
}

std::vector<StoreVersion> EtcdHistory::Versions() {
  const HistoryState history = Read();
  std::vector<StoreVersion> versions;
  for (auto it = history.kept.rbegin(); it != history.kept.rend(); ++it) {
    versions.push_back(it->second.about);
  }
  return versions;
}

void EtcdHistory::SetDepth(unsigned depth) {
  const etcdlayout::Keys& keys = reader_.OwnKeys();
  for (int attempt = 1;; ++attempt) {
    // The pointers with the history: what they name stays.
    const Pointers now = reader_.ReadPointers(std::string(), true);
    Generations current;
    if (now.keys == &keys) {
      for (const auto& [name, pointer] : now.byCollection) current.emplace(name, pointer.gen);
    }
    etcdserverpb::TxnRequest txn;
    AddHistoryChange(&txn, keys, now.history, now.history.newest, depth, nullptr, current, {});
    if (client_.Txn(txn)) {
      // What the switch left of the forgotten versions' generations. Tidying
      // only: the depth is set, and a later commit collects what is left.
      try {
        DeleteGenerations(client_, keys, reader_.ReadPointers(std::string(), true).orphans);
      } catch (const ConfigStoreException&) {
      }
      return;
    }
    if (attempt == kDepthAttempts) {
      throw ConfigStoreException(
          client_.Where() + ": the history depth could not be set: other writers kept committing",
          kErrorConflict);
    }
  }
}

std::vector<std::shared_ptr<ConfigStoreObject>> EtcdHistory::ListVersion(
    std::uint64_t number, const FilterSpecObject& filter) {
  const etcdlayout::Keys& keys = reader_.OwnKeys();
  return EtcdReader::Snapshot([&] {
    etcdserverpb::RangeRequest request;
    request.set_key(keys.Version(number));
    etcdwire::Reply reply;
    client_.Range(request, &reply);
    VersionRecord record;
    if (number == 0 || reply.ranges[0].kvs.empty() ||
        !DecodeVersion(reply.ranges[0].kvs[0].value, &record)) {
      throw ConfigStoreException(NotKeptMessage(client_.Where(), number), kErrorNoSuchVersion);
    }
    // Every generation at the revision the version was read at: one
    // snapshot, and the version's generations still there.
    std::vector<Listed> listed;
    const std::string& instance = filter.Id().InstanceId();
    for (const auto& [name, gen] : record.gens) {
      ConfigStoreObjectId id("", "", "");
      if (!CollectionMatches(filter, name, &id)) continue;
      etcdwire::Reply objects;
      std::vector<Entry> entries;
      reader_.ReadGeneration(keys, gen, instance.empty() ? nullptr : &instance, reply.revision,
                             &objects, &entries);
      for (const Entry& entry : entries) {
        id.SetInstanceId(entry.instance);
        listed.push_back({entry.order, ObjectOf(id, entry, nullptr, nullptr, client_.Where())});
      }
    }
    return InWriteOrder(std::move(listed));
  });
}

}  // namespace TavoConfigStore
