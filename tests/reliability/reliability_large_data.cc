// Large and odd data, byte-exact back: 100,000 policies, a 10 MiB blob, and
// NUL, 0xFF and invalid UTF-8 in every field and every look-up key, read in
// the writing process and again in a new one.

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <random>
#include <string>
#include <vector>

#include "TavoKarst/KarstLib.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstLib;
using TavoKarst::KarstPolicyBlob;
using TavoKarst::KarstPolicyInfo;

std::string RandomBytes(std::size_t n, std::mt19937_64& rng) {
  std::string s(n, '\0');
  for (std::size_t i = 0; i < n; i += 8) {
    const std::uint64_t v = rng();
    for (std::size_t j = 0; j < 8 && i + j < n; ++j) s[i + j] = static_cast<char>(v >> (8 * j));
  }
  return s;
}

// A digest of a whole listing, so a new process can report it in a line.
std::string Fingerprint(const std::vector<KarstPolicyInfo>& policies,
                        const std::vector<KarstDatastoreInfo>& datastores) {
  std::uint64_t h = 1469598103934665603ull;
  auto mix = [&h](const std::string& s) {
    for (unsigned char c : s) h = (h ^ c) * 1099511628211ull;
    h = (h ^ s.size()) * 1099511628211ull;
  };
  for (const auto& p : policies) {
    mix(p.name);
    mix(p.policy_id);
    mix(p.description);
    mix(std::to_string(p.generation_number));
    for (const auto& b : p.blobs) {
      mix(b.datastore_namespace);
      mix(b.blob);
    }
  }
  for (const auto& d : datastores) {
    mix(d.url);
    mix(d.datastore_namespace);
    mix(d.drp_policy_id);
  }
  return std::to_string(policies.size()) + "/" + std::to_string(datastores.size()) + "/" +
         std::to_string(h);
}

// What a new process lists, as a fingerprint.
std::string FingerprintInFreshProcess() {
  const ChildResult r = RunChild([](int fd) {
    WriteAll(fd, Fingerprint(KarstLib::ListPolicyInfo(), KarstLib::ListDatastoreInfo()));
  });
  return r.exited && r.code == 0 ? r.output : "failed: " + r.Describe();
}

double Seconds(std::chrono::steady_clock::time_point since) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - since).count();
}

std::string Fixed(double v) {
  char text[32];
  std::snprintf(text, sizeof text, "%.2f", v);
  return text;
}

class LargeDataTest : public ::testing::Test {
 protected:
  void SetUp() override { UseStoreAt(dir_.File("store.db")); }
  ScratchDir dir_;
};

TEST_F(LargeDataTest, HundredThousandPolicies) {
  const int n = Scaled(100000, 20000);
  std::mt19937_64 rng(3);
  std::vector<KarstPolicyInfo> policies(n);
  for (int i = 0; i < n; ++i) {
    KarstPolicyInfo& p = policies[i];
    p.name = "policy-" + std::to_string(i);
    p.policy_id = "id-" + std::to_string(i);
    p.description = RandomBytes(i % 40, rng);
    p.generation_number = static_cast<std::int64_t>(rng());
    p.blobs = {{RandomBytes(16 + i % 64, rng), "CORRA"},
               {RandomBytes(i % 8, rng), std::string("ns\0", 3) + std::to_string(i % 5)}};
  }
  const std::vector<KarstDatastoreInfo> datastores = {
      {"ds-last", "CORRA", policies.back().policy_id}};

  auto start = std::chrono::steady_clock::now();
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);
  const double writeSeconds = Seconds(start);
  start = std::chrono::steady_clock::now();
  const auto listed = KarstLib::ListPolicyInfo();
  const double listSeconds = Seconds(start);
  ASSERT_EQ(listed.size(), policies.size());
  int mismatched = 0;
  for (int i = 0; i < n; ++i) mismatched += listed[i] == policies[i] ? 0 : 1;
  EXPECT_EQ(mismatched, 0);

  // Look-ups at the far end of the catalogue.
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName(policies[n / 2].name),
            policies[n / 2].blobs[0].blob);
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobById(policies.back().policy_id),
            policies.back().blobs[0].blob);
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob("ds-last"), policies.back().blobs[0].blob);
  const auto digests = KarstLib::GetDbHash();
  EXPECT_FALSE(digests.first.empty());
  EXPECT_EQ(KarstLib::GetDbHash(), digests);

  const std::string fresh = FingerprintInFreshProcess();
  EXPECT_EQ(fresh, Fingerprint(policies, datastores));

  // Replacing the large catalogue by a small one drops every old record.
  start = std::chrono::steady_clock::now();
  KarstLib::AddPolicyInfo({policies[7]});
  const double shrinkSeconds = Seconds(start);
  EXPECT_EQ(KarstLib::ListPolicyInfo(), std::vector<KarstPolicyInfo>{policies[7]});

  ReportFigures("large-policies",
                "large-policies: " + std::to_string(n) +
                    " policies byte-exact back in the "
                    "writing process (mismatches " +
                    std::to_string(mismatched) + ") and in a new one (" +
                    (fresh == Fingerprint(policies, datastores) ? "same" : "DIFFERENT") +
                    "); replace " + Fixed(writeSeconds) + " s, listing " + Fixed(listSeconds) +
                    " s, replace by one policy " + Fixed(shrinkSeconds) + " s");
}

