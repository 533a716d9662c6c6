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

}  // namespace coding
}  // namespace TavoConfigStore
