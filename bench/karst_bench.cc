// The catalogue operations on the SQLite store, and in the same run the
// baselines they are judged against: the same records kept directly in SQLite
// (RawSqlite.h) and zlib's crc32. bench/run turns the output into ratios.

#include <benchmark/benchmark.h>
#include <malloc.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <zlib.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "BenchData.h"
#include "PeakRss.h"
#include "RawSqlite.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/StoreHistory.h"
#include "TavoKarst/KarstLib.h"
#include "hash/Crc32.h"

namespace karst_bench {
namespace {

using TavoKarst::KarstLib;
using Layout = RawPolicyDb::Layout;

constexpr std::size_t kTextBatch = 1024;

const char* LayoutName(Layout layout) {
  switch (layout) {
    case Layout::kOneRow:
      return "onerow";
    case Layout::kTwoTables:
      return "twotables";
    default:
      return "storeschema";
  }
}

Layout LayoutNamed(const std::string& name) {
  for (Layout layout : {Layout::kOneRow, Layout::kTwoTables, Layout::kStoreSchema}) {
    if (name == LayoutName(layout)) return layout;
  }
  std::abort();
}

const ConnectionSettings& Settings() {
  static const ConnectionSettings settings = [] {
    UseKarstStore("settings.db");
    return StoreConnectionSettings();
  }();
  return settings;
}

// A raw database per layout and size holding Policies(n), filled once and kept
// open for the whole process.
RawPolicyDb& FilledRawDb(Layout layout, std::size_t n) {
  static std::map<std::pair<Layout, std::size_t>, std::unique_ptr<RawPolicyDb>> dbs;
  auto& slot = dbs[{layout, n}];
  if (!slot) {
    slot = std::make_unique<RawPolicyDb>(
        StoreDir() + "/raw-read-" + LayoutName(layout) + "-" + std::to_string(n) + ".db", layout,
        Settings());
    slot->Replace(Policies(n));
  }
  return *slot;
}

std::size_t N(const benchmark::State& state) { return static_cast<std::size_t>(state.range(0)); }

void Check(bool ok, benchmark::State& state, const char* what) {
  if (!ok) state.SkipWithError(what);
}

long MinorFaults() {
  struct rusage usage {};
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_minflt;
}

// Page faults per iteration: on virtual machines each costs microseconds, so
// memory that is handed back to the system and touched again shows up here.
class FaultCounter {
 public:
  explicit FaultCounter(benchmark::State& state) : state_(state), start_(MinorFaults()) {}
  ~FaultCounter() {
    state_.counters["faults"] = benchmark::Counter(static_cast<double>(MinorFaults() - start_),
                                                   benchmark::Counter::kAvgIterations);
  }

