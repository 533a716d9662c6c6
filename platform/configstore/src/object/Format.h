// The binary encoding of one stored object's values and sub-objects: the
// body every backend stores (a column in SQLite, the value of a key in
// etcd). Format 1 (varint and bytes as in Coding.h):
//   body   := u8 format=1, values, subs
//   values := varint count, value*
//   value  := bytes name, u8 kind (0 = byte string, 1 = integer), payload
//             payload: bytes for kind 0, zigzag varint for kind 1
//   subs   := varint count, sub*
//   sub    := bytes array, bytes key, values
// The identifier is not part of the body: each backend keeps it where it
// can be looked up.
//
// A body is checked in full once, when it is read (Split); the readers
// below then walk bytes known to be well formed.

#ifndef TAVOCONFIGSTORE_SRC_OBJECT_FORMAT_H_
#define TAVOCONFIGSTORE_SRC_OBJECT_FORMAT_H_

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {
namespace format {

constexpr char kFormat = 1;

// One value, its bytes in place.
struct Value {
  std::string_view name;
  bool isInteger = false;
  std::string_view bytes;
  std::int64_t integer = 0;
};

struct Sub {
  std::string_view array;
  std::string_view key;
  std::string_view values;  // a "values" section
};

// A checked body's two sections.
struct Parts {
  std::string_view values;
  std::string_view subs;
};

// Splits "body" into its sections after checking all of it. Throws
// ConfigStoreException(kErrorCorruptObject) naming the damage when it is not
// one complete, well-formed body.
Parts Split(std::string_view body);

// ---- Checked "values" sections (an empty one holds no values) -------------

// The first value called "name".
bool FindValue(std::string_view values, std::string_view name, Value* out);
std::vector<StoreValue> DecodeValues(std::string_view values);

// Sets "name" in the section "*values": in its place when the section has
// it, else appended. "bytes" set: a byte string, else "integer".
void SetValue(std::string* values, std::string_view name, const std::string* bytes,
              std::int64_t integer);

// ---- "subs" sections ------------------------------------------------------

// Reads the sub-objects of a "subs" section one by one, checking each:
// damage throws as Split does.
class SubReader {
 public:
  explicit SubReader(std::string_view subs);
  std::size_t Count() const { return count_; }
  // The next sub-object; false after the last.
  bool Next(Sub* out);
  // What follows the last sub-object read.
  std::string_view Rest() const { return rest_; }

 private:
  std::string_view rest_;
  std::size_t count_ = 0;
  std::size_t left_ = 0;
};

// Appends a sub-object's array and key; its "values" section follows.
void PutSubHeader(std::string* out, std::string_view array, std::string_view key);

}  // namespace format
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_OBJECT_FORMAT_H_
