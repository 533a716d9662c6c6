#ifndef KARST_TESTS_LIBRARY_MEMORY_STORE_FIXTURE_H_
#define KARST_TESTS_LIBRARY_MEMORY_STORE_FIXTURE_H_

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/CallProbe.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"

namespace karst_test {

// Every library call in these tests goes to a fresh in-memory store, watched
// by a fault injector that also logs each call.
class MemoryStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    store_ = TavoConfigStore::NewMemoryStore();
    TavoConfigStore::SetGlobalStore(store_);
    probe_ = std::make_shared<TavoConfigStore::FaultInjector>();
    TavoConfigStore::InstallCallProbe(probe_);
  }
  void TearDown() override {
    TavoConfigStore::InstallCallProbe(nullptr);
    TavoConfigStore::SetGlobalStore(nullptr);
  }

  // The store-level calls logged since the last ClearLog.
  std::vector<std::string> StoreCalls() const {
    return probe_->Calls(TavoConfigStore::StoreOperations());
  }

  std::shared_ptr<TavoConfigStore::ConfigStore> store_;
  std::shared_ptr<TavoConfigStore::FaultInjector> probe_;
};

inline TavoKarst::KarstPolicyInfo Policy(const std::string& name, const std::string& id,
                                         std::vector<TavoKarst::KarstPolicyBlob> blobs = {},
                                         const std::string& description = "",
                                         std::int64_t generation = 1) {
  TavoKarst::KarstPolicyInfo p;
  p.name = name;
  p.policy_id = id;
  p.description = description;
  p.generation_number = generation;
  p.blobs = std::move(blobs);
  return p;
}

inline TavoKarst::KarstDatastoreInfo Datastore(const std::string& url, const std::string& ns,
                                               const std::string& drp) {
  return TavoKarst::KarstDatastoreInfo{url, ns, drp};
}

}  // namespace karst_test

namespace TavoKarst {
// Record comparison and printing for gtest, found by argument-dependent lookup.
inline bool operator==(const KarstPolicyBlob& a, const KarstPolicyBlob& b) {
  return a.blob == b.blob && a.datastore_namespace == b.datastore_namespace;
}
inline bool operator==(const KarstPolicyInfo& a, const KarstPolicyInfo& b) {
  return a.name == b.name && a.policy_id == b.policy_id && a.description == b.description &&
         a.generation_number == b.generation_number && a.blobs == b.blobs;
}
inline bool operator==(const KarstDatastoreInfo& a, const KarstDatastoreInfo& b) {
  return a.url == b.url && a.datastore_namespace == b.datastore_namespace &&
         a.drp_policy_id == b.drp_policy_id;
}
inline void PrintTo(const KarstPolicyInfo& p, std::ostream* os) {
  *os << "{name=" << ::testing::PrintToString(p.name)
      << " policy_id=" << ::testing::PrintToString(p.policy_id)
      << " description=" << ::testing::PrintToString(p.description)
      << " generation=" << p.generation_number << " blobs=[";
  for (const KarstPolicyBlob& b : p.blobs) {
    *os << ::testing::PrintToString(b.datastore_namespace) << ":"
        << ::testing::PrintToString(b.blob) << " ";
  }
  *os << "]}";
}
inline void PrintTo(const KarstDatastoreInfo& d, std::ostream* os) {
  *os << "{" << ::testing::PrintToString(d.url) << ", "
      << ::testing::PrintToString(d.datastore_namespace) << ", "
      << ::testing::PrintToString(d.drp_policy_id) << "}";
}
}  // namespace TavoKarst

#endif  // KARST_TESTS_LIBRARY_MEMORY_STORE_FIXTURE_H_
