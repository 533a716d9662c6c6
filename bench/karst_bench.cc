// Speed of the catalogue operations on the SQLite store, and of the digest
// against zlib's crc32 measured in the same run.

#include <benchmark/benchmark.h>
#include <unistd.h>
#include <zlib.h>

#include <cstdlib>
#include <filesystem>
#include <random>
#include <string>
#include <vector>

#include "TavoKarst/KarstLib.h"
#include "hash/Crc32.h"

namespace {

std::string RandomBytes(std::size_t n, unsigned seed) {
  std::mt19937 rng(seed);
  std::string s(n, '\0');
  for (char& c : s) c = static_cast<char>(rng());
  return s;
}

void BM_Crc32Hex(benchmark::State& state) {
  const std::string text = RandomBytes(static_cast<std::size_t>(state.range(0)), 1);
  for (auto _ : state) benchmark::DoNotOptimize(TavoKarst::Crc32Hex(text));
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}
BENCHMARK(BM_Crc32Hex)->Arg(40)->Arg(1 << 20);

void BM_ZlibCrc32(benchmark::State& state) {
  const std::string text = RandomBytes(static_cast<std::size_t>(state.range(0)), 1);
  for (auto _ : state) {
    benchmark::DoNotOptimize(
        crc32(0L, reinterpret_cast<const Bytef*>(text.data()), static_cast<uInt>(text.size())));
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}
BENCHMARK(BM_ZlibCrc32)->Arg(40)->Arg(1 << 20);

// Policies with 4 string values of 10-30 bytes, a generation number and
// 4 blobs of 256 bytes.
std::vector<TavoKarst::KarstPolicyInfo> Workload(int n) {
  std::vector<TavoKarst::KarstPolicyInfo> policies(static_cast<std::size_t>(n));
  for (int i = 0; i < n; ++i) {
    auto& p = policies[static_cast<std::size_t>(i)];
    p.name = "policy-name-" + std::to_string(i);
    p.policy_id = "policy-identifier-" + std::to_string(i);
    p.description = "a storage policy of tier " + std::to_string(i % 7);
    p.generation_number = i;
    for (const char* ns : {"CORRA", "ns-alpha", "ns-beta", "ns-gamma"}) {
      p.blobs.push_back({RandomBytes(256, static_cast<unsigned>(i)), ns});
    }
  }
  return policies;
}

class SqliteStoreDir {
 public:
  SqliteStoreDir() {
    std::string pattern = std::filesystem::temp_directory_path().string() + "/karst-bench-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) std::abort();
    dir_ = pattern;
    setenv("TAVO_CONFIGSTORE_PATH", (dir_ + "/store.db").c_str(), 1);
  }
  ~SqliteStoreDir() { std::filesystem::remove_all(dir_); }

 private:
  std::string dir_;
};

void BM_AddPolicyInfo(benchmark::State& state) {
  SqliteStoreDir dir;
  const auto policies = Workload(static_cast<int>(state.range(0)));
  for (auto _ : state) TavoKarst::KarstLib::AddPolicyInfo(policies);
  state.SetItemsProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}
BENCHMARK(BM_AddPolicyInfo)->Arg(10000)->Unit(benchmark::kMillisecond);

void BM_ListPolicyInfo(benchmark::State& state) {
  SqliteStoreDir dir;
  TavoKarst::KarstLib::AddPolicyInfo(Workload(static_cast<int>(state.range(0))));
  for (auto _ : state) benchmark::DoNotOptimize(TavoKarst::KarstLib::ListPolicyInfo());
  state.SetItemsProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}
BENCHMARK(BM_ListPolicyInfo)->Arg(10000)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
