// The history of an etcd store as the functions of StoreHistory.h see it
// (HistorySource.h): the kept versions, the depth, and a kept version's
// objects, read at one revision.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_HISTORY_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_HISTORY_H_

#include <cstdint>
#include <memory>
#include <vector>

#include "EtcdClient.h"
#include "EtcdReader.h"
#include "EtcdVersions.h"
#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {

class EtcdHistory {
 public:
  EtcdHistory(EtcdClient& client, EtcdReader& reader) : client_(client), reader_(reader) {}

  // Newest first.
  std::vector<StoreVersion> Versions();
  unsigned Depth() { return Read().depth; }
  std::uint64_t Newest() { return Read().newest; }
  // Forgets the versions beyond "depth" at once, and the generations only
  // they named.
  void SetDepth(unsigned depth);
  // Throws kErrorNoSuchVersion for a version not kept.
  std::vector<std::shared_ptr<ConfigStoreObject>> ListVersion(std::uint64_t number,
                                                              const FilterSpecObject& filter);

 private:
  HistoryState Read();

  EtcdClient& client_;
  EtcdReader& reader_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_HISTORY_H_
