#include "ObjectCodec.h"

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <new>
#include <utility>
#include <vector>

#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace codec {
namespace {

constexpr unsigned char kFormat = 1;
constexpr unsigned char kKindBytes = 0;
constexpr unsigned char kKindInteger = 1;

std::size_t VarintSize(std::uint64_t v) {
  std::size_t n = 1;
  while (v >= 0x80) {
    v >>= 7;
    ++n;
  }
  return n;
}

char* PutVarint(std::uint64_t v, char* out) {
  while (v >= 0x80) {
    *out++ = static_cast<char>((v & 0x7f) | 0x80);
    v >>= 7;
  }
  *out++ = static_cast<char>(v);
  return out;
}

char* PutBytes(const std::string& s, char* out) {
  out = PutVarint(s.size(), out);
  s.copy(out, s.size());  // raw bytes, no terminator
  return out + s.size();
}

std::uint64_t Zigzag(long long value) {
  // Zigzag keeps small negative numbers short.
  const auto n = static_cast<std::uint64_t>(value);
  return (n << 1) ^ (0 - (n >> 63));
}

std::size_t BytesSize(const std::string& s) { return VarintSize(s.size()) + s.size(); }

std::size_t ValuesSize(const std::vector<StoreValue>& values) {
  std::size_t n = VarintSize(values.size());
  for (const StoreValue& v : values) {
    n += BytesSize(v.name) + 1;
    if (const auto* s = std::get_if<std::string>(&v.value)) {
      n += BytesSize(*s);
    } else {
      n += VarintSize(Zigzag(std::get<long long>(v.value)));
    }
  }
  return n;
}

char* PutValues(const std::vector<StoreValue>& values, char* out) {
  out = PutVarint(values.size(), out);
  for (const StoreValue& v : values) {
    const auto* bytes = std::get_if<std::string>(&v.value);
    out = PutValue(v.name.data(), v.name.size(), bytes, bytes ? 0 : std::get<long long>(v.value),
                   out);
  }
  return out;
}

// One object's "values" section, given as it keeps it encoded where it
// does (read objects, and new ones until a name is set twice).
struct Section {
  explicit Section(const StoreObject* object) {
    static const std::vector<StoreValue> kNoValues;
    if (object == nullptr) {
      values = &kNoValues;
    } else if (!Access::Encoded(*object, &encoded, &encodedSize)) {
      values = &object->Values();
    }
  }
  std::size_t Size() const { return values ? ValuesSize(*values) : encodedSize; }
  char* Put(char* out) const {
    if (values) return PutValues(*values, out);
    std::memcpy(out, encoded, encodedSize);
    return out + encodedSize;
  }

  const std::vector<StoreValue>* values = nullptr;
  const unsigned char* encoded = nullptr;
  std::size_t encodedSize = 0;
};

// A bounds-checked cursor: every read checks what is left first. Bodies are
// checked in full when decoded, so the later readers never meet damage; they
// check anyway, as memory handed to a StoreObject by other means might be bad.
class Reader {
 public:
  Reader(const unsigned char* data, std::size_t size) : p_(data), end_(data + size) {}

  [[noreturn]] static void Corrupt(const char* why) {
    throw ConfigStoreException(std::string("corrupt object encoding: ") + why, kErrorCorruptObject);
  }

  std::size_t Left() const { return static_cast<std::size_t>(end_ - p_); }
  const unsigned char* Position() const { return p_; }

  unsigned char Byte() {
    if (p_ == end_) Corrupt("truncated");
    return *p_++;
  }

