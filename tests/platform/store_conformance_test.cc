// Behaviour every configuration store backend must share, run against each.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <climits>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "TavoConfigStore/CallProbe.h"
#include "TavoConfigStore/ConfigStore.h"
#include "store_test_util.h"

namespace TavoConfigStore {
namespace {

using ::testing::ElementsAre;
using testutil::All;
using testutil::CodeOf;
using testutil::Describe;
using testutil::DescribeValues;
using testutil::Dump;
using testutil::Filter;
using testutil::Instances;
using testutil::Obj;
using testutil::ScratchDir;

class StoreConformance : public ::testing::TestWithParam<std::string> {
 protected:
  void SetUp() override {
    if (GetParam() == "memory") {
      store_ = NewMemoryStore();
    } else {
      dir_.emplace();
      store_ = NewSqliteStore(dir_->Path() + "/store.db");
    }
  }

  void TearDown() override {
    InstallCallProbe(nullptr);
    store_.reset();  // closes the file before the directory goes
    dir_.reset();
  }

  void Set(const std::shared_ptr<ConfigStoreObject>& o) { testutil::Set(*store_, o); }

  std::shared_ptr<ConfigStoreObject> Get(const std::string& key, const std::string& group,
                                         const std::string& component,
                                         const std::string& instance) {
    return store_->GetObject(ConfigStoreObjectId(key, group, component, instance));
  }

