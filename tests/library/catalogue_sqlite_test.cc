// The catalogue on the SQLite store, through the shared library as a host
// links it: every byte comes back, and a second connection to the file sees
// what the first one wrote.

#include <gtest/gtest.h>

#include "FaultStore.h"
#include "Files.h"
#include "Records.h"

namespace karst_test {
namespace {

using TavoKarst::KarstLib;

TEST(CatalogueSqliteTest, RoundTripsEveryByteAndASecondConnectionSeesIt) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
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
    ScopedFaultStore second(TavoConfigStore::NewSqliteStore(dir.File("store.db")));
    EXPECT_EQ(KarstLib::ListPolicyInfo(), policies);
    EXPECT_EQ(KarstLib::ListDatastoreInfo(), datastores);
    KarstLib::AddPolicyInfo({Policy("after", "p")});
  }
  // The first connection, which read before, sees the second one's write.
  EXPECT_EQ(KarstLib::ListPolicyInfo(), (std::vector{Policy("after", "p")}));
}

}  // namespace
}  // namespace karst_test
