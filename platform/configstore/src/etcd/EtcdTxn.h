// Building etcd transactions: single operations, and many operations spread
// over as many transactions as they take (Batches).

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_TXN_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_TXN_H_

#include <cstdint>
#include <deque>
#include <future>
#include <string>
#include <vector>

#include "EtcdClient.h"
#include "EtcdLayout.h"

namespace TavoConfigStore {

void AddPut(etcdserverpb::TxnRequest* txn, std::string key, std::string value,
            std::int64_t lease = 0);
void AddDelete(etcdserverpb::TxnRequest* txn, std::string key, std::string rangeEnd = {});
void AddDeletePrefix(etcdserverpb::TxnRequest* txn, const std::string& prefix);
// The key's mod revision is "revision"; 0 means the key does not exist.
void AddCompareRevision(etcdserverpb::TxnRequest* txn, const std::string& key,
                        std::int64_t revision);

// Writes operations in transactions of at most kBatchOps and kBatchBytes.
// The first batch (which registers a new generation) is written alone; after
// it up to kInFlight are on their way at once while the next is built. Their
// order does not matter (no reader looks at a generation before the switch,
// and deletions of what nothing points at can go in any order), and etcd
// syncs batches that arrive together to disk together.
class Batches {
 public:
  static constexpr std::size_t kInFlight = 4;

  explicit Batches(EtcdClient& client) : client_(client) {}
  // Waits for every batch still on its way: what is abandoned after a
  // failure must not be written afterwards by a batch of its own.
  ~Batches();
  Batches(const Batches&) = delete;
  Batches& operator=(const Batches&) = delete;

  // A put that takes about "size" bytes of a request.
  void Put(std::string key, std::string value, std::size_t size, std::int64_t lease = 0);
  void Delete(std::string key, std::string rangeEnd = {});
  // Sends what is left and waits for every batch; throws the first failure.
  void Finish();

 private:
  void Added(std::size_t size);
  void Send();
  void Collect();

  EtcdClient& client_;
  etcdserverpb::TxnRequest txn_;
  std::size_t bytes_ = 0;
  bool started_ = false;
  std::deque<std::future<void>> inFlight_;
};

// Deletes generations "gens" whole, registration included, in batches.
void DeleteGenerations(EtcdClient& client, const etcdlayout::Keys& keys,
                       const std::vector<std::string>& gens);

// Puts an object into generation "gen", in as many parts as its body needs.
void WriteObject(const etcdlayout::Keys& keys, const std::string& gen, const std::string& instance,
                 etcdlayout::Header header, std::string_view body, Batches* batches);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_TXN_H_
