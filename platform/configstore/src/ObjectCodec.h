// The binary encoding of one stored object's values and sub-objects, as the
// SQLite backend keeps it in a single column. Internal to the library.
//
// Format 1 (varint = unsigned LEB128, at most 10 bytes):
//   body   := u8 format=1, values, varint count, sub*
//   values := varint count, value*
//   value  := bytes name, u8 kind (0 = byte string, 1 = integer), payload
//             payload: bytes for kind 0, zigzag varint for kind 1
//   sub    := bytes array, bytes key, values
//   bytes  := varint length, that many raw bytes
// The identifier is not part of the body: the store keeps it in its own
// columns, where it can be indexed.
//
// A decoded object keeps its body, in the same allocation, and reads values
// straight from it (see StoreObject.h). A body is checked in full once, when
// it is decoded, and the readers below then walk memory known to be well
// formed (they check bounds all the same).

#ifndef TAVOCONFIGSTORE_SRC_OBJECT_CODEC_H_
#define TAVOCONFIGSTORE_SRC_OBJECT_CODEC_H_

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {
namespace codec {

// Appends the encoding of the object's values and sub-objects to "*out".
void EncodeObject(const ConfigStoreObject& object, std::string* out);

class BodyArena;

// A new object with identifier "id" and the contents encoded in
// data[0, size), which is copied into memory from "arena" (or, when null, an
// allocation of its own). Throws ConfigStoreException(kErrorCorruptObject)
// when the bytes are not a complete, well-formed encoding, and then leaves
// "id" as it was; never reads past "size".
std::shared_ptr<ConfigStoreObject> DecodeObject(ConfigStoreObjectId&& id, const unsigned char* data,
                                                std::size_t size, BodyArena* arena = nullptr);

// ---- One value of a "values" section ---------------------------------------

// The bytes a value takes: a byte string when "bytes" is set, else "integer".
std::size_t ValueSize(std::size_t nameSize, const std::string* bytes, long long integer);
// Writes it at "out", which has room for ValueSize bytes; returns the end.
char* PutValue(const char* name, std::size_t nameSize, const std::string* bytes, long long integer,
               char* out);

// ---- Readers of a checked "values" section ---------------------------------

// Every value, in order.
std::vector<StoreValue> DecodeValues(const unsigned char* data, std::size_t size);

// The first value called "name" (compared as std::string == const char*
// would). Its bytes point into the section.
struct ValueRef {
  bool isInteger = false;
  const char* bytes = nullptr;
  std::size_t size = 0;
  long long integer = 0;
};
bool FindValue(const unsigned char* data, std::size_t size, const char* name, ValueRef* out);

// ---- Reader of a checked "varint count, sub*" section ----------------------

struct SubRef {
  const char* array;
  std::size_t arraySize;
  const char* key;
  std::size_t keySize;
  const unsigned char* values;  // a "values" section
  std::size_t valuesSize;
};

class SubReader {
 public:
  SubReader(const unsigned char* data, std::size_t size);
  std::size_t Count() const { return count_; }
  // The next sub-object; false after the last.
  bool Next(SubRef* out);

 private:
  const unsigned char* p_;
  const unsigned char* end_;
  std::size_t count_;
  std::size_t left_;
};

// Builds objects over encoded memory; the friend the object classes allow.
class Access {
 public:
  // Its "subs" sub-objects are built on first access.
  static std::shared_ptr<ConfigStoreObject> NewObject(ConfigStoreObjectId&& id,
                                                      const unsigned char* body, std::size_t size,
                                                      std::size_t valuesBegin,
                                                      std::size_t subsBegin, std::size_t subs,
                                                      BodyArena* arena);
  // The object's values as an encoded "values" section, when it keeps them
  // so (read objects, and new ones until a name is set twice).
  static bool Encoded(const StoreObject& object, const unsigned char** data, std::size_t* size) {
    *data = object.encoded_;
    *size = object.encodedSize_;
    return *data != nullptr;
  }
};

class SubRooms;

// The memory of an object read from the store (see BodyArena): this header,
// then the encoded body. Its sub-objects are built when first asked for, in
// room taken then: a listing holds every body at once before the first is
// read, and a scan that reads one value of each object never needs them.
struct Body {
  struct Sub {
    std::string_view array;
    std::string_view key;
    StoreObject object;
  };
  Sub* subs = nullptr;  // room for "capacity" once built, of which "built" are
  std::size_t capacity = 0;
  std::size_t built = 0;
  std::size_t subsSize = 0;   // of the encoded "count, sub*" section
  std::size_t footprint = 0;  // bytes taken in its arena chunk
  // Where a listing's bodies take their room (null for an object read
  // alone, which allocates its own), and what keeps the room taken there.
  SubRooms* rooms = nullptr;
  std::shared_ptr<void> room;

  Body() = default;
  Body(const Body&) = delete;
  Body& operator=(const Body&) = delete;
  ~Body() {
    for (std::size_t i = 0; i < built; ++i) subs[i].~Sub();
    if (!room) ::operator delete(subs);
  }

  // Gives "subs" room for "capacity" sub-objects. Callers hold the lock that
  // serialises lazy building, which also guards "rooms".
  void TakeRoom();
};

// Room for the sub-objects of a listing's objects, taken in shared blocks as
// each object's are first built: one allocation then serves a few hundred
// objects instead of one each. A block lives while any body whose
// sub-objects it holds does, so a listing read in order frees them in order.
class SubRooms {
 public:
  Body::Sub* Take(std::size_t count, std::shared_ptr<void>* owner);

 private:
  std::shared_ptr<void> block_;
  unsigned char* area_ = nullptr;
  std::size_t capacity_ = 0;
  std::size_t used_ = 0;
};

// The bodies of the objects of one listing, placed one after another in
// shared chunks. One allocation then serves dozens of objects, and bodies,
// larger than what malloc keeps on its fast paths, stop costing a slow one
// each. A chunk lives while any object or sub-object placed in it does.
class BodyArena {
 public:
  static constexpr std::size_t kChunkSize = std::size_t{64} * 1024;

  // "chunkSize" 0 gives each body a block of its own exact size: for an
  // object read alone, which may be kept long after the read.
  explicit BodyArena(std::size_t chunkSize = kChunkSize) : chunkSize_(chunkSize) {}

  // A new body of "size" bytes, which start at "*bytes".
  std::shared_ptr<Body> NewBody(std::size_t size, unsigned char** bytes);

 private:
  struct Chunk;
  std::size_t chunkSize_;
  std::shared_ptr<Chunk> chunk_;
  std::shared_ptr<SubRooms> rooms_;
};

// An allocator for allocate_shared that asks for "extra" bytes more than the
// control block needs and reports where they start: the object and a buffer
// of its own then take one allocation. Aligned for any type.
template <typename T>
struct TrailingBytes {
  using value_type = T;
  std::size_t extra;
  unsigned char** bytes;

  TrailingBytes(std::size_t e, unsigned char** b) : extra(e), bytes(b) {}
  template <typename U>
  TrailingBytes(const TrailingBytes<U>& other) : extra(other.extra), bytes(other.bytes) {}

  static constexpr std::size_t Head(std::size_t n) {
    constexpr std::size_t kAlign = alignof(std::max_align_t);
    return (n * sizeof(T) + kAlign - 1) / kAlign * kAlign;
  }
  T* allocate(std::size_t n) {
    auto* p = static_cast<unsigned char*>(::operator new(Head(n) + extra));
    *bytes = p + Head(n);
    return reinterpret_cast<T*>(p);
  }
  void deallocate(T* p, std::size_t) { ::operator delete(p); }
  template <typename U>
  bool operator==(const TrailingBytes<U>& other) const {
    return extra == other.extra && bytes == other.bytes;
  }
  template <typename U>
  bool operator!=(const TrailingBytes<U>& other) const {
    return !(*this == other);
  }
};

}  // namespace codec

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_OBJECT_CODEC_H_
