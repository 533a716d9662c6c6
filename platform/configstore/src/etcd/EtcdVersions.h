// The versions an etcd store keeps of its catalogue (EtcdLayout.h has the
// keys), and what a commit adds to its switch to record one.
//
// A version names the generation each collection held after its commit. A
// switch keeps the generations a kept version names instead of deleting
// them, and deletes those that only the versions it pushes beyond the depth
// named. h/head holds the newest number and the depth; every commit
// rewrites it and compares its mod revision, so a commit's version names
// exactly the generations current after it, and no two commits take the
// same number.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_VERSIONS_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_VERSIONS_H_

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <string_view>

#include "EtcdClient.h"
#include "EtcdLayout.h"
#include "EtcdWire.h"
#include "TavoConfigStore/StoreHistory.h"

namespace TavoConfigStore {

constexpr unsigned kDefaultHistoryDepth = 10;

// collection -> generation
using Generations = std::map<std::string, std::string>;

struct VersionRecord {
  StoreVersion about;
  Generations gens;
};

// The history as one read found it.
struct HistoryState {
  std::int64_t headRevision = 0;  // h/head's mod revision; 0 before the first commit
  std::uint64_t newest = 0;
  unsigned depth = kDefaultHistoryDepth;
  std::map<std::uint64_t, VersionRecord> kept;  // by number

  bool Names(const std::string& gen) const;
};

std::string EncodeVersion(const VersionRecord& record);
// False when "value" is not a version's record.
bool DecodeVersion(std::string_view value, VersionRecord* record);

// The history from a range over Keys::History(). Records that cannot be read
// are left out (and so are forgotten as if never kept).
HistoryState ParseHistory(const etcdlayout::Keys& keys, const etcdwire::Range& range);

// A version of the catalogue as it is after this commit, for its writer.
VersionRecord NewVersion(std::uint64_t number, Generations gens);

// Adds to a switch: the compare that no other commit (nor a change of
// depth) came in since "history" was read, the new head, the versions
// beyond "depth" counted back from "newest" deleted, "record" kept (unless
// the depth is 0), and the generations of "candidates" that then neither a
// kept version nor "current" names deleted. "candidates" should hold what
// the commit stops pointing at; the forgotten versions' generations are
// added here.
void AddHistoryChange(etcdserverpb::TxnRequest* txn, const etcdlayout::Keys& keys,
                      const HistoryState& history, std::uint64_t newest, unsigned depth,
                      const VersionRecord* record, const Generations& current,
                      std::set<std::string> candidates);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_VERSIONS_H_
