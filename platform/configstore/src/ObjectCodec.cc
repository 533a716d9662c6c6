#include "ObjectCodec.h"

#include <cstdint>
#include <utility>
#include <vector>

#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace codec {
namespace {

constexpr unsigned char kFormat = 1;
constexpr unsigned char kKindBytes = 0;
constexpr unsigned char kKindInteger = 1;

void PutVarint(std::uint64_t v, std::string* out) {
  while (v >= 0x80) {
    out->push_back(static_cast<char>((v & 0x7f) | 0x80));
    v >>= 7;
  }
  out->push_back(static_cast<char>(v));
}

void PutBytes(const std::string& s, std::string* out) {
  PutVarint(s.size(), out);
  out->append(s);
}

void PutValues(const std::vector<StoreValue>& values, std::string* out) {
  PutVarint(values.size(), out);
  for (const StoreValue& v : values) {
    PutBytes(v.name, out);
    if (const auto* s = std::get_if<std::string>(&v.value)) {
      out->push_back(static_cast<char>(kKindBytes));
      PutBytes(*s, out);
    } else {
      out->push_back(static_cast<char>(kKindInteger));
      // Zigzag keeps small negative numbers short.
      const auto n = static_cast<std::uint64_t>(std::get<long long>(v.value));
      PutVarint((n << 1) ^ (0 - (n >> 63)), out);
    }
  }
}

// A bounds-checked cursor: every read checks what is left first.
class Reader {
 public:
  Reader(const unsigned char* data, std::size_t size) : p_(data), end_(data + size) {}

  [[noreturn]] static void Corrupt(const char* why) {
    throw ConfigStoreException(std::string("corrupt object encoding: ") + why, kErrorCorruptObject);
  }

  std::size_t Left() const { return static_cast<std::size_t>(end_ - p_); }

  unsigned char Byte() {
    if (p_ == end_) Corrupt("truncated");
    return *p_++;
  }

  std::uint64_t Varint() {
    std::uint64_t v = 0;
    for (int shift = 0; shift < 64; shift += 7) {
      const unsigned char b = Byte();
      // The tenth byte may only carry the top bit of a 64-bit value.
      if (shift == 63 && b > 1) Corrupt("varint overflows 64 bits");
      v |= static_cast<std::uint64_t>(b & 0x7f) << shift;
      if ((b & 0x80) == 0) return v;
    }
    Corrupt("varint too long");
  }

  // A count of items that each take at least one byte: larger than what is
  // left means damage, and checking it keeps reserve() from exploding.
  std::size_t Count() {
    const std::uint64_t n = Varint();
    if (n > Left()) Corrupt("count exceeds the encoding");
    return static_cast<std::size_t>(n);
  }

  std::string Bytes() {
    const std::uint64_t n = Varint();
    if (n > Left()) Corrupt("length exceeds the encoding");
    std::string s(reinterpret_cast<const char*>(p_), static_cast<std::size_t>(n));
    p_ += n;
    return s;
  }

 private:
  const unsigned char* p_;
  const unsigned char* end_;
};

std::vector<StoreValue> GetValues(Reader* r) {
  const std::size_t count = r->Count();
  std::vector<StoreValue> values;
  values.reserve(count);
  for (std::size_t i = 0; i < count; ++i) {
    StoreValue v;
    v.name = r->Bytes();
    switch (r->Byte()) {
      case kKindBytes:
        v.value = r->Bytes();
        break;
      case kKindInteger: {
        const std::uint64_t z = r->Varint();
        v.value = static_cast<long long>((z >> 1) ^ (0 - (z & 1)));
        break;
      }
      default:
        Reader::Corrupt("unknown value kind");
    }
    values.push_back(std::move(v));
  }
  return values;
}

}  // namespace

void EncodeObject(const ConfigStoreObject& object, std::string* out) {
  out->push_back(static_cast<char>(kFormat));
  PutValues(object.Values(), out);
  const std::vector<SubObjectEntry>& subs = object.SubObjects();
  PutVarint(subs.size(), out);
  static const std::vector<StoreValue> kNoValues;
  for (const SubObjectEntry& e : subs) {
    PutBytes(e.id.Array(), out);
    PutBytes(e.id.Key(), out);
    PutValues(e.object ? e.object->Values() : kNoValues, out);
  }
}

std::shared_ptr<ConfigStoreObject> DecodeObject(const ConfigStoreObjectId& id,
                                                const unsigned char* data, std::size_t size) {
  Reader r(data, size);
  if (r.Byte() != kFormat) Reader::Corrupt("unknown format");
  std::vector<StoreValue> values = GetValues(&r);
  const std::size_t count = r.Count();
  std::vector<SubObjectEntry> subs;
  subs.reserve(count);
  for (std::size_t i = 0; i < count; ++i) {
    std::string array = r.Bytes();
    std::string key = r.Bytes();
    subs.push_back(
        SubObjectEntry{SubObjectId(array, key), std::make_shared<StoreObject>(GetValues(&r))});
  }
  if (r.Left() != 0) Reader::Corrupt("trailing bytes");
  return std::make_shared<ConfigStoreObject>(id, std::move(values), std::move(subs));
}

}  // namespace codec
}  // namespace TavoConfigStore
