// The four blob look-ups: what they find, what they return for any absence,
// and how often they open the store.

#include <gtest/gtest.h>

#include "MemoryStoreFixture.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "policy/PolicyStore.h"

namespace karst_test {
namespace {

using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;

class LookupTest : public MemoryStoreTest {
 protected:
  void SetUp() override {
    MemoryStoreTest::SetUp();
    KarstLib::AddPolicyInfo({
        Policy("gold", "p-1", {{"gold-corra", "CORRA"}, {"gold-beta", "ns-beta"}}),
        Policy("first-p2", "p-2", {{"first-beta", "ns-beta"}}),
        Policy("second-p2", "p-2", {{"second-corra", "CORRA"}}),
        Policy("lower", "p-3", {{"lower-corra", "corra"}, {"", "CORRA"}}),
        Policy("nul", std::string("p\0x", 3), {{std::string("b\0y", 3), "CORRA"}}),
    });
    KarstLib::AddDatastoreInfo({
        Datastore("ds://beta", "ns-beta", "p-1"),
        Datastore("ds://corra", "CORRA", "p-2"),
        Datastore("ds://no-default", "CORRA", ""),
        Datastore("ds://no-namespace", "", "p-1"),
    });
    probe_->ClearLog();
  }
};

TEST_F(LookupTest, FindsBlobsByIdNameAndDefault) {
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
}

TEST_F(LookupTest, EverythingMissingGivesEmpty) {
  // Byte-exact matching: case, trailing blank, a longer id, a NUL-truncated id.
  for (const std::string id : {"P-1", "p-1 ", "p-10", "p", "p-3", "p-404"}) {
    EXPECT_EQ(KarstLib::GetCorraPolicyBlobById(id), "") << id;
  }
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobById("p"), "");
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("lower"), "");  // "corra" is not "CORRA"
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("p-1"), "");    // by name, not by id
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("nobody"), "");
  EXPECT_EQ(KarstLib::GetPolicyBlobById("p-1", "ds://unknown"), "");
  EXPECT_EQ(KarstLib::GetPolicyBlobById("p-1", "ds://no-namespace"), "");
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds://unknown"), "");
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds://no-namespace"), "");
  EXPECT_EQ(probe_->Count("SetObject") + probe_->Count("BeginTransaction"), 0);
}

TEST_F(LookupTest, OpensTheStoreOnlyWhenItMustAndOnlyToRead) {
  using Calls = std::vector<std::string>;
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobById(""), "");
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName(""), "");
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob(""), "");
  EXPECT_EQ(KarstLib::GetPolicyBlobById("p-1", ""), "");
  EXPECT_EQ(TavoKarst::FindPolicyBlobById("p-1", ""), "");
  EXPECT_EQ(TavoKarst::FindPolicyBlobByName("gold", ""), "");
  EXPECT_TRUE(probe_->Calls().empty());

  // An empty policy id still reads the datastore's namespace, once.
  EXPECT_EQ(KarstLib::GetPolicyBlobById("", "ds://beta"), "");
  EXPECT_EQ(StoreCalls(), (Calls{"GetStore", "GetObject"}));

  probe_->ClearLog();
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds://no-default"), "");
  EXPECT_EQ(StoreCalls(), (Calls{"GetStore", "GetObject"}));

  probe_->ClearLog();
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds://beta"), "gold-beta");
  EXPECT_EQ(StoreCalls(),
            (Calls{"GetStore", "GetObject", "GetStore", "GetObject", "GetStore", "GetObjects"}));

  probe_->ClearLog();
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("gold"), "gold-corra");
  EXPECT_EQ(StoreCalls(), (Calls{"GetStore", "GetObject"}));
  EXPECT_EQ(probe_->Count("GetSubObject"), 1);
}

TEST_F(LookupTest, StoreErrorsReachTheCallerUnchanged) {
  // The scan reads "policy_id" from each policy; the second one fails.
  probe_->FailStoreError("GetValue", 2, "unreadable policy", 41);
  try {
    KarstLib::GetCorraPolicyBlobById("p-2");
    ADD_FAILURE() << "no exception";
  } catch (const ConfigStoreException& e) {
    EXPECT_STREQ(e.what(), "unreadable policy");
    EXPECT_EQ(e.Code(), 41);
  }
  for (const std::string operation : {"GetStore", "GetObject", "GetSubObject"}) {
    SCOPED_TRACE(operation);
    probe_->ClearFaults();
    probe_->ClearLog();
    probe_->FailStoreError(operation, 1, "failed " + operation, 42);
    EXPECT_THROW(KarstLib::GetCorraPolicyBlobByName("gold"), ConfigStoreException);
  }
  probe_->ClearFaults();
  probe_->ClearLog();
  probe_->FailStoreError("GetObjects", 1, "no scan", 43);
  EXPECT_THROW(KarstLib::GetDefaultPolicyBlob("ds://beta"), ConfigStoreException);
}

}  // namespace
}  // namespace karst_test
