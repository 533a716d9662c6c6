#include "Objects.h"

#include <cstring>
#include <new>
#include <string_view>
#include <utility>

#include "Coding.h"
#include "DamagedObject.h"
#include "Format.h"

namespace TavoConfigStore {
namespace objectmodel {
namespace {

// An empty section: no values, or no sub-objects.
constexpr std::string_view kNone("\0", 1);

// FilterSpecObject::Matches(const SubObjectId&) over views: the filter's key
// against the array, its instance id against the key, an empty part
// matching anything, and a null filter everything.
bool SubMatches(const FilterSpecObject* filter, std::string_view array, std::string_view key) {
  if (filter == nullptr) return true;
  const std::string& a = filter->Id().Key();
  const std::string& k = filter->Id().InstanceId();
  return (a.empty() || a == array) && (k.empty() || k == key);
}

}  // namespace

// The sub-objects of a read object: an object over each one's values in the
// body, which the index keeps. The entries follow the index in the same
// allocation (WithEntries).
struct SubIndex {
  struct Entry {
    std::string_view array;
    std::string_view key;
    StoreObject object;
  };
  SubIndex(std::size_t n, Entry* room) : count(n), entries(room) {}
  SubIndex(const SubIndex&) = delete;
  SubIndex& operator=(const SubIndex&) = delete;
  ~SubIndex() {
    for (std::size_t i = 0; i < count; ++i) entries[i].~Entry();
  }
  const Entry* begin() const { return entries; }
  const Entry* end() const { return entries + count; }

  std::weak_ptr<SubIndex> self;
  std::shared_ptr<const void> body;
  std::size_t count;
  Entry* entries;
};

namespace {

// An allocator for allocate_shared that takes room for "count" entries
// after what it allocates and says where: the index, its entries and the
// shared count are then one allocation.
template <typename T>
struct WithEntries {
  using value_type = T;
  std::size_t count;
  SubIndex::Entry** room;

  WithEntries(std::size_t n, SubIndex::Entry** r) : count(n), room(r) {}
  template <typename U>
  WithEntries(const WithEntries<U>& other) : count(other.count), room(other.room) {}

  static std::size_t Head(std::size_t n) {
    constexpr std::size_t kAlign = alignof(SubIndex::Entry);
    return (n * sizeof(T) + kAlign - 1) / kAlign * kAlign;
  }
  T* allocate(std::size_t n) {
    char* p = static_cast<char*>(::operator new(Head(n) + count * sizeof(SubIndex::Entry)));
    *room = reinterpret_cast<SubIndex::Entry*>(p + Head(n));
    return reinterpret_cast<T*>(p);
  }
  void deallocate(T* p, std::size_t) { ::operator delete(p); }
  template <typename U>
  bool operator==(const WithEntries<U>& other) const {
    return count == other.count && room == other.room;
  }
  template <typename U>
  bool operator!=(const WithEntries<U>& other) const {
    return !(*this == other);
  }
};

}  // namespace

// The one friend of the object classes: the object model's own code reaches
// their representation through it.
class Access {
 public:
  static std::string_view Values(const StoreObject& object) {
    if (object.data_ != nullptr) return std::string_view(object.data_, object.size_);
    return object.own_.empty() ? kNone : std::string_view(object.own_);
  }

  // Before a change: the values become the object's own. The body stays,
  // as a read object's sub-objects may still lie in it.
  static std::string* Own(StoreObject& object) {
    if (object.data_ != nullptr) {
      object.own_.assign(object.data_, object.size_);
      object.data_ = nullptr;
      object.size_ = 0;
    }
    return &object.own_;
  }

  static void View(StoreObject& object, std::string_view values, std::shared_ptr<const void> body) {
    object.data_ = values.data();
    object.size_ = values.size();
    object.body_ = std::move(body);
  }

  static std::shared_ptr<SubIndex> NewIndex(const ConfigStoreObject& object) {
    format::SubReader reader(EncodedSubs(object));
    SubIndex::Entry* room = nullptr;
    auto index = std::allocate_shared<SubIndex>(WithEntries<SubIndex>(reader.Count(), &room),
                                                std::size_t{0}, room);
    index->entries = room;
    index->self = index;
    index->body = object.body_;
    format::Sub sub;
    while (reader.Next(&sub)) {
      SubIndex::Entry* entry = new (room + index->count) SubIndex::Entry();
      ++index->count;
      entry->array = sub.array;
      entry->key = sub.key;
      View(entry->object, sub.values, nullptr);
    }
    return index;
  }

  // One of the index's objects, which keeps the index.
  static std::shared_ptr<StoreObject> Share(const SubIndex& index, const SubIndex::Entry& entry) {
    return std::shared_ptr<StoreObject>(index.self.lock(), const_cast<StoreObject*>(&entry.object));
  }

