// Helpers shared by the configuration store tests.

#ifndef KARST_TESTS_PLATFORM_STORE_TEST_UTIL_H_
#define KARST_TESTS_PLATFORM_STORE_TEST_UTIL_H_

#include <gtest/gtest.h>
#include <stdlib.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"

namespace TavoConfigStore {
namespace testutil {

inline std::shared_ptr<ConfigStoreObject> Obj(const std::string& key, const std::string& group,
                                              const std::string& component,
                                              const std::string& instance) {
  return std::make_shared<ConfigStoreObject>(ConfigStoreObjectId(key, group, component, instance));
}

inline std::shared_ptr<FilterSpecObject> Filter(const std::string& key, const std::string& group,
                                                const std::string& component,
                                                const std::string& instance) {
  return std::make_shared<FilterSpecObject>(ConfigStoreObjectId(key, group, component, instance));
}

inline std::shared_ptr<FilterSpecObject> All() { return Filter("", "", "", ""); }

inline void Set(ConfigStore& store, const std::shared_ptr<ConfigStoreObject>& object) {
  std::int32_t flags = 0;
  store.SetObject(object, flags);
}

// Printable and byte-exact: anything outside plain ASCII is escaped.
inline std::string Escape(const std::string& s) {
  static const char* kHex = "0123456789abcdef";
  std::string out;
  for (unsigned char c : s) {
    if (c >= 0x20 && c < 0x7f && c != '\\') {
      out.push_back(static_cast<char>(c));
    } else {
      out += "\\x";
      out.push_back(kHex[c >> 4]);
      out.push_back(kHex[c & 0xf]);
    }
  }
  return out;
}

inline std::string DescribeValues(const std::vector<StoreValue>& values) {
  std::string out;
  for (const StoreValue& v : values) {
    out += " " + Escape(v.name) + "=";
    if (const auto* s = std::get_if<std::string>(&v.value)) {
      out += "s'" + Escape(*s) + "'";
    } else {
      out += "i" + std::to_string(std::get<long long>(v.value));
    }
  }
  return out;
}

// The whole of an object, for exact comparisons.
inline std::string Describe(const ConfigStoreObject& o) {
  const ConfigStoreObjectId& id = o.Id();
  std::string out = "(" + Escape(id.Key()) + "|" + Escape(id.Group()) + "|" +
                    Escape(id.Component()) + "|" + Escape(id.InstanceId()) + ")" +
                    DescribeValues(o.Values());
  for (const SubObjectEntry& e : o.SubObjects()) {
    out += " [" + Escape(e.id.Array()) + "/" + Escape(e.id.Key()) + ":" +
           DescribeValues(e.object->Values()) + "]";
  }
  return out;
}

// The store's whole state, in order.
inline std::vector<std::string> Dump(ConfigStore& store) {
  std::vector<std::string> out;
  for (const auto& o : store.GetObjects(All())) out.push_back(Describe(*o));
  return out;
}

inline std::vector<std::string> Instances(
    const std::vector<std::shared_ptr<ConfigStoreObject>>& objects) {
  std::vector<std::string> out;
  for (const auto& o : objects) out.push_back(o->Id().InstanceId());
  return out;
}

// The code of the ConfigStoreException "f" throws, or 0 when it returns.
template <typename F>
std::int32_t CodeOf(F&& f) {
  try {
    f();
  } catch (const ConfigStoreException& e) {
    return e.Code();
  }
  return 0;
}

// A fresh directory under the test temp dir, removed with everything in it.
class ScratchDir {
 public:
  ScratchDir() {
    std::string pattern = ::testing::TempDir() + "/configstore_XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) ADD_FAILURE() << "mkdtemp failed";
    path_ = pattern;
  }
  ~ScratchDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
  }
  ScratchDir(const ScratchDir&) = delete;
  ScratchDir& operator=(const ScratchDir&) = delete;

  const std::string& Path() const { return path_; }

 private:
  std::string path_;
};

}  // namespace testutil
}  // namespace TavoConfigStore

#endif  // KARST_TESTS_PLATFORM_STORE_TEST_UTIL_H_
