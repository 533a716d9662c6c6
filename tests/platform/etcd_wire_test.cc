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

std::vector<Row> Rows(const Range& range) {
  std::vector<Row> rows;
  for (const KeyValue& kv : range.kvs) {
    rows.emplace_back(std::string(kv.key), std::string(kv.value), kv.createRevision,
                      kv.modRevision);
  }
  return rows;
}

std::vector<Row> Rows(const etcdserverpb::RangeResponse& range) {
  std::vector<Row> rows;
  for (const auto& kv : range.kvs()) {
    rows.emplace_back(kv.key(), kv.value(), kv.create_revision(), kv.mod_revision());
  }
  return rows;
}

// A copy of exactly the reply's size, so that the sanitizers see a read past
// its end.
bool Parse(const std::string& bytes, Reply* reply, bool txn) {
  reply->bytes = grpc::Slice(bytes);
  return txn ? ParseTxnResponse(reply) : ParseRangeResponse(reply);
}

TEST(EtcdWire, ReadsARangeReplyInPlace) {
  const std::string big(3 << 20, '\x01');
  const std::string bytes = RangeBytes(big);
  etcdserverpb::RangeResponse expected;
  ASSERT_TRUE(expected.ParseFromString(bytes));
  Reply reply;
  ASSERT_TRUE(Parse(bytes, &reply, false));
  EXPECT_EQ(reply.revision, 77);
  ASSERT_EQ(reply.ranges.size(), 1u);
  EXPECT_EQ(Rows(reply.ranges[0]), Rows(expected));
  const auto* begin = reinterpret_cast<const char*>(reply.bytes.begin());
  EXPECT_GE(reply.ranges[0].kvs[1].value.data(), begin);
  EXPECT_LE(reply.ranges[0].kvs[1].value.data() + big.size(), begin + reply.bytes.size());
}

TEST(EtcdWire, ReadsATransactionsRangesInOrder) {
  etcdserverpb::TxnResponse txn;
  txn.mutable_header()->set_revision(9);
  txn.set_succeeded(true);
  *txn.add_responses()->mutable_response_range()->add_kvs() = Kv("k1", "v1", 4);
  txn.add_responses()->mutable_response_put()->mutable_header()->set_revision(9);
  txn.add_responses()->mutable_response_range();
  *txn.add_responses()->mutable_response_range()->add_kvs() = Kv("k2", "", 6);
  // ... and a field of a later etcd, which is skipped.
  const std::string succeeded = txn.SerializeAsString() + Varint(9 << 3) + Varint(5);
  Reply reply;
  ASSERT_TRUE(Parse(succeeded, &reply, true));
  EXPECT_EQ(reply.revision, 9);
  EXPECT_TRUE(reply.succeeded);
  ASSERT_EQ(reply.ranges.size(), 4u);
  for (int i = 0; i < 4; ++i) {
    EXPECT_EQ(Rows(reply.ranges[static_cast<std::size_t>(i)]),
              Rows(txn.responses(i).response_range()))
        << i;
  }
  txn.set_succeeded(false);
  const std::string failed = txn.SerializeAsString();
  ASSERT_TRUE(Parse(failed, &reply, true));
  EXPECT_FALSE(reply.succeeded);
}

// Every cut of a reply, and every byte of it changed: where protobuf reads
// the bytes the reader reads the same, and it accepts nothing protobuf
// refuses (it may refuse more: a known field with the wrong wire type).
TEST(EtcdWire, CutOrDamagedRepliesAgreeWithProtobuf) {
  etcdserverpb::TxnResponse txn;
  txn.mutable_header()->set_revision(3);
  etcdserverpb::RangeResponse* range = txn.add_responses()->mutable_response_range();
  *range->add_kvs() = Kv("key", "value", 2);
  for (const auto& [bytes, isTxn] :
       {std::pair{RangeBytes("value"), false}, std::pair{txn.SerializeAsString(), true}}) {
    std::vector<std::string> variants;
    for (std::size_t cut = 0; cut < bytes.size(); ++cut) variants.push_back(bytes.substr(0, cut));
    for (std::size_t at = 0; at < bytes.size(); ++at) {
      for (unsigned char x : {0x01, 0x07, 0x80, 0xff}) {
        variants.push_back(bytes);
        variants.back()[at] = static_cast<char>(bytes[at] ^ x);
      }
    }
    for (const std::string& variant : variants) {
      Reply reply;
      const bool read = Parse(variant, &reply, isTxn);
      etcdserverpb::TxnResponse judge;
      etcdserverpb::RangeResponse judgeRange;
      const bool judged =
          isTxn ? judge.ParseFromString(variant) : judgeRange.ParseFromString(variant);
      if (variant.size() < bytes.size()) {
        EXPECT_EQ(read, judged) << "cut at " << variant.size();
      } else if (read) {
        EXPECT_TRUE(judged);
      }
      if (!read || !judged) continue;
      if (!isTxn) {
        ASSERT_EQ(reply.ranges.size(), 1u);
        EXPECT_EQ(Rows(reply.ranges[0]), Rows(judgeRange));
        EXPECT_EQ(reply.revision, judgeRange.header().revision());
        continue;
      }
      ASSERT_EQ(reply.ranges.size(), static_cast<std::size_t>(judge.responses_size()));
      for (int i = 0; i < judge.responses_size(); ++i) {
        EXPECT_EQ(Rows(reply.ranges[static_cast<std::size_t>(i)]),
                  Rows(judge.responses(i).response_range()));
      }
      EXPECT_EQ(reply.revision, judge.header().revision());
      EXPECT_EQ(reply.succeeded, judge.succeeded());
    }
  }
}

}  // namespace
}  // namespace etcdwire
}  // namespace TavoConfigStore
