// A synchronous client for the parts of etcd's v3 API the store uses, with
// the store's error reporting: every failure becomes a ConfigStoreException
// whose message names the cluster and whose code is kErrorEtcdBase plus the
// gRPC status code.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_

#include <grpcpp/grpcpp.h>
#include <grpcpp/impl/client_unary_call.h>
#include <grpcpp/impl/rpc_method.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "EtcdWire.h"
#include "TavoConfigStore/EtcdStore.h"
#include "etcd/etcdserver/etcdserverpb/rpc.grpc.pb.h"

namespace TavoConfigStore {

class EtcdClient {
 public:
  explicit EtcdClient(const EtcdStoreOptions& options);

  // "etcd HOST:PORT[,...]", for messages.
  const std::string& Where() const { return where_; }

  // A request that cannot reach a member is tried again until its time is
  // up, so a failover between members goes unnoticed.
  // "retry": the request may be sent twice (puts of the same bytes, or a
  // transaction guarded by compares that a second attempt would fail).
  etcdserverpb::TxnResponse Txn(const etcdserverpb::TxnRequest& request, bool retry);
  // Reads, with the reply kept as received (EtcdWire.h); a transaction sent
  // this way must only read.
  void Read(const etcdserverpb::RangeRequest& request, etcdwire::Reply* reply);
  void Read(const etcdserverpb::TxnRequest& request, etcdwire::Reply* reply);

  std::int64_t LeaseGrant(std::int64_t ttlSeconds);
  void LeaseKeepAlive(std::int64_t lease);
  // Throws unless etcd confirms the lease is gone.
  void LeaseRevoke(std::int64_t lease);

  // Readies a context for a call of one's own (a watch, which has no
  // deadline): waits for a member, carries the auth token.
  void Prepare(grpc::ClientContext* context);
  etcdserverpb::Watch::Stub& WatchStub() { return *watch_; }

  // Throws the store's exception for a failed call.
  [[noreturn]] void Fail(const grpc::Status& status, const char* what) const;

 private:
  template <typename Call>
  grpc::Status Invoke(const Call& call, bool retry);
  void Authenticate(std::chrono::system_clock::time_point deadline);
  template <typename Request>
  void Receive(const grpc::internal::RpcMethod& method, const Request& request,
               etcdwire::Reply* reply);

  EtcdStoreOptions options_;
  std::string where_;
  std::shared_ptr<grpc::Channel> channel_;
  std::unique_ptr<etcdserverpb::KV::Stub> kv_;
  std::unique_ptr<grpc::internal::RpcMethod> rangeMethod_;
  std::unique_ptr<grpc::internal::RpcMethod> txnMethod_;
  std::unique_ptr<etcdserverpb::Lease::Stub> lease_;
  std::unique_ptr<etcdserverpb::Watch::Stub> watch_;
  std::unique_ptr<etcdserverpb::Auth::Stub> auth_;
  std::mutex tokenMu_;
  std::string token_;
  bool authenticated_ = false;
};

// The first key after every key that starts with "prefix" (etcd's range end).
std::string PrefixEnd(std::string prefix);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_
