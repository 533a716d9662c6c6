// Replacing a catalogue and resetting: the store calls made, and what reaches
// the caller when one of them fails.

#include <gtest/gtest.h>

#include <functional>
#include <new>

#include "MemoryStoreFixture.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "frame/StoreAccess.h"

namespace karst_test {
namespace {

using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;
using Calls = std::vector<std::string>;

const std::vector<TavoKarst::KarstPolicyInfo> kOldPolicies = {
    Policy("old-a", "p-a", {{"A", "CORRA"}}), Policy("old-b", "p-b")};
const std::vector<TavoKarst::KarstPolicyInfo> kNewPolicies = {
    Policy("new-1", "p-1", {{"blob-1", "CORRA"}, {"skipped", ""}, {"blob-2", "ns-beta"}}),
    Policy("new-2", "p-2"), Policy("new-3", "p-3", {{"x", "ns"}})};
const std::vector<TavoKarst::KarstDatastoreInfo> kOldDatastores = {
    Datastore("ds://old", "CORRA", "p-a")};
const std::vector<TavoKarst::KarstDatastoreInfo> kNewDatastores = {
    Datastore("ds://1", "CORRA", "p-1"), Datastore("ds://2", "ns-beta", "p-2"),
    Datastore("ds://3", "", "")};

class WriteTest : public MemoryStoreTest {
 protected:
  void Seed() {
    KarstLib::AddPolicyInfo(kOldPolicies);
    KarstLib::AddDatastoreInfo(kOldDatastores);
    probe_->ClearLog();
  }

  // The calls logged after the "nth" call of "operation".
  Calls CallsAfter(const std::string& operation, int nth) const {
    Calls all = probe_->Calls();
    for (std::size_t i = 0; i < all.size(); ++i) {
      if (all[i] == operation && --nth == 0) return Calls(all.begin() + i + 1, all.end());
    }
    ADD_FAILURE() << operation << " was not called often enough";
    return {};
  }
};

TEST_F(WriteTest, ReplaceMakesOneSetObjectPerRecordInOneTransaction) {
  Seed();
  KarstLib::AddPolicyInfo(kNewPolicies);
  EXPECT_EQ(StoreCalls(), (Calls{"GetStore", "BeginTransaction", "DeleteObjects", "SetObject",
                                 "SetObject", "SetObject", "CommitTransaction"}));
  // Four values, then per stored blob one sub-object with two values, all
  // before the object is written; the blob with an empty namespace costs nothing.
  const Calls all = probe_->Calls();
  const Calls firstPolicy(all.begin() + 3, all.begin() + 14);
  EXPECT_EQ(firstPolicy,
            (Calls{"SetValue", "SetValue", "SetValue", "SetValue", "CreateSubObject", "SetValue",
                   "SetValue", "CreateSubObject", "SetValue", "SetValue", "SetObject"}));

  EXPECT_EQ(KarstLib::ListDatastoreInfo(), kOldDatastores);
  auto listed = KarstLib::ListPolicyInfo();
  ASSERT_EQ(listed.size(), 3u);
  EXPECT_EQ(listed[0].blobs,
            (std::vector<TavoKarst::KarstPolicyBlob>{{"blob-1", "CORRA"}, {"blob-2", "ns-beta"}}));

  probe_->ClearLog();
  KarstLib::AddDatastoreInfo(kNewDatastores);
  EXPECT_EQ(StoreCalls(), (Calls{"GetStore", "BeginTransaction", "DeleteObjects", "SetObject",
                                 "SetObject", "SetObject", "CommitTransaction"}));
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), kNewDatastores);
  EXPECT_EQ(KarstLib::ListPolicyInfo().size(), 3u);
}

TEST_F(WriteTest, EmptyListClearsOnlyItsOwnCollection) {
  Seed();
  KarstLib::AddPolicyInfo({});
  EXPECT_EQ(StoreCalls(),
            (Calls{"GetStore", "BeginTransaction", "DeleteObjects", "CommitTransaction"}));
  EXPECT_TRUE(KarstLib::ListPolicyInfo().empty());
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), kOldDatastores);
  KarstLib::AddPolicyInfo(kOldPolicies);
  KarstLib::AddDatastoreInfo({});
  EXPECT_TRUE(KarstLib::ListDatastoreInfo().empty());
  EXPECT_EQ(KarstLib::ListPolicyInfo(), kOldPolicies);
}

struct FailurePoint {
  std::string operation;
  int nth;
};

// For each write and each place a store call can fail: the transaction is
// abandoned right after the failing call, the caller gets the store's message,
// code and detail, the old catalogue is intact, and the store still works.
TEST_F(WriteTest, StoreErrorAbandonsTheReplaceAtEveryFailurePoint) {
  struct Write {
    std::string name;
    std::function<void()> run;
    std::vector<FailurePoint> points;
  };
  const std::vector<Write> writes = {
      {"AddPolicyInfo",
       [] { KarstLib::AddPolicyInfo(kNewPolicies); },
       {{"GetStore", 1},
        {"BeginTransaction", 1},
        {"DeleteObjects", 1},
        {"SetValue", 1},
        {"SetValue", 4},
        {"CreateSubObject", 2},
        {"SetValue", 6},
        {"SetObject", 1},
        {"SetObject", 3},
        {"CommitTransaction", 1}}},
      {"AddDatastoreInfo",
       [] { KarstLib::AddDatastoreInfo(kNewDatastores); },
       {{"GetStore", 1},
        {"BeginTransaction", 1},
        {"DeleteObjects", 1},
        {"SetValue", 2},
        {"SetObject", 2},
        {"CommitTransaction", 1}}},
  };
  for (const Write& write : writes) {
    for (const FailurePoint& point : write.points) {
      SCOPED_TRACE(write.name + " failing at " + point.operation + " #" +
                   std::to_string(point.nth));
      TearDown();
      SetUp();
      Seed();
      auto detail = std::make_shared<int>(7);
      probe_->FailWith(point.operation, point.nth,
                       [detail] { throw ConfigStoreException("disk on fire", 517, detail); });
      try {
        write.run();
        ADD_FAILURE() << "no exception";
      } catch (const ConfigStoreException& e) {
        EXPECT_STREQ(e.what(), "disk on fire");
        EXPECT_EQ(e.Code(), 517);
        EXPECT_EQ(e.Detail().get(), detail.get());
      }
      const Calls expectedAfter =
          point.operation == "GetStore" ? Calls{} : Calls{"AbortTransaction"};
      EXPECT_EQ(CallsAfter(point.operation, point.nth), expectedAfter);

      probe_->ClearFaults();
      EXPECT_EQ(KarstLib::ListPolicyInfo(), kOldPolicies);
      EXPECT_EQ(KarstLib::ListDatastoreInfo(), kOldDatastores);
      write.run();  // nothing was left open
    }
  }
}

