#ifndef KARSTCTL_UTF8_H_
#define KARSTCTL_UTF8_H_

#include <string>

namespace karstctl {

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF, no
// truncated sequences. NUL is valid.
bool IsValidUtf8(const std::string& bytes);

}  // namespace karstctl

#endif  // KARSTCTL_UTF8_H_
