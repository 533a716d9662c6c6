#include "Json.h"

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <limits>
#include <set>
#include <string_view>
#include <utility>

#include "Errors.h"

namespace karstctl {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyBlob;
using TavoKarst::KarstPolicyInfo;

// ---- Bytes as JSON text --------------------------------------------------

namespace {
constexpr std::string_view kAlphabet =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
constexpr char kBase64Key[] = "base64";
}  // namespace

bool IsValidUtf8(const std::string& bytes) {
  std::size_t i = 0;
  const std::size_t n = bytes.size();
  while (i < n) {
    const auto lead = static_cast<std::uint8_t>(bytes[i]);
    if (lead < 0x80) {
      ++i;
      continue;
    }
    // The allowed range of the second byte rules out overlongs (E0, F0),
    // surrogates (ED) and code points above U+10FFFF (F4).
    std::size_t length = 0;
    std::uint8_t low = 0x80, high = 0xBF;
    if (lead >= 0xC2 && lead <= 0xDF) {
      length = 2;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
      length = 3;
      if (lead == 0xE0) low = 0xA0;
      if (lead == 0xED) high = 0x9F;
    } else if (lead >= 0xF0 && lead <= 0xF4) {
      length = 4;
      if (lead == 0xF0) low = 0x90;
      if (lead == 0xF4) high = 0x8F;
    } else {
      return false;  // continuation byte, C0/C1 overlong lead, or F5..FF
    }
    if (n - i < length) return false;
    const auto second = static_cast<std::uint8_t>(bytes[i + 1]);
    if (second < low || second > high) return false;
    for (std::size_t k = 2; k < length; ++k) {
      const auto next = static_cast<std::uint8_t>(bytes[i + k]);
      if (next < 0x80 || next > 0xBF) return false;
    }
    i += length;
  }
  return true;
}

std::string EncodeBase64(const std::string& bytes) {
  std::string out;
  out.reserve((bytes.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < bytes.size(); i += 3) {
    const std::size_t given = std::min<std::size_t>(3, bytes.size() - i);
    std::uint32_t group = 0;
    for (std::size_t k = 0; k < 3; ++k) {
      group = group << 8 | (k < given ? static_cast<std::uint8_t>(bytes[i + k]) : 0u);
    }
    // One letter per 6 bits given, then '=' to a whole group of four.
    for (std::size_t k = 0; k < 4; ++k) {
      out += k <= given ? kAlphabet[group >> (18 - 6 * k) & 63] : '=';
    }
  }
  return out;
}

std::optional<std::string> DecodeBase64(const std::string& text) {
  if (text.size() % 4 != 0) return std::nullopt;
  std::size_t padding = 0;
  if (!text.empty() && text.back() == '=') {
    padding = text[text.size() - 2] == '=' ? 2 : 1;
  }

  std::string out;
  out.reserve(text.size() / 4 * 3);
  const std::size_t dataEnd = text.size() - padding;
  std::uint32_t acc = 0;
  int bits = 0;
  for (std::size_t i = 0; i < dataEnd; ++i) {
    const std::size_t sextet = kAlphabet.find(text[i]);  // '=' inside the data is rejected here
    if (sextet == std::string_view::npos) return std::nullopt;
    acc = (acc << 6 | static_cast<std::uint32_t>(sextet)) & 0xFFFFFF;
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      out += static_cast<char>(acc >> bits & 0xFF);
    }
  }
  // Bits left over after the last whole byte must be zero.
  if ((acc & ((1u << bits) - 1)) != 0) return std::nullopt;
  return out;
}

Json EncodeBytes(const std::string& bytes) {
  if (IsValidUtf8(bytes)) return Json(bytes);
  Json wrapped = Json::object();
  wrapped[kBase64Key] = EncodeBase64(bytes);
  return wrapped;
}

std::string DecodeBytes(const Json& value, const std::string& path) {
  if (value.is_string()) return value.get_ref<const std::string&>();
  if (!value.is_object()) {
    throw InputError(path + ": expected a string or {\"base64\": \"...\"}, got " +
                     value.type_name());
  }
  for (const auto& item : value.items()) {
    if (item.key() != kBase64Key) {
      throw InputError(path + ": unknown key " + Json(item.key()).dump());
    }
  }
  if (!value.contains(kBase64Key)) throw InputError(path + ": missing \"base64\"");
  const Json& text = value.at(kBase64Key);
  if (!text.is_string()) {
    throw InputError(path + ".base64: expected a string, got " + text.type_name());
  }
  auto bytes = DecodeBase64(text.get_ref<const std::string&>());
  if (!bytes) throw InputError(path + ".base64: invalid base64");
  return *bytes;
}

// ---- Documents -----------------------------------------------------------

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

// "source:line:column: " of the byte at "offset" (0-based), both counted from
// 1; an offset past the end is the position just after the last byte.
std::string At(const std::string& source, const std::string& text, std::size_t offset) {
  std::size_t line = 1, column = 1;
  for (std::size_t i = 0; i < std::min(offset, text.size()); ++i) {
    column = text[i] == '\n' ? 1 : column + 1;
    line += text[i] == '\n';
  }
  return source + ":" + std::to_string(line) + ":" + std::to_string(column) + ": ";
}

}  // namespace

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

