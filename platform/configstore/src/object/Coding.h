// Varints and length-prefixed byte strings, the one coding of every format
// the store writes or reads: the object body, the etcd layout's headers and
// etcd's own replies (protocol buffers code lengths and numbers the same way).
//
// A varint is an unsigned LEB128 number of at most 10 bytes; the tenth may
// carry only the top bit of a 64-bit value. A length-prefixed string is a
// varint length, then that many raw bytes.

#ifndef TAVOCONFIGSTORE_SRC_OBJECT_CODING_H_
#define TAVOCONFIGSTORE_SRC_OBJECT_CODING_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace TavoConfigStore {
namespace coding {

constexpr std::size_t kMaxVarintLength = 10;

inline std::size_t VarintLength(std::uint64_t value) {
  std::size_t n = 1;
  while (value >= 0x80) {
    value >>= 7;
    ++n;
  }
  return n;
}

// Writes "value" at "out", which has room for VarintLength(value) bytes, and
// returns the end.
inline char* EncodeVarint(char* out, std::uint64_t value) {
  while (value >= 0x80) {
    *out++ = static_cast<char>((value & 0x7f) | 0x80);
    value >>= 7;
  }
  *out++ = static_cast<char>(value);
  return out;
}

inline void PutVarint(std::string* out, std::uint64_t value) {
  char buffer[kMaxVarintLength];
  out->append(buffer, static_cast<std::size_t>(EncodeVarint(buffer, value) - buffer));
}
inline void PutLengthPrefixed(std::string* out, std::string_view bytes) {
  PutVarint(out, bytes.size());
  out->append(bytes);
}

// Read from the front of "*in" and drop what they read. False when the bytes
// end first, or a varint is too long or overflows 64 bits; "*in" is then
// left somewhere inside.
inline bool GetVarint(std::string_view* in, std::uint64_t* value) {
  // One byte is the common case: lengths and counts below 128.
  if (!in->empty() && static_cast<unsigned char>(in->front()) < 0x80) {
    *value = static_cast<unsigned char>(in->front());
    in->remove_prefix(1);
    return true;
  }
  std::uint64_t result = 0;
  const std::size_t n = in->size() < kMaxVarintLength ? in->size() : kMaxVarintLength;
  for (std::size_t i = 0; i < n; ++i) {
    const auto byte = static_cast<unsigned char>((*in)[i]);
    if (i == kMaxVarintLength - 1 && byte > 1) return false;  // past 64 bits
    result |= static_cast<std::uint64_t>(byte & 0x7f) << (7 * i);
    if ((byte & 0x80) == 0) {
      in->remove_prefix(i + 1);
      *value = result;
      return true;
    }
  }
  return false;
}
inline bool GetLengthPrefixed(std::string_view* in, std::string_view* bytes) {
  std::uint64_t size = 0;
  if (!GetVarint(in, &size) || size > in->size()) return false;
  *bytes = in->substr(0, static_cast<std::size_t>(size));
  in->remove_prefix(static_cast<std::size_t>(size));
  return true;
}

// Signed numbers as varints: small negative ones stay short.
inline std::uint64_t ZigZag(std::int64_t value) {
  const auto n = static_cast<std::uint64_t>(value);
  return (n << 1) ^ (0 - (n >> 63));
}
inline std::int64_t UnZigZag(std::uint64_t value) {
  return static_cast<std::int64_t>((value >> 1) ^ (0 - (value & 1)));
}

}  // namespace coding
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_OBJECT_CODING_H_
