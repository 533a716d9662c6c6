#include "EtcdKeys.h"

#include <grpcpp/grpcpp.h>

#include <stdexcept>

#include "etcd/etcdserver/etcdserverpb/rpc.grpc.pb.h"

namespace karst_test {

struct EtcdKeys::Stubs {
  std::unique_ptr<etcdserverpb::KV::Stub> kv;
  std::unique_ptr<etcdserverpb::Lease::Stub> lease;
};

namespace {

void Check(const grpc::Status& status, const char* what) {
  if (!status.ok()) {
    throw std::runtime_error(std::string("etcd ") + what + ": " + status.error_message());
  }
}

std::string PrefixEnd(std::string prefix) {
  while (!prefix.empty() && static_cast<unsigned char>(prefix.back()) == 0xff) prefix.pop_back();
  if (prefix.empty()) return std::string(1, '\0');
  prefix.back() = static_cast<char>(prefix.back() + 1);
  return prefix;
}

}  // namespace

EtcdKeys::EtcdKeys(const std::string& endpoint) : stubs_(std::make_unique<Stubs>()) {
  grpc::ChannelArguments args;
  args.SetMaxReceiveMessageSize(-1);
  auto channel =
      grpc::CreateCustomChannel("dns:///" + endpoint, grpc::InsecureChannelCredentials(), args);
  stubs_->kv = etcdserverpb::KV::NewStub(channel);
  stubs_->lease = etcdserverpb::Lease::NewStub(channel);
}

EtcdKeys::~EtcdKeys() = default;

std::map<std::string, std::string> EtcdKeys::List(const std::string& prefix) const {
  etcdserverpb::RangeRequest request;
  request.set_key(prefix);
  request.set_range_end(PrefixEnd(prefix));
  etcdserverpb::RangeResponse response;
  grpc::ClientContext context;
  Check(stubs_->kv->Range(&context, request, &response), "range");
  std::map<std::string, std::string> out;
  for (const auto& kv : response.kvs()) out.emplace(kv.key(), kv.value());
  return out;
}

std::vector<std::string> EtcdKeys::Keys(const std::string& prefix) const {
  etcdserverpb::RangeRequest request;
  request.set_key(prefix);
  request.set_range_end(PrefixEnd(prefix));
  request.set_keys_only(true);
  etcdserverpb::RangeResponse response;
  grpc::ClientContext context;
  Check(stubs_->kv->Range(&context, request, &response), "range");
  std::vector<std::string> out;
  for (const auto& kv : response.kvs()) out.push_back(kv.key());
  return out;
}

void EtcdKeys::Put(const std::string& key, const std::string& value, std::int64_t lease) const {
  etcdserverpb::PutRequest request;
  request.set_key(key);
  request.set_value(value);
  request.set_lease(lease);
  etcdserverpb::PutResponse response;
  grpc::ClientContext context;
  Check(stubs_->kv->Put(&context, request, &response), "put");
}

std::int64_t EtcdKeys::GrantLease(std::int64_t ttlSeconds) const {
  etcdserverpb::LeaseGrantRequest request;
  request.set_ttl(ttlSeconds);
  etcdserverpb::LeaseGrantResponse response;
  grpc::ClientContext context;
  Check(stubs_->lease->LeaseGrant(&context, request, &response), "lease grant");
  return response.id();
}

void EtcdKeys::RevokeLease(std::int64_t lease) const {
  etcdserverpb::LeaseRevokeRequest request;
  request.set_id(lease);
  etcdserverpb::LeaseRevokeResponse response;
  grpc::ClientContext context;
  Check(stubs_->lease->LeaseRevoke(&context, request, &response), "lease revoke");
}

std::string StoreRoot(const std::string& prefix) {
  std::string root = "/";
  for (char c : prefix) {
    if (c == '\0' || c == '\1') {
      root += '\1';
      root += static_cast<char>(c + 1);
    } else {
      root += c;
    }
  }
  return root + "/" + '\0';
}

}  // namespace karst_test
