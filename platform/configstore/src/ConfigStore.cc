// What the interface itself defines: its exception, and the behaviour a
// backend inherits unless it has a better one.

#include "TavoConfigStore/ConfigStore.h"

#include <chrono>
#include <thread>
#include <utility>

namespace TavoConfigStore {

const std::string sGlobalNamespace = "global";

ConfigStoreException::ConfigStoreException(std::string message, std::int32_t code,
                                           std::shared_ptr<const void> detail)
    : VelkException(std::move(message), std::move(detail)), code_(code) {}

ConfigStoreException::~ConfigStoreException() = default;

ConfigStore::~ConfigStore() = default;

bool ConfigStore::WaitForChange(int timeoutMs) {
  std::this_thread::sleep_for(std::chrono::milliseconds(timeoutMs));
  return true;
}

}  // namespace TavoConfigStore
