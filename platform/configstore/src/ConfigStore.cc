// What the interface itself defines: the behaviour a backend inherits unless
// it has a better one.

#include "TavoConfigStore/ConfigStore.h"

#include <chrono>
#include <thread>

namespace TavoConfigStore {

const std::string sGlobalNamespace = "global";

ConfigStore::~ConfigStore() = default;

bool ConfigStore::WaitForChange(int timeoutMs) {
  std::this_thread::sleep_for(std::chrono::milliseconds(timeoutMs));
  return true;
}

}  // namespace TavoConfigStore
