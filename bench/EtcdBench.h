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

struct Page {
  std::int64_t revision = 0;
  bool more = false;
};

// A way to reach etcd's KV calls.
class Transport {
 public:
  virtual ~Transport() = default;
  // The keys in [key, end) at revision (0: the latest), at most limit of
  // them (0: all), appended to out. An empty end reads the one key.
  virtual Page Range(const std::string& key, const std::string& end, std::int64_t revision,
                     std::int64_t limit, Records* out) = 0;
  // One transaction putting records[begin, end).
  virtual void Put(const Records& records, std::size_t begin, std::size_t end) = 0;
  // Connections opened so far, where the transport can tell: keep-alive
  // should hold this at 1.
  virtual long Connections() const { return -1; }
};

// The generated v3 stubs on a channel of their own, as the store's client
// sets one up, with nothing of the store on top.
class GrpcTransport : public Transport {
 public:
  explicit GrpcTransport(const std::string& endpoint);

  Page Range(const std::string& key, const std::string& end, std::int64_t revision,
             std::int64_t limit, Records* out) override;
  void Put(const Records& records, std::size_t begin, std::size_t end) override;

  // Drops the history older than the latest revision, so that repeated
  // writes do not grow the database from one repetition to the next.
  void CompactAll();
  void DeletePrefix(const std::string& prefix);

 private:
  std::shared_ptr<grpc::Channel> channel_;
  std::unique_ptr<etcdserverpb::KV::Stub> kv_;
};

// Every key under prefix, in one reply.
Records ListOne(Transport& t, const std::string& prefix);

// The records in transactions of kEtcdBatch puts, one after the other.
void WriteBatches(Transport& t, const Records& records);

// A client for setting up and tidying, apart from the ones timed.
GrpcTransport& EtcdAdmin();

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
