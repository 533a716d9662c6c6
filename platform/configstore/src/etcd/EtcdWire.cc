#include "EtcdWire.h"

#include "../object/Coding.h"

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
  explicit Reader(std::string_view bytes) : rest_(bytes) {}

  bool Done() const { return rest_.empty(); }

  bool Field(std::uint64_t* number, int* type) {
    std::uint64_t tag = 0;
    if (!coding::GetVarint(&rest_, &tag)) return false;
    *number = tag >> 3;
    *type = static_cast<int>(tag & 7);
    return *number != 0;
  }

  bool Bytes(int type, std::string_view* out) {
    return type == kBytes && coding::GetLengthPrefixed(&rest_, out);
  }

  bool Int64(int type, std::int64_t* out) {
    std::uint64_t v = 0;
    if (type != kVarint || !coding::GetVarint(&rest_, &v)) return false;
    *out = static_cast<std::int64_t>(v);
    return true;
  }

  bool Skip(int type) {
    std::int64_t number = 0;
    std::string_view bytes;
    const std::size_t fixed = type == kFixed64 ? 8 : type == kFixed32 ? 4 : 0;
    if (fixed == 0) return Int64(type, &number) || Bytes(type, &bytes);
    if (rest_.size() < fixed) return false;
    rest_.remove_prefix(fixed);
    return true;
  }

 private:
  std::string_view rest_;
};

// Hands each field of "bytes" to "read" (reader, number, wire type), which
// reads or skips it; false when a field cannot be read.
template <typename Read>
bool ForEachField(std::string_view bytes, const Read& read) {
  Reader r(bytes);
  while (!r.Done()) {
    std::uint64_t number = 0;
    int type = 0;
    if (!r.Field(&number, &type) || !read(r, number, type)) return false;
  }
  return true;
}

// ResponseHeader: revision = 3.
bool ParseHeader(std::string_view bytes, std::int64_t* revision) {
  return ForEachField(bytes, [&](Reader& r, std::uint64_t number, int type) {
    return number == 3 ? r.Int64(type, revision) : r.Skip(type);
  });
}

// mvccpb.KeyValue: key = 1, create_revision = 2, mod_revision = 3, value = 5.
bool ParseKeyValue(std::string_view bytes, KeyValue* kv) {
  return ForEachField(bytes, [&](Reader& r, std::uint64_t number, int type) {
    switch (number) {
      case 1:
        return r.Bytes(type, &kv->key);
      case 2:
        return r.Int64(type, &kv->createRevision);
      case 3:
        return r.Int64(type, &kv->modRevision);
      case 5:
        return r.Bytes(type, &kv->value);
      default:
        return r.Skip(type);
    }
  });
}

// RangeResponse: header = 1, kvs = 2.
bool ParseRange(std::string_view bytes, Range* range, std::int64_t* revision) {
  return ForEachField(bytes, [&](Reader& r, std::uint64_t number, int type) {
    std::string_view field;
    if (number != 1 && number != 2) return r.Skip(type);
    if (!r.Bytes(type, &field)) return false;
    return number == 1 ? ParseHeader(field, revision)
                       : ParseKeyValue(field, &range->kvs.emplace_back());
  });
}

// ResponseOp: response_range = 1 (the others are not read). A response
// inside a transaction carries no revision of its own that is read.
bool ParseResponseOp(std::string_view bytes, Range* range) {
  std::int64_t ignored = 0;
  return ForEachField(bytes, [&](Reader& r, std::uint64_t number, int type) {
    std::string_view field;
    if (number != 1) return r.Skip(type);
    return r.Bytes(type, &field) && ParseRange(field, range, &ignored);
  });
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
  return ForEachField(View(reply->bytes), [&](Reader& r, std::uint64_t number, int type) {
    std::string_view field;
    std::int64_t succeeded = 0;
    switch (number) {
      case 1:
        return r.Bytes(type, &field) && ParseHeader(field, &reply->revision);
      case 2:
        if (!r.Int64(type, &succeeded)) return false;
        reply->succeeded = succeeded != 0;
        return true;
      case 3:
        return r.Bytes(type, &field) && ParseResponseOp(field, &reply->ranges.emplace_back());
      default:
        return r.Skip(type);
    }
  });
}

}  // namespace etcdwire
}  // namespace TavoConfigStore
