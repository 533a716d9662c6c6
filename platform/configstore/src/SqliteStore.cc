// Placeholder until the SQLite backend lands.
#include "TavoConfigStore/ConfigStore.h"

namespace TavoConfigStore {

std::shared_ptr<ConfigStore> NewSqliteStore(const std::string& path) {
  throw ConfigStoreException("configuration store: SQLite backend not built (" + path + ")", 1);
}

}  // namespace TavoConfigStore
