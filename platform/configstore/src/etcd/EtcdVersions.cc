#include "EtcdVersions.h"

#include "../HistorySource.h"
#include "../object/Coding.h"
#include "EtcdTxn.h"

namespace TavoConfigStore {
namespace {

constexpr char kRecordFormat = 1;
constexpr std::size_t kGenerationsInSwitch = 16;

bool GetString(std::string_view* in, std::string* out) {
  std::uint64_t size = 0;
  if (!coding::GetVarint(in, &size) || size > in->size()) return false;
  out->assign(in->substr(0, size));
  in->remove_prefix(size);
  return true;
}

// h/head: the newest number and the depth, as two varints.
bool ParseHead(std::string_view value, HistoryState* history) {
  std::uint64_t newest = 0;
  std::uint64_t depth = 0;
  if (!coding::GetVarint(&value, &newest) || !coding::GetVarint(&value, &depth) ||
      depth > UINT32_MAX) {
    return false;
  }
  history->newest = newest;
  history->depth = static_cast<unsigned>(depth);
  return true;
}

}  // namespace

bool HistoryState::Names(const std::string& gen) const {
  for (const auto& entry : kept) {
    for (const auto& [collection, named] : entry.second.gens) {
      if (named == gen) return true;
    }
  }
  return false;
}

// Format byte, time, host, user, then each collection and its generation.
std::string EncodeVersion(const VersionRecord& record) {
  std::string value(1, kRecordFormat);
  coding::PutVarint(&value, static_cast<std::uint64_t>(record.about.unixTimeMs));
  coding::PutLengthPrefixed(&value, record.about.host);
  coding::PutLengthPrefixed(&value, record.about.user);
  coding::PutVarint(&value, record.gens.size());
  for (const auto& [collection, gen] : record.gens) {
    coding::PutLengthPrefixed(&value, collection);
    coding::PutLengthPrefixed(&value, gen);
  }
  return value;
}

bool DecodeVersion(std::string_view value, VersionRecord* record) {
  if (value.empty() || value.front() != kRecordFormat) return false;
  value.remove_prefix(1);
  std::uint64_t time = 0;
  std::uint64_t count = 0;
  if (!coding::GetVarint(&value, &time) || !GetString(&value, &record->about.host) ||
      !GetString(&value, &record->about.user) || !coding::GetVarint(&value, &count)) {
    return false;
  }
  record->about.unixTimeMs = static_cast<std::int64_t>(time);
  for (std::uint64_t i = 0; i < count; ++i) {
    std::string collection;
    std::string gen;
    if (!GetString(&value, &collection) || !GetString(&value, &gen) ||
        !etcdlayout::IsGenerationId(gen)) {
      return false;
    }
    record->gens.emplace(std::move(collection), std::move(gen));
  }
  return value.empty();
}

HistoryState ParseHistory(const etcdlayout::Keys& keys, const etcdwire::Range& range) {
  HistoryState history;
  const std::string head = keys.HistoryHead();
  const std::string versions = keys.Versions();
  for (const etcdwire::KeyValue& kv : range.kvs) {
    if (kv.key == head) {
      if (ParseHead(kv.value, &history)) history.headRevision = kv.modRevision;
      continue;
    }
    const std::string_view name = etcdlayout::Keys::NameIn(versions, kv.key);
    VersionRecord record;
    if (kv.key.substr(0, versions.size()) != versions || name.size() != 16 ||
        name.find_first_not_of("0123456789abcdef") != std::string_view::npos ||
        !DecodeVersion(kv.value, &record)) {
      continue;
    }
    record.about.number = std::stoull(std::string(name), nullptr, 16);
    history.kept.emplace(record.about.number, std::move(record));
  }
  return history;
}

VersionRecord NewVersion(std::uint64_t number, Generations gens) {
  VersionRecord record;
  record.about = NewVersionBy(number);
  record.gens = std::move(gens);
  return record;
}

void AddHistoryChange(etcdserverpb::TxnRequest* txn, const etcdlayout::Keys& keys,
                      const HistoryState& history, std::uint64_t newest, unsigned depth,
                      const VersionRecord* record, const Generations& current,
                      std::set<std::string> candidates) {
  AddCompareRevision(txn, keys.HistoryHead(), history.headRevision);
  std::string head;
  coding::PutVarint(&head, newest);
  coding::PutVarint(&head, depth);
  AddPut(txn, keys.HistoryHead(), std::move(head));
  std::set<std::string> named;
  for (const auto& entry : current) named.insert(entry.second);
  // The newest "depth" numbers stay (none with depth 0), the current
  // state's among them.
  const std::uint64_t firstKept = newest >= depth ? newest - depth + 1 : 1;
  bool forgets = false;
  for (const auto& [number, kept] : history.kept) {
    const bool stays = number >= firstKept;
    forgets = forgets || !stays;
    for (const auto& entry : kept.gens) (stays ? named : candidates).insert(entry.second);
  }
  // One operation for any number of versions: a smaller depth forgets many.
  if (forgets) AddDelete(txn, keys.Version(0), keys.Version(firstKept));
  if (record != nullptr && depth > 0) {
    AddPut(txn, keys.Version(record->about.number), EncodeVersion(*record));
  }
  // Only so many generations go in the switch itself: a much smaller depth
  // forgets many versions at once, and all of theirs would pass etcd's
  // limit of operations in one transaction (128 by default). The rest are
  // then registered generations nothing names, which the collection of
  // orphans after a commit deletes in batches.
  std::size_t deleted = 0;
  for (const std::string& gen : candidates) {
    if (named.count(gen)) continue;
    if (deleted++ == kGenerationsInSwitch) break;
    AddDeletePrefix(txn, keys.Generation(gen));
    AddDelete(txn, keys.Registered() + gen);
  }
}

}  // namespace TavoConfigStore
