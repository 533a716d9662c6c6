// Listing the catalogue and the four blob look-ups on the in-memory store:
// store order, unreadable records, absence, and store errors on the way.

#include <gtest/gtest.h>

#include <functional>
#include <tuple>

#include "FaultStore.h"
#include "Records.h"
#include "StoreObjects.h"

namespace karst_test {
namespace {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstLib;
using TavoKarst::KarstPolicyInfo;

class ReadTest : public ::testing::Test {
 protected:
  std::shared_ptr<TavoConfigStore::ConfigStore> memory_ = TavoConfigStore::NewMemoryStore();
  ScopedFaultStore store_{memory_};
};

const std::vector<KarstPolicyInfo> kPolicies = {
    Policy("zeta", "p-9", {{"z", "CORRA"}}, "last name first"),
    Policy("alpha", "p-1", {{"a2", "ns-b"}, {"a1", "ns-a"}}, "", -5),
    Policy("mid", "p-9", {}, "same id as zeta", INT64_MAX)};
const std::vector<KarstDatastoreInfo> kDatastores = {
    Datastore("ds://2", "b", "q"), Datastore("ds://1", "a", "p"), Datastore("ds://3", "c", "r")};

TEST_F(ReadTest, ListsInStoreOrderAndDropsOnlyTheUnreadableRecord) {
  KarstLib::AddPolicyInfo(kPolicies);
  KarstLib::AddDatastoreInfo(kDatastores);
  EXPECT_EQ(KarstLib::ListPolicyInfo(), kPolicies);
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), kDatastores);

  // The first record's first read fails: the others are listed all the same.
  // (Both collections are listed by one loop: policies stand for both.)
  store_->ClearLog();
  store_->Fail("GetValue", 1, FaultKind::kStoreErrorOnce);
  EXPECT_EQ(KarstLib::ListPolicyInfo(), (std::vector<KarstPolicyInfo>{kPolicies[1], kPolicies[2]}));
}

TEST_F(ReadTest, FieldsComeFromStoredValuesAndMissingOnesReadEmpty) {
  using TavoConfigStore::ConfigStoreObject;
  using TavoConfigStore::ConfigStoreObjectId;
  auto policy = std::make_shared<ConfigStoreObject>(
      ConfigStoreObjectId("karst_policies", "storage", "tavo", "instance-name"));
  policy->SetValue("name", std::string("value-name"));
  policy->CreateSubObject({"blobs", "key-ns"})->SetValue("blob", std::string("b"));
  policy->CreateSubObject({"other", "x"})->SetValue("blob", std::string("not a blob"));
  auto datastore = std::make_shared<ConfigStoreObject>(
      ConfigStoreObjectId("karst_datastores", "storage", "tavo", "ds://instance"));
  datastore->SetValue("datastore_namespace", std::string("ns"));
  Set(*memory_, policy);
  Set(*memory_, datastore);
  EXPECT_EQ(KarstLib::ListPolicyInfo(),
            (std::vector<KarstPolicyInfo>{Policy("value-name", "", {{"b", ""}}, "", 0)}));
  EXPECT_EQ(KarstLib::ListDatastoreInfo(),
            (std::vector<KarstDatastoreInfo>{Datastore("", "ns", "")}));
}

class LookupTest : public ReadTest {
 protected:
  void SetUp() override {
    KarstLib::AddPolicyInfo(
        {Policy("gold", "p-1", {{"gold-corra", "CORRA"}, {"gold-beta", "ns-beta"}}),
         Policy("first-p2", "p-2", {{"first-beta", "ns-beta"}}),
         Policy("second-p2", "p-2", {{"second-corra", "CORRA"}}),
         Policy("lower", "p-3", {{"lower-corra", "corra"}}),
         Policy("nul", std::string("p\0x", 3), {{std::string("b\0y", 3), "CORRA"}}),
         // Empty names and ids can be stored: an empty argument must not find them.
         Policy("", "", {{"empty", "CORRA"}, {"empty", "ns-beta"}})});
    KarstLib::AddDatastoreInfo(
        {Datastore("ds://beta", "ns-beta", "p-1"), Datastore("ds://corra", "CORRA", "p-2"),
         Datastore("ds://no-default", "CORRA", ""), Datastore("ds://no-namespace", "", "p-1"),
         Datastore("", "CORRA", "p-1")});
  }
};

TEST_F(LookupTest, FirstMatchInStoreOrderByteExactOrEmpty) {
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobById("p-1"), "gold-corra");
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("gold"), "gold-corra");
  EXPECT_EQ(KarstLib::GetPolicyBlobById("p-1", "ds://beta"), "gold-beta");
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds://beta"), "gold-beta");
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobById(std::string("p\0x", 3)), std::string("b\0y", 3));
  // The first policy with the id decides, even when it lacks the blob.
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobById("p-2"), "");
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds://corra"), "");
  EXPECT_EQ(KarstLib::GetPolicyBlobById("p-2", "ds://beta"), "first-beta");
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("second-p2"), "second-corra");

  // Byte-exact (case, prefixes either way, an id cut at its NUL, "corra" is
  // not "CORRA", a name is not an id), missing objects, sub-objects and
  // values, and empty arguments: all give "".
  for (const char* id : {"P-1", "p-", "p-10", "p", "p-3", ""}) {
    EXPECT_EQ(KarstLib::GetCorraPolicyBlobById(id), "") << id;
  }
  for (const char* name : {"p-1", "nobody", ""}) {
    EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName(name), "") << name;
  }
  for (const char* url : {"ds://no-default", "ds://unknown", ""}) {
    EXPECT_EQ(KarstLib::GetDefaultPolicyBlob(url), "") << url;
  }
  for (const char* url : {"ds://no-namespace", "ds://unknown", ""}) {
    EXPECT_EQ(KarstLib::GetPolicyBlobById("p-1", url), "") << url;
  }
  EXPECT_EQ(KarstLib::GetPolicyBlobById("", "ds://beta"), "");
}

// A look-up or listing that swallowed one of these would return as if
// nothing were stored; the sweep cannot tell. What escapes it checks.
TEST_F(LookupTest, ErrorsOutsideOneListedRecordReachTheCaller) {
  const FaultKind store = FaultKind::kStoreErrorFromThenOn;
  const std::tuple<const char*, FaultKind, std::function<void()>> rows[] = {
      {"GetValue", FaultKind::kBadAlloc, [] { KarstLib::ListPolicyInfo(); }},
      {"GetObjects", store, [] { KarstLib::ListDatastoreInfo(); }},
      {"GetObjects", store, [] { KarstLib::GetCorraPolicyBlobById("p-1"); }},
      {"GetValue", store, [] { KarstLib::GetCorraPolicyBlobById("p-2"); }},
      {"GetObject", store, [] { KarstLib::GetCorraPolicyBlobByName("gold"); }},
      {"GetSubObject", store, [] { KarstLib::GetCorraPolicyBlobByName("gold"); }},
      {"GetValue", store, [] { KarstLib::GetCorraPolicyBlobByName("gold"); }},
      {"GetValue", store, [] { KarstLib::GetDefaultPolicyBlob("ds://beta"); }},
  };
  for (const auto& [operation, kind, run] : rows) {
    store_->ClearFaults();
    store_->ClearLog();
    store_->Fail(operation, 1, kind);
    EXPECT_ANY_THROW(run()) << operation;
  }
}

}  // namespace
}  // namespace karst_test
