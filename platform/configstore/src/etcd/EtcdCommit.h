// The commit of a store's transaction, in one of two ways (EtcdLayout.h has
// the keys):
//  - small changes (one etcd request's worth, no collection cleared) go in
//    place into the current generations, in one etcd transaction;
//  - anything else writes each changed collection whole into a new
//    generation, in as many requests as it takes, and then makes the new
//    generations current in one small etcd transaction that compares each
//    collection's version and that the writer's lease is still alive. Until
//    that switch no reader sees any of it; after it every reader sees all of
//    it.
// A commit that finds a collection changed by another writer since the
// transaction read it fails with kErrorConflict: what it would write may
// depend on what it read. A transaction that only wrote a collection (a
// replace: clear, then write) is applied again to the new state instead,
// since its outcome does not depend on what was there.
// Either way the commit records the catalogue after it as a new version
// (EtcdVersions.h); a switch that lost only to a commit of other
// collections is sent again on the new state.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_COMMIT_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_COMMIT_H_

#include <chrono>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "EtcdClient.h"
#include "EtcdReader.h"

namespace TavoConfigStore {

struct Put {
  std::uint64_t seq = 0;  // the place in the transaction's write order
  std::string body;
};

// What an open transaction did to one collection.
struct Pending {
  bool cleared = false;
  std::set<std::string> deleted;
  std::map<std::string, Put> puts;
  bool Touched() const { return cleared || !deleted.empty() || !puts.empty(); }
};

using PendingCollections = std::map<std::string, Pending>;
// The collections a transaction read, with the version each had (0: none).
using ObservedVersions = std::map<std::string, std::int64_t>;

class EtcdCommit {
 public:
  EtcdCommit(EtcdClient& client, EtcdReader& reader) : client_(client), reader_(reader) {}

  // Applies "pending"; throws kErrorConflict as above, or the cluster's
  // failure (a commit that reports failure has not happened, unless the
  // cluster could not even be asked whether it did).
  void Apply(const PendingCollections& pending, const ObservedVersions& observed);

  [[noreturn]] void Conflict(const std::string& collection) const;

 private:
  using Touched = std::vector<std::string>;
  bool FitsInPlace(const PendingCollections& pending, const Touched& touched,
                   const Pointers& now) const;
  bool CommitInPlace(const PendingCollections& pending, const Touched& touched, const Pointers& now,
                     const std::string& token);
  bool CommitGenerations(const PendingCollections& pending, const Touched& touched,
                         const Pointers& base, const std::string& token);
  bool Switch(const etcdserverpb::TxnRequest& txn, const std::string& witness,
              const std::string& token, std::int64_t lease = 0);
  bool Holds(const std::string& witness, const std::string& token);
  void GiveUp(std::int64_t lease);
  std::int64_t TakeLease();
  void RemoveLegacy(const Pointers& moved);

  EtcdClient& client_;
  EtcdReader& reader_;
  // The lease of this store's last successful commit (0: none), left to run
  // out when the store goes, and when it was last renewed.
  std::int64_t lease_ = 0;
  std::chrono::steady_clock::time_point leaseRenewed_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_COMMIT_H_
