// The members of a cluster as the client reaches them: a channel of its own
// for each, so that one member that hangs or refuses holds up nobody, and
// the order to try them in.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_MEMBERS_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_MEMBERS_H_

#include <grpcpp/generic/generic_stub.h>
#include <grpcpp/grpcpp.h>

#include <cstddef>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "EtcdTlsFiles.h"
#include "TavoConfigStore/EtcdStore.h"
#include "etcd/etcdserver/etcdserverpb/rpc.grpc.pb.h"

namespace TavoConfigStore {

struct EtcdMember {
  EtcdMember(const std::string& endpoint, const EtcdStoreOptions& options,
             const TlsMaterial& material);

  // When the last connection to the member failed, connects again at once
  // (rather than after a backoff of up to a second) and gives the attempt a
  // moment, until "until" at most, so that a request is told what the member
  // does now rather than how an earlier attempt ended.
  void Reconnect(std::chrono::steady_clock::time_point until);

  std::string endpoint;  // HOST:PORT
  std::shared_ptr<grpc::Channel> channel;
  // Unary calls by name, their replies kept as received; the generated
  // stubs for the streams.
  grpc::GenericStub calls;
  std::unique_ptr<etcdserverpb::Lease::Stub> lease;
  std::unique_ptr<etcdserverpb::Watch::Stub> watch;
};

class EtcdMembers {
 public:
  EtcdMembers(const EtcdStoreOptions& options, const TlsMaterial& material);

  std::size_t Size() const { return members_.size(); }
  EtcdMember& operator[](std::size_t i) { return *members_[i]; }

  // The members in the order to try them: the one that answered last, then
  // the others in the locator's order, those that let a request go
  // unanswered since they last answered one at the end.
  std::vector<std::size_t> Order() const;
  void Answered(std::size_t i);
  // Let a request go unanswered in its time, or lost a stream.
  void Stalled(std::size_t i);

 private:
  std::vector<std::unique_ptr<EtcdMember>> members_;
  mutable std::mutex mu_;
  std::size_t preferred_ = 0;
  std::vector<bool> stalled_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_MEMBERS_H_
