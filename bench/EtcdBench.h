// What the etcd benchmarks share: the etcd that bench/run started, etcd's own
// gRPC calls with nothing on top, and the server's CPU time as a counter.

#ifndef KARST_BENCH_ETCD_BENCH_H_
#define KARST_BENCH_ETCD_BENCH_H_

#include <benchmark/benchmark.h>
#include <grpcpp/grpcpp.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "etcd/etcdserver/etcdserverpb/rpc.grpc.pb.h"

namespace karst_bench {

using Records = std::vector<std::pair<std::string, std::string>>;

// Puts per write transaction, as the etcd store batches them.
constexpr std::size_t kEtcdBatch = 100;

// HOST:PORT of the etcd in KARST_BENCH_ETCD; throws when it is not set.
std::string EtcdEndpoint();

// The end of the range that holds every key starting with prefix.
std::string PrefixEnd(std::string prefix);

// etcd's generated v3 stubs on a channel of their own, as the store's client
// sets one up, with nothing of the store on top.
class RawEtcd {
 public:
  explicit RawEtcd(const std::string& endpoint);

  // The keys in [key, end) at the latest revision, at most limit of them (0:
  // all), appended to out; an empty end reads the one key. Returns the
  // revision read.
  std::int64_t Range(const std::string& key, const std::string& end, Records* out,
                     std::int64_t limit = 0);
  // One transaction putting records[begin, end).
  void Put(const Records& records, std::size_t begin, std::size_t end);

  // Drops the history older than the latest revision, so that repeated
  // writes do not grow the database from one repetition to the next.
  void CompactAll();
  void DeletePrefix(const std::string& prefix);

 private:
  std::shared_ptr<grpc::Channel> channel_;
  std::unique_ptr<etcdserverpb::KV::Stub> kv_;
};

// Every key under prefix, in one reply.
Records ListOne(RawEtcd& etcd, const std::string& prefix);

// The records in transactions of kEtcdBatch puts, one after the other.
void WriteBatches(RawEtcd& etcd, const Records& records);

// A client for setting up and tidying, apart from the ones timed.
RawEtcd& EtcdAdmin();

// The server's version, for the report.
std::string EtcdVersion();

// The etcd server's CPU time (KARST_BENCH_ETCD_PID) per iteration, as the
// counter etcd_cpu_ms, from construction to destruction.
class EtcdCpu {
 public:
  explicit EtcdCpu(benchmark::State& state);
  ~EtcdCpu();
  EtcdCpu(const EtcdCpu&) = delete;
  EtcdCpu& operator=(const EtcdCpu&) = delete;

 private:
  benchmark::State& state_;
  double start_;
};

// Freed memory stays with the process: otherwise every listing faults its
// pages in again, and on a virtual machine that is most of the noise. False
// when glibc refuses.
bool KeepFreedMemory();

}  // namespace karst_bench

#endif  // KARST_BENCH_ETCD_BENCH_H_
