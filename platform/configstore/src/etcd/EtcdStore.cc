#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {

std::shared_ptr<ConfigStore> NewEtcdStore(const EtcdStoreOptions& options) {
  throw ConfigStoreException("etcd store " + options.endpoints.at(0) + ": not available yet",
                             kErrorEtcdBase + 12);
}

}  // namespace TavoConfigStore