  std::optional<ScratchDir> dir_;
  std::shared_ptr<ConfigStore> store_;
};

TEST_P(StoreConformance, ValuesRoundTripByteExact) {
  const std::string withNul("a\0b\0", 4);
  const std::string highBytes("\xff\xfe\x80\x00\x7f", 5);
  const std::string badUtf8("\xc3\x28\xe2\x82\xf0\x9f", 6);
  std::string big(1 << 20, '\0');
  for (std::size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>((i * 131 + 7) % 256);

  // Identifier parts are byte strings as well.
  const std::string key("k\0\xff", 3);
  auto o = Obj(key, "g\xc3\x28", "c", std::string("i\0", 2));
  o->SetValue("empty", std::string());
  o->SetValue("nul", withNul);
  o->SetValue("high", highBytes);
  o->SetValue("utf8", badUtf8);
  o->SetValue("big", big);
  o->SetValue("min", static_cast<long long>(LLONG_MIN));
  o->SetValue("max", static_cast<long long>(LLONG_MAX));
  o->SetValue("zero", 0LL);
  o->SetValue("minus", -1LL);
  o->SetValue("kind", std::string("was a string"));
  o->SetValue("kind", 42LL);  // changes kind, keeps its place
  o->CreateSubObject(SubObjectId(std::string("a\0", 2), "\xff"))->SetValue("v", withNul);
  Set(o);
  // A neighbour differing only after a NUL must stay a different object.
  Set(Obj("k", "g\xc3\x28", "c", std::string("i\0", 2)));

  const std::string expected = Describe(*o);
  auto back = Get(key, "g\xc3\x28", "c", std::string("i\0", 2));
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(Describe(*back), expected);
  const auto listed = store_->GetObjects(Filter(key, "", "", ""));
  ASSERT_EQ(listed.size(), 1u);
  EXPECT_EQ(Describe(*listed[0]), expected);

  std::string s;
  ASSERT_TRUE(back->GetValue("big", &s));
  EXPECT_EQ(s, big);
  ASSERT_TRUE(back->GetValue("nul", &s));
  EXPECT_EQ(s, withNul);
  ASSERT_TRUE(back->GetValue("empty", &s));
  EXPECT_EQ(s, "");
  long long n = 0;
  ASSERT_TRUE(back->GetValue("min", &n));
  EXPECT_EQ(n, LLONG_MIN);
  ASSERT_TRUE(back->GetValue("max", &n));
  EXPECT_EQ(n, LLONG_MAX);
  ASSERT_TRUE(back->GetValue("kind", &n));
  EXPECT_EQ(n, 42);
  EXPECT_EQ(back->Values()[9].name, "kind");

  // Missing or of the other kind: false, and the output is left alone.
  s = "untouched";
  n = 7;
  EXPECT_FALSE(back->GetValue("absent", &s));
  EXPECT_FALSE(back->GetValue("absent", &n));
  EXPECT_FALSE(back->GetValue("kind", &s));
  EXPECT_FALSE(back->GetValue("nul", &n));
  EXPECT_EQ(s, "untouched");
  EXPECT_EQ(n, 7);
}

TEST_P(StoreConformance, SubObjectsAndFilters) {
  auto o = Obj("pool", "storage", "tavo", "p1");
  o->CreateSubObject(SubObjectId("blobs", "b1"))->SetValue("size", 1LL);
  o->CreateSubObject(SubObjectId("other", "x"))->SetValue("size", 9LL);
  o->CreateSubObject(SubObjectId("blobs", "b2"))->SetValue("size", 2LL);
  auto b3 = o->CreateSubObject(SubObjectId("blobs", "b3"));
  b3->SetValue("size", 3LL);
  // Same array and key: an empty replacement in the same place.
  auto b2 = o->CreateSubObject(SubObjectId("blobs", "b2"));
  b2->SetValue("name", std::string("second b2"));
  o->CreateSubObject(SubObjectId("blobs", ""))->SetValue("size", 0LL);
  Set(o);

  auto back = Get("pool", "storage", "tavo", "p1");
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(Describe(*back), Describe(*o));
  auto blobs = back->GetSubObjectInstances(Filter("blobs", "", "", ""));
  ASSERT_EQ(blobs.size(), 4u);
  std::vector<std::string> described;
  for (const auto& b : blobs) described.push_back(DescribeValues(b->Values()));
  EXPECT_THAT(described, ElementsAre(" size=i1", " name=s'second b2'", " size=i3", " size=i0"));
  ASSERT_EQ(back->GetSubObjectInstances(Filter("blobs", "", "", "b3")).size(), 1u);
  EXPECT_EQ(back->GetSubObjectInstances(Filter("", "", "", "")).size(), 5u);
  EXPECT_TRUE(back->GetSubObjectInstances(Filter("none", "", "", "")).empty());
  ASSERT_NE(back->GetSubObject(SubObjectId("other", "x")), nullptr);
  EXPECT_EQ(back->GetSubObject(SubObjectId("other", "b1")), nullptr);
  long long size = 0;
  EXPECT_FALSE(back->GetSubObject(SubObjectId("blobs", "b2"))->GetValue("size", &size));

  // Collections: only (pool, storage, tavo, *) in write order.
  Set(Obj("pool", "storage", "tavo", "p2"));
  Set(Obj("pool", "storage", "other", "p3"));
  Set(Obj("pool2", "storage", "tavo", "p4"));
  Set(Obj("pool", "state", "tavo", "p5"));
  Set(Obj("pool", "storage", "tavo", "p0"));
  Set(Obj("pool", "storage", "tavo", ""));
  EXPECT_THAT(Instances(store_->GetObjects(Filter("pool", "storage", "tavo", ""))),
              ElementsAre("p1", "p2", "p0", ""));
  // Each part on its own, and an exact id.
  EXPECT_THAT(Instances(store_->GetObjects(Filter("pool", "", "", ""))),
              ElementsAre("p1", "p2", "p3", "p5", "p0", ""));
  EXPECT_THAT(Instances(store_->GetObjects(Filter("", "state", "", ""))), ElementsAre("p5"));
  EXPECT_THAT(Instances(store_->GetObjects(Filter("", "", "other", ""))), ElementsAre("p3"));
  EXPECT_THAT(Instances(store_->GetObjects(Filter("", "", "", "p4"))), ElementsAre("p4"));
  EXPECT_THAT(Instances(store_->GetObjects(Filter("pool", "storage", "tavo", "p2"))),
              ElementsAre("p2"));
  EXPECT_THAT(Instances(store_->GetObjects(Filter("", "storage", "tavo", ""))),
              ElementsAre("p1", "p2", "p4", "p0", ""));
  EXPECT_TRUE(store_->GetObjects(Filter("pool", "storage", "nope", "")).empty());
}

TEST_P(StoreConformance, SetObjectReplacesWholeAndMovesToEnd) {
  for (const char* instance : {"a", "b", "c"}) {
    auto o = Obj("k", "g", "c", instance);
    o->SetValue("old", 1LL);
    o->CreateSubObject(SubObjectId("arr", "s"))->SetValue("old", 1LL);
    Set(o);
  }
  auto replacement = Obj("k", "g", "c", "a");
  replacement->SetValue("new", std::string("v"));
  Set(replacement);

  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("b", "c", "a"));
  auto back = Get("k", "g", "c", "a");
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(Describe(*back), "(k|g|c|a) new=s'v'");

  // Rewriting the newest object keeps it last; the empty instance is an
  // ordinary identifier.
  Set(Obj("k", "g", "c", ""));
  Set(Obj("k", "g", "c", "c"));
  Set(Obj("k", "g", "c", "c"));
  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("b", "a", "", "c"));
  ASSERT_NE(Get("k", "g", "c", ""), nullptr);
}

TEST_P(StoreConformance, WriteOrderAndAbsence) {
  std::vector<std::string> expected;
  for (int i = 0; i < 40; ++i) {
    // Instance names that sort differently from write order.
    const std::string instance = std::to_string((i * 17) % 40);
    Set(Obj(i % 2 ? "odd" : "even", "g", "c", instance));
    expected.push_back(instance);
  }
  EXPECT_EQ(Instances(store_->GetObjects(All())), expected);

  // Deleting the newest and writing again still appends.
  store_->DeleteObjects(Filter("odd", "g", "c", expected.back()));
  expected.pop_back();
  Set(Obj("even", "g", "c", "late"));
  expected.push_back("late");
  EXPECT_EQ(Instances(store_->GetObjects(All())), expected);

  EXPECT_EQ(Get("even", "g", "c", "absent"), nullptr);
  EXPECT_EQ(Get("even", "g", "x", "0"), nullptr);
  EXPECT_EQ(Get("even", "g", "c", ""), nullptr);  // not a wildcard here
  EXPECT_NE(Get("even", "g", "c", "0"), nullptr);
}

TEST_P(StoreConformance, DeleteObjectsOnlyMatching) {
  Set(Obj("a", "g1", "c1", "1"));
  Set(Obj("a", "g1", "c2", "2"));
  Set(Obj("a", "g2", "c1", "3"));
  Set(Obj("b", "g1", "c1", "4"));
  Set(Obj("b", "g1", "c1", "5"));

  store_->DeleteObjects(Filter("a", "g1", "", ""));
  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("3", "4", "5"));
  store_->DeleteObjects(Filter("", "", "c1", "4"));
  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("3", "5"));
  store_->DeleteObjects(Filter("none", "", "", ""));
  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("3", "5"));
  store_->DeleteObjects(All());
  EXPECT_TRUE(store_->GetObjects(All()).empty());
  EXPECT_EQ(Get("b", "g1", "c1", "5"), nullptr);
}

