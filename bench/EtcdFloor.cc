#include "EtcdFloor.h"

#include <grpcpp/support/byte_buffer.h>

#include <chrono>
#include <stdexcept>

namespace karst_bench {
namespace {

// etcdserverpb.RangeRequest: key (field 1, bytes) and serializable
// (field 7, bool); every other field keeps its default.
std::string EncodeRange(const std::string& key, bool serializable) {
  std::string bytes(1, '\x0a');
  for (std::size_t n = key.size();; n >>= 7) {
    bytes += static_cast<char>(n < 0x80 ? n : (n & 0x7f) | 0x80);
    if (n < 0x80) break;
  }
  bytes += key;
  if (serializable) bytes += std::string("\x38\x01", 2);
  return bytes;
}

}  // namespace

OneKeyRange::OneKeyRange(const std::string& endpoint, const std::string& key, bool serializable)
    : channel_(grpc::CreateChannel("dns:///" + endpoint, grpc::InsecureChannelCredentials())),
      stub_(channel_) {
  const std::string bytes = EncodeRange(key, serializable);
  grpc::Slice slice(bytes);
  request_ = grpc::ByteBuffer(&slice, 1);
}

void OneKeyRange::Read() {
  grpc::ClientContext context;
  context.set_deadline(std::chrono::system_clock::now() + std::chrono::seconds(5));
  grpc::CompletionQueue queue;
  grpc::ByteBuffer reply;
  grpc::Status status;
  auto call = stub_.PrepareUnaryCall(&context, "/etcdserverpb.KV/Range", request_, &queue);
  call->StartCall();
  call->Finish(&reply, &status, nullptr);
  void* tag = nullptr;
  bool ok = false;
  queue.Next(&tag, &ok);
  queue.Shutdown();
  while (queue.Next(&tag, &ok)) {
  }
  if (!status.ok()) throw std::runtime_error("Range: " + status.error_message());
}

}  // namespace karst_bench
