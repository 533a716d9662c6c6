#ifndef VELK_MISC_H_
#define VELK_MISC_H_

#include <cstddef>
#include <string>

#include "Velk/Export.h"

namespace Velk {
namespace Misc {

// Formats by the rules of printf and returns the complete text, however long.
// "%s" inserts a NUL-terminated text; "%ld" a signed 64-bit integer.
VELK_EXPORT std::string StrPrintf(const char* format, ...) __attribute__((format(printf, 1, 2)));

// Concatenates three byte strings given as pointer and length. Every byte is
// kept, NUL included; a null pointer is allowed only with length 0.
VELK_EXPORT std::string StrCat(const char* a, std::size_t aLen, const char* b, std::size_t bLen,
                               const char* c, std::size_t cLen);

}  // namespace Misc
}  // namespace Velk

#endif  // VELK_MISC_H_
