// The etcd store reads its replies in place (EtcdWire.h). Replies are made
// here by etcd's own protobuf code, which is also the judge of what a cut or
// damaged reply holds: the reader must agree with it, never read outside the
// reply, and never accept what protobuf refuses.

#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

#include "EtcdWire.h"
#include "etcd/etcdserver/etcdserverpb/rpc.pb.h"

namespace TavoConfigStore {
namespace etcdwire {
namespace {

using Row = std::tuple<std::string, std::string, std::int64_t, std::int64_t>;

std::string Varint(std::uint64_t v) {
  std::string out;
  for (; v >= 0x80; v >>= 7) out += static_cast<char>(v | 0x80);
  return out + static_cast<char>(v);
}

std::string Field(int number, const std::string& bytes) {
  return Varint(static_cast<std::uint64_t>(number) << 3 | 2) + Varint(bytes.size()) + bytes;
}

mvccpb::KeyValue Kv(const std::string& key, const std::string& value, std::int64_t revision) {
  mvccpb::KeyValue kv;
  kv.set_key(key);
  kv.set_value(value);
  kv.set_create_revision(revision);
  kv.set_mod_revision(revision + 1);
  kv.set_version(3);  // fields the store does not read are skipped
  kv.set_lease(0x7fffffffffffffff);
  return kv;
}

// A RangeResponse whose second key-value also carries unknown 64- and
// 32-bit fields (number 15), as a newer etcd might send.
std::string RangeBytes(const std::string& bigValue) {
  etcdserverpb::ResponseHeader header;
  header.set_cluster_id(1);
  header.set_revision(77);
  header.set_raft_term(2);
  std::string out = Field(1, header.SerializeAsString());
  out += Field(2, Kv("/p/g/1/a", std::string("x\0\xff", 3), 5).SerializeAsString());
  out += Field(2, Kv("/p/g/1/b", bigValue, -1).SerializeAsString() + "\x79" + std::string(8, 'f') +
                      "\x7d" + std::string(4, 'f'));
  out += Varint(3 << 3) + Varint(1);  // more = true
  return out;
}

// A TxnResponse with ranges, a put's reply and an empty range among them, and
// a field of a later etcd, which is skipped.
std::string TxnBytes(bool succeeded) {
  etcdserverpb::TxnResponse txn;
  txn.mutable_header()->set_revision(9);
  txn.set_succeeded(succeeded);
  *txn.add_responses()->mutable_response_range()->add_kvs() = Kv("k1", "v1", 4);
  txn.add_responses()->mutable_response_put()->mutable_header()->set_revision(9);
  txn.add_responses()->mutable_response_range();
  *txn.add_responses()->mutable_response_range()->add_kvs() = Kv("k2", "", 6);
  return txn.SerializeAsString() + Varint(9 << 3) + Varint(5);
}

std::vector<Row> Rows(const etcdserverpb::RangeResponse& range) {
  std::vector<Row> rows;
  for (const auto& kv : range.kvs()) {
    rows.emplace_back(kv.key(), kv.value(), kv.create_revision(), kv.mod_revision());
  }
  return rows;
}

// Reads "bytes" into "reply" (from a copy of exactly their size, so that the
// sanitizers see a read past the end) and with protobuf; where both read
// them, the reader must have found what protobuf found. {read, judged}.
std::pair<bool, bool> ReadBoth(const std::string& bytes, bool isTxn, Reply* reply) {
  reply->bytes = grpc::Slice(bytes);
  const bool read = isTxn ? ParseTxnResponse(reply) : ParseRangeResponse(reply);
  etcdserverpb::TxnResponse txn;
  etcdserverpb::RangeResponse range;
  const bool judged = isTxn ? txn.ParseFromString(bytes) : range.ParseFromString(bytes);
  if (!read || !judged) return {read, judged};
  std::vector<std::vector<Row>> expected, got;
  if (!isTxn) expected.push_back(Rows(range));
  for (const auto& response : txn.responses()) expected.push_back(Rows(response.response_range()));
  for (const Range& r : reply->ranges) {
    got.emplace_back();
    for (const KeyValue& kv : r.kvs) {
      got.back().emplace_back(std::string(kv.key), std::string(kv.value), kv.createRevision,
                              kv.modRevision);
    }
  }
  EXPECT_EQ(got, expected);
  EXPECT_EQ(reply->revision, isTxn ? txn.header().revision() : range.header().revision());
  if (isTxn) {
    EXPECT_EQ(reply->succeeded, txn.succeeded());
  }
  return {read, judged};
}

// Every reply whole and cut short anywhere, and the replies of one range with
// any byte changed: a cut reply is read exactly when protobuf reads it, and
// nothing protobuf refuses is read (the reader may refuse more: a known field
// with the wrong wire type). A put's reply within a transaction is skipped
// unread, so damage there goes unseen.
TEST(EtcdWire, RepliesWholeCutOrDamagedReadAsProtobufReadsThem) {
  etcdserverpb::TxnResponse oneRange;
  oneRange.mutable_header()->set_revision(3);
  *oneRange.add_responses()->mutable_response_range()->add_kvs() = Kv("key", "value", 2);
  const std::tuple<std::string, bool, bool> replies[] = {{RangeBytes("value"), false, true},
                                                         {oneRange.SerializeAsString(), true, true},
                                                         {TxnBytes(true), true, false},
                                                         {TxnBytes(false), true, false}};
  for (const auto& [bytes, isTxn, damaged] : replies) {
    Reply whole;
    ASSERT_EQ(ReadBoth(bytes, isTxn, &whole), std::pair(true, true));
    for (std::size_t cut = 0; cut < bytes.size(); ++cut) {
      Reply reply;
      const auto [read, judged] = ReadBoth(bytes.substr(0, cut), isTxn, &reply);
      EXPECT_EQ(read, judged) << "cut at " << cut;
    }
    for (std::size_t at = 0; damaged && at < bytes.size(); ++at) {
      for (unsigned char x : {0x01, 0x07, 0x80, 0xff}) {
        std::string variant = bytes;
        variant[at] = static_cast<char>(bytes[at] ^ x);
        Reply reply;
        const auto [read, judged] = ReadBoth(variant, isTxn, &reply);
        EXPECT_TRUE(judged || !read) << "byte " << at << " ^ " << int{x};
      }
    }
  }
  // A reply read again starts afresh, and a large value is read in place.
  Reply reply;
  ReadBoth(TxnBytes(true), true, &reply);
  ASSERT_EQ(ReadBoth(TxnBytes(false), true, &reply), std::pair(true, true));
  const std::string big(3 << 20, '\x01');
  ASSERT_EQ(ReadBoth(RangeBytes(big), false, &reply), std::pair(true, true));
  const std::string_view value = reply.ranges.at(0).kvs.at(1).value;
  const auto* begin = reinterpret_cast<const char*>(reply.bytes.begin());
  EXPECT_TRUE(value.data() >= begin && value.data() + big.size() <= begin + reply.bytes.size());
}

}  // namespace
}  // namespace etcdwire
}  // namespace TavoConfigStore
