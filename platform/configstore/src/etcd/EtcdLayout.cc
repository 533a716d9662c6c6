#include "EtcdLayout.h"

#include <cstdio>

#include "../object/Coding.h"

namespace TavoConfigStore {
namespace etcdlayout {

std::string Escape(std::string_view part) {
  std::string out;
  out.reserve(part.size());
  for (char c : part) {
    if (c == '\0' || c == '\1') {
      out += '\1';
      out += static_cast<char>(c + 1);
    } else {
      out += c;
    }
  }
  return out;
}

bool Unescape(std::string_view text, std::string* out) {
  // Most parts have nothing escaped: a listing unescapes every key.
  if (text.find_first_of(std::string_view("\0\1", 2)) == std::string_view::npos) {
    out->assign(text);
    return true;
  }
  out->clear();
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\0') return false;
    if (text[i] != '\1') {
      *out += text[i];
      continue;
    }
    if (i + 1 == text.size() || (text[i + 1] != '\1' && text[i + 1] != '\2')) return false;
    *out += static_cast<char>(text[++i] - 1);
  }
  return true;
}

std::string CollectionOf(const ConfigStoreObjectId& id) {
  return Escape(id.Key()) + '\0' + Escape(id.Group()) + '\0' + Escape(id.Component());
}

bool ParseCollection(std::string_view name, ConfigStoreObjectId* id) {
  const std::size_t first = name.find('\0');
  const std::size_t second = first == std::string_view::npos ? first : name.find('\0', first + 1);
  if (second == std::string_view::npos) return false;
  std::string key;
  std::string group;
  std::string component;
  if (!Unescape(name.substr(0, first), &key) ||
      !Unescape(name.substr(first + 1, second - first - 1), &group) ||
      !Unescape(name.substr(second + 1), &component)) {
    return false;
  }
  *id = ConfigStoreObjectId(key, group, component);
  return true;
}

std::string PointerValue(const std::string& gen, const std::string& token) {
  return gen + '\0' + token;
}

std::pair<std::string, std::string> ParsePointer(std::string_view value) {
  const std::size_t zero = value.find('\0');
  if (zero == std::string_view::npos) return {std::string(value), std::string()};
  return {std::string(value.substr(0, zero)), std::string(value.substr(zero + 1))};
}

bool IsGenerationId(std::string_view text) {
  return text.size() == 16 && text.find_first_not_of("0123456789abcdef") == std::string_view::npos;
}

std::string FirstPart(const Header& header, std::string_view body) {
  std::string value(1, '\1');
  value.reserve(body.size() + 4 * coding::kMaxVarintLength + 1);
  coding::PutVarint(&value, static_cast<std::uint64_t>(header.kind));
  coding::PutVarint(&value, static_cast<std::uint64_t>(header.revision));
  coding::PutVarint(&value, header.index);
  coding::PutVarint(&value, header.parts);
  value.append(body);
  return value;
}

bool ReadHeader(std::string_view* value, Header* header) {
  if (value->empty() || value->front() != 1) return false;
  value->remove_prefix(1);
  std::uint64_t kind = 0;
  std::uint64_t revision = 0;
  if (!coding::GetVarint(value, &kind) || kind > 2 || !coding::GetVarint(value, &revision) ||
      !coding::GetVarint(value, &header->index) || !coding::GetVarint(value, &header->parts) ||
      header->parts == 0 || revision > static_cast<std::uint64_t>(INT64_MAX)) {
    return false;
  }
  header->kind = static_cast<OrderKind>(kind);
  header->revision = static_cast<std::int64_t>(revision);
  return true;
}

bool ParseObjectKey(std::string_view rest, std::string_view* stem, std::size_t* part) {
  const std::size_t zero = rest.find('\0');
  if (zero == std::string_view::npos) return false;
  *stem = rest.substr(0, zero + 1);
  const std::string_view digits = rest.substr(zero + 1);
  *part = digits.size() == 4 ? 0 : kNoPart;
  for (std::size_t i = 0; i < digits.size() && *part != kNoPart; ++i) {
    const char c = digits[i];
    const int digit = c >= '0' && c <= '9' ? c - '0' : c >= 'a' && c <= 'f' ? c - 'a' + 10 : -1;
    *part = digit < 0 ? kNoPart : *part * 16 + static_cast<std::size_t>(digit);
  }
  return true;
}

std::string Keys::PartSuffix(std::size_t part) {
  char text[17];
  std::snprintf(text, sizeof text, "%04zx", part);
  return text;
}

std::string Keys::Version(std::uint64_t number) const {
  char text[17];
  std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(number));
  return Versions() + text;
}

std::string PrefixEnd(std::string prefix) {
  while (!prefix.empty()) {
    if (static_cast<unsigned char>(prefix.back()) != 0xff) {
      prefix.back() = static_cast<char>(static_cast<unsigned char>(prefix.back()) + 1);
      return prefix;
    }
    prefix.pop_back();
  }
  return std::string(1, '\0');  // every key
}

}  // namespace etcdlayout
}  // namespace TavoConfigStore
