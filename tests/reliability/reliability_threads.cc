// Several threads of one process replace, list, look up and digest the
// catalogue at once, each through its own cached connection to one store
// file. Built with ThreadSanitizer by scripts/test; in every build no listing
// may be torn, no call may fail, and the store ends whole and writable.

#include "reliability_util.h"

namespace karst_reliability {

TEST(Threads, ConcurrentCallsNeverTearAListing) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  KarstLib::AddPolicyInfo(PoliciesFor(Tag{9, 0}));
  KarstLib::AddDatastoreInfo(DatastoresFor(Tag{9, 1}));

  const int threads = 4, rounds = 400;
  std::atomic<int> torn{0}, errors{0};
  auto worker = [&](int id) {
    for (int r = 0; r < rounds; ++r) {
      try {
        if (r % 4 == 0) KarstLib::AddPolicyInfo(PoliciesFor(Tag{id, r}));
        if (r % 4 == 1) KarstLib::AddDatastoreInfo(DatastoresFor(Tag{id, r}));
        if (r % 4 == 2) {
          torn += (Classify(KarstLib::ListPolicyInfo()) == "torn") +
                  (Classify(KarstLib::ListDatastoreInfo()) == "torn");
        }
        if (r % 4 == 3) {
          KarstLib::GetCorraPolicyBlobByName("policy-0");
          KarstLib::GetDefaultPolicyBlob("ds-0");
          KarstLib::GetCorraPolicyBlobById("id-1");
          KarstLib::GetDbHash();
        }
      } catch (const ConfigStoreException& e) {
        ++errors;
        ADD_FAILURE() << "thread " << id << ": " << e.what();
      }
    }
  };
  std::vector<std::thread> workers;
  for (int t = 0; t < threads; ++t) workers.emplace_back(worker, t);
  for (auto& w : workers) w.join();

  // Whole at the end, and still writable.
  const std::string final = State(ListCatalogue());
  KarstLib::AddPolicyInfo(PoliciesFor(Tag{9, 2}));
  ReportFigures("threads",
                "threads: %d threads x %d rounds of replaces, listings, look-ups and digests on "
                "one file: torn listings %d, errors %d; final store %s",
                threads, rounds, torn.load(), errors.load(), final.c_str());
  EXPECT_TRUE(torn == 0 && final.find("torn") == std::string::npos) << final;
  EXPECT_EQ(Classify(KarstLib::ListPolicyInfo()), Classify(PoliciesFor(Tag{9, 2})));
}

}  // namespace karst_reliability
