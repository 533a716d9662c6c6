#include "Velk/Misc.h"

#include <cstdarg>
#include <cstdio>

#include "Velk/VelkException.h"

namespace Velk {
namespace Misc {

std::string StrPrintf(const char* format, ...) {
  // Most digest texts are short: try a stack buffer first, then size exactly.
  char small[256];
  va_list args;
  va_start(args, format);
  va_list again;
  va_copy(again, args);
  const int needed = std::vsnprintf(small, sizeof small, format, args);
  va_end(args);
  if (needed < 0) {
    va_end(again);
    throw Lib::VelkException(std::string("StrPrintf: cannot format \"") + format + "\"");
  }
  std::string out;
  if (static_cast<std::size_t>(needed) < sizeof small) {
    out.assign(small, static_cast<std::size_t>(needed));
  } else {
    out.resize(static_cast<std::size_t>(needed));
    std::vsnprintf(out.data(), out.size() + 1, format, again);
  }
  va_end(again);
  return out;
}

std::string StrCat(const char* a, std::size_t aLen, const char* b, std::size_t bLen, const char* c,
                   std::size_t cLen) {
  std::string out;
  out.reserve(aLen + bLen + cLen);
  out.append(a, aLen).append(b, bLen).append(c, cLen);
  return out;
}

}  // namespace Misc
}  // namespace Velk
