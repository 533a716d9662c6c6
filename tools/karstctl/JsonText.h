#ifndef KARSTCTL_JSON_TEXT_H_
#define KARSTCTL_JSON_TEXT_H_

#include <cstddef>
#include <string>

#include "JsonBytes.h"

namespace karstctl {

// Parses a whole JSON document. Malformed text, and an object with the same
// key twice (which would silently drop a value), throw InputError naming
// "source" and, for malformed text, the line and column.
Json ParseJsonText(const std::string& text, const std::string& source);

// Line and column, both from 1, of the byte at "offset" (0-based); an offset
// past the end is the position just after the last byte.
struct TextPosition {
  std::size_t line;
  std::size_t column;
};
TextPosition PositionOf(const std::string& text, std::size_t offset);

// Pretty-printed (indent 2) with a final newline. UTF-8 is written as is;
// only what JSON requires is escaped.
std::string DumpJsonText(const Json& value);

}  // namespace karstctl

#endif  // KARSTCTL_JSON_TEXT_H_
