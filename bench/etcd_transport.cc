// The two ways the etcd store could talk to etcd, on the same work: gRPC
// with the generated v3 stubs, and libcurl against etcd's JSON gateway
// (keys and values base64 in JSON). Each lists 10,000 policy-sized records
// in one reply and in pages, and writes them in transactions of 100 puts.
// Every listing is checked to give the same bytes as the records written.
//
// Needs a running etcd: KARST_BENCH_ETCD=HOST:PORT (bench/run starts one).
// With KARST_BENCH_ETCD_PID set, the server's CPU time per operation is
// reported too: the gateway's JSON work is done there.

#include <benchmark/benchmark.h>
#include <curl/curl.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <memory>
#include <nlohmann/json.hpp>
#include <random>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "EtcdBench.h"
#include "PeakRss.h"

namespace karst_bench {
namespace {

constexpr std::size_t kRecords = 10000;
constexpr std::size_t kValueBytes = 1400;
constexpr std::int64_t kPage = 1000;
const std::string kListPrefix = "/karst-bench/list/";
const std::string kWritePrefix = "/karst-bench/write/";

// Keys in etcd's order (zero-padded), values of random bytes as a stored
// policy has; the same for every call.
Records MakeRecords(const std::string& prefix) {
  Records records;
  records.reserve(kRecords);
  std::mt19937_64 rng(42);
  for (std::size_t i = 0; i < kRecords; ++i) {
    char name[32];
    std::snprintf(name, sizeof name, "policy-%06zu", i);
    std::string value(kValueBytes, '\0');
    for (char& c : value) c = static_cast<char>(rng());
    records.emplace_back(prefix + name, std::move(value));
  }
  return records;
}

const Records& ListRecords() {
  static const Records records = MakeRecords(kListPrefix);
  return records;
}

const Records& WriteRecords() {
  static const Records records = MakeRecords(kWritePrefix);
  return records;
}

// ---- base64, as Go's encoding/json writes []byte ---------------------------

constexpr char kBase64[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

void AppendBase64(const std::string& in, std::string* out) {
  const auto* p = reinterpret_cast<const unsigned char*>(in.data());
  const std::size_t n = in.size();
  std::size_t at = out->size();
  out->resize(at + (n + 2) / 3 * 4);
  char* o = out->data();
  std::size_t i = 0;
  for (; i + 3 <= n; i += 3) {
    const std::uint32_t v = (p[i] << 16) | (p[i + 1] << 8) | p[i + 2];
    o[at++] = kBase64[v >> 18];
    o[at++] = kBase64[(v >> 12) & 63];
    o[at++] = kBase64[(v >> 6) & 63];
    o[at++] = kBase64[v & 63];
  }
  if (i < n) {
    const std::uint32_t v = (p[i] << 16) | (i + 1 < n ? p[i + 1] << 8 : 0);
    o[at++] = kBase64[v >> 18];
    o[at++] = kBase64[(v >> 12) & 63];
    o[at++] = i + 1 < n ? kBase64[(v >> 6) & 63] : '=';
    o[at++] = '=';
  }
}

std::string Base64(const std::string& in) {
  std::string out;
  AppendBase64(in, &out);
  return out;
}

struct Base64Table {
  std::int8_t value[256];
  Base64Table() : value() {
    std::fill(std::begin(value), std::end(value), static_cast<std::int8_t>(-1));
    for (int i = 0; i < 64; ++i)
      value[static_cast<unsigned char>(kBase64[i])] = static_cast<std::int8_t>(i);
  }
};

std::string Unbase64(const std::string& in) {
  static const Base64Table table;
  if (in.size() % 4 != 0) throw std::runtime_error("base64 of a length not a multiple of 4");
  std::size_t padding = 0;
  if (!in.empty() && in.back() == '=') padding = in[in.size() - 2] == '=' ? 2 : 1;
  std::string out(in.size() / 4 * 3 - padding, '\0');
  const auto* p = reinterpret_cast<const unsigned char*>(in.data());
  std::size_t o = 0;
  for (std::size_t i = 0; i < in.size(); i += 4) {
    const bool last = i + 4 == in.size();
    std::int32_t v = 0;
    for (std::size_t k = 0; k < 4; ++k) {
      const std::int8_t d = last && k >= 4 - padding ? std::int8_t{0} : table.value[p[i + k]];
      if (d < 0) throw std::runtime_error("not base64");
      v = (v << 6) | d;
    }
    out[o++] = static_cast<char>(v >> 16);
    if (o < out.size()) out[o++] = static_cast<char>(v >> 8);
    if (o < out.size()) out[o++] = static_cast<char>(v);
  }
  return out;
}

// ---- libcurl against the JSON gateway ----------------------------------------

class CurlTransport : public Transport {
 public:
  explicit CurlTransport(const std::string& endpoint)
      : base_("http://" + endpoint), curl_(curl_easy_init()) {
    if (curl_ == nullptr) throw std::runtime_error("curl_easy_init failed");
    headers_ = curl_slist_append(headers_, "Content-Type: application/json");
    // No "Expect: 100-continue" round trip before a large body.
    headers_ = curl_slist_append(headers_, "Expect:");
    curl_easy_setopt(curl_, CURLOPT_HTTPHEADER, headers_);
    curl_easy_setopt(curl_, CURLOPT_WRITEFUNCTION, &CurlTransport::Append);
    curl_easy_setopt(curl_, CURLOPT_WRITEDATA, &reply_);
  }
  ~CurlTransport() override {
    curl_easy_cleanup(curl_);
    curl_slist_free_all(headers_);
  }
  CurlTransport(const CurlTransport&) = delete;
  CurlTransport& operator=(const CurlTransport&) = delete;

  Page Range(const std::string& key, const std::string& end, std::int64_t revision,
             std::int64_t limit, Records* out) override {
    nlohmann::json request = {{"key", Base64(key)}, {"range_end", Base64(end)}};
    if (revision != 0) request["revision"] = revision;
    if (limit != 0) request["limit"] = limit;
    const nlohmann::json reply = nlohmann::json::parse(Post("/v3/kv/range", request.dump()));
    const auto kvs = reply.find("kvs");
    if (kvs != reply.end()) {
      out->reserve(out->size() + kvs->size());
      for (const nlohmann::json& kv : *kvs) {
        // proto3 JSON leaves an empty value out.
        const auto value = kv.find("value");
        out->emplace_back(
            Unbase64(kv.at("key").get_ref<const std::string&>()),
            value == kv.end() ? std::string() : Unbase64(value->get_ref<const std::string&>()));
      }
    }
    // int64 fields come as JSON strings.
    return {std::stoll(reply.at("header").at("revision").get<std::string>()),
            reply.value("more", false)};
  }

  void Put(const Records& records, std::size_t begin, std::size_t end) override {
    // Written by hand: base64 needs no JSON escaping, and the body is built in
    // one buffer reused from call to call.
    body_.assign(R"({"success":[)");
    for (std::size_t i = begin; i < end; ++i) {
      body_ += i == begin ? R"({"request_put":{"key":")" : R"(,{"request_put":{"key":")";
      AppendBase64(records[i].first, &body_);
      body_ += R"(","value":")";
      AppendBase64(records[i].second, &body_);
      body_ += R"("}})";
    }
    body_ += "]}";
    const nlohmann::json reply = nlohmann::json::parse(Post("/v3/kv/txn", body_));
    if (!reply.value("succeeded", false)) throw std::runtime_error("txn did not succeed");
  }

  long Connections() const override { return connections_; }

  // The reply's body without parsing it: how much of a listing is transfer.
  const std::string& Post(const char* path, const std::string& body) {
    reply_.clear();
    const std::string url = base_ + path;
    curl_easy_setopt(curl_, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl_, CURLOPT_POSTFIELDS, body.data());
    curl_easy_setopt(curl_, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body.size()));
    const CURLcode code = curl_easy_perform(curl_);
    if (code != CURLE_OK) {
      throw std::runtime_error(std::string("curl ") + path + ": " + curl_easy_strerror(code));
    }
    long connects = 0;
    curl_easy_getinfo(curl_, CURLINFO_NUM_CONNECTS, &connects);
    connections_ += connects;
    long status = 0;
    curl_easy_getinfo(curl_, CURLINFO_RESPONSE_CODE, &status);
    if (status != 200) {
      throw std::runtime_error(std::string("curl ") + path + ": HTTP " + std::to_string(status) +
                               ": " + reply_.substr(0, 200));
    }
    return reply_;
  }

