// Listing both catalogues: the store's order, values taken from what is
// stored, and one unreadable record dropped without losing the others.

#include <gtest/gtest.h>

#include <new>

#include "MemoryStoreFixture.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "frame/StoreAccess.h"

namespace karst_test {
namespace {

using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;

class ListTest : public MemoryStoreTest {
 protected:
  // Writes an object straight into the store, bypassing the library.
  void Put(const std::string& key, const std::string& instance,
           const std::function<void(TavoConfigStore::ConfigStoreObject&)>& fill) {
    auto object = TavoKarst::NewObject(key, instance);
    fill(*object);
    std::int32_t flags = 0;
    store_->SetObject(object, flags);
  }
};

const std::vector<TavoKarst::KarstPolicyInfo> kPolicies = {
    Policy("zeta", "p-9", {{"z", "CORRA"}}, "last name first"),
    Policy("alpha", "p-1", {{"a2", "ns-b"}, {"a1", "ns-a"}}, "", -5),
    Policy("mid", "p-9", {}, "same id as zeta", INT64_MAX)};

TEST_F(ListTest, KeepsStoreOrderAndEveryField) {
  KarstLib::AddPolicyInfo(kPolicies);
  probe_->ClearLog();
  EXPECT_EQ(KarstLib::ListPolicyInfo(), kPolicies);
  EXPECT_EQ(StoreCalls(), (std::vector<std::string>{"GetStore", "GetObjects"}));
  EXPECT_EQ(probe_->Count("BeginTransaction"), 0);

  // Fields come from the stored values, never from the instance id; missing
  // values read as "" and a missing generation number as 0.
  KarstLib::Reset();
  Put("karst_policies", "instance-name", [](TavoConfigStore::ConfigStoreObject& o) {
    o.SetValue("name", std::string("value-name"));
    o.CreateSubObject({"blobs", "key-ns"})->SetValue("blob", std::string("b"));
    o.CreateSubObject({"other", "x"})->SetValue("blob", std::string("not a blob"));
  });
  Put("karst_datastores", "ds://instance", [](TavoConfigStore::ConfigStoreObject& o) {
    o.SetValue("datastore_namespace", std::string("ns"));
  });
  const auto policies = KarstLib::ListPolicyInfo();
  ASSERT_EQ(policies.size(), 1u);
  EXPECT_EQ(policies[0], Policy("value-name", "", {{"b", ""}}, "", 0));
  EXPECT_EQ(KarstLib::ListDatastoreInfo(),
            (std::vector<TavoKarst::KarstDatastoreInfo>{Datastore("", "ns", "")}));
}

TEST_F(ListTest, DropsExactlyTheUnreadableRecord) {
  KarstLib::AddPolicyInfo(kPolicies);
  // zeta reads 4 values and 2 per blob: the 7th GetValue is alpha's first.
  probe_->FailStoreError("GetValue", 7, "bad row", 11);
  EXPECT_EQ(KarstLib::ListPolicyInfo(),
            (std::vector<TavoKarst::KarstPolicyInfo>{kPolicies[0], kPolicies[2]}));

  probe_->ClearFaults();
  probe_->ClearLog();
  probe_->FailStoreError("GetSubObjectInstances", 3, "bad blobs", 12);
  EXPECT_EQ(KarstLib::ListPolicyInfo(),
            (std::vector<TavoKarst::KarstPolicyInfo>{kPolicies[0], kPolicies[1]}));

  probe_->ClearFaults();
  probe_->FailStoreError("GetValue", 1, "all bad", 13, /*persistent=*/true);
  EXPECT_TRUE(KarstLib::ListPolicyInfo().empty());

  probe_->ClearFaults();
  probe_->ClearLog();
  KarstLib::AddDatastoreInfo({Datastore("ds://1", "a", "p"), Datastore("ds://2", "b", "q"),
                              Datastore("ds://3", "c", "r")});
  probe_->FailStoreError("GetValue", 6, "bad datastore", 14);  // the last value of ds://2
  EXPECT_EQ(KarstLib::ListDatastoreInfo(),
            (std::vector<TavoKarst::KarstDatastoreInfo>{Datastore("ds://1", "a", "p"),
                                                        Datastore("ds://3", "c", "r")}));
}

TEST_F(ListTest, FailuresOutsideOneRecordEndTheListing) {
  KarstLib::AddPolicyInfo(kPolicies);
  KarstLib::AddDatastoreInfo({Datastore("ds://1", "a", "p")});
  for (const std::string operation : {"GetStore", "GetObjects"}) {
    SCOPED_TRACE(operation);
    probe_->ClearFaults();
    probe_->ClearLog();
    probe_->FailStoreError(operation, 1, "cannot read " + operation, 31, /*persistent=*/true);
    try {
      KarstLib::ListPolicyInfo();
      ADD_FAILURE() << "no exception";
    } catch (const ConfigStoreException& e) {
      EXPECT_EQ(e.what(), "cannot read " + operation);
      EXPECT_EQ(e.Code(), 31);
    }
    EXPECT_THROW(KarstLib::ListDatastoreInfo(), ConfigStoreException);
  }
  probe_->ClearFaults();
  probe_->ClearLog();
  // Inside a record only store errors are dropped: anything else ends the call.
  probe_->FailWith("GetValue", 5, [] { throw std::bad_alloc(); });
  EXPECT_THROW(KarstLib::ListPolicyInfo(), std::bad_alloc);
  probe_->ClearFaults();
  probe_->ClearLog();
  probe_->FailWith("GetValue", 2, [] { throw Velk::Lib::VelkException("core failure"); });
  EXPECT_THROW(KarstLib::ListDatastoreInfo(), Velk::Lib::VelkException);
}

}  // namespace
}  // namespace karst_test
