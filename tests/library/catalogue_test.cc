// The catalogue on the SQLite and the etcd store, through the shared library
// as a host links it: every byte comes back, and a second connection to the
// same store sees what the first one wrote.

#include <gtest/gtest.h>

#include "EtcdCluster.h"
#include "FaultStore.h"
#include "Files.h"
#include "Records.h"

namespace karst_test {
namespace {

using TavoKarst::KarstLib;

class CatalogueTest : public ::testing::TestWithParam<std::string> {
 protected:
  // Where the store is, for the default store and for a second connection.
  std::string Locator() {
    return GetParam() == "sqlite" ? dir_.File("store.db")
                                  : SharedEtcdCluster().Locator("catalogue");
  }

  ScratchDir dir_;
};

TEST_P(CatalogueTest, RoundTripsEveryByteAndASecondConnectionSeesIt) {
  UseStoreAt(Locator());
  const std::string odd("\xff\xfe\xc0\x80\xed\xa0\x80", 7);  // not UTF-8
  const std::vector<TavoKarst::KarstPolicyInfo> policies = {
      Policy(std::string("n\0ul", 4), std::string("\0id", 3),
             {{std::string("\0\0blob\0", 7), "CORRA"}, {odd, odd}}, std::string("desc\0", 5),
             INT64_MIN),
      Policy("", "", {{"", "ns"}}, "", 0),
  };
  const std::vector<TavoKarst::KarstDatastoreInfo> datastores = {
      Datastore(std::string("ds://\0x", 7), odd, std::string("\0", 1)), Datastore("", "", "")};
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);
  EXPECT_EQ(KarstLib::ListPolicyInfo(), policies);
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), datastores);

  {
    ScopedFaultStore second(TavoConfigStore::OpenStore(Locator()));
    EXPECT_EQ(KarstLib::ListPolicyInfo(), policies);
    EXPECT_EQ(KarstLib::ListDatastoreInfo(), datastores);
    KarstLib::AddPolicyInfo({Policy("after", "p")});
  }
  // The first connection, which read before, sees the second one's write.
  EXPECT_EQ(KarstLib::ListPolicyInfo(), (std::vector{Policy("after", "p")}));
}

INSTANTIATE_TEST_SUITE_P(Stores, CatalogueTest, ::testing::Values("sqlite", "etcd"),
                         [](const auto& info) { return info.param; });

}  // namespace
}  // namespace karst_test
