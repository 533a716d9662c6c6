// Replacing and resetting the catalogue on the in-memory store: the stored
// layout, and what reaches the caller when a call fails.

#include <gtest/gtest.h>

#include <set>
#include <variant>

#include "FaultSweep.h"
#include "Records.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace karst_test {
namespace {

using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;

const Catalogue kOld = {{Policy("old-a", "p-a", {{"A", "CORRA"}}), Policy("old-b", "p-b")},
                        {Datastore("ds://old", "CORRA", "p-b")}};
const Catalogue kNew = {
    {Policy("new-1", "p-1", {{"blob-1", "CORRA"}, {"blob-2", "ns-beta"}}, "d", -2),
     Policy("new-2", "p-2"), Policy("new-3", "p-3", {{"x", "ns"}})},
    {Datastore("ds://1", "CORRA", "p-1"), Datastore("ds://2", "ns-beta", "p-2"),
     Datastore("", "", "")}};

class WriteTest : public ::testing::Test {
 protected:
  void SetUp() override {
    StoreCatalogue(kOld);
    store_->ClearLog();
  }
  std::shared_ptr<TavoConfigStore::ConfigStore> memory_ = TavoConfigStore::NewMemoryStore();
  ScopedFaultStore store_{memory_};
};

// "name=s:text" and "name=i:number", sorted by name.
std::string Values(const TavoConfigStore::StoreObject& object) {
  std::set<std::string> values;
  for (const TavoConfigStore::StoreValue& v : object.Values()) {
    values.insert(v.name + (v.value.index() ? "=i:" + std::to_string(std::get<1>(v.value))
                                            : "=s:" + std::get<0>(v.value)));
  }
  std::string out;
  for (const std::string& v : values) out += v + " ";
  return out;
}

TEST_F(WriteTest, StoredLayout) {
  KarstLib::AddPolicyInfo(
      {Policy("gold", "p-1", {{"B", "ns-b"}, {"skipped", ""}, {"", "ns-a"}}, "", 7)});
  KarstLib::AddDatastoreInfo({Datastore("ds://a", "", "p-1")});
  // The values, then the sub-objects in store order as "array[key]{values}".
  auto read = [this](const std::string& key, const std::string& instance) {
    auto object = memory_->GetObject({key, "storage", "tavo", instance});
    if (!object) return std::string("missing");
    std::string out = Values(*object);
    for (const TavoConfigStore::SubObjectEntry& sub : object->SubObjects()) {
      out += sub.id.Array() + "[" + sub.id.Key() + "]{" + Values(*sub.object) + "}";
    }
    return out;
  };
  EXPECT_EQ(read("karst_policies", "gold"),
            "description=s: generation_number=i:7 name=s:gold policy_id=s:p-1 "
            "blobs[ns-b]{blob=s:B datastore_namespace=s:ns-b }"
            "blobs[ns-a]{blob=s: datastore_namespace=s:ns-a }");
  EXPECT_EQ(read("karst_datastores", "ds://a"),
            "datastore_namespace=s: drp_policy_id=s:p-1 url=s:ds://a ");
  // What each collection holds after a replace with records, and that the
  // other one is left alone, the fault sweep (reliability_fault_sweep)
  // checks; an empty list must clear too.
  KarstLib::AddDatastoreInfo({});
  EXPECT_TRUE(KarstLib::ListDatastoreInfo().empty());
}

// The sweep checks the code, the message and the abort; not the detail the
// copy must share, nor that other errors are left as they are.
TEST_F(WriteTest, AStoreErrorReachesTheCallerAsACopyAndOthersUnchanged) {
  auto detail = std::make_shared<int>(7);
  store_->FailWith("SetObject", 2, [detail] { throw ConfigStoreException("", 517, detail); });
  try {
    KarstLib::AddPolicyInfo(kNew.policies);
    ADD_FAILURE() << "nothing thrown";
  } catch (const ConfigStoreException& e) {
    EXPECT_EQ(e.Detail(), detail);
  }

  store_->ClearFaults();
  store_->ClearLog();
  store_->FailWith("DeleteObjects", 1, [] { throw Velk::Lib::VelkException("core"); });
  try {
    KarstLib::AddDatastoreInfo(kNew.datastores);
    ADD_FAILURE() << "nothing thrown";
  } catch (const Velk::Lib::VelkException& e) {
    EXPECT_EQ(dynamic_cast<const ConfigStoreException*>(&e), nullptr) << "made a store error";
  }
}

TEST_F(WriteTest, ResetIgnoresFailedDeletionsButNotAFailedBegin) {
  // The first deletion fails: the other is still made, and committed.
  store_->Fail("DeleteObjects", 1, FaultKind::kStoreErrorOnce);
  EXPECT_NO_THROW(KarstLib::Reset());
  EXPECT_NE(KarstLib::ListPolicyInfo().empty(), KarstLib::ListDatastoreInfo().empty());
  // The sweep lets a returning Reset pass, so it misses a swallowed failed begin.
  store_->ClearFaults();
  store_->Fail("BeginTransaction", 1, FaultKind::kStoreErrorFromThenOn);
  EXPECT_THROW(KarstLib::Reset(), ConfigStoreException);
}

}  // namespace
}  // namespace karst_test
