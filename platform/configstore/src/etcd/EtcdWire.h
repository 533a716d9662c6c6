// etcd's read replies, read where they lie. Parsing a reply into protobuf
// messages gives every key and value a string of its own and frees them all
// again afterwards: for a listing that was more work than the rest of the
// listing together. The store reads keys and values as views into the
// received bytes instead, which the reply keeps.
//
// Only the fields the store reads are kept: the header's revision, a
// transaction's outcome, and each range's keys, values and revisions.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_WIRE_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_WIRE_H_

#include <grpcpp/support/slice.h>

#include <cstdint>
#include <string_view>
#include <vector>

namespace TavoConfigStore {
namespace etcdwire {

struct KeyValue {
  std::string_view key;
  std::string_view value;
  std::int64_t createRevision = 0;
  std::int64_t modRevision = 0;
};

struct Range {
  std::vector<KeyValue> kvs;
};

// A RangeResponse (one range) or a TxnResponse (one range for each of its
// responses, in order; those that are not ranges are left empty). The views
// point into "bytes", which the reply owns: it is neither copied nor moved.
struct Reply {
  Reply() = default;
  Reply(const Reply&) = delete;
  Reply& operator=(const Reply&) = delete;

  grpc::Slice bytes;
  std::int64_t revision = 0;
  bool succeeded = false;
  std::vector<Range> ranges;
};

// Fill "*reply" from the encoded message in "reply->bytes"; false when the
// bytes are not such a message.
bool ParseRangeResponse(Reply* reply);
bool ParseTxnResponse(Reply* reply);

}  // namespace etcdwire
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_WIRE_H_
