#include "Objects.h"

#include <cstring>
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
// body, which the index keeps.
struct SubIndex : std::enable_shared_from_this<SubIndex> {
  struct Entry {
    std::string_view array;
    std::string_view key;
    StoreObject object;
  };
  std::shared_ptr<const void> body;
  std::vector<Entry> entries;
};

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
    format::SubReader reader(std::string_view(object.encodedSubs_, object.encodedSubsSize_));
    auto index = std::make_shared<SubIndex>();
    index->body = object.body_;
    // Room for all first: an entry's object never moves once handed out.
    index->entries.reserve(reader.Count());
    format::Sub sub;
    while (reader.Next(&sub)) {
      SubIndex::Entry& entry = index->entries.emplace_back();
      entry.array = sub.array;
      entry.key = sub.key;
      View(entry.object, sub.values, nullptr);
    }
    return index;
  }

  // Calls "visit(array, key, share)" for each sub-object of "object" in
  // order until it returns true; "share()" gives the sub-object. A read
  // object's come from its index.
  template <typename Visit>
  static void ForEachSub(const ConfigStoreObject& object, Visit visit) {
    if (object.encodedSubs_ == nullptr) {
      for (const SubObjectEntry& e : object.subs_) {
        if (visit(e.id.Array(), e.id.Key(), [&e] { return e.object; })) return;
      }
      return;
    }
    SubIndex& index = const_cast<SubIndex&>(object.Index());
    for (SubIndex::Entry& e : index.entries) {
      auto share = [&] {
        return std::shared_ptr<StoreObject>(index.shared_from_this(), &e.object);
      };
      if (visit(e.array, e.key, share)) return;
    }
  }

  static void Encode(const ConfigStoreObject& object, std::string* out) {
    const std::string_view values = Values(object);
    out->reserve(out->size() + 1 + values.size() + object.encodedSubsSize_);
    out->push_back(format::kFormat);
    out->append(values);
    // A read object's sub-objects go back as they were read unless one was
    // handed out, which may have changed since.
    if (object.encodedSubs_ != nullptr && object.index_.load() == nullptr) {
      out->append(object.encodedSubs_, object.encodedSubsSize_);
      return;
    }
    const std::size_t count =
        object.encodedSubs_ ? object.Index().entries.size() : object.subs_.size();
    coding::PutVarint(out, count);
    ForEachSub(object, [out](std::string_view array, std::string_view key, auto share) {
      format::PutSubHeader(out, array, key);
      out->append(Values(*share()));
      return false;
    });
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
  Access::Encode(object, out);
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
  if (index_ != nullptr) indexOwner_ = index_.load()->shared_from_this();
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
  std::vector<SubObjectEntry> out;
  Access::ForEachSub(*this, [&out](std::string_view array, std::string_view key, auto share) {
    out.push_back(SubObjectEntry{SubObjectId(std::string(array), std::string(key)), share()});
    return false;
  });
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
  std::shared_ptr<StoreObject> found;
  Access::ForEachSub(*this, [&](std::string_view array, std::string_view key, auto share) {
    if (array != id.Array() || key != id.Key()) return false;
    found = share();
    return true;
  });
  return found;
}

std::vector<std::shared_ptr<StoreObject>> ConfigStoreObject::GetSubObjectInstances(
    const std::shared_ptr<FilterSpecObject>& filter) const {
  std::vector<std::shared_ptr<StoreObject>> out;
  Access::ForEachSub(*this, [&](std::string_view array, std::string_view key, auto share) {
    if (objectmodel::SubMatches(filter.get(), array, key)) out.push_back(share());
    return false;
  });
  return out;
}

}  // namespace TavoConfigStore