 private:
  benchmark::State& state_;
  long start_;
};

// ---- CRC-32 ---------------------------------------------------------------
// Texts of the given length, many of them, so short texts are not one text
// hashed from the same cache line over and over.
std::vector<std::string> Texts(std::size_t length) {
  const std::size_t count = length < 4096 ? kTextBatch : 1;
  std::vector<std::string> texts;
  for (std::size_t i = 0; i < count; ++i) texts.push_back(RandomBytes(length, i + 1));
  return texts;
}

void BM_Crc32Hex(benchmark::State& state) {
  const auto texts = Texts(N(state));
  for (const std::string& t : texts) {
    const auto expected = static_cast<std::uint32_t>(
        crc32(0L, reinterpret_cast<const Bytef*>(t.data()), static_cast<uInt>(t.size())));
    Check(TavoKarst::Crc32(t.data(), t.size()) == expected, state, "differs from zlib");
  }
  std::size_t i = 0;
  for (auto _ : state) benchmark::DoNotOptimize(TavoKarst::Crc32Hex(texts[i++ % texts.size()]));
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
}
BENCHMARK(BM_Crc32Hex)->Arg(40)->Arg(1 << 20)->Repetitions(5);

void BM_ZlibCrc32(benchmark::State& state) {
  const auto texts = Texts(N(state));
  std::size_t i = 0;
  for (auto _ : state) {
    const std::string& t = texts[i++ % texts.size()];
    benchmark::DoNotOptimize(
        crc32(0L, reinterpret_cast<const Bytef*>(t.data()), static_cast<uInt>(t.size())));
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
}
BENCHMARK(BM_ZlibCrc32)->Arg(40)->Arg(1 << 20)->Repetitions(5);

// The portable path alone, for the record: what a CPU without carry-less
// multiplication gets.
void BM_Crc32Portable(benchmark::State& state) {
  const auto texts = Texts(N(state));
  std::size_t i = 0;
  for (auto _ : state) {
    const std::string& t = texts[i++ % texts.size()];
    benchmark::DoNotOptimize(TavoKarst::Crc32Portable(t.data(), t.size()));
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
}
BENCHMARK(BM_Crc32Portable)->Arg(40)->Arg(1 << 20);

// ---- Replacing the policy catalogue ---------------------------------------
// Each iteration replaces N stored policies with N policies (the store is
// filled once before timing), in one transaction.

// A replace on a store that keeps "depth" versions (the default keeps 10);
// the file's size afterwards shows what the kept versions take.
void ReplaceKeeping(benchmark::State& state, unsigned depth) {
  const auto& policies = Policies(N(state));
  const std::string name =
      "karst-add-d" + std::to_string(depth) + "-" + std::to_string(N(state)) + ".db";
  UseKarstStore(name);
  TavoConfigStore::SetHistoryDepth(
      *TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace), depth);
  // Until the store keeps all its versions, each replace makes the file
  // larger; timed from then on, the loop sees the steady state a store in
  // use is in, where a replace reuses the pages of the version it forgets.
  for (unsigned i = 0; i <= depth; ++i) KarstLib::AddPolicyInfo(policies);
  for (auto _ : state) KarstLib::AddPolicyInfo(policies);
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
  struct stat file {};
  stat((StoreDir() + "/" + name).c_str(), &file);
  state.counters["file_mib"] = static_cast<double>(file.st_size) / (1 << 20);
}

void BM_KarstAdd(benchmark::State& state) { ReplaceKeeping(state, 10); }
void BM_KarstAddKeepingNone(benchmark::State& state) { ReplaceKeeping(state, 0); }

void BM_RawReplace(benchmark::State& state, Layout layout) {
  const auto& policies = Policies(N(state));
  RawPolicyDb db(
      StoreDir() + "/raw-add-" + LayoutName(layout) + "-" + std::to_string(N(state)) + ".db",
      layout, Settings());
  db.Replace(policies);
  for (auto _ : state) db.Replace(policies);
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
}

// ---- Listing ----------------------------------------------------------------

void BM_KarstList(benchmark::State& state) {
  UseFilledKarstStore(N(state));
  Check(SameListing(KarstLib::ListPolicyInfo(), Policies(N(state))), state, "listing differs");
  FaultCounter faults(state);
  for (auto _ : state) benchmark::DoNotOptimize(KarstLib::ListPolicyInfo());
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
}

void BM_RawList(benchmark::State& state, Layout layout) {
  RawPolicyDb& db = FilledRawDb(layout, N(state));
  Check(SameListing(db.List(), Policies(N(state))), state, "listing differs");
  FaultCounter faults(state);
  for (auto _ : state) benchmark::DoNotOptimize(db.List());
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * N(state)));
}

// Both listings, as GetDbHash makes them.
void BM_KarstListBoth(benchmark::State& state) {
  UseFilledKarstStore(N(state));
  // Untimed first round, as the other read benchmarks have: the first pass
  // over the sizes of a run grows the heap, at a page fault a page.
  KarstLib::ListPolicyInfo();
  KarstLib::ListDatastoreInfo();
  FaultCounter faults(state);
  for (auto _ : state) {
    benchmark::DoNotOptimize(KarstLib::ListPolicyInfo());
    benchmark::DoNotOptimize(KarstLib::ListDatastoreInfo());
  }
}

void BM_KarstGetDbHash(benchmark::State& state) {
  UseFilledKarstStore(N(state));
  KarstLib::GetDbHash();
  FaultCounter faults(state);
  for (auto _ : state) benchmark::DoNotOptimize(KarstLib::GetDbHash());
}

// ---- Look-ups ---------------------------------------------------------------

// Names of stored policies in a shuffled order, so look-ups wander the index.
std::vector<std::string> SomeNames(std::size_t n) {
  std::vector<std::string> names;
  for (const auto& p : Policies(n)) names.push_back(p.name);
  std::shuffle(names.begin(), names.end(), std::mt19937(5));
  names.resize(std::min<std::size_t>(names.size(), kTextBatch));
  return names;
}

void BM_KarstBlobByName(benchmark::State& state) {
  const auto names = SomeNames(N(state));
  UseFilledKarstStore(N(state));
  Check(KarstLib::GetCorraPolicyBlobByName(Policies(N(state))[3].name) ==
            Policies(N(state))[3].blobs[0].blob,
        state, "wrong blob");
  std::size_t i = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(KarstLib::GetCorraPolicyBlobByName(names[i++ % names.size()]));
  }
}

