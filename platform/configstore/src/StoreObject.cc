#include "TavoConfigStore/StoreObject.h"

#include <algorithm>
#include <cstring>
#include <mutex>
#include <new>
#include <string_view>

#include "ObjectCodec.h"

namespace TavoConfigStore {

namespace {
// Serialises the one-time expansions that const members perform on objects
// read from the store, so concurrent readers of one object stay safe. They
// are rare and short, so one lock serves every object.
std::mutex gExpandMu;

// An object's own encoding: its capacity, then a "values" section whose
// count takes one byte, so it holds at most kMaxAppended values.
constexpr std::size_t kCapacityBytes = sizeof(std::size_t);
constexpr unsigned char kMaxAppended = 0x7f;

// FilterSpecObject::Matches(const SubObjectId&) over views of the encoding:
// the filter's key against the array, its instance id against the key, an
// empty part matching anything.
bool SubMatches(const FilterSpecObject* filter, std::string_view array, std::string_view key) {
  if (filter == nullptr) return true;
  const std::string& a = filter->Id().Key();
  const std::string& k = filter->Id().InstanceId();
  return (a.empty() || a == array) && (k.empty() || k == key);
}
}  // namespace

// ---- StoreObject ----------------------------------------------------------

StoreObject::StoreObject(const StoreObject& other) : values_(other.Values()) {}

StoreObject& StoreObject::operator=(const StoreObject& other) {
  if (this == &other) return *this;
  values_ = other.Values();
  ReleaseEncoding();
  expanded_.store(false, std::memory_order_relaxed);
  return *this;
}

StoreObject::~StoreObject() { ReleaseEncoding(); }

void StoreObject::ReleaseEncoding() {
  if (ownsEncoding_) ::operator delete(const_cast<unsigned char*>(encoded_) - kCapacityBytes);
  ownsEncoding_ = false;
  encoded_ = nullptr;
  encodedSize_ = 0;
}

const std::vector<StoreValue>& StoreObject::Values() const {
  if (encoded_ != nullptr && !expanded_.load(std::memory_order_acquire)) {
    std::vector<StoreValue> decoded = codec::DecodeValues(encoded_, encodedSize_);
    std::lock_guard<std::mutex> lock(gExpandMu);
    if (!expanded_.load(std::memory_order_relaxed)) {
      values_ = std::move(decoded);
      expanded_.store(true, std::memory_order_release);
    }
  }
  return values_;
}

void StoreObject::Own() {
  if (encoded_ == nullptr) return;
  if (!expanded_.load(std::memory_order_acquire))
    values_ = codec::DecodeValues(encoded_, encodedSize_);
  ReleaseEncoding();
  expanded_.store(false, std::memory_order_relaxed);
}

// A new object's values go straight into one encoding, as the store will
// write them: a few appends to one block instead of a string for each name
// and value, and the store copies the section whole.
bool StoreObject::Append(const char* name, const std::string* bytes, long long integer) {
  unsigned char* data = nullptr;
  std::size_t used = 1;  // the count
  std::size_t capacity = 0;
  if (encoded_ != nullptr) {
    if (!ownsEncoding_ || expanded_.load(std::memory_order_acquire)) return false;
    codec::ValueRef existing;
    if (encoded_[0] == kMaxAppended || codec::FindValue(encoded_, encodedSize_, name, &existing)) {
      return false;  // a name set again is replaced where it stands
    }
    data = const_cast<unsigned char*>(encoded_);
    used = encodedSize_;
    std::memcpy(&capacity, data - kCapacityBytes, kCapacityBytes);
  } else if (!values_.empty()) {
    return false;
  }
  const std::size_t nameSize = std::strlen(name);
  const std::size_t needed = used + codec::ValueSize(nameSize, bytes, integer);
  if (data == nullptr || needed > capacity) {
    // Room for a few more names and short values besides.
    capacity = std::max(needed + 64, 2 * capacity);
    auto* block = static_cast<unsigned char*>(::operator new(kCapacityBytes + capacity));
    std::memcpy(block, &capacity, kCapacityBytes);
    unsigned char* grown = block + kCapacityBytes;
    if (data == nullptr) {
      grown[0] = 0;
    } else {
      std::memcpy(grown, data, used);
    }
    ReleaseEncoding();
    data = grown;
    encoded_ = data;
    ownsEncoding_ = true;
  }
  codec::PutValue(name, nameSize, bytes, integer, reinterpret_cast<char*>(data + used));
  ++data[0];
  encodedSize_ = needed;
  return true;
}

const StoreValue* StoreObject::Find(const char* name) const {
  for (const StoreValue& v : values_) {
    if (v.name == name) return &v;
  }
  return nullptr;
}

StoreValue& StoreObject::Slot(const char* name) {
  for (StoreValue& v : values_) {
    if (v.name == name) return v;
  }
  // Objects are small: room for a few values at once saves regrowing.
  if (values_.empty()) values_.reserve(4);
  values_.push_back(StoreValue{name, {}});
  return values_.back();
}

void StoreObject::SetValue(const char* name, const std::string& value) {
  if (Append(name, &value, 0)) return;
  Own();
  Slot(name).value = value;
}

void StoreObject::SetValue(const char* name, long long value) {
  if (Append(name, nullptr, value)) return;
  Own();
  Slot(name).value = value;
}

bool StoreObject::GetValue(const char* name, std::string* value) const {
  if (encoded_ != nullptr) {
    codec::ValueRef v;
    if (!codec::FindValue(encoded_, encodedSize_, name, &v) || v.isInteger) return false;
    value->assign(v.bytes, v.size);
    return true;
  }
  const StoreValue* v = Find(name);
  if (v == nullptr) return false;
  const auto* s = std::get_if<std::string>(&v->value);
  if (s == nullptr) return false;
  *value = *s;
  return true;
}

bool StoreObject::GetValue(const char* name, long long* value) const {
  if (encoded_ != nullptr) {
    codec::ValueRef v;
    if (!codec::FindValue(encoded_, encodedSize_, name, &v) || !v.isInteger) return false;
    *value = v.integer;
    return true;
  }
  const StoreValue* v = Find(name);
  if (v == nullptr) return false;
  const auto* n = std::get_if<long long>(&v->value);
  if (n == nullptr) return false;
  *value = *n;
  return true;
}

// ---- ConfigStoreObject ----------------------------------------------------

ConfigStoreObject::ConfigStoreObject(const ConfigStoreObjectId& id) : id_(id) {}

ConfigStoreObject::ConfigStoreObject(ConfigStoreObjectId&& id) : id_(std::move(id)) {}

ConfigStoreObject::ConfigStoreObject(const ConfigStoreObjectId& id, std::vector<StoreValue> values,
                                     std::vector<SubObjectEntry> subObjects)
    : StoreObject(std::move(values)), id_(id), subObjects_(std::move(subObjects)) {}

ConfigStoreObject::ConfigStoreObject(const ConfigStoreObject& other)
    : StoreObject(other), id_(other.id_), subObjects_(other.SubObjects()) {}

ConfigStoreObject& ConfigStoreObject::operator=(const ConfigStoreObject& other) {
  if (this == &other) return *this;
  std::vector<SubObjectEntry> subs = other.SubObjects();
  StoreObject::operator=(other);
  id_ = other.id_;
  subObjects_ = std::move(subs);
  encodedSubs_ = nullptr;
  // Values and sub-objects no longer point into the body.
  body_.reset();
  subsBuilt_.store(false, std::memory_order_relaxed);
  subsExpanded_.store(false, std::memory_order_relaxed);
  return *this;
}

ConfigStoreObject::~ConfigStoreObject() = default;

const codec::Body& ConfigStoreObject::BuiltSubs() const {
  if (!subsBuilt_.load(std::memory_order_acquire)) {
    std::lock_guard<std::mutex> lock(gExpandMu);
    if (!subsBuilt_.load(std::memory_order_relaxed)) {
      // Views into the body, in room taken now.
      body_->TakeRoom();
      codec::SubReader reader(encodedSubs_, body_->subsSize);
      codec::SubRef ref;
      while (body_->built < body_->capacity && reader.Next(&ref)) {
        codec::Body::Sub* sub = new (body_->subs + body_->built) codec::Body::Sub();
        ++body_->built;
        sub->array = std::string_view(ref.array, ref.arraySize);
        sub->key = std::string_view(ref.key, ref.keySize);
        sub->object.encoded_ = ref.values;
        sub->object.encodedSize_ = ref.valuesSize;
      }
      subsBuilt_.store(true, std::memory_order_release);
    }
  }
  return *body_;
}

void ConfigStoreObject::ExpandSubObjects() const {
  if (encodedSubs_ == nullptr || subsExpanded_.load(std::memory_order_acquire)) return;
  const codec::Body& body = BuiltSubs();
  std::vector<SubObjectEntry> subs;
  subs.reserve(body.built);
  for (std::size_t i = 0; i < body.built; ++i) {
    const codec::Body::Sub& sub = body.subs[i];
    subs.push_back(SubObjectEntry{SubObjectId(std::string(sub.array), std::string(sub.key)),
                                  std::shared_ptr<StoreObject>(body_, &body.subs[i].object)});
  }
  std::lock_guard<std::mutex> lock(gExpandMu);
  if (!subsExpanded_.load(std::memory_order_relaxed)) {
    subObjects_ = std::move(subs);
    subsExpanded_.store(true, std::memory_order_release);
  }
}

void ConfigStoreObject::OwnSubObjects() {
  if (encodedSubs_ == nullptr) return;
  ExpandSubObjects();
  // The body stays: the values may still be read from it, and the entries
  // share it.
  encodedSubs_ = nullptr;
  subsExpanded_.store(false, std::memory_order_relaxed);
}

const std::vector<SubObjectEntry>& ConfigStoreObject::SubObjects() const {
  ExpandSubObjects();
  return subObjects_;
}

std::shared_ptr<StoreObject> ConfigStoreObject::CreateSubObject(const SubObjectId& id) {
  OwnSubObjects();
  auto sub = std::make_shared<StoreObject>();
  for (SubObjectEntry& e : subObjects_) {
    if (e.id.Array() == id.Array() && e.id.Key() == id.Key()) {
      e.object = sub;
      return sub;
    }
  }
  if (subObjects_.empty()) subObjects_.reserve(4);
  subObjects_.push_back(SubObjectEntry{id, sub});
  return sub;
}

std::shared_ptr<StoreObject> ConfigStoreObject::GetSubObject(const SubObjectId& id) const {
  if (encodedSubs_ != nullptr) {
    const codec::Body& body = BuiltSubs();
    for (std::size_t i = 0; i < body.built; ++i) {
      if (body.subs[i].array == id.Array() && body.subs[i].key == id.Key()) {
        return std::shared_ptr<StoreObject>(body_, &body.subs[i].object);
      }
    }
    return nullptr;
  }
  for (const SubObjectEntry& e : subObjects_) {
    if (e.id.Array() == id.Array() && e.id.Key() == id.Key()) return e.object;
  }
  return nullptr;
}

std::vector<std::shared_ptr<StoreObject>> ConfigStoreObject::GetSubObjectInstances(
    const std::shared_ptr<FilterSpecObject>& filter) const {
  std::vector<std::shared_ptr<StoreObject>> out;
  if (encodedSubs_ != nullptr) {
    const codec::Body& body = BuiltSubs();
    out.reserve(body.built);
    for (std::size_t i = 0; i < body.built; ++i) {
      if (SubMatches(filter.get(), body.subs[i].array, body.subs[i].key)) {
        out.emplace_back(body_, &body.subs[i].object);
      }
    }
    return out;
  }
  out.reserve(subObjects_.size());
  for (const SubObjectEntry& e : subObjects_) {
    if (filter == nullptr || filter->Matches(e.id)) out.push_back(e.object);
  }
  return out;
}

std::shared_ptr<ConfigStoreObject> ConfigStoreObject::Clone() const {
  const std::vector<SubObjectEntry>& mine = SubObjects();
  std::vector<SubObjectEntry> subs;
  subs.reserve(mine.size());
  for (const SubObjectEntry& e : mine) {
    subs.push_back(SubObjectEntry{e.id, std::make_shared<StoreObject>(e.object->Values())});
  }
  return std::make_shared<ConfigStoreObject>(id_, Values(), std::move(subs));
}

}  // namespace TavoConfigStore