// ---- Catalogue records ---------------------------------------------------

namespace {

constexpr char kPolicies[] = "policies";
constexpr char kDatastores[] = "datastores";

// A record's byte-string fields by key, in the order they are written.
template <typename Record>
using StringFields = std::vector<std::pair<const char*, std::string Record::*>>;

const StringFields<KarstPolicyBlob> kBlobFields = {
    {"datastore_namespace", &KarstPolicyBlob::datastore_namespace},
    {"blob", &KarstPolicyBlob::blob}};
const StringFields<KarstPolicyInfo> kPolicyFields = {
    {"name", &KarstPolicyInfo::name},
    {"policy_id", &KarstPolicyInfo::policy_id},
    {"description", &KarstPolicyInfo::description}};
const StringFields<KarstDatastoreInfo> kDatastoreFields = {
    {"url", &KarstDatastoreInfo::url},
    {"datastore_namespace", &KarstDatastoreInfo::datastore_namespace},
    {"drp_policy_id", &KarstDatastoreInfo::drp_policy_id}};

void RequireType(const Json& value, Json::value_t type, const std::string& path) {
  if (value.type() != type) {
    throw InputError(path + ": expected " + Json(type).type_name() + ", got " + value.type_name());
  }
}

InputError UnknownKey(const std::string& path, const std::string& key) {
  return InputError(path + ": unknown key " + Json(key).dump());
}

std::string Indexed(const std::string& path, std::size_t index) {
  return path + "[" + std::to_string(index) + "]";
}

std::int64_t DecodeInt64(const Json& value, const std::string& path) {
  if (value.is_number_unsigned()) {
    // nlohmann keeps non-negative integers unsigned, up to UINT64_MAX.
    auto n = value.get<std::uint64_t>();
    if (n > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
      throw InputError(path + ": out of the signed 64-bit range");
    }
    return static_cast<std::int64_t>(n);
  }
  if (value.is_number_integer()) return value.get<std::int64_t>();
  if (value.is_number_float()) {
    // Integers too large for 64 bits come back as floats; say so rather
    // than complain about a fraction that was never written.
    double d = value.get<double>();
    bool integral = std::isfinite(d) && std::trunc(d) == d;
    if (integral && std::fabs(d) >= 9223372036854775808.0) {
      throw InputError(path + ": out of the signed 64-bit range");
    }
    throw InputError(path + ": expected an integer, got a number with a fraction or exponent");
  }
  throw InputError(path + ": expected an integer, got " + value.type_name());
}

template <typename Record>
Json RecordToJson(const Record& record, const StringFields<Record>& fields) {
  Json out = Json::object();
  for (const auto& [key, member] : fields) out[key] = EncodeBytes(record.*member);
  return out;
}

// Decodes an object's members in the order written: the string fields, and
// any other key through "other", which returns false for a key it does not
// know.
template <typename Record, typename Other>
Record RecordFromJson(const Json& value, const std::string& path,
                      const StringFields<Record>& fields, Other other) {
  RequireType(value, Json::value_t::object, path);
  Record record;
  for (const auto& item : value.items()) {
    const std::string& key = item.key();
    const std::string field = path + "." + key;
    const auto known = std::find_if(fields.begin(), fields.end(),
                                    [&key](const auto& f) { return key == f.first; });
    if (known != fields.end()) {
      record.*(known->second) = DecodeBytes(item.value(), field);
    } else if (!other(record, key, item.value(), field)) {
      throw UnknownKey(path, key);
    }
  }
  return record;
}

// Decodes a JSON array with "decode" for each element, named path[i].
template <typename Decode>
auto ArrayFromJson(const Json& value, const std::string& path, Decode decode) {
  RequireType(value, Json::value_t::array, path);
  std::vector<decltype(decode(value, path))> out;
  out.reserve(value.size());
  for (std::size_t i = 0; i < value.size(); ++i) out.push_back(decode(value[i], Indexed(path, i)));
  return out;
}

template <typename Record, typename Encode>
Json ArrayToJson(const std::vector<Record>& records, Encode encode) {
  Json out = Json::array();
  for (const Record& record : records) out.push_back(encode(record));
  return out;
}

const auto kNoOtherKeys = [](auto&, const std::string&, const Json&, const std::string&) {
  return false;
};

KarstPolicyBlob BlobFromJson(const Json& value, const std::string& path) {
  return RecordFromJson(value, path, kBlobFields, kNoOtherKeys);
}

KarstPolicyInfo PolicyFromJson(const Json& value, const std::string& path) {
  return RecordFromJson(value, path, kPolicyFields,
                        [](KarstPolicyInfo& policy, const std::string& key, const Json& member,
                           const std::string& field) {
                          if (key == "generation_number") {
                            policy.generation_number = DecodeInt64(member, field);
                          } else if (key == "blobs") {
                            policy.blobs = ArrayFromJson(member, field, BlobFromJson);
                          } else {
                            return false;
                          }
                          return true;
                        });
}

KarstDatastoreInfo DatastoreFromJson(const Json& value, const std::string& path) {
  return RecordFromJson(value, path, kDatastoreFields, kNoOtherKeys);
}

}  // namespace

