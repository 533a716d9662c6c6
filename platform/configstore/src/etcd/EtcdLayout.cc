#include "EtcdLayout.h"

#include <cstdio>

namespace TavoConfigStore {
namespace etcdlayout {
namespace {

void AppendVarint(std::uint64_t v, std::string* out) {
  while (v >= 0x80) {
    out->push_back(static_cast<char>((v & 0x7f) | 0x80));
    v >>= 7;
  }
  out->push_back(static_cast<char>(v));
}

bool ReadVarint(std::string_view* in, std::uint64_t* v) {
  *v = 0;
  for (int shift = 0; shift < 64 && !in->empty(); shift += 7) {
    const auto byte = static_cast<unsigned char>(in->front());
    in->remove_prefix(1);
    *v |= static_cast<std::uint64_t>(byte & 0x7f) << shift;
    if ((byte & 0x80) == 0) return true;
  }
  return false;
}

}  // namespace

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

void AppendHeader(const Header& header, std::string* out) {
  out->push_back(1);
  AppendVarint(static_cast<std::uint64_t>(header.kind), out);
  AppendVarint(static_cast<std::uint64_t>(header.revision), out);
  AppendVarint(header.index, out);
  AppendVarint(header.parts, out);
}

bool ReadHeader(std::string_view* value, Header* header) {
  if (value->empty() || value->front() != 1) return false;
  value->remove_prefix(1);
  std::uint64_t kind = 0;
  std::uint64_t revision = 0;
  if (!ReadVarint(value, &kind) || kind > 2 || !ReadVarint(value, &revision) ||
      !ReadVarint(value, &header->index) || !ReadVarint(value, &header->parts) ||
      header->parts == 0 || revision > static_cast<std::uint64_t>(INT64_MAX)) {
    return false;
  }
  header->kind = static_cast<OrderKind>(kind);
  header->revision = static_cast<std::int64_t>(revision);
  return true;
}

bool IsGenerationId(std::string_view text) {
  return text.size() == 16 && text.find_first_not_of("0123456789abcdef") == std::string_view::npos;
}

std::string Keys::PartSuffix(std::size_t part) {
  char text[17];
  std::snprintf(text, sizeof text, "%04zx", part);
  return text;
}

}  // namespace etcdlayout
}  // namespace TavoConfigStore