TEST_F(LargeDataTest, TenMebibyteBlob) {
  std::mt19937_64 rng(4);
  const std::string blob = RandomBytes(10 << 20, rng);
  ASSERT_NE(blob.find('\0'), std::string::npos);
  ASSERT_NE(blob.find('\xff'), std::string::npos);
  std::vector<KarstPolicyInfo> policies(2);
  policies[0].name = "big";
  policies[0].policy_id = "big-id";
  policies[0].description = RandomBytes(1 << 20, rng);
  policies[0].blobs = {{blob, "CORRA"}, {blob.substr(0, 3 << 20), "ns"}};
  policies[1].name = "after";
  policies[1].blobs = {{"small", "CORRA"}};
  const std::vector<KarstDatastoreInfo> datastores = {{RandomBytes(1 << 20, rng), "ns", "big-id"}};
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);
  const bool listedSame = KarstLib::ListPolicyInfo() == policies;
  EXPECT_TRUE(listedSame);
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), datastores);
  const bool lookedUp = KarstLib::GetCorraPolicyBlobByName("big") == blob;
  EXPECT_TRUE(lookedUp);
  EXPECT_EQ(KarstLib::GetDefaultPolicyBlob(datastores[0].url), blob.substr(0, 3 << 20));
  EXPECT_EQ(KarstLib::GetCorraPolicyBlobByName("after"), "small");
  const bool fresh = FingerprintInFreshProcess() == Fingerprint(policies, datastores);
  EXPECT_TRUE(fresh);
  ReportFigures("large-blob", std::string("large-blob: a 10 MiB blob, a 1 MiB description and a "
                                          "1 MiB url of random bytes: listing ") +
                                  (listedSame ? "exact" : "DIFFERENT") + ", look-up " +
                                  (lookedUp ? "exact" : "DIFFERENT") + ", new process " +
                                  (fresh ? "exact" : "DIFFERENT"));
}

TEST_F(LargeDataTest, OddBytesInEveryFieldAndKey) {
  // Strings that differ only after a NUL, prefixes of each other, invalid
  // UTF-8 (a lone continuation byte, an overlong NUL, a surrogate, 0xFF),
  // and the empty string.
  const std::vector<std::string> odd = {std::string("a\0b", 3),
                                        std::string("a\0c", 3),
                                        std::string("a", 1),
                                        std::string("\0", 1),
                                        std::string("\xff\xfe", 2),
                                        std::string("\x80", 1),
                                        std::string("\xc0\x80", 2),
                                        std::string("\xed\xa0\x80", 3),
                                        std::string("\xf4\x90\x80\x80", 4),
                                        std::string(""),
                                        std::string("a\0", 2),
                                        std::string("\n\r\t\\\"", 5)};
  std::vector<KarstPolicyInfo> policies;
  std::vector<KarstDatastoreInfo> datastores;
  const std::int64_t generations[] = {INT64_MIN, INT64_MAX, -1, 0, 1};
  for (std::size_t i = 0; i < odd.size(); ++i) {
    KarstPolicyInfo p;
    p.name = odd[i];
    p.policy_id = odd[(i + 1) % odd.size()];
    p.description = odd[(i + 2) % odd.size()] + odd[i];
    p.generation_number = generations[i % 5];
    p.blobs = {{"corra:" + odd[i], "CORRA"}};
    for (std::size_t j = 0; j < odd.size(); ++j) {
      if (!odd[j].empty()) p.blobs.push_back({"blob " + odd[i] + "|" + odd[j], odd[j]});
    }
    policies.push_back(p);
    datastores.push_back({odd[i], odd[(i + 3) % odd.size()], odd[(i + 1) % odd.size()]});
  }
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);

  int checks = 0, wrong = 0;
  auto expect = [&](const std::string& got, const std::string& want, const std::string& what) {
    ++checks;
    if (got != want) {
      ++wrong;
      ADD_FAILURE() << what << ": got " << ::testing::PrintToString(got) << ", want "
                    << ::testing::PrintToString(want);
    }
  };
  EXPECT_EQ(KarstLib::ListPolicyInfo(), policies);
  EXPECT_EQ(KarstLib::ListDatastoreInfo(), datastores);
  for (std::size_t i = 0; i < odd.size(); ++i) {
    const std::string& key = odd[i];
    SCOPED_TRACE(::testing::PrintToString(key));
    // Empty arguments return "" by contract.
    expect(KarstLib::GetCorraPolicyBlobByName(key), key.empty() ? "" : "corra:" + key, "by name");
    // The first policy in store order whose id is "key".
    std::string byId;
    const KarstPolicyInfo* first = nullptr;
    for (const auto& p : policies) {
      if (p.policy_id == key) {
        first = &p;
        break;
      }
    }
    if (!key.empty() && first != nullptr) byId = first->blobs[0].blob;
    expect(KarstLib::GetCorraPolicyBlobById(key), byId, "corra by id");
    // The datastore stored under "key": its namespace picks the blob of
    // its default policy.
    const KarstDatastoreInfo& d = datastores[i];
    std::string want;
    if (!key.empty() && !d.drp_policy_id.empty() && !d.datastore_namespace.empty()) {
      for (const auto& p : policies) {
        if (p.policy_id != d.drp_policy_id) continue;
        for (const auto& b : p.blobs) {
          if (b.datastore_namespace == d.datastore_namespace) want = b.blob;
        }
        break;
      }
    }
    expect(KarstLib::GetDefaultPolicyBlob(key), want, "default blob");
  }
  const bool fresh = FingerprintInFreshProcess() == Fingerprint(policies, datastores);
  EXPECT_TRUE(fresh);
  ReportFigures("odd-bytes", "odd-bytes: " + std::to_string(odd.size()) +
                                 " keys with NUL, 0xFF, invalid UTF-8 or nothing in every field "
                                 "and look-up: listings exact, look-ups right " +
                                 std::to_string(checks - wrong) + " of " + std::to_string(checks) +
                                 ", new process " + (fresh ? "exact" : "DIFFERENT"));
}

}  // namespace
}  // namespace karst_reliability
