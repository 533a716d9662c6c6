#include "EtcdWire.h"

namespace TavoConfigStore {
namespace etcdwire {

namespace {

// Protocol buffers' wire format: each field a varint tag (number << 3 | wire
// type) and a payload; unknown fields are skipped, as protobuf itself does.
constexpr int kVarint = 0;
constexpr int kFixed64 = 1;
constexpr int kBytes = 2;
constexpr int kFixed32 = 5;

class Reader {
 public:
  explicit Reader(std::string_view bytes) : p_(bytes.data()), end_(bytes.data() + bytes.size()) {}

  bool Done() const { return p_ == end_; }

  bool Varint(std::uint64_t* value) {
    std::uint64_t v = 0;
    for (int shift = 0; shift < 64 && p_ != end_; shift += 7) {
      const auto byte = static_cast<unsigned char>(*p_++);
      v |= std::uint64_t{byte & 0x7fu} << shift;
      if ((byte & 0x80u) == 0) {
        *value = v;
        return true;
      }
    }
    return false;
  }

  bool Field(std::uint64_t* number, int* type) {
    std::uint64_t tag = 0;
    if (!Varint(&tag)) return false;
    *number = tag >> 3;
    *type = static_cast<int>(tag & 7);
    return *number != 0;
  }

  bool Bytes(std::string_view* out) {
    std::uint64_t size = 0;
    if (!Varint(&size) || size > static_cast<std::uint64_t>(end_ - p_)) return false;
    *out = std::string_view(p_, static_cast<std::size_t>(size));
    p_ += size;
    return true;
  }

  bool Int64(int type, std::int64_t* out) {
    std::uint64_t v = 0;
    if (type != kVarint || !Varint(&v)) return false;
    *out = static_cast<std::int64_t>(v);
    return true;
  }

  bool Skip(int type) {
    std::uint64_t ignored = 0;
    std::string_view bytes;
    switch (type) {
      case kVarint:
        return Varint(&ignored);
      case kBytes:
        return Bytes(&bytes);
      case kFixed64:
      case kFixed32: {
        const std::size_t size = type == kFixed64 ? 8 : 4;
        if (static_cast<std::size_t>(end_ - p_) < size) return false;
        p_ += size;
        return true;
      }
      default:
        return false;
    }
  }

 private:
  const char* p_;
  const char* end_;
};

// ResponseHeader: revision = 3.
bool ParseHeader(std::string_view bytes, std::int64_t* revision) {
  Reader r(bytes);
  while (!r.Done()) {
    std::uint64_t number = 0;
    int type = 0;
    if (!r.Field(&number, &type)) return false;
    if (!(number == 3 ? r.Int64(type, revision) : r.Skip(type))) return false;
  }
  return true;
}

// mvccpb.KeyValue: key = 1, create_revision = 2, mod_revision = 3, value = 5.
bool ParseKeyValue(std::string_view bytes, KeyValue* kv) {
  Reader r(bytes);
  while (!r.Done()) {
    std::uint64_t number = 0;
    int type = 0;
    if (!r.Field(&number, &type)) return false;
    bool ok = false;
    switch (number) {
      case 1:
        ok = type == kBytes && r.Bytes(&kv->key);
        break;
      case 2:
        ok = r.Int64(type, &kv->createRevision);
        break;
      case 3:
        ok = r.Int64(type, &kv->modRevision);
        break;
      case 5:
        ok = type == kBytes && r.Bytes(&kv->value);
        break;
      default:
        ok = r.Skip(type);
    }
    if (!ok) return false;
  }
  return true;
}

// RangeResponse: header = 1, kvs = 2.
bool ParseRange(std::string_view bytes, Range* range, std::int64_t* revision) {
  Reader r(bytes);
  while (!r.Done()) {
    std::uint64_t number = 0;
    int type = 0;
    std::string_view field;
    if (!r.Field(&number, &type)) return false;
    if (number != 1 && number != 2) {
      if (!r.Skip(type)) return false;
      continue;
    }
    if (type != kBytes || !r.Bytes(&field)) return false;
    if (number == 1) {
      if (!ParseHeader(field, revision)) return false;
    } else if (!ParseKeyValue(field, &range->kvs.emplace_back())) {
      return false;
    }
  }
  return true;
}

// ResponseOp: response_range = 1 (the others are not read). A response
// inside a transaction carries no revision of its own that is read.
bool ParseResponseOp(std::string_view bytes, Range* range) {
  Reader r(bytes);
  while (!r.Done()) {
    std::uint64_t number = 0;
    int type = 0;
    std::string_view field;
    std::int64_t ignored = 0;
    if (!r.Field(&number, &type)) return false;
    if (number != 1) {
      if (!r.Skip(type)) return false;
    } else if (type != kBytes || !r.Bytes(&field) || !ParseRange(field, range, &ignored)) {
      return false;
    }
  }
  return true;
}

std::string_view View(const grpc::Slice& slice) {
  return std::string_view(reinterpret_cast<const char*>(slice.begin()), slice.size());
}

}  // namespace

bool ParseRangeResponse(Reply* reply) {
  reply->ranges.assign(1, Range());
  return ParseRange(View(reply->bytes), &reply->ranges[0], &reply->revision);
}

// TxnResponse: header = 1, succeeded = 2, responses = 3.
bool ParseTxnResponse(Reply* reply) {
  reply->ranges.clear();
  reply->succeeded = false;
  Reader r(View(reply->bytes));
  while (!r.Done()) {
    std::uint64_t number = 0;
    int type = 0;
    std::string_view field;
    if (!r.Field(&number, &type)) return false;
    if (number == 2) {
      std::int64_t succeeded = 0;
      if (!r.Int64(type, &succeeded)) return false;
      reply->succeeded = succeeded != 0;
      continue;
    }
    if (number != 1 && number != 3) {
      if (!r.Skip(type)) return false;
      continue;
    }
    if (type != kBytes || !r.Bytes(&field)) return false;
    if (number == 1) {
      if (!ParseHeader(field, &reply->revision)) return false;
      continue;
    }
    if (!ParseResponseOp(field, &reply->ranges.emplace_back())) return false;
  }
  return true;
}

}  // namespace etcdwire
}  // namespace TavoConfigStore
