#include "Format.h"

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

// Reads one value from the front of "*in"; false when it is damaged.
bool GetValue(std::string_view* in, Value* out) {
  if (!coding::GetLengthPrefixed(in, &out->name) || in->empty()) return false;
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
  Value value;
  for (std::size_t i = 0; i < count; ++i) {
    if (!GetValue(in, &value)) Corrupt("damaged value");
  }
}

void PutValue(std::string* out, std::string_view name, const std::string* bytes,
              std::int64_t integer) {
  coding::PutLengthPrefixed(out, name);
  if (bytes != nullptr) {
    out->push_back(kKindBytes);
    coding::PutLengthPrefixed(out, *bytes);
  } else {
    out->push_back(kKindInteger);
    coding::PutVarint(out, coding::ZigZag(integer));
  }
}

}  // namespace

Parts Split(std::string_view body) {
  if (body.empty() || body.front() != kFormat) Corrupt("unknown format");
  std::string_view in = body.substr(1);
  Parts parts;
  const char* values = in.data();
  SkipValues(&in);
  parts.values = std::string_view(values, static_cast<std::size_t>(in.data() - values));
  parts.subs = in;
  std::size_t count = 0;
  if (!GetCount(&in, &count)) Corrupt("truncated sub-object count");
  std::string_view ignored;
  for (std::size_t i = 0; i < count; ++i) {
    if (!coding::GetLengthPrefixed(&in, &ignored) || !coding::GetLengthPrefixed(&in, &ignored)) {
      Corrupt("damaged sub-object identifier");
    }
    SkipValues(&in);
  }
  if (!in.empty()) Corrupt("trailing bytes");
  return parts;
}

bool FindValue(std::string_view values, std::string_view name, Value* out) {
  std::size_t count = 0;
  if (values.empty() || !GetCount(&values, &count)) return false;
  for (std::size_t i = 0; i < count && GetValue(&values, out); ++i) {
    if (out->name == name) return true;
  }
  return false;
}

std::vector<StoreValue> DecodeValues(std::string_view values) {
  std::vector<StoreValue> out;
  std::size_t count = 0;
  if (values.empty() || !GetCount(&values, &count)) return out;
  out.reserve(count);
  Value value;
  for (std::size_t i = 0; i < count && GetValue(&values, &value); ++i) {
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
  std::string encoded;
  PutValue(&encoded, name, bytes, integer);
  std::string_view in(*values);
  std::size_t count = 0;
  if (!in.empty() && !GetCount(&in, &count)) Corrupt("damaged value count");
  const std::size_t countSize = values->size() - in.size();
  Value value;
  for (std::size_t i = 0; i < count; ++i) {
    const std::size_t start = values->size() - in.size();
    if (!GetValue(&in, &value)) Corrupt("damaged value");
    if (value.name == name) {
      values->replace(start, values->size() - in.size() - start, encoded);
      return;
    }
  }
  std::string newCount;
  coding::PutVarint(&newCount, count + 1);
  values->replace(0, countSize, newCount);
  values->append(encoded);
}

SubReader::SubReader(std::string_view subs) : rest_(subs) {
  if (!rest_.empty()) GetCount(&rest_, &count_);
  left_ = count_;
}

bool SubReader::Next(Sub* out) {
  if (left_ == 0) return false;
  --left_;
  coding::GetLengthPrefixed(&rest_, &out->array);
  coding::GetLengthPrefixed(&rest_, &out->key);
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
