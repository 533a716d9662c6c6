#ifndef TAVOCONFIGSTORE_STORE_OBJECT_H_
#define TAVOCONFIGSTORE_STORE_OBJECT_H_

#include <atomic>
#include <cstddef>
#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "TavoConfigStore/ConfigStoreObjectId.h"
#include "TavoConfigStore/Export.h"

namespace TavoConfigStore {

// One named value: a byte string or a signed 64-bit integer.
struct StoreValue {
  std::string name;
  std::variant<std::string, long long> value;
};

namespace codec {
class Access;
struct Body;
}  // namespace codec

class ConfigStoreObject;

// A set of named values. Setting a name that is already present replaces its
// value (and may change its kind); values keep the order in which their names
// were first set.
//
// Objects read from a store keep the values in their stored encoding and read
// them from there in place; so do new objects, which append each value to an
// encoding of their own until a name is set twice. The vector behind Values()
// is built only when asked for. Const members may be called from several
// threads at once.
class CONFIGSTORE_EXPORT StoreObject {
 public:
  StoreObject() = default;
  explicit StoreObject(std::vector<StoreValue> values) : values_(std::move(values)) {}
  StoreObject(const StoreObject& other);
  StoreObject& operator=(const StoreObject& other);
  virtual ~StoreObject();

  void SetValue(const char* name, const std::string& value);
  void SetValue(const char* name, long long value);

  // Fills "*value" and returns true when a value of that name and kind is
  // present. Otherwise returns false and leaves "*value" untouched. Virtual,
  // as are the sub-object reads below, so that a store decorator can hand out
  // objects of its own; a read that fails throws ConfigStoreException.
  virtual bool GetValue(const char* name, std::string* value) const;
  virtual bool GetValue(const char* name, long long* value) const;

  // For backends: every value.
  const std::vector<StoreValue>& Values() const;

 private:
  friend class ConfigStoreObject;
  friend class codec::Access;

  StoreValue& Slot(const char* name);
  const StoreValue* Find(const char* name) const;
  // Before a change: encoded values become ordinary ones.
  void Own();
  // Appends a value to the object's own encoding; false when the object
  // holds its values otherwise, or already has one of that name.
  bool Append(const char* name, const std::string* bytes, long long integer);
  void ReleaseEncoding();

  // While encoded_ is set, the values are the ones encoded at
  // encoded_[0, encodedSize_), and values_ is filled from them on the first
  // Values(). The memory is this object's own when ownsEncoding_ (its
  // capacity then stored just before it), and otherwise that of whoever
  // owns this object.
  mutable std::vector<StoreValue> values_;
  const unsigned char* encoded_ = nullptr;
  std::size_t encodedSize_ = 0;
  mutable std::atomic<bool> expanded_{false};
  bool ownsEncoding_ = false;
};

// One sub-object together with its identifier, as a backend encodes it.
struct SubObjectEntry {
  SubObjectId id;
  std::shared_ptr<StoreObject> object;
};

// A stored object: identifier, values and arrays of sub-objects. The store
// copies an object when it is written and hands out fresh copies when it is
// read, so changing an object never changes the store behind the caller's back.
class CONFIGSTORE_EXPORT ConfigStoreObject : public StoreObject {
 public:
  explicit ConfigStoreObject(const ConfigStoreObjectId& id);
  explicit ConfigStoreObject(ConfigStoreObjectId&& id);
  ConfigStoreObject(const ConfigStoreObjectId& id, std::vector<StoreValue> values,
                    std::vector<SubObjectEntry> subObjects);
  // Shares the sub-objects, as a member-wise copy would.
  ConfigStoreObject(const ConfigStoreObject& other);
  ConfigStoreObject& operator=(const ConfigStoreObject& other);
  ~ConfigStoreObject() override;

  const ConfigStoreObjectId& Id() const noexcept { return id_; }

  // Adds an empty sub-object. A sub-object with the same array and key is
  // replaced in its place by the new, empty one.
  std::shared_ptr<StoreObject> CreateSubObject(const SubObjectId& id);

  // The sub-object with that array and key, or null when there is none.
  virtual std::shared_ptr<StoreObject> GetSubObject(const SubObjectId& id) const;

  // Every sub-object the filter matches, in the order they were created.
  virtual std::vector<std::shared_ptr<StoreObject>> GetSubObjectInstances(
      const std::shared_ptr<FilterSpecObject>& filter) const;

  // For backends: every sub-object.
  const std::vector<SubObjectEntry>& SubObjects() const;

  // A deep copy: values and sub-objects are not shared with this object.
  std::shared_ptr<ConfigStoreObject> Clone() const;

 private:
  friend class codec::Access;

  // The body's sub-objects, built once.
  const codec::Body& BuiltSubs() const;
  // Fills subObjects_ from the body once.
  void ExpandSubObjects() const;
  // Before a change: subObjects_ becomes the only record of the sub-objects.
  void OwnSubObjects();

  ConfigStoreObjectId id_;
  // While encodedSubs_ is set, the sub-objects are the ones encoded there and
  // built in body_; subObjects_ is filled, sharing them, only when asked for.
  mutable std::vector<SubObjectEntry> subObjects_;
  const unsigned char* encodedSubs_ = nullptr;
  // The memory of an object read from the store: its encoded values and
  // sub-objects, and the sub-objects once built. Shared with the sub-objects
  // handed out, which may outlive this object.
  std::shared_ptr<codec::Body> body_;
  mutable std::atomic<bool> subsBuilt_{false};
  mutable std::atomic<bool> subsExpanded_{false};
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_STORE_OBJECT_H_