void BM_RawBlobByName(benchmark::State& state, Layout layout) {
  const auto names = SomeNames(N(state));
  RawPolicyDb& db = FilledRawDb(layout, N(state));
  Check(db.BlobByName(Policies(N(state))[3].name, "CORRA") == Policies(N(state))[3].blobs[0].blob,
        state, "wrong blob");
  std::size_t i = 0;
  for (auto _ : state) benchmark::DoNotOptimize(db.BlobByName(names[i++ % names.size()], "CORRA"));
}

// The id of the last policy written: the scan reads the whole collection.
void BM_KarstBlobById(benchmark::State& state) {
  const auto& last = Policies(N(state)).back();
  UseFilledKarstStore(N(state));
  Check(KarstLib::GetCorraPolicyBlobById(last.policy_id) == last.blobs[0].blob, state,
        "wrong blob");
  for (auto _ : state) benchmark::DoNotOptimize(KarstLib::GetCorraPolicyBlobById(last.policy_id));
}

// ---- Opening the store ------------------------------------------------------

void BM_KarstGetStore(benchmark::State& state) {
  UseFilledKarstStore(1000);
  for (auto _ : state) {
    auto store = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
    benchmark::DoNotOptimize(store.get());
  }
}

// ---- Peak memory of a listing -----------------------------------------------
// Each listing runs in a fresh process (this binary, exec'd with
// --peak-rss-child), so neither inherits the other's or the benchmark's
// pages; the parent reads the child's ru_maxrss.

constexpr char kChildFlag[] = "--peak-rss-child=";

// The child's peak resident set in KiB, as it reports it on its stdout, or
// -1.
long PeakRssOfChild(const std::vector<std::string>& args) {
  const std::string report = RunSelf(args);
  return report.empty() ? -1 : std::strtol(report.c_str(), nullptr, 10);
}

void BM_PeakRss(benchmark::State& state, const std::string& kind) {
  const std::size_t n = N(state);
  std::string path;
  if (kind == "karst") {
    UseFilledKarstStore(n);
    path = FilledKarstStorePath(n);
  } else {
    FilledRawDb(LayoutNamed(kind), n);
    path = StoreDir() + "/raw-read-" + kind + "-" + std::to_string(n) + ".db";
  }
  std::string pragmas;
  for (const std::string& p : Settings().pragmas) pragmas += p + ";";
  long kib = 0;
  for (auto _ : state) {
    kib = PeakRssOfChild({kChildFlag + kind, path, std::to_string(n), pragmas});
  }
  Check(kib > 0, state, "the listing child failed");
  state.counters["peak_rss_kib"] = static_cast<double>(kib);
}

// The child's side: list once, print the peak RSS, exit 0 when all n records
// came back.
int PeakRssChild(const std::string& kind, const std::string& path, std::size_t n,
                 const std::string& pragmas) {
  std::size_t listed;
  if (kind == "karst") {
    setenv("TAVO_CONFIGSTORE_PATH", path.c_str(), 1);
    listed = KarstLib::ListPolicyInfo().size();
  } else {
    ConnectionSettings settings;
    for (std::size_t at = 0, end; (end = pragmas.find(';', at)) != std::string::npos;
         at = end + 1) {
      settings.pragmas.push_back(pragmas.substr(at, end - at));
    }
    RawPolicyDb db(path, LayoutNamed(kind), settings);
    listed = db.List().size();
  }
  std::printf("%ld\n", OwnPeakRssKib());
  return listed == n ? 0 : 1;
}

// ---- Registration -----------------------------------------------------------

