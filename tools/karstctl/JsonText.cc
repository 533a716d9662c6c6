#include "JsonText.h"

#include <set>
#include <vector>

#include "Errors.h"

namespace karstctl {

namespace {

// nlohmann's message reads "[json.exception.parse_error.101] parse error at
// line 1, column 5: syntax error ..."; keep only what follows the position,
// which is reported from our own count.
std::string ParseErrorReason(const std::string& what) {
  std::string::size_type start = what.find("parse error");
  if (start == std::string::npos) return what;
  std::string::size_type colon = what.find(": ", start);
  if (colon == std::string::npos) return what.substr(start);
  return what.substr(colon + 2);
}

}  // namespace

TextPosition PositionOf(const std::string& text, std::size_t offset) {
  if (offset > text.size()) offset = text.size();
  TextPosition position{1, 1};
  for (std::size_t i = 0; i < offset; ++i) {
    if (text[i] == '\n') {
      ++position.line;
      position.column = 1;
    } else {
      ++position.column;
    }
  }
  return position;
}

Json ParseJsonText(const std::string& text, const std::string& source) {
  // The keys seen so far in each object being parsed, innermost last.
  std::vector<std::set<std::string>> open;
  auto checkKeys = [&](int, Json::parse_event_t event, Json& parsed) {
    switch (event) {
      case Json::parse_event_t::object_start:
        open.emplace_back();
        break;
      case Json::parse_event_t::object_end:
        open.pop_back();
        break;
      case Json::parse_event_t::key: {
        const auto& key = parsed.get_ref<const std::string&>();
        if (!open.back().insert(key).second) {
          throw InputError(source + ": duplicate key " + parsed.dump());
        }
        break;
      }
      default:
        break;
    }
    return true;
  };
  try {
    return Json::parse(text, checkKeys);
  } catch (const Json::parse_error& e) {
    // e.byte counts from 1 and points at the last byte read.
    TextPosition at = PositionOf(text, e.byte == 0 ? 0 : e.byte - 1);
    throw InputError(source + ":" + std::to_string(at.line) + ":" + std::to_string(at.column) +
                     ": " + ParseErrorReason(e.what()));
  }
}

std::string DumpJsonText(const Json& value) { return value.dump(2, ' ', false) + "\n"; }

}  // namespace karstctl
