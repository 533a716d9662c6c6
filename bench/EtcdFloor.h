// The cheapest request etcd answers, with nothing of the store around it:
// a Range of one key, sent through gRPC's generic stub as bytes encoded
// here. What a read of the store costs the cluster is measured against it.

#ifndef KARST_BENCH_ETCD_FLOOR_H_
#define KARST_BENCH_ETCD_FLOOR_H_

#include <grpcpp/generic/generic_stub.h>
#include <grpcpp/grpcpp.h>

#include <memory>
#include <string>

namespace karst_bench {

class OneKeyRange {
 public:
  // A channel of its own to "endpoint" (HOST:PORT), reading "key";
  // "serializable" reads answer from the member's own copy, without the
  // leader's read index.
  OneKeyRange(const std::string& endpoint, const std::string& key, bool serializable);

  // One request; throws std::runtime_error when etcd does not answer it.
  void Read();

 private:
  std::shared_ptr<grpc::Channel> channel_;
  grpc::GenericStub stub_;
  grpc::ByteBuffer request_;
};

}  // namespace karst_bench

#endif  // KARST_BENCH_ETCD_FLOOR_H_
