// Several threads of one process replace, list, look up and digest the
// catalogue at once, each through its own cached connection to one store
// file, while another thread keeps arming faults in a process-wide
// FaultInjector and installing and removing it. Built with ThreadSanitizer
// by scripts/test; in every build no listing may be torn and every failure
// must be an injected one.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <new>
#include <string>
#include <thread>
#include <vector>

#include "TavoConfigStore/CallProbe.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "TavoKarst/KarstLib.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoConfigStore::ConfigStoreException;
using TavoConfigStore::FaultInjector;
using TavoKarst::KarstLib;

struct Counts {
  std::atomic<long long> replaces{0}, listings{0}, torn{0}, lookups{0}, digests{0};
  std::atomic<long long> injected{0}, badAlloc{0}, other{0};
};

void Worker(int id, int rounds, Counts* c) {
  for (int r = 0; r < rounds; ++r) {
    const Tag tag{id, r};
    try {
      switch (r % 4) {
        case 0:
          KarstLib::AddPolicyInfo(PoliciesFor(tag));
          ++c->replaces;
          break;
        case 1:
          KarstLib::AddDatastoreInfo(DatastoresFor(tag));
          ++c->replaces;
          break;
        case 2: {
          const Observed p = Classify(KarstLib::ListPolicyInfo());
          const Observed d = Classify(KarstLib::ListDatastoreInfo());
          c->listings += 2;
          c->torn += (p.kind == Observed::kTorn) + (d.kind == Observed::kTorn);
          break;
        }
        default:
          KarstLib::GetCorraPolicyBlobByName("policy-0");
          KarstLib::GetDefaultPolicyBlob("ds-0");
          KarstLib::GetCorraPolicyBlobById("id-1");
          c->lookups += 3;
          KarstLib::GetDbHash();
          ++c->digests;
      }
    } catch (const ConfigStoreException& e) {
      if (e.Code() == TavoConfigStore::kErrorInjected) {
        ++c->injected;
      } else {
        ++c->other;
        ADD_FAILURE() << "thread " << id << ": " << e.what();
      }
    } catch (const std::bad_alloc&) {
      ++c->badAlloc;
    }
  }
}

TEST(Threads, ConcurrentCallsWithFaultsNeverTearAListing) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  KarstLib::AddPolicyInfo(PoliciesFor(Tag{9, 0}));
  KarstLib::AddDatastoreInfo(DatastoresFor(Tag{9, 1}));

  const int threads = 4;
  const int rounds = 400;
  Counts counts;
  std::atomic<bool> done{false};
  // Keeps re-arming: each fault fails whichever thread makes that call.
  std::thread faults([&] {
    auto probe = std::make_shared<FaultInjector>();
    for (int i = 0; !done.load(); ++i) {
      probe->ClearFaults();
      probe->FailStoreError("SetObject", probe->Count("SetObject") + 7, "injected",
                            TavoConfigStore::kErrorInjected);
      // Not on the record reads (GetValue...): a listing leaves out a record
      // it cannot read, by contract, which would look torn here.
      probe->FailStoreError("GetObjects", probe->Count("GetObjects") + 11, "injected",
                            TavoConfigStore::kErrorInjected);
      probe->FailWith("DeleteObjects", probe->Count("DeleteObjects") + 3,
                      [] { throw std::bad_alloc(); });
      probe->FailStoreError("GetObject", probe->Count("GetObject") + 5, "injected",
                            TavoConfigStore::kErrorInjected);
      TavoConfigStore::InstallCallProbe(i % 5 == 4 ? nullptr : probe);
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
      probe->Calls();  // reads the log while the workers append to it
      if (i % 50 == 49) probe->ClearLog();
    }
    TavoConfigStore::InstallCallProbe(nullptr);
  });
  std::vector<std::thread> workers;
  for (int t = 0; t < threads; ++t) workers.emplace_back(Worker, t, rounds, &counts);
  for (auto& w : workers) w.join();
  done.store(true);
  faults.join();

  // After all that, the store is whole and writable.
  const Observed p = Classify(KarstLib::ListPolicyInfo());
  const Observed d = Classify(KarstLib::ListDatastoreInfo());
  KarstLib::AddPolicyInfo(PoliciesFor(Tag{9, 2}));
  ReportFigures("threads", "threads: " + std::to_string(threads) + " threads x " +
                               std::to_string(rounds) +
                               " rounds on one file with faults armed meanwhile: replaces " +
                               std::to_string(counts.replaces.load()) + ", listings " +
                               std::to_string(counts.listings.load()) + " (torn " +
                               std::to_string(counts.torn.load()) + "), look-ups " +
                               std::to_string(counts.lookups.load()) + ", digests " +
                               std::to_string(counts.digests.load()) + ", injected store errors " +
                               std::to_string(counts.injected.load()) + ", bad_alloc " +
                               std::to_string(counts.badAlloc.load()) + ", other errors " +
                               std::to_string(counts.other.load()) + "; final store " +
                               p.Describe() + " / " + d.Describe());
  EXPECT_EQ(counts.torn.load(), 0);
  EXPECT_EQ(counts.other.load(), 0);
  EXPECT_EQ(p.kind, Observed::kWhole);
  EXPECT_EQ(d.kind, Observed::kWhole);
  EXPECT_GT(counts.injected.load() + counts.badAlloc.load(), 0);
  const Observed last = Classify(KarstLib::ListPolicyInfo());
  EXPECT_TRUE(last.kind == Observed::kWhole && last.tag == (Tag{9, 2})) << last.Describe();
}

}  // namespace
}  // namespace karst_reliability