 private:
  static std::size_t Append(char* data, std::size_t size, std::size_t count, void* reply) {
    static_cast<std::string*>(reply)->append(data, size * count);
    return size * count;
  }

  std::string base_;
  CURL* curl_;
  curl_slist* headers_ = nullptr;
  std::string reply_;
  std::string body_;
  long connections_ = 0;
};

// ---- The operations measured ------------------------------------------------

// Pages at the revision of the first, so the listing is one consistent view.
Records ListPaged(Transport& t, const std::string& prefix) {
  Records out;
  const std::string end = PrefixEnd(prefix);
  Page page = t.Range(prefix, end, 0, kPage, &out);
  const std::int64_t revision = page.revision;
  while (page.more) page = t.Range(out.back().first + '\0', end, revision, kPage, &out);
  return out;
}

// The listed records, written once a process.
void FillListPrefix() {
  static const bool filled = [] {
    EtcdAdmin().DeletePrefix(kListPrefix);
    WriteBatches(EtcdAdmin(), ListRecords());
    EtcdAdmin().CompactAll();
    return true;
  }();
  (void)filled;
}

std::unique_ptr<Transport> NewTransport(const std::string& kind) {
  if (kind == "grpc") return std::make_unique<GrpcTransport>(EtcdEndpoint());
  return std::make_unique<CurlTransport>(EtcdEndpoint());
}

void SetSizes(benchmark::State& state) {
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * kRecords));
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * kRecords * kValueBytes));
}