  std::uint64_t Varint() {
    // One byte is the common case: lengths and counts below 128.
    if (p_ != end_ && *p_ < 0x80) return *p_++;
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

  // A length-prefixed byte string, in place.
  const char* Bytes(std::size_t* size) {
    const std::uint64_t n = Varint();
    if (n > Left()) Corrupt("length exceeds the encoding");
    const char* s = reinterpret_cast<const char*>(p_);
    p_ += n;
    *size = static_cast<std::size_t>(n);
    return s;
  }

  std::string String() {
    std::size_t size;
    const char* s = Bytes(&size);
    return std::string(s, size);
  }

  long long Integer() {
    const std::uint64_t z = Varint();
    return static_cast<long long>((z >> 1) ^ (0 - (z & 1)));
  }

  // Steps over one value.
  void SkipPayload() {
    const unsigned char kind = Byte();
    std::size_t size;
    switch (kind) {
      case kKindBytes:
        Bytes(&size);
        break;
      case kKindInteger:
        Varint();
        break;
      default:
        Corrupt("unknown value kind");
    }
  }

  void SkipValues() {
    const std::size_t count = Count();
    std::size_t size;
    for (std::size_t i = 0; i < count; ++i) {
      Bytes(&size);
      SkipPayload();
    }
  }

 private:
  const unsigned char* p_;
  const unsigned char* end_;
};

}  // namespace

void EncodeObject(const ConfigStoreObject& object, std::string* out) {
  // Sized first and written in one go: no regrowing of "out".
  const std::vector<SubObjectEntry>& subs = object.SubObjects();
  std::size_t size = 1 + Section(&object).Size() + VarintSize(subs.size());
  for (const SubObjectEntry& e : subs) {
    size += BytesSize(e.id.Array()) + BytesSize(e.id.Key()) + Section(e.object.get()).Size();
  }
  const std::size_t start = out->size();
  out->resize(start + size);
  char* p = &(*out)[start];
  *p++ = static_cast<char>(kFormat);
  p = Section(&object).Put(p);
  p = PutVarint(subs.size(), p);
  for (const SubObjectEntry& e : subs) {
    p = PutBytes(e.id.Array(), p);
    p = PutBytes(e.id.Key(), p);
    p = Section(e.object.get()).Put(p);
  }
}

std::size_t ValueSize(std::size_t nameSize, const std::string* bytes, long long integer) {
  return VarintSize(nameSize) + nameSize + 1 +
         (bytes ? BytesSize(*bytes) : VarintSize(Zigzag(integer)));
}

char* PutValue(const char* name, std::size_t nameSize, const std::string* bytes, long long integer,
               char* out) {
  char* p = PutVarint(nameSize, out);
  std::memcpy(p, name, nameSize);
  p += nameSize;
  if (bytes) {
    *p++ = static_cast<char>(kKindBytes);
    p = PutBytes(*bytes, p);
  } else {
    *p++ = static_cast<char>(kKindInteger);
    p = PutVarint(Zigzag(integer), p);
  }
  return p;
}

std::shared_ptr<ConfigStoreObject> DecodeObject(ConfigStoreObjectId&& id, const unsigned char* data,
                                                std::size_t size, BodyArena* arena) {
  // Check everything now, so that damage is reported by the read that
  // fetched it and the object's lazy readers only meet sound bytes.
  Reader r(data, size);
  if (r.Byte() != kFormat) Reader::Corrupt("unknown format");
  const std::size_t valuesBegin = 1;
  r.SkipValues();
  const std::size_t subsBegin = size - r.Left();
  const std::size_t count = r.Count();
  for (std::size_t i = 0; i < count; ++i) {
    std::size_t ignored = 0;
    r.Bytes(&ignored);  // array
    r.Bytes(&ignored);  // key
    r.SkipValues();
  }
  if (r.Left() != 0) Reader::Corrupt("trailing bytes");

  return Access::NewObject(std::move(id), data, size, valuesBegin, subsBegin, count, arena);
}

std::shared_ptr<ConfigStoreObject> Access::NewObject(ConfigStoreObjectId&& id,
                                                     const unsigned char* body, std::size_t size,
                                                     std::size_t valuesBegin, std::size_t subsBegin,
                                                     std::size_t subs, BodyArena* arena) {
  unsigned char* copy = nullptr;
  BodyArena own(0);
  std::shared_ptr<Body> block = (arena != nullptr ? arena : &own)->NewBody(size, &copy);
  if (size != 0) std::memcpy(copy, body, size);
  block->capacity = subs;
  block->subsSize = size - subsBegin;

  auto object = std::make_shared<ConfigStoreObject>(std::move(id));
  object->encoded_ = copy + valuesBegin;
  object->encodedSize_ = subsBegin - valuesBegin;
  object->encodedSubs_ = copy + subsBegin;
  object->body_ = std::move(block);
  return object;
}

struct BodyArena::Chunk {
  unsigned char* area = nullptr;
  std::size_t capacity = 0;
  std::size_t used = 0;
  // Outlives the bodies, which point to it.
  std::shared_ptr<SubRooms> rooms;

