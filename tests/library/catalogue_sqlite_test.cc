// The catalogue on the real SQLite store, through the shared library as a
// host links it: byte-exact round trips, replacement, and persistence across
// processes.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>

#include "MemoryStoreFixture.h"
#include "TavoKarst/KarstLib.h"

namespace karst_test {
namespace {

using TavoKarst::KarstLib;
using TavoKarst::KarstPolicyInfo;

class CatalogueSqliteTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = ::testing::TempDir() + "karst-sqlite-XXXXXX";
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
    setenv("TAVO_CONFIGSTORE_PATH", (dir_ + "/nested/dir/store.db").c_str(), 1);
  }
  void TearDown() override {
    unsetenv("TAVO_CONFIGSTORE_PATH");
    std::filesystem::remove_all(dir_);
  }

  // Runs "body" in a child process and returns its exit status.
  static int InChild(const std::function<void()>& body) {
    const pid_t pid = fork();
    if (pid == 0) {
      try {
        body();
        _exit(0);
      } catch (...) {
        _exit(3);
      }
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128;
  }

  std::string dir_;
};

std::vector<KarstPolicyInfo> OddPolicies() {
  const std::string invalidUtf8("\xff\xfe\xc0\x80\xed\xa0\x80", 7);
  return {
      Policy(std::string("n\0ul", 4), std::string("\0id", 3),
             {{std::string("\0\0blob\0", 7), "CORRA"}, {invalidUtf8, invalidUtf8}},
             std::string("desc\0", 5), INT64_MIN),
      Policy("max", "p-max", {}, "", INT64_MAX),
      Policy("empty-blob", "", {{"", "ns"}}, "", 0),
      Policy("big", "p-big", {{std::string(1 << 20, '\xab'), "CORRA"}}, "one MiB", -1),
      Policy("", "empty-name", {}, "", 5),
  };
}

TEST_F(CatalogueSqliteTest, RoundTripsEveryByte) {
  const auto policies = OddPolicies();
  const std::vector<TavoKarst::KarstDatastoreInfo> datastores = {
      Datastore(std::string("ds://\0x", 7), std::string("\xff", 1), std::string("\0", 1)),
      Datastore("", "", "")};
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);
  EXPECT_EQ(KarstLib::ListPolicyInfo(), policies);
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), datastores);
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("big"), std::string(1 << 20, '\xab'));
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobById(std::string("\0id", 3)), std::string("\0\0blob\0", 7));
}

TEST_F(CatalogueSqliteTest, ReplacesWholeCollectionsAndLeavesTheOtherAlone) {
  std::vector<KarstPolicyInfo> many;
  for (int i = 0; i < 10000; ++i) {
    many.push_back(Policy("policy-" + std::to_string(i), "id-" + std::to_string(i % 97),
                          {{"blob-" + std::to_string(i), "CORRA"}}, "", i));
  }
  const std::vector<TavoKarst::KarstDatastoreInfo> datastores = {
      Datastore("ds://a", "CORRA", "id-5")};
  KarstLib::AddDatastoreInfo(datastores);
  KarstLib::AddPolicyInfo(OddPolicies());
  KarstLib::AddPolicyInfo(many);
  EXPECT_EQ(KarstLib::ListPolicyInfo(), many);
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), datastores);
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds://a"), "blob-5");
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("policy-9999"), "blob-9999");

  KarstLib::AddDatastoreInfo({});
  EXPECT_EQ(KarstLib::ListPolicyInfo().size(), many.size());
  KarstLib::Reset();
  EXPECT_TRUE(KarstLib::ListPolicyInfo().empty());
  EXPECT_EQ(KarstLib::GetDbHash(), (std::pair<std::string, std::string>("", "")));
}

TEST_F(CatalogueSqliteTest, SurvivesTheProcessThatWroteIt) {
  const auto policies = OddPolicies();
  const std::vector<TavoKarst::KarstDatastoreInfo> datastores = {Datastore("ds://a", "CORRA", "p")};
  ASSERT_EQ(InChild([&] {
              KarstLib::AddPolicyInfo(policies);
              KarstLib::AddDatastoreInfo(datastores);
            }),
            0);
  std::pair<std::string, std::string> hash;
  ASSERT_EQ(InChild([&] {
              if (KarstLib::ListPolicyInfo() != policies) _exit(1);
              if (KarstLib::ListDatastoreInfo() != datastores) _exit(2);
            }),
            0);
  EXPECT_EQ(KarstLib::ListPolicyInfo(), policies);
  hash = KarstLib::GetDbHash();
  // A child replaces what this process already read; the next read here sees it.
  ASSERT_EQ(InChild([] { KarstLib::AddPolicyInfo({Policy("after", "x")}); }), 0);
  EXPECT_NE(KarstLib::GetDbHash().first, hash.first);
  EXPECT_EQ(KarstLib::ListPolicyInfo().size(), 1u);
}

}  // namespace
}  // namespace karst_test