Json PoliciesToJson(const std::vector<KarstPolicyInfo>& policies) {
  return ArrayToJson(policies, [](const KarstPolicyInfo& policy) {
    Json out = RecordToJson(policy, kPolicyFields);
    out["generation_number"] = policy.generation_number;
    out["blobs"] = ArrayToJson(
        policy.blobs, [](const KarstPolicyBlob& blob) { return RecordToJson(blob, kBlobFields); });
    return out;
  });
}

Json DatastoresToJson(const std::vector<KarstDatastoreInfo>& datastores) {
  return ArrayToJson(datastores, [](const KarstDatastoreInfo& datastore) {
    return RecordToJson(datastore, kDatastoreFields);
  });
}

std::vector<KarstPolicyInfo> PoliciesFromJson(const Json& value, const std::string& path) {
  return ArrayFromJson(value, path, PolicyFromJson);
}

std::vector<KarstDatastoreInfo> DatastoresFromJson(const Json& value, const std::string& path) {
  return ArrayFromJson(value, path, DatastoreFromJson);
}

Json CatalogueToJson(const std::vector<KarstPolicyInfo>& policies,
                     const std::vector<KarstDatastoreInfo>& datastores) {
  Json out = Json::object();
  out[kPolicies] = PoliciesToJson(policies);
  out[kDatastores] = DatastoresToJson(datastores);
  return out;
}

Catalogue CatalogueFromJson(const Json& value) {
  RequireType(value, Json::value_t::object, "top level");
  Catalogue catalogue;
  for (const auto& item : value.items()) {
    if (item.key() == kPolicies) {
      catalogue.policies = PoliciesFromJson(item.value(), kPolicies);
    } else if (item.key() == kDatastores) {
      catalogue.datastores = DatastoresFromJson(item.value(), kDatastores);
    } else {
      throw UnknownKey("top level", item.key());
    }
  }
  return catalogue;
}

Catalogue CatalogueFromAnyJson(const Json& value) {
  if (!value.is_array()) return CatalogueFromJson(value);
  Catalogue catalogue;
  if (value.empty()) return catalogue;
  for (const Json& record : value) {
    if (!record.is_object()) continue;
    for (const auto& item : record.items()) {
      const bool datastoreKey =
          std::any_of(kDatastoreFields.begin(), kDatastoreFields.end(),
                      [&item](const auto& f) { return item.key() == f.first; });
      if (datastoreKey) {
        catalogue.datastores = DatastoresFromJson(value, kDatastores);
        return catalogue;
      }
    }
    if (!record.empty()) break;
  }
  catalogue.policies = PoliciesFromJson(value, kPolicies);
  return catalogue;
}

}  // namespace karstctl
