#include "EtcdBench.h"

#include <malloc.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <stdexcept>

namespace karst_bench {
namespace {

void Check(const grpc::Status& status, const char* call) {
  if (!status.ok()) {
    throw std::runtime_error(std::string("gRPC ") + call + ": " + status.error_message());
  }
}

// CPU time the etcd server has used so far, in milliseconds, or -1.
double EtcdCpuMs() {
  const char* pid = std::getenv("KARST_BENCH_ETCD_PID");
  if (pid == nullptr || *pid == '\0') return -1;
  std::ifstream stat(std::string("/proc/") + pid + "/stat");
  std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
  // Fields after the command name, which is in parentheses: utime and stime
  // are the 12th and 13th of them.
  const std::size_t close = text.rfind(')');
  if (close == std::string::npos) return -1;
  std::vector<std::string> fields;
  std::size_t at = close + 2;
  for (std::size_t space; (space = text.find(' ', at)) != std::string::npos; at = space + 1) {
    fields.push_back(text.substr(at, space - at));
  }
  if (fields.size() < 13) return -1;
  const double ticks = std::stod(fields[11]) + std::stod(fields[12]);
  return ticks * 1000.0 / static_cast<double>(sysconf(_SC_CLK_TCK));
}

}  // namespace

std::string EtcdEndpoint() {
  const char* endpoint = std::getenv("KARST_BENCH_ETCD");
  if (endpoint == nullptr || *endpoint == '\0') {
    throw std::runtime_error("KARST_BENCH_ETCD (HOST:PORT of an etcd) is not set");
  }
  return endpoint;
}

std::string PrefixEnd(std::string prefix) {
  ++prefix.back();
  return prefix;
}

RawEtcd::RawEtcd(const std::string& endpoint) {
  grpc::ChannelArguments args;
  // A listing of 10,000 policies in one reply is over gRPC's default 4 MB.
  args.SetMaxReceiveMessageSize(-1);
  args.SetMaxSendMessageSize(-1);
  args.SetLoadBalancingPolicyName("pick_first");
  channel_ =
      grpc::CreateCustomChannel("dns:///" + endpoint, grpc::InsecureChannelCredentials(), args);
  kv_ = etcdserverpb::KV::NewStub(channel_);
}

std::int64_t RawEtcd::Range(const std::string& key, const std::string& end, Records* out,
                            std::int64_t limit) {
  etcdserverpb::RangeRequest request;
  request.set_key(key);
  request.set_range_end(end);
  request.set_limit(limit);
  etcdserverpb::RangeResponse response;
  grpc::ClientContext context;
  Check(kv_->Range(&context, request, &response), "Range");
  out->reserve(out->size() + static_cast<std::size_t>(response.kvs_size()));
  for (mvccpb::KeyValue& kv : *response.mutable_kvs()) {
    out->emplace_back(std::move(*kv.mutable_key()), std::move(*kv.mutable_value()));
  }
  return response.header().revision();
}

void RawEtcd::Put(const Records& records, std::size_t begin, std::size_t end) {
  etcdserverpb::TxnRequest request;
  for (std::size_t i = begin; i < end; ++i) {
    etcdserverpb::PutRequest* put = request.add_success()->mutable_request_put();
    put->set_key(records[i].first);
    put->set_value(records[i].second);
  }
  etcdserverpb::TxnResponse response;
  grpc::ClientContext context;
  Check(kv_->Txn(&context, request, &response), "Txn");
}

void RawEtcd::CompactAll() {
  Records none;
  etcdserverpb::CompactionRequest request;
  request.set_revision(Range(std::string(1, '\0'), std::string(1, '\0'), &none, 1));
  request.set_physical(true);
  etcdserverpb::CompactionResponse response;
  grpc::ClientContext context;
  Check(kv_->Compact(&context, request, &response), "Compact");
}

void RawEtcd::DeletePrefix(const std::string& prefix) {
  etcdserverpb::DeleteRangeRequest request;
  request.set_key(prefix);
  request.set_range_end(PrefixEnd(prefix));
  etcdserverpb::DeleteRangeResponse response;
  grpc::ClientContext context;
  Check(kv_->DeleteRange(&context, request, &response), "DeleteRange");
}

Records ListOne(RawEtcd& etcd, const std::string& prefix) {
  Records out;
  etcd.Range(prefix, PrefixEnd(prefix), &out);
  return out;
}

void WriteBatches(RawEtcd& etcd, const Records& records) {
  for (std::size_t i = 0; i < records.size(); i += kEtcdBatch) {
    etcd.Put(records, i, std::min(i + kEtcdBatch, records.size()));
  }
}

RawEtcd& EtcdAdmin() {
  static RawEtcd admin(EtcdEndpoint());
  return admin;
}

std::string EtcdVersion() {
  try {
    auto maintenance = etcdserverpb::Maintenance::NewStub(
        grpc::CreateChannel(EtcdEndpoint(), grpc::InsecureChannelCredentials()));
    etcdserverpb::StatusResponse response;
    grpc::ClientContext context;
    const grpc::Status status =
        maintenance->Status(&context, etcdserverpb::StatusRequest(), &response);
    return status.ok() ? response.version() : "unreachable: " + status.error_message();
  } catch (const std::exception& e) {
    return e.what();
  }
}

EtcdCpu::EtcdCpu(benchmark::State& state) : state_(state), start_(EtcdCpuMs()) {}

EtcdCpu::~EtcdCpu() {
  const double now = EtcdCpuMs();
  if (start_ >= 0 && now >= 0) {
    state_.counters["etcd_cpu_ms"] =
        benchmark::Counter(now - start_, benchmark::Counter::kAvgIterations);
  }
}

bool KeepFreedMemory() {
  return mallopt(M_TRIM_THRESHOLD, 1 << 30) == 1 && mallopt(M_MMAP_THRESHOLD, 32 << 20) == 1;
}

}  // namespace karst_bench