TEST_P(StoreConformance, CommitKeepsAndAbortRestoresExactly) {
  for (const char* instance : {"1", "2", "3"}) {
    auto o = Obj("k", "g", "c", instance);
    o->SetValue("v", std::string(instance));
    o->CreateSubObject(SubObjectId("arr", instance))->SetValue("n", 1LL);
    Set(o);
  }
  const std::vector<std::string> before = Dump(*store_);

  store_->BeginTransaction();
  auto replaced = Obj("k", "g", "c", "1");
  replaced->SetValue("v", std::string("replaced"));
  Set(replaced);
  store_->DeleteObjects(Filter("k", "g", "c", "2"));
  Set(Obj("k", "g", "c", "4"));
  // The transaction sees its own writes.
  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("3", "1", "4"));
  EXPECT_EQ(Get("k", "g", "c", "2"), nullptr);
  store_->AbortTransaction();
  EXPECT_EQ(Dump(*store_), before);

  store_->AbortTransaction();  // none open: nothing happens
  EXPECT_EQ(Dump(*store_), before);

  store_->BeginTransaction();
  Set(replaced);
  store_->DeleteObjects(Filter("k", "g", "c", "2"));
  store_->CommitTransaction();
  store_->AbortTransaction();  // after commit: nothing to undo
  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("3", "1"));
  EXPECT_EQ(Describe(*Get("k", "g", "c", "1")), "(k|g|c|1) v=s'replaced'");
}