// ---- Benchmarks -------------------------------------------------------------

using ListFn = Records (*)(Transport&, const std::string&);

void BM_List(benchmark::State& state, const std::string& kind, ListFn list) {
  try {
    FillListPrefix();
    auto transport = NewTransport(kind);
    // Both transports are held to the bytes written, so to each other.
    if (list(*transport, kListPrefix) != ListRecords()) {
      state.SkipWithError("the listing differs from the records written");
      return;
    }
    EtcdCpu etcd(state);
    for (auto _ : state) benchmark::DoNotOptimize(list(*transport, kListPrefix));
    SetSizes(state);
    state.counters["connections"] = static_cast<double>(transport->Connections());
  } catch (const std::exception& e) {
    state.SkipWithError(e.what());
  }
}

// The gateway's listing as bytes, not parsed: the transfer's share of the
// libcurl listing.
void BM_CurlListTransferOnly(benchmark::State& state) {
  try {
    FillListPrefix();
    CurlTransport curl(EtcdEndpoint());
    const std::string body =
        nlohmann::json{{"key", Base64(kListPrefix)}, {"range_end", Base64(PrefixEnd(kListPrefix))}}
            .dump();
    EtcdCpu etcd(state);
    std::size_t bytes = 0;
    for (auto _ : state) bytes = curl.Post("/v3/kv/range", body).size();
    state.counters["reply_bytes"] = static_cast<double>(bytes);
    SetSizes(state);
  } catch (const std::exception& e) {
    state.SkipWithError(e.what());
  }
}

void BM_Write(benchmark::State& state, const std::string& kind) {
  try {
    auto transport = NewTransport(kind);
    EtcdAdmin().DeletePrefix(kWritePrefix);
    WriteBatches(*transport, WriteRecords());
    if (ListOne(EtcdAdmin(), kWritePrefix) != WriteRecords()) {
      state.SkipWithError("the records read back differ from those written");
      return;
    }
    {
      EtcdCpu etcd(state);
      for (auto _ : state) WriteBatches(*transport, WriteRecords());
    }
    SetSizes(state);
    state.counters["connections"] = static_cast<double>(transport->Connections());
    EtcdAdmin().CompactAll();
  } catch (const std::exception& e) {
    state.SkipWithError(e.what());
  }
}

// ---- Peak memory of a listing -----------------------------------------------
// A fresh process per figure (this binary, run with kChildFlag). It reports
// its resident set once connected (one small request done) and its peak after
// one listing: the difference is what the listing itself took.

