// The catalogue operations on the etcd store, and in the same run their
// baselines: the same bytes written and read with etcd's own gRPC calls and
// nothing of the store on top. The raw copy is what the store itself wrote
// for the catalogue (its generations' keys and values, moved under another
// root of the same length), so both sides move the same number of keys and
// bytes; what is left is the store's own work and its extra round trips.
//
// Needs a running etcd: KARST_BENCH_ETCD=HOST:PORT (bench/run --etcd starts
// one); KARST_BENCH_ETCD_PID adds the server's CPU time.

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <memory>
#include <random>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "BenchData.h"
#include "EtcdBench.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/StoreHistory.h"
#include "TavoKarst/KarstLib.h"
#include "frame/FixedNames.h"

namespace karst_bench {
namespace {

using TavoKarst::KarstLib;

constexpr std::size_t kLookups = 1024;

std::size_t N(const benchmark::State& state) { return static_cast<std::size_t>(state.range(0)); }

// "/<kind>-<n>/" and a zero byte, the root under which the store of prefix
// "<kind>-<n>" keeps its keys: the store's roots and the raw copies' have
// the same length for the same n, so their keys do too.
std::string Root(const char* kind, std::size_t n) {
  return "/" + std::string(kind) + "-" + std::to_string(n) + "/" + std::string(1, '\0');
}

// Makes the library's default store the etcd store with the root's prefix;
// returns its locator.
std::string UseEtcdStore(const std::string& root) {
  const std::string locator = "etcd://" + EtcdEndpoint() + root.substr(0, root.size() - 2);
  setenv("TAVO_CONFIGSTORE_PATH", locator.c_str(), 1);
  return locator;
}

Records Rerooted(const Records& records, const std::string& from, const std::string& to) {
  Records out;
  out.reserve(records.size());
  for (const auto& [key, value] : records) {
    if (key.compare(0, from.size(), from) != 0) throw std::logic_error("key outside its root");
    out.emplace_back(to + key.substr(from.size()), value);
  }
  return out;
}

// One collection as the store laid it out (EtcdLayout.h): the generation's
// head "<root>g/<gen>/" and one key an object, "<root>g/<gen>/<instance>\0"
// and the part number. Copied under the raw root.
struct RawCollection {
  std::string prefix;                      // the raw copy's "<root>g/<gen>/"
  Records records;                         // the raw copy, keys in etcd's order
  std::map<std::string, std::string> key;  // instance id -> the raw key of its object
};

// The catalogues of Policies(n) and Datastores(n) in the store (kb-store-n),
// and the raw copy of their keys and values (kb-raw---n). Made once per n.
struct Catalogue {
  std::string storeRoot;
  std::string rawRoot;
  RawCollection policies;
  RawCollection datastores;
};

const Catalogue& FilledCatalogue(std::size_t n) {
  static std::map<std::size_t, std::unique_ptr<Catalogue>> made;
  auto& slot = made[n];
  if (slot) return *slot;
  auto c = std::make_unique<Catalogue>();
  c->storeRoot = Root("kb-store", n);
  c->rawRoot = Root("kb-raw--", n);
  EtcdAdmin().DeletePrefix(c->storeRoot);
  EtcdAdmin().DeletePrefix(c->rawRoot);
  UseEtcdStore(c->storeRoot);
  KarstLib::AddPolicyInfo(Policies(n));
  KarstLib::AddDatastoreInfo(Datastores(n));

  const std::string generations = c->storeRoot + "g/";
  const Records stored = ListOne(EtcdAdmin(), generations);
  // Split by generation; each starts with its head, whose value names the
  // collection.
  for (std::size_t i = 0; i < stored.size();) {
    const std::size_t slash = stored[i].first.find('/', generations.size());
    const std::string gen = stored[i].first.substr(0, slash + 1);
    std::size_t end = i;
    while (end < stored.size() && stored[end].first.compare(0, gen.size(), gen) == 0) ++end;
    const bool isPolicies =
        stored[i].first == gen && stored[i].second.compare(0, TavoKarst::kPoliciesKey.size() + 1,
                                                           TavoKarst::kPoliciesKey + '\0') == 0;
    RawCollection& to = isPolicies ? c->policies : c->datastores;
    to.prefix = c->rawRoot + gen.substr(c->storeRoot.size());
    to.records = Rerooted(Records(stored.begin() + static_cast<std::ptrdiff_t>(i),
                                  stored.begin() + static_cast<std::ptrdiff_t>(end)),
                          c->storeRoot, c->rawRoot);
    for (const auto& [key, value] : to.records) {
      const std::size_t zero = key.find('\0', to.prefix.size());
      // The bench's ids hold no byte the layout escapes.
      if (zero != std::string::npos)
        to.key[key.substr(to.prefix.size(), zero - to.prefix.size())] = key;
    }
    WriteBatches(EtcdAdmin(), to.records);
    i = end;
  }
  if (c->policies.key.size() != n || c->datastores.key.size() != n) {
    throw std::runtime_error("the store's keys are not laid out as this benchmark expects");
  }
  EtcdAdmin().CompactAll();
  slot = std::move(c);
  return *slot;
}

// Runs a benchmark's body, turning a failure into the benchmark's error.
template <typename Body>
void Guarded(benchmark::State& state, const Body& body) {
  try {
    body();
  } catch (const std::exception& e) {
    state.SkipWithError(e.what());
  }
}

void Expect(bool ok, const char* what) {
  if (!ok) throw std::runtime_error(what);
}

// Names of stored policies in a shuffled order, so look-ups wander the keys.
std::vector<std::string> SomeNames(std::size_t n) {
  std::vector<std::string> names;
  for (const auto& p : Policies(n)) names.push_back(p.name);
  std::shuffle(names.begin(), names.end(), std::mt19937(5));
  names.resize(std::min(names.size(), kLookups));
  return names;
}

// The blob GetDefaultPolicyBlob gives for the datastore.
std::string DefaultBlobOf(const TavoKarst::KarstDatastoreInfo& datastore, std::size_t n) {
  for (const auto& p : Policies(n)) {
    if (p.policy_id != datastore.drp_policy_id) continue;
    for (const auto& b : p.blobs) {
      if (b.datastore_namespace == datastore.datastore_namespace) return b.blob;
    }
    return std::string();
  }
  return std::string();
}

// ---- Replacing the policy catalogue ---------------------------------------
// The store holds N policies before timing; each iteration replaces them with
// the same N in one transaction. The raw side puts the keys and values the
// store wrote for them, in transactions of up to 100 puts, over themselves.

// The store keeps its last "depth" versions (10 unless set); each replace
// then keeps the generation it replaces instead of deleting it, and deletes
// the one the version it pushes out named.
void StoreReplace(benchmark::State& state, const char* kind, unsigned depth) {
  Guarded(state, [&] {
    const auto& policies = Policies(N(state));
    const std::string root = Root(kind, N(state));
    EtcdAdmin().DeletePrefix(root);
    // Kept in the store: any connection to it sets it.
    TavoConfigStore::SetHistoryDepth(*TavoConfigStore::OpenStore(UseEtcdStore(root)), depth);
    // Enough versions that every replace timed pushes the oldest out, the
    // same number at every depth; then etcd tidies them (and the deletion
    // above) away before the timing, as it took the K = 10 row twice as
    // long as K = 0's to do so after such a start.
    for (int i = 0; i <= 10; ++i) KarstLib::AddPolicyInfo(policies);
    EtcdAdmin().CompactAll();
    {
      EtcdCpu etcd(state);
      for (auto _ : state) KarstLib::AddPolicyInfo(policies);
    }
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
    EtcdAdmin().CompactAll();
  });
}

void BM_StoreReplace(benchmark::State& state) { StoreReplace(state, "kb-add--", 10); }
void BM_StoreReplaceNoHistory(benchmark::State& state) { StoreReplace(state, "kb-add0-", 0); }

void BM_RawReplace(benchmark::State& state) {
  Guarded(state, [&] {
    const Catalogue& c = FilledCatalogue(N(state));
    const std::string root = Root("kb-write", N(state));
    const Records records = Rerooted(c.policies.records, c.rawRoot, root);
    RawEtcd raw(EtcdEndpoint());
    WriteBatches(raw, records);
    {
      EtcdCpu etcd(state);
      for (auto _ : state) WriteBatches(raw, records);
    }
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
    EtcdAdmin().CompactAll();
  });
}

// ---- Listing ----------------------------------------------------------------

void BM_StoreList(benchmark::State& state) {
  Guarded(state, [&] {
    UseEtcdStore(FilledCatalogue(N(state)).storeRoot);
    Expect(SameListing(KarstLib::ListPolicyInfo(), Policies(N(state))), "listing differs");
    EtcdCpu etcd(state);
    for (auto _ : state) benchmark::DoNotOptimize(KarstLib::ListPolicyInfo());
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
  });
}

// One Range over the policies' generation: the keys the store's listing reads.
void BM_RawList(benchmark::State& state) {
  Guarded(state, [&] {
    const RawCollection& policies = FilledCatalogue(N(state)).policies;
    RawEtcd raw(EtcdEndpoint());
    Expect(ListOne(raw, policies.prefix) == policies.records, "listing differs");
    EtcdCpu etcd(state);
    for (auto _ : state) benchmark::DoNotOptimize(ListOne(raw, policies.prefix));
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
  });
}

// Both listings, as GetDbHash makes them.
void BM_StoreGetDbHash(benchmark::State& state) {
  Guarded(state, [&] {
    UseEtcdStore(FilledCatalogue(N(state)).storeRoot);
    Expect(!KarstLib::GetDbHash().first.empty(), "no digest");
    EtcdCpu etcd(state);
    for (auto _ : state) benchmark::DoNotOptimize(KarstLib::GetDbHash());
  });
}

void BM_RawListBoth(benchmark::State& state) {
  Guarded(state, [&] {
    const Catalogue& c = FilledCatalogue(N(state));
    RawEtcd raw(EtcdEndpoint());
    Expect(ListOne(raw, c.datastores.prefix) == c.datastores.records, "listing differs");
    EtcdCpu etcd(state);
    for (auto _ : state) {
      benchmark::DoNotOptimize(ListOne(raw, c.policies.prefix));
      benchmark::DoNotOptimize(ListOne(raw, c.datastores.prefix));
    }
  });
}

// ---- Look-ups ---------------------------------------------------------------

void BM_StoreBlobByName(benchmark::State& state) {
  Guarded(state, [&] {
    const auto names = SomeNames(N(state));
    UseEtcdStore(FilledCatalogue(N(state)).storeRoot);
    const auto& some = Policies(N(state))[3];
    Expect(KarstLib::GetCorraPolicyBlobByName(some.name) == some.blobs[0].blob, "wrong blob");
    EtcdCpu etcd(state);
    std::size_t i = 0;
    for (auto _ : state) {
      benchmark::DoNotOptimize(KarstLib::GetCorraPolicyBlobByName(names[i++ % names.size()]));
    }
  });
}

// A single-key Range for the object of each name the store's look-up reads.
void BM_RawBlobByName(benchmark::State& state) {
  Guarded(state, [&] {
    const RawCollection& policies = FilledCatalogue(N(state)).policies;
    std::vector<std::string> keys;
    for (const std::string& name : SomeNames(N(state))) keys.push_back(policies.key.at(name));
    RawEtcd raw(EtcdEndpoint());
    Records one;
    raw.Range(keys[0], std::string(), &one);
    Expect(one.size() == 1, "no such key");
    EtcdCpu etcd(state);
    std::size_t i = 0;
    for (auto _ : state) {
      Records out;
      raw.Range(keys[i++ % keys.size()], std::string(), &out);
      benchmark::DoNotOptimize(out);
    }
  });
}

// The id of the last policy written: the scan reads the whole collection. Its
// baseline is BM_RawList, the one Range over the collection.
void BM_StoreBlobById(benchmark::State& state) {
  Guarded(state, [&] {
    const auto& last = Policies(N(state)).back();
    UseEtcdStore(FilledCatalogue(N(state)).storeRoot);
    Expect(KarstLib::GetCorraPolicyBlobById(last.policy_id) == last.blobs[0].blob, "wrong blob");
    EtcdCpu etcd(state);
    for (auto _ : state) benchmark::DoNotOptimize(KarstLib::GetCorraPolicyBlobById(last.policy_id));
  });
}

// The datastore's record, then a scan of the policies for its default.
void BM_StoreDefaultBlob(benchmark::State& state) {
  Guarded(state, [&] {
    const auto& datastore = Datastores(N(state)).back();
    UseEtcdStore(FilledCatalogue(N(state)).storeRoot);
    Expect(KarstLib::GetDefaultPolicyBlob(datastore.url) == DefaultBlobOf(datastore, N(state)),
           "wrong blob");
    EtcdCpu etcd(state);
    for (auto _ : state) benchmark::DoNotOptimize(KarstLib::GetDefaultPolicyBlob(datastore.url));
  });
}

// A single-key Range for the datastore's object and one Range over the
// policies.
void BM_RawDefaultBlob(benchmark::State& state) {
  Guarded(state, [&] {
    const Catalogue& c = FilledCatalogue(N(state));
    const std::string& key = c.datastores.key.at(Datastores(N(state)).back().url);
    RawEtcd raw(EtcdEndpoint());
    EtcdCpu etcd(state);
    for (auto _ : state) {
      Records out;
      raw.Range(key, std::string(), &out);
      benchmark::DoNotOptimize(out);
      benchmark::DoNotOptimize(ListOne(raw, c.policies.prefix));
    }
  });
}

void Register() {
  using Fn = void (*)(benchmark::State&);
  for (std::int64_t n : {1000, 10000}) {
    auto add = [n](const char* name, Fn fn, benchmark::TimeUnit unit) {
      // Client CPU over all the process's threads: gRPC does part of its
      // work in its own.
      benchmark::RegisterBenchmark(name, fn)
          ->Arg(n)
          ->Unit(unit)
          ->UseRealTime()
          ->MeasureProcessCPUTime()
          ->MinTime(0.3)
          ->Repetitions(10);
    };
    add("BM_StoreReplace", BM_StoreReplace, benchmark::kMillisecond);
    add("BM_StoreReplaceNoHistory", BM_StoreReplaceNoHistory, benchmark::kMillisecond);
    add("BM_RawReplace", BM_RawReplace, benchmark::kMillisecond);
    add("BM_StoreList", BM_StoreList, benchmark::kMillisecond);
    add("BM_RawList", BM_RawList, benchmark::kMillisecond);
    add("BM_StoreBlobByName", BM_StoreBlobByName, benchmark::kMicrosecond);
    add("BM_RawBlobByName", BM_RawBlobByName, benchmark::kMicrosecond);
    add("BM_StoreBlobById", BM_StoreBlobById, benchmark::kMillisecond);
    add("BM_StoreDefaultBlob", BM_StoreDefaultBlob, benchmark::kMillisecond);
    add("BM_RawDefaultBlob", BM_RawDefaultBlob, benchmark::kMillisecond);
    add("BM_StoreGetDbHash", BM_StoreGetDbHash, benchmark::kMillisecond);
    add("BM_RawListBoth", BM_RawListBoth, benchmark::kMillisecond);
  }
}

}  // namespace
}  // namespace karst_bench

int main(int argc, char** argv) {
  if (!karst_bench::KeepFreedMemory()) {
    std::fprintf(stderr, "mallopt failed\n");
    return 1;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  karst_bench::Register();
  benchmark::AddCustomContext("etcd", karst_bench::EtcdVersion());
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
