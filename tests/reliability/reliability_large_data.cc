// Large data on the SQLite store, byte-exact back in the writing process and
// in a new one: 100,000 policies and a 10 MiB blob. (Odd bytes in every field
// are the library's SQLite round-trip test.)

#include "reliability_util.h"

namespace karst_reliability {

std::mt19937_64 rng(3);

// Stores the catalogue, then counts where it does not come back whole: in
// this process, in a new one, and in the look-ups of "named"'s CORRA blob
// and of the first datastore's default blob. Reports them as "part".
void StoreAndCheck(const char* part, const char* what, const std::vector<KarstPolicyInfo>& policies,
                   const std::vector<KarstDatastoreInfo>& datastores, const KarstPolicyInfo& named,
                   const std::string& defaultBlob) {
  const auto start = std::chrono::steady_clock::now();
  StoreCatalogue({policies, datastores});
  const auto stored = std::chrono::steady_clock::now();
  const Catalogue listed = ListCatalogue();
  const std::chrono::duration<double> write = stored - start,
                                      list = std::chrono::steady_clock::now() - stored;
  const int wrong = (listed.policies != policies) + (listed.datastores != datastores) +
                    (KarstLib::GetCorraPolicyBlobByName(named.name) != named.blobs[0].blob) +
                    (KarstLib::GetDefaultPolicyBlob(datastores[0].url) != defaultBlob) +
                    !RunChild([&](int) {
                       const Catalogue c = ListCatalogue();
                       _exit(c.policies != policies || c.datastores != datastores);
                     }).Ok();
  EXPECT_EQ(wrong, 0);
  ReportFigures(part,
                "%s: %s: replace %.2f s, listing %.2f s; wrong (here, look-ups, new process) %d",
                part, what, write.count(), list.count(), wrong);
}

TEST(LargeData, HundredThousandPolicies) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  const int n = Scaled(100000, 20000);
  std::vector<KarstPolicyInfo> policies;
  for (int i = 0; i < n; ++i) {
    policies.push_back(
        Policy("policy-" + std::to_string(i), "id-" + std::to_string(i),
               {{RandomBytes(16 + i % 64, rng), "CORRA"},
                {RandomBytes(i % 8, rng), std::string("ns\0", 3) + std::to_string(i % 5)}},
               RandomBytes(i % 40, rng), static_cast<std::int64_t>(rng())));
  }
  // Look-ups at the far end of the catalogue.
  StoreAndCheck("large-policies", (std::to_string(n) + " policies").c_str(), policies,
                {{"ds-last", "CORRA", policies.back().policy_id}}, policies[n / 2],
                policies.back().blobs[0].blob);
  // Replacing the large catalogue by a small one drops every old record.
  KarstLib::AddPolicyInfo({policies[7]});
  EXPECT_EQ(KarstLib::ListPolicyInfo(), std::vector<KarstPolicyInfo>{policies[7]});
}

TEST(LargeData, TenMebibyteBlob) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  const std::string blob = RandomBytes(10 << 20, rng);
  const std::vector<KarstPolicyInfo> policies = {
      Policy("big", "big-id", {{blob, "CORRA"}, {blob.substr(0, 3 << 20), "ns"}},
             RandomBytes(1 << 20, rng)),
      Policy("after", "", {{"small", "CORRA"}})};
  StoreAndCheck("large-blob", "a 10 MiB blob, a 1 MiB description and a 1 MiB url of random bytes",
                policies, {{RandomBytes(1 << 20, rng), "ns", "big-id"}}, policies[0],
                blob.substr(0, 3 << 20));
}

}  // namespace karst_reliability