  Chunk() = default;
  Chunk(const Chunk&) = delete;
  Chunk& operator=(const Chunk&) = delete;
  ~Chunk() {
    for (std::size_t at = 0; at < used;) {
      auto* body = reinterpret_cast<Body*>(area + at);
      at += body->footprint;
      body->~Body();
    }
  }
};

std::shared_ptr<Body> BodyArena::NewBody(std::size_t size, unsigned char** bytes) {
  constexpr std::size_t kAlign = alignof(std::max_align_t);
  const std::size_t need = (sizeof(Body) + size + kAlign - 1) / kAlign * kAlign;
  if (!chunk_ || chunk_->capacity - chunk_->used < need) {
    // A body too large for a shared chunk gets one of its own size.
    const std::size_t capacity = need > chunkSize_ / 4 ? need : chunkSize_;
    unsigned char* area = nullptr;
    chunk_ = std::allocate_shared<Chunk>(TrailingBytes<Chunk>(capacity, &area));
    chunk_->area = area;
    chunk_->capacity = capacity;
    if (chunkSize_ != 0) {
      if (!rooms_) rooms_ = std::make_shared<SubRooms>();
      chunk_->rooms = rooms_;
    }
  }
  unsigned char* at = chunk_->area + chunk_->used;
  auto* body = new (at) Body();
  body->footprint = need;
  body->rooms = chunk_->rooms.get();
  chunk_->used += need;
  *bytes = at + sizeof(Body);
  return std::shared_ptr<Body>(chunk_, body);
}

void Body::TakeRoom() {
  if (subs != nullptr || capacity == 0) return;
  if (rooms != nullptr) {
    subs = rooms->Take(capacity, &room);
  } else {
    subs = static_cast<Sub*>(::operator new(capacity * sizeof(Sub)));
  }
}

Body::Sub* SubRooms::Take(std::size_t count, std::shared_ptr<void>* owner) {
  static_assert(alignof(Body::Sub) <= alignof(std::max_align_t), "blocks are aligned for any type");
  constexpr std::size_t kAlign = alignof(Body::Sub);
  constexpr std::size_t kBlockSize = BodyArena::kChunkSize;
  struct Block {};
  const std::size_t need = count * sizeof(Body::Sub);
  if (need > kBlockSize / 4) {
    // Room too large for a shared block gets one of its own size, and the
    // shared one stays for the objects after it.
    unsigned char* area = nullptr;
    *owner = std::allocate_shared<Block>(TrailingBytes<Block>(need, &area));
    return reinterpret_cast<Body::Sub*>(area);
  }
  if (!block_ || capacity_ - used_ < need) {
    capacity_ = kBlockSize;
    block_ = std::allocate_shared<Block>(TrailingBytes<Block>(capacity_, &area_));
    used_ = 0;
  }
  auto* room = reinterpret_cast<Body::Sub*>(area_ + used_);
  used_ += (need + kAlign - 1) / kAlign * kAlign;
  *owner = block_;
  return room;
}

std::vector<StoreValue> DecodeValues(const unsigned char* data, std::size_t size) {
  Reader r(data, size);
  const std::size_t count = r.Count();
  std::vector<StoreValue> values;
  values.reserve(count);
  for (std::size_t i = 0; i < count; ++i) {
    StoreValue v;
    v.name = r.String();
    switch (r.Byte()) {
      case kKindBytes:
        v.value = r.String();
        break;
      case kKindInteger:
        v.value = r.Integer();
        break;
      default:
        Reader::Corrupt("unknown value kind");
    }
    values.push_back(std::move(v));
  }
  return values;
}

bool FindValue(const unsigned char* data, std::size_t size, const char* name, ValueRef* out) {
  const std::size_t nameSize = std::strlen(name);
  Reader r(data, size);
  const std::size_t count = r.Count();
  for (std::size_t i = 0; i < count; ++i) {
    std::size_t candidateSize;
    const char* candidate = r.Bytes(&candidateSize);
    if (candidateSize != nameSize || std::memcmp(candidate, name, nameSize) != 0) {
      r.SkipPayload();
      continue;
    }
    switch (r.Byte()) {
      case kKindBytes:
        out->isInteger = false;
        out->bytes = r.Bytes(&out->size);
        return true;
      case kKindInteger:
        out->isInteger = true;
        out->integer = r.Integer();
        return true;
      default:
        Reader::Corrupt("unknown value kind");
    }
  }
  return false;
}

SubReader::SubReader(const unsigned char* data, std::size_t size)
    : p_(data), end_(data + size), count_(0), left_(0) {
  Reader r(data, size);
  count_ = left_ = r.Count();
  p_ = r.Position();
}

bool SubReader::Next(SubRef* out) {
  if (left_ == 0) return false;
  Reader r(p_, static_cast<std::size_t>(end_ - p_));
  out->array = r.Bytes(&out->arraySize);
  out->key = r.Bytes(&out->keySize);
  out->values = r.Position();
  r.SkipValues();
  out->valuesSize = static_cast<std::size_t>(r.Position() - out->values);
  p_ = r.Position();
  --left_;
  return true;
}

}  // namespace codec
}  // namespace TavoConfigStore
