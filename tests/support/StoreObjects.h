// Objects, filters and what a store holds, for the configuration store's tests.

#ifndef KARST_TESTS_SUPPORT_STORE_OBJECTS_H_
#define KARST_TESTS_SUPPORT_STORE_OBJECTS_H_

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"

namespace karst_test {

using TavoConfigStore::ConfigStore;
using TavoConfigStore::ConfigStoreException;
using TavoConfigStore::ConfigStoreObject;
using TavoConfigStore::FilterSpecObject;

// An object, or a filter, with that identifier; empty filter parts match
// anything.
std::shared_ptr<ConfigStoreObject> Obj(const std::string& key = "", const std::string& group = "",
                                       const std::string& component = "",
                                       const std::string& instance = "");
std::shared_ptr<FilterSpecObject> Filter(const std::string& key = "", const std::string& group = "",
                                         const std::string& component = "",
                                         const std::string& instance = "");

// The object "instance" of collection key/"g"/"c" with one value, "v".
std::shared_ptr<ConfigStoreObject> Valued(const std::string& instance,
                                          const std::string& value = "",
                                          const std::string& key = "k");

// SetObject, without its unused flags.
void Set(ConfigStore& store, const std::shared_ptr<ConfigStoreObject>& object);

// The whole of an object, every byte in order, for exact comparisons.
std::string Describe(const ConfigStoreObject& object);

// Describe of each object the filter lists, in order.
std::vector<std::string> Dump(ConfigStore& store,
                              const std::shared_ptr<FilterSpecObject>& filter = Filter());

// "instance=v" of each object the filter lists, in order, "v" being the
// value Valued sets.
std::vector<std::string> ValuesOf(ConfigStore& store,
                                  const std::shared_ptr<FilterSpecObject>& filter = Filter());

// The instance ids the filter lists, in order.
std::vector<std::string> List(ConfigStore& store,
                              const std::shared_ptr<FilterSpecObject>& filter = Filter());

// The ConfigStoreException "f" throws, or one with code 0 when it returns.
template <typename F>
ConfigStoreException ErrorOf(F&& f) {
  try {
    f();
  } catch (const ConfigStoreException& e) {
    return e;
  }
  return ConfigStoreException("", 0);
}

template <typename F>
std::int32_t CodeOf(F&& f) {
  return ErrorOf(f).Code();
}

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_STORE_OBJECTS_H_