TEST_P(StoreConformance, TransactionMisuseFailsWithItsCode) {
  EXPECT_EQ(CodeOf([&] { store_->CommitTransaction(); }), kErrorNoTransaction);

  store_->BeginTransaction();
  Set(Obj("k", "g", "c", "inside"));
  EXPECT_EQ(CodeOf([&] { store_->BeginTransaction(); }), kErrorNestedTransaction);
  // The failed Begin left the open transaction alone.
  EXPECT_NE(Get("k", "g", "c", "inside"), nullptr);
  store_->CommitTransaction();
  EXPECT_EQ(CodeOf([&] { store_->CommitTransaction(); }), kErrorNoTransaction);
  EXPECT_NE(Get("k", "g", "c", "inside"), nullptr);

  store_->BeginTransaction();
  EXPECT_EQ(CodeOf([&] { store_->BeginTransaction(); }), kErrorNestedTransaction);
  store_->AbortTransaction();
  EXPECT_EQ(CodeOf([&] { store_->CommitTransaction(); }), kErrorNoTransaction);
}

TEST_P(StoreConformance, StoredCopiesAreIndependentOfCallerObjects) {
  auto o = Obj("k", "g", "c", "i");
  o->SetValue("v", std::string("stored"));
  auto sub = o->CreateSubObject(SubObjectId("arr", "s"));
  sub->SetValue("n", 1LL);
  Set(o);
  const std::vector<std::string> stored = Dump(*store_);

  o->SetValue("v", std::string("changed"));
  o->SetValue("extra", 1LL);
  sub->SetValue("n", 2LL);
  o->CreateSubObject(SubObjectId("arr", "t"));
  EXPECT_EQ(Dump(*store_), stored);

  auto read = Get("k", "g", "c", "i");
  ASSERT_NE(read, nullptr);
  read->SetValue("v", std::string("changed"));
  read->GetSubObject(SubObjectId("arr", "s"))->SetValue("n", 3LL);
  read->CreateSubObject(SubObjectId("arr", "u"));
  auto listed = store_->GetObjects(All());
  listed[0]->SetValue("v", std::string("changed too"));
  EXPECT_EQ(Dump(*store_), stored);
}

TEST_P(StoreConformance, EveryOperationReportsToTheProbeFirst) {
  auto o = Obj("k", "g", "c", "i");
  o->SetValue("v", 1LL);
  o->CreateSubObject(SubObjectId("arr", "s"))->SetValue("n", 1LL);

  auto probe = std::make_shared<FaultInjector>();
  InstallCallProbe(probe);
  Set(o);
  store_->GetObject(o->Id());
  store_->GetObjects(All());
  store_->BeginTransaction();
  store_->DeleteObjects(All());
  store_->AbortTransaction();
  store_->BeginTransaction();
  store_->CommitTransaction();
  // Backends copy objects without going through the probed object calls.
  EXPECT_THAT(probe->Calls(), ElementsAre("SetObject", "GetObject", "GetObjects",
                                          "BeginTransaction", "DeleteObjects", "AbortTransaction",
                                          "BeginTransaction", "CommitTransaction"));

  // An injected failure happens before the operation does anything.
  probe->FailStoreError("SetObject", 2, "injected", kErrorInjected);
  probe->FailStoreError("DeleteObjects", 2, "injected", kErrorInjected);
  probe->FailStoreError("BeginTransaction", 3, "injected", kErrorInjected);
  auto other = Obj("k", "g", "c", "other");
  EXPECT_EQ(CodeOf([&] { Set(other); }), kErrorInjected);
  EXPECT_EQ(CodeOf([&] { store_->DeleteObjects(All()); }), kErrorInjected);
  EXPECT_EQ(CodeOf([&] { store_->BeginTransaction(); }), kErrorInjected);
  InstallCallProbe(nullptr);
  EXPECT_THAT(Instances(store_->GetObjects(All())), ElementsAre("i"));
  // The failed Begin opened nothing.
  EXPECT_EQ(CodeOf([&] { store_->CommitTransaction(); }), kErrorNoTransaction);
}

INSTANTIATE_TEST_SUITE_P(Backends, StoreConformance, ::testing::Values("memory", "sqlite"),
                         [](const ::testing::TestParamInfo<std::string>& info) {
                           return info.param;
                         });

}  // namespace
}  // namespace TavoConfigStore
