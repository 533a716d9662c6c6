// The etcd harness: clusters that answer, keep answering without their
// leader, and let in only the clients that TLS and auth ask for.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "EtcdCluster.h"
#include "TavoConfigStore/EtcdStore.h"

namespace karst_test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

TEST(EtcdClusterTest, OneMemberAnswers) {
  EtcdCluster cluster;
  cluster.Etcdctl({"put", "/k", "v"});
  EXPECT_EQ(cluster.Etcdctl({"get", "/k"}), "/k\nv\n");
}

TEST(EtcdClusterTest, ThreeMembersOutliveTheirLeaderWhichCatchesUpOnRestart) {
  EtcdCluster cluster({3});
  const int leader = cluster.LeaderIndex();
  cluster.Kill(leader);
  // etcd 3.4 holds a write sent while nobody leads until it times out.
  EXPECT_NE(cluster.LeaderIndex(), leader);
  cluster.Etcdctl({"put", "/k", "v"});
  cluster.Restart(leader);
  EXPECT_EQ(
      cluster.Etcdctl({"get", "/k", "--consistency=s", "--endpoints=" + cluster.Endpoint(leader)}),
      "/k\nv\n");
}

TEST(EtcdClusterTest, TlsAndAuthLetInOnlyClientsWithCertificateAndPassword) {
  EtcdCluster cluster({1, true, true});
  // The client as user and certificate rather than an EtcdClient: GCC 12 at
  // -O3 wrongly warns (maybe-uninitialized) that a string with a default
  // member initializer, nested in an array's aggregate, may be destroyed
  // before it was made.
  const struct {
    const char* user;
    bool cert;
    std::string key;
    std::string refusal;  // "" when let in
  } cases[] = {
      {"root", true, "/k", ""},
      {"root", false, "/k", "deadline exceeded"},
      {"", true, "/k", "permission denied"},
      {"limited", true, std::string(EtcdCluster::kLimitedPrefix) + "k", ""},
      {"limited", true, "/k", "permission denied"},
  };
  for (const auto& c : cases) {
    const EtcdClient client{c.user, c.cert};
    SCOPED_TRACE(client.user + (client.cert ? " with" : " without") + " certificate, " + c.key);
    const auto put = [&] { cluster.Etcdctl({"put", c.key, "v", "--dial-timeout=1s"}, client); };
    if (c.refusal.empty()) {
      EXPECT_NO_THROW(put());
    } else {
      EXPECT_THAT(put, ::testing::ThrowsMessage<std::runtime_error>(HasSubstr(c.refusal)));
    }
  }

  const auto o = TavoConfigStore::ParseEtcdLocator(cluster.Locator("a/b"));
  EXPECT_THAT((std::vector<std::string>{o.endpoints.at(0), o.prefix, o.user, o.password, o.caFile,
                                        o.certFile, o.keyFile}),
              ElementsAre(cluster.Endpoint(0), "a/b", "root", cluster.Password("root"),
                          cluster.CaFile(), cluster.CertFile(), cluster.KeyFile()));
}

}  // namespace
}  // namespace karst_test
