#include "Format.h"

#include <algorithm>
#include <cstring>

#include "Coding.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace format {
namespace {

constexpr char kKindBytes = 0;
constexpr char kKindInteger = 1;

[[noreturn]] void Corrupt(const char* why) {
  throw ConfigStoreException(std::string("corrupt object encoding: ") + why, kErrorCorruptObject);
}

// Read a value's kind and payload from the front of "*in"; false when
// they are damaged.
bool GetPayload(std::string_view* in, Value* out) {
  if (in->empty()) return false;
  const char kind = in->front();
  in->remove_prefix(1);
  if (kind == kKindBytes) {
    out->isInteger = false;
    return coding::GetLengthPrefixed(in, &out->bytes);
  }
  std::uint64_t zigzag = 0;
  if (kind != kKindInteger || !coding::GetVarint(in, &zigzag)) return false;
  out->isInteger = true;
  out->integer = coding::UnZigZag(zigzag);
  return true;
}

bool SkipPayload(std::string_view* in) {
  if (in->empty()) return false;
  const char kind = in->front();
  in->remove_prefix(1);
  std::uint64_t ignored = 0;
  if (kind == kKindInteger) return coding::GetVarint(in, &ignored);
  std::string_view bytes;
  return kind == kKindBytes && coding::GetLengthPrefixed(in, &bytes);
}

// A count of items that each take at least one byte: more than are left
// means damage, and checking it keeps reserve() from exploding.
bool GetCount(std::string_view* in, std::size_t* count) {
  std::uint64_t n = 0;
  if (!coding::GetVarint(in, &n) || n > in->size()) return false;
  *count = static_cast<std::size_t>(n);
  return true;
}

// Checks a "values" section at the front of "*in" and drops it.
void SkipValues(std::string_view* in) {
  std::size_t count = 0;
  if (!GetCount(in, &count)) Corrupt("truncated value count");
  std::string_view name;
  for (std::size_t i = 0; i < count; ++i) {
    if (!coding::GetLengthPrefixed(in, &name) || !SkipPayload(in)) Corrupt("damaged value");
  }
}

void PutValue(std::string* out, std::string_view name, const std::string* bytes,
              std::int64_t integer) {
  coding::PutLengthPrefixed(out, name);
  out->push_back(bytes != nullptr ? kKindBytes : kKindInteger);
  if (bytes != nullptr) {
    coding::PutLengthPrefixed(out, *bytes);
  } else {
    coding::PutVarint(out, coding::ZigZag(integer));
  }
}

}  // namespace

Parts Split(std::string_view body) {
  if (body.empty() || body.front() != kFormat) Corrupt("unknown format");
  std::string_view in = body.substr(1);
  const char* values = in.data();
  SkipValues(&in);
  if (in.empty()) Corrupt("truncated sub-object count");
  SubReader reader(in);
  Sub sub;
  while (reader.Next(&sub)) {
  }
  if (!reader.Rest().empty()) Corrupt("trailing bytes");
  return Parts{std::string_view(values, static_cast<std::size_t>(in.data() - values)), in};
}

bool FindValue(std::string_view values, std::string_view name, Value* out) {
  std::size_t count = 0;
  if (values.empty() || !GetCount(&values, &count)) return false;
  for (std::size_t i = 0; i < count; ++i) {
    if (!coding::GetLengthPrefixed(&values, &out->name)) return false;
    if (out->name == name) return GetPayload(&values, out);
    if (!SkipPayload(&values)) return false;
  }
  return false;
}

std::vector<StoreValue> DecodeValues(std::string_view values) {
  std::vector<StoreValue> out;
  std::size_t count = 0;
  if (values.empty() || !GetCount(&values, &count)) return out;
  out.reserve(count);
  Value value;
  for (std::size_t i = 0;
       i < count && coding::GetLengthPrefixed(&values, &value.name) && GetPayload(&values, &value);
       ++i) {
    StoreValue& v = out.emplace_back();
    v.name.assign(value.name);
    if (value.isInteger) {
      v.value = static_cast<long long>(value.integer);
    } else {
      v.value = std::string(value.bytes);
    }
  }
  return out;
}

void SetValue(std::string* values, std::string_view name, const std::string* bytes,
              std::int64_t integer) {
  std::string_view in(*values);
  std::size_t count = 0;
  if (!in.empty() && !GetCount(&in, &count)) Corrupt("damaged value count");
  const std::size_t countSize = values->size() - in.size();
  std::string_view candidate;
  for (std::size_t i = 0; i < count; ++i) {
    const std::size_t start = values->size() - in.size();
    if (!coding::GetLengthPrefixed(&in, &candidate) || !SkipPayload(&in)) {
      Corrupt("damaged value");
    }
    if (candidate == name) {
      std::string encoded;
      PutValue(&encoded, name, bytes, integer);
      values->replace(start, values->size() - in.size() - start, encoded);
      return;
    }
  }
  // A new name goes at the end, after the count is rewritten.
  char newCount[coding::kMaxVarintLength];
  values->replace(0, countSize, newCount,
                  static_cast<std::size_t>(coding::EncodeVarint(newCount, count + 1) - newCount));
  PutValue(values, name, bytes, integer);
}

SubReader::SubReader(std::string_view subs) : rest_(subs) {
  if (!rest_.empty() && !GetCount(&rest_, &count_)) Corrupt("truncated sub-object count");
  left_ = count_;
}

bool SubReader::Next(Sub* out) {
  if (left_ == 0) return false;
  --left_;
  if (!coding::GetLengthPrefixed(&rest_, &out->array) ||
      !coding::GetLengthPrefixed(&rest_, &out->key)) {
    Corrupt("damaged sub-object identifier");
  }
  const char* values = rest_.data();
  SkipValues(&rest_);
  out->values = std::string_view(values, static_cast<std::size_t>(rest_.data() - values));
  return true;
}

void PutSubHeader(std::string* out, std::string_view array, std::string_view key) {
  coding::PutLengthPrefixed(out, array);
  coding::PutLengthPrefixed(out, key);
}

}  // namespace format
}  // namespace TavoConfigStore
