#include "Coding.h"

namespace TavoConfigStore {
namespace coding {

void PutVarint(std::string* out, std::uint64_t value) {
  char buffer[kMaxVarintLength];
  out->append(buffer, static_cast<std::size_t>(EncodeVarint(buffer, value) - buffer));
}

void PutLengthPrefixed(std::string* out, std::string_view bytes) {
  PutVarint(out, bytes.size());
  out->append(bytes);
}

bool GetVarintSlow(std::string_view* in, std::uint64_t* value) {
  std::uint64_t result = 0;
  for (std::size_t i = 0; i < kMaxVarintLength && i < in->size(); ++i) {
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

bool GetLengthPrefixed(std::string_view* in, std::string_view* bytes) {
  std::uint64_t size = 0;
  if (!GetVarint(in, &size) || size > in->size()) return false;
  *bytes = in->substr(0, static_cast<std::size_t>(size));
  in->remove_prefix(static_cast<std::size_t>(size));
  return true;
}

}  // namespace coding
}  // namespace TavoConfigStore