TEST_F(WriteTest, OtherExceptionsPassWithNeitherCommitNorAbort) {
  Seed();
  probe_->FailWith("SetObject", 2, [] { throw std::bad_alloc(); });
  EXPECT_THROW(KarstLib::AddPolicyInfo(kNewPolicies), std::bad_alloc);
  EXPECT_EQ(StoreCalls(),
            (Calls{"GetStore", "BeginTransaction", "DeleteObjects", "SetObject", "SetObject"}));

  TearDown();
  SetUp();
  // A core-library error that is not a store error is not a store error here either.
  probe_->FailWith("DeleteObjects", 1, [] { throw Velk::Lib::VelkException("not a store error"); });
  try {
    KarstLib::AddDatastoreInfo(kNewDatastores);
    ADD_FAILURE() << "no exception";
  } catch (const ConfigStoreException&) {
    ADD_FAILURE() << "converted to a store error";
  } catch (const Velk::Lib::VelkException& e) {
    EXPECT_STREQ(e.what(), "not a store error");
  }
  EXPECT_EQ(probe_->Count("AbortTransaction") + probe_->Count("CommitTransaction"), 0);
}

TEST_F(WriteTest, ResetDeletesBothAndIgnoresDeletionFailures) {
  KarstLib::Reset();  // an empty store
  EXPECT_EQ(StoreCalls(), (Calls{"GetStore", "BeginTransaction", "DeleteObjects", "DeleteObjects",
                                 "CommitTransaction"}));

  Seed();
  KarstLib::Reset();
  EXPECT_TRUE(KarstLib::ListPolicyInfo().empty());
  EXPECT_TRUE(KarstLib::ListDatastoreInfo().empty());

  // The policy deletion fails: datastores are still deleted and committed.
  Seed();
  probe_->FailStoreError("DeleteObjects", 1, "locked", 5);
  EXPECT_NO_THROW(KarstLib::Reset());
  EXPECT_EQ(StoreCalls(), (Calls{"GetStore", "BeginTransaction", "DeleteObjects", "DeleteObjects",
                                 "CommitTransaction"}));
  EXPECT_EQ(KarstLib::ListPolicyInfo(), kOldPolicies);
  EXPECT_TRUE(KarstLib::ListDatastoreInfo().empty());

  probe_->ClearFaults();
  Seed();
  probe_->FailStoreError("DeleteObjects", 1, "locked", 5, /*persistent=*/true);
  EXPECT_NO_THROW(KarstLib::Reset());
  EXPECT_EQ(probe_->Count("CommitTransaction"), 1);
  EXPECT_EQ(probe_->Count("AbortTransaction"), 0);
}

TEST_F(WriteTest, ResetReportsOpenBeginAndCommitFailures) {
  for (const std::string operation : {"GetStore", "BeginTransaction", "CommitTransaction"}) {
    SCOPED_TRACE(operation);
    TearDown();
    SetUp();
    Seed();
    probe_->FailStoreError(operation, 1, "no " + operation, 11);
    try {
      KarstLib::Reset();
      ADD_FAILURE() << "no exception";
    } catch (const ConfigStoreException& e) {
      EXPECT_EQ(e.what(), "no " + operation);
      EXPECT_EQ(e.Code(), 11);
    }
    EXPECT_EQ(probe_->Count("AbortTransaction"), operation == "GetStore" ? 0 : 1);
    probe_->ClearFaults();
    EXPECT_EQ(KarstLib::ListPolicyInfo(), kOldPolicies);
  }

  TearDown();
  SetUp();
  probe_->FailWith("DeleteObjects", 2, [] { throw std::bad_alloc(); });
  EXPECT_THROW(KarstLib::Reset(), std::bad_alloc);
  EXPECT_EQ(probe_->Count("AbortTransaction") + probe_->Count("CommitTransaction"), 0);
}

TEST_F(WriteTest, ClearingRethrowsACopyUnlessErrorsAreIgnored) {
  auto store = TavoKarst::OpenStore();
  probe_->FailStoreError("DeleteObjects", 1, "denied", 23, /*persistent=*/true);
  try {
    TavoKarst::ClearPolicies(store, false);
    ADD_FAILURE() << "no exception";
  } catch (const ConfigStoreException& e) {
    EXPECT_STREQ(e.what(), "denied");
    EXPECT_EQ(e.Code(), 23);
  }
  EXPECT_THROW(TavoKarst::ClearDatastores(store, false), ConfigStoreException);
  EXPECT_NO_THROW(TavoKarst::ClearPolicies(store, true));
  EXPECT_NO_THROW(TavoKarst::ClearDatastores(store, true));
}

}  // namespace
}  // namespace karst_test