void Register() {
  const std::vector<std::int64_t> sizes = {1000, 10000, 100000};
  auto sized = [](benchmark::internal::Benchmark* b, std::int64_t n) {
    b->Arg(n)->Unit(benchmark::kMillisecond)->UseRealTime();
    // The largest size takes seconds an iteration: few, timed singly.
    if (n >= 100000) {
      b->Iterations(1)->Repetitions(3);
    } else {
      b->MinTime(0.3)->Repetitions(5);
    }
  };
  for (std::int64_t n : sizes) {
    sized(benchmark::RegisterBenchmark("BM_KarstAdd", BM_KarstAdd), n);
    if (n == 10000) {
      sized(benchmark::RegisterBenchmark("BM_KarstAddKeepingNone", BM_KarstAddKeepingNone), n);
    }
    sized(benchmark::RegisterBenchmark("BM_KarstList", BM_KarstList), n);
    sized(benchmark::RegisterBenchmark("BM_KarstListBoth", BM_KarstListBoth), n);
    sized(benchmark::RegisterBenchmark("BM_KarstGetDbHash", BM_KarstGetDbHash), n);
    for (Layout layout : {Layout::kOneRow, Layout::kTwoTables, Layout::kStoreSchema}) {
      const std::string suffix = std::string("_") + LayoutName(layout);
      sized(benchmark::RegisterBenchmark(("BM_RawReplace" + suffix).c_str(), BM_RawReplace, layout),
            n);
      sized(benchmark::RegisterBenchmark(("BM_RawList" + suffix).c_str(), BM_RawList, layout), n);
    }
  }
  benchmark::RegisterBenchmark("BM_KarstBlobById", BM_KarstBlobById)
      ->Arg(10000)
      ->Unit(benchmark::kMillisecond)
      ->UseRealTime()
      ->MinTime(0.3)
      ->Repetitions(5);
  auto keyed = [](benchmark::internal::Benchmark* b) {
    b->Arg(10000)->Unit(benchmark::kMicrosecond)->UseRealTime()->MinTime(0.2)->Repetitions(5);
  };
  keyed(benchmark::RegisterBenchmark("BM_KarstBlobByName", BM_KarstBlobByName));
  for (Layout layout : {Layout::kOneRow, Layout::kTwoTables, Layout::kStoreSchema}) {
    keyed(benchmark::RegisterBenchmark(
        (std::string("BM_RawBlobByName_") + LayoutName(layout)).c_str(), BM_RawBlobByName, layout));
  }
  benchmark::RegisterBenchmark("BM_KarstGetStore", BM_KarstGetStore)
      ->Unit(benchmark::kMicrosecond)
      ->UseRealTime()
      ->MinTime(0.2)
      ->Repetitions(5);
  for (const char* kind : {"karst", "onerow", "twotables", "storeschema"}) {
    benchmark::RegisterBenchmark((std::string("BM_PeakRss_") + kind).c_str(), BM_PeakRss,
                                 std::string(kind))
        ->Arg(100000)
        ->Unit(benchmark::kMillisecond)
        ->UseRealTime()
        ->Iterations(1);
  }
}

}  // namespace
}  // namespace karst_bench

int main(int argc, char** argv) {
  if (argc == 5 &&
      std::strncmp(argv[1], karst_bench::kChildFlag, std::strlen(karst_bench::kChildFlag)) == 0) {
    return karst_bench::PeakRssChild(argv[1] + std::strlen(karst_bench::kChildFlag), argv[2],
                                     std::strtoul(argv[3], nullptr, 10), argv[4]);
  }
  // Freed memory stays with this process. By default glibc hands the top of
  // the heap back after a listing frees it, and the next listing faults every
  // page in again; on a virtual machine a fault costs microseconds, so the
  // timings would follow where earlier benchmarks left the heap rather than
  // the code measured. Both sides of every ratio run under the same rule; the
  // peak-RSS children (above) keep the default.
  if (mallopt(M_TRIM_THRESHOLD, 1 << 30) != 1 || mallopt(M_MMAP_THRESHOLD, 32 << 20) != 1) {
    std::fprintf(stderr, "mallopt failed\n");
    return 1;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  karst_bench::Register();
  benchmark::AddCustomContext("store_dir", karst_bench::StoreDir());
  benchmark::AddCustomContext("store_fs", karst_bench::StoreDirKind());
  benchmark::AddCustomContext("sqlite_settings", karst_bench::Settings().Describe());
  benchmark::AddCustomContext("sqlite_version", sqlite3_libversion());
  benchmark::AddCustomContext("crc32_clmul", TavoKarst::CpuHasClmul() ? "yes" : "no");
  benchmark::AddCustomContext("crc32_avx512", TavoKarst::CpuHasAvx512Clmul() ? "yes" : "no");
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