constexpr char kChildFlag[] = "--peak-rss-child=";

long OwnRssKib() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmRSS:", 0) == 0) return std::strtol(line.c_str() + 6, nullptr, 10);
  }
  return -1;
}

int PeakRssChild(const std::string& kind, const std::string& mode) {
  try {
    auto transport = NewTransport(kind);
    Records none;
    transport->Range(kListPrefix, PrefixEnd(kListPrefix), 0, 1, &none);
    const long connected = OwnRssKib();
    const Records listed = (mode == "paged" ? ListPaged : ListOne)(*transport, kListPrefix);
    std::printf("%ld %ld\n", connected, OwnPeakRssKib());
    return listed.size() == kRecords ? 0 : 1;
  } catch (const std::exception& e) {
    std::fprintf(stderr, "%s\n", e.what());
    return 1;
  }
}

void BM_PeakRss(benchmark::State& state, const std::string& kind, const std::string& mode) {
  FillListPrefix();
  std::string report;
  for (auto _ : state) report = RunSelf({kChildFlag + kind, mode});
  long connected = 0;
  long peak = 0;
  if (std::sscanf(report.c_str(), "%ld %ld", &connected, &peak) != 2 || peak <= 0) {
    state.SkipWithError("the listing child failed");
    return;
  }
  state.counters["connected_rss_kib"] = static_cast<double>(connected);
  state.counters["peak_rss_kib"] = static_cast<double>(peak);
  state.counters["listing_rss_kib"] = static_cast<double>(peak - connected);
}

void Register() {
  // Client CPU over all the process's threads: gRPC does part of its work in
  // its own. The timed loops are long enough (a listing is tens of ms or
  // more) that half a second holds a few iterations, and the repetitions are
  // what the spread is read from.
  auto timed = [](benchmark::internal::Benchmark* b, double min_time) {
    b->Unit(benchmark::kMillisecond)
        ->UseRealTime()
        ->MeasureProcessCPUTime()
        ->MinTime(min_time)
        ->Repetitions(10);
  };
  for (const char* kind : {"grpc", "curl"}) {
    const std::string k = kind;
    timed(benchmark::RegisterBenchmark(("BM_ListOne_" + k).c_str(), BM_List, k, &ListOne), 0.5);
    timed(benchmark::RegisterBenchmark(("BM_ListPaged_" + k).c_str(), BM_List, k, &ListPaged), 0.5);
    timed(benchmark::RegisterBenchmark(("BM_Write_" + k).c_str(), BM_Write, k), 1.0);
    for (const char* mode : {"one", "paged"}) {
      benchmark::RegisterBenchmark((std::string("BM_PeakRss_") + mode + "_" + k).c_str(),
                                   BM_PeakRss, k, std::string(mode))
          ->Unit(benchmark::kMillisecond)
          ->Iterations(1)
          ->Repetitions(3);
    }
  }
  timed(benchmark::RegisterBenchmark("BM_CurlListTransferOnly", BM_CurlListTransferOnly), 0.5);
}

}  // namespace
}  // namespace karst_bench

int main(int argc, char** argv) {
  if (argc == 3 &&
      std::strncmp(argv[1], karst_bench::kChildFlag, std::strlen(karst_bench::kChildFlag)) == 0) {
    curl_global_init(CURL_GLOBAL_DEFAULT);
    return karst_bench::PeakRssChild(argv[1] + std::strlen(karst_bench::kChildFlag), argv[2]);
  }
  // Freed memory stays with the process, as in karst_bench: otherwise every
  // listing faults its pages in again, and on a VM that is most of the noise.
  if (!karst_bench::KeepFreedMemory()) {
    std::fprintf(stderr, "mallopt failed\n");
    return 1;
  }
  curl_global_init(CURL_GLOBAL_DEFAULT);
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  karst_bench::Register();
  benchmark::AddCustomContext("libcurl", curl_version());
  benchmark::AddCustomContext("grpc", grpc::Version());
  benchmark::AddCustomContext("etcd", karst_bench::EtcdVersion());
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  curl_global_cleanup();
  return 0;
}
