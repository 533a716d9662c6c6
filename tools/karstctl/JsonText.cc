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

// A number too large for a double ("1e999") is reported by nlohmann as
// out_of_range, which carries no position. Parsing again with a handler that
// only notes where the parser stopped finds it.
struct ErrorLocator : nlohmann::json_sax<Json> {
  std::size_t offset = 0;
  bool null() override { return true; }
  bool boolean(bool) override { return true; }
  bool number_integer(number_integer_t) override { return true; }
  bool number_unsigned(number_unsigned_t) override { return true; }
  bool number_float(number_float_t, const string_t&) override { return true; }
  bool string(string_t&) override { return true; }
  bool binary(binary_t&) override { return true; }
  bool start_object(std::size_t) override { return true; }
  bool key(string_t&) override { return true; }
  bool end_object() override { return true; }
  bool start_array(std::size_t) override { return true; }
  bool end_array() override { return true; }
  bool parse_error(std::size_t position, const std::string&,
                   const nlohmann::detail::exception&) override {
    offset = position;
    return false;
  }
};

// "[json.exception.out_of_range.406] number overflow ..." without its tag.
std::string WithoutTag(const std::string& what) {
  std::string::size_type end = what.rfind("] ", what.find(' '));
  return end == std::string::npos ? what : what.substr(end + 2);
}

// The offset of the opening quote of the key numbered "index" (from 0, in
// document order). Only called for text the parser has accepted up to that
// key, so a string is a key exactly when it follows '{' or ',' in an object.
std::size_t KeyOffset(const std::string& text, std::size_t index) {
  std::vector<char> open;  // '{' or '[' of each enclosing container
  char previous = 0;       // the last byte outside strings and whitespace
  for (std::size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (c == '"') {
      if (!open.empty() && open.back() == '{' && (previous == '{' || previous == ',') &&
          index-- == 0) {
        return i;
      }
      for (++i; i < text.size() && text[i] != '"'; ++i) {
        if (text[i] == '\\') ++i;
      }
      previous = '"';
    } else if (c == '{' || c == '[') {
      open.push_back(c);
      previous = c;
    } else if (c == '}' || c == ']') {
      if (!open.empty()) open.pop_back();
      previous = c;
    } else if (c != ' ' && c != '\t' && c != '\n' && c != '\r') {
      previous = c;
    }
  }
  return text.size();
}

std::string At(const std::string& source, const std::string& text, std::size_t offset) {
  const TextPosition at = PositionOf(text, offset);
  return source + ":" + std::to_string(at.line) + ":" + std::to_string(at.column) + ": ";
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
  std::size_t keys = 0;  // keys parsed so far, to find a repeat in the text
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
          throw InputError(At(source, text, KeyOffset(text, keys)) + "duplicate key " +
                           parsed.dump());
        }
        ++keys;
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
    throw InputError(At(source, text, e.byte == 0 ? 0 : e.byte - 1) + ParseErrorReason(e.what()));
  } catch (const Json::out_of_range& e) {
    ErrorLocator locator;
    Json::sax_parse(text, &locator);
    throw InputError(At(source, text, locator.offset == 0 ? 0 : locator.offset - 1) +
                     WithoutTag(e.what()));
  }
}

std::string DumpJsonText(const Json& value) { return value.dump(2, ' ', false) + "\n"; }

}  // namespace karstctl