  static bool Encoded(const ConfigStoreObject& object) { return object.encodedSubs_ != nullptr; }
  static std::string_view EncodedSubs(const ConfigStoreObject& object) {
    return std::string_view(object.encodedSubs_, object.encodedSubsSize_);
  }
  static const std::vector<SubObjectEntry>& Subs(const ConfigStoreObject& object) {
    return object.subs_;
  }

  // An object over "body", whose sections "parts" are: over a copy in
  // "arena" (null: memory of its own), or with "owner" set, over "body"
  // itself, which "owner" keeps.
  static std::shared_ptr<ConfigStoreObject> Place(ConfigStoreObjectId&& id, std::string_view body,
                                                  const format::Parts& parts, Arena* arena,
                                                  std::shared_ptr<const void> owner) {
    const char* at = body.data();
    if (owner == nullptr) {
      Arena alone;
      char* copy = (arena ? arena : &alone)->Allocate(body.size(), &owner);
      std::memcpy(copy, body.data(), body.size());
      at = copy;
    }
    auto object = std::make_shared<ConfigStoreObject>(std::move(id));
    object->encodedSubs_ = at + (parts.subs.data() - body.data());
    object->encodedSubsSize_ = parts.subs.size();
    View(*object, std::string_view(at + (parts.values.data() - body.data()), parts.values.size()),
         std::move(owner));
    return object;
  }
};

void EncodeObject(const ConfigStoreObject& object, std::string* out) {
  // Sized first and written in one go: no regrowing of "out".
  const std::string_view values = Access::Values(object);
  std::size_t size = 1 + values.size();
  const std::vector<SubObjectEntry>& subs = Access::Subs(object);
  if (Access::Encoded(object)) {
    size += Access::EncodedSubs(object).size();
  } else {
    size += coding::VarintLength(subs.size());
    for (const SubObjectEntry& e : subs) {
      size += coding::VarintLength(e.id.Array().size()) + e.id.Array().size() +
              coding::VarintLength(e.id.Key().size()) + e.id.Key().size() +
              Access::Values(*e.object).size();
    }
  }
  out->reserve(out->size() + size);
  out->push_back(format::kFormat);
  out->append(values);
  if (Access::Encoded(object)) {
    out->append(Access::EncodedSubs(object));
    return;
  }
  coding::PutVarint(out, subs.size());
  for (const SubObjectEntry& e : subs) {
    format::PutSubHeader(out, e.id.Array(), e.id.Key());
    out->append(Access::Values(*e.object));
  }
}

std::shared_ptr<ConfigStoreObject> DecodeObject(ConfigStoreObjectId id, std::string_view body,
                                                Arena* arena) {
  return Access::Place(std::move(id), body, format::Split(body), arena, nullptr);
}

namespace {

std::shared_ptr<ConfigStoreObject> PlaceOrDamaged(ConfigStoreObjectId&& id, std::string_view body,
                                                  Arena* arena, std::shared_ptr<const void> owner,
                                                  const std::string& where) {
  format::Parts parts;
  try {
    parts = format::Split(body);
  } catch (const ConfigStoreException& e) {
    return std::make_shared<DamagedObject>(
        std::move(id), ConfigStoreException(where + ": " + e.Message(), e.Code()));
  }
  return Access::Place(std::move(id), body, parts, arena, std::move(owner));
}

}  // namespace

std::shared_ptr<ConfigStoreObject> DecodeOrDamaged(ConfigStoreObjectId id, std::string_view body,
                                                   Arena* arena, const std::string& where) {
  return PlaceOrDamaged(std::move(id), body, arena, nullptr, where);
}

std::shared_ptr<ConfigStoreObject> ViewOrDamaged(ConfigStoreObjectId id, std::string_view body,
                                                 std::shared_ptr<const void> owner,
                                                 const std::string& where) {
  return PlaceOrDamaged(std::move(id), body, nullptr, std::move(owner), where);
}

}  // namespace objectmodel

using objectmodel::Access;

// ---- StoreObject ----------------------------------------------------------

StoreObject::StoreObject(const StoreObject& other)
    : own_(other.own_), data_(other.data_), size_(other.size_), body_(other.body_) {
  // A sub-object's values lie in its parent's body, which may go before the
  // copy does.
  if (body_ == nullptr) Access::Own(*this);
}

StoreObject& StoreObject::operator=(const StoreObject& other) {
  if (this != &other) {
    StoreObject copy(other);
    own_ = std::move(copy.own_);
    data_ = copy.data_;
    size_ = copy.size_;
    body_ = std::move(copy.body_);
  }
  return *this;
}
StoreObject::~StoreObject() = default;

void StoreObject::SetValue(const char* name, const std::string& value) {
  format::SetValue(Access::Own(*this), name, &value, 0);
}

void StoreObject::SetValue(const char* name, long long value) {
  format::SetValue(Access::Own(*this), name, nullptr, value);
}

bool StoreObject::GetValue(const char* name, std::string* value) const {
  format::Value v;
  if (!format::FindValue(Access::Values(*this), name, &v) || v.isInteger) return false;
  value->assign(v.bytes);
  return true;
}

bool StoreObject::GetValue(const char* name, long long* value) const {
  format::Value v;
  if (!format::FindValue(Access::Values(*this), name, &v) || !v.isInteger) return false;
  *value = v.integer;
  return true;
}

std::vector<StoreValue> StoreObject::Values() const {
  return format::DecodeValues(Access::Values(*this));
}

// ---- ConfigStoreObject ----------------------------------------------------

ConfigStoreObject::ConfigStoreObject(const ConfigStoreObjectId& id) : id_(id) {}
ConfigStoreObject::ConfigStoreObject(ConfigStoreObjectId&& id) : id_(std::move(id)) {}
ConfigStoreObject::ConfigStoreObject(const ConfigStoreObject& other)
    : StoreObject(other),
      id_(other.id_),
      subs_(other.subs_),
      encodedSubs_(other.encodedSubs_),
      encodedSubsSize_(other.encodedSubsSize_),
      index_(other.index_.load(std::memory_order_acquire)) {
  if (index_ != nullptr) indexOwner_ = index_.load()->self.lock();
}

ConfigStoreObject& ConfigStoreObject::operator=(const ConfigStoreObject& other) {
  if (this != &other) {
    ConfigStoreObject copy(other);
    StoreObject::operator=(copy);
    id_ = std::move(copy.id_);
    subs_ = std::move(copy.subs_);
    encodedSubs_ = copy.encodedSubs_;
    encodedSubsSize_ = copy.encodedSubsSize_;
    index_.store(copy.index_.load());
    indexOwner_ = std::move(copy.indexOwner_);
  }
  return *this;
}

ConfigStoreObject::~ConfigStoreObject() = default;

const objectmodel::SubIndex& ConfigStoreObject::Index() const {
  objectmodel::SubIndex* index = index_.load(std::memory_order_acquire);
  if (index != nullptr) return *index;
  std::shared_ptr<objectmodel::SubIndex> made = Access::NewIndex(*this);
  // Of two threads that made one at once, the first to publish it wins. Only
  // the winner sets indexOwner_, which nothing else reads while others may
  // be reading the object.
  if (!index_.compare_exchange_strong(index, made.get(), std::memory_order_acq_rel)) {
    return *index;
  }
  indexOwner_ = std::move(made);
  return *indexOwner_;
}

std::vector<SubObjectEntry> ConfigStoreObject::SubObjects() const {
  if (encodedSubs_ == nullptr) return subs_;
  const objectmodel::SubIndex& index = Index();
  std::vector<SubObjectEntry> out;
  out.reserve(index.count);
  for (const auto& e : index) {
    out.push_back(SubObjectEntry{SubObjectId(std::string(e.array), std::string(e.key)),
                                 Access::Share(index, e)});
  }
  return out;
}

std::shared_ptr<StoreObject> ConfigStoreObject::CreateSubObject(const SubObjectId& id) {
  if (encodedSubs_ != nullptr) {
    subs_ = SubObjects();
    encodedSubs_ = nullptr;
    encodedSubsSize_ = 0;
    index_.store(nullptr);
    indexOwner_.reset();  // subs_ keeps it
  }
  auto sub = std::make_shared<StoreObject>();
  for (SubObjectEntry& e : subs_) {
    if (e.id.Array() == id.Array() && e.id.Key() == id.Key()) {
      e.object = sub;
      return sub;
    }
  }
  if (subs_.empty()) subs_.reserve(4);
  subs_.push_back(SubObjectEntry{id, sub});
  return sub;
}

std::shared_ptr<StoreObject> ConfigStoreObject::GetSubObject(const SubObjectId& id) const {
  if (encodedSubs_ != nullptr) {
    const objectmodel::SubIndex& index = Index();
    for (const auto& e : index) {
      if (e.array == id.Array() && e.key == id.Key()) return Access::Share(index, e);
    }
    return nullptr;
  }
  for (const SubObjectEntry& e : subs_) {
    if (e.id.Array() == id.Array() && e.id.Key() == id.Key()) return e.object;
  }
  return nullptr;
}

std::vector<std::shared_ptr<StoreObject>> ConfigStoreObject::GetSubObjectInstances(
    const std::shared_ptr<FilterSpecObject>& filter) const {
  std::vector<std::shared_ptr<StoreObject>> out;
  if (encodedSubs_ != nullptr) {
    const objectmodel::SubIndex& index = Index();
    out.reserve(index.count);
    for (const auto& e : index) {
      if (objectmodel::SubMatches(filter.get(), e.array, e.key)) {
        out.push_back(Access::Share(index, e));
      }
    }
    return out;
  }
  out.reserve(subs_.size());
  for (const SubObjectEntry& e : subs_) {
    if (filter == nullptr || filter->Matches(e.id)) out.push_back(e.object);
  }
  return out;
}

}  // namespace TavoConfigStore
