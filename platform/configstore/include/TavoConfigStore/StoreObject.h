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

namespace objectmodel {
class Access;
struct SubIndex;
}  // namespace objectmodel

// A set of named values. Setting a name that is already present replaces its
// value (and may change its kind); values keep the order in which their names
// were first set. Const members may be called from several threads at once.
class CONFIGSTORE_EXPORT StoreObject {
 public:
  StoreObject() = default;
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

  // Every value, in order.
  std::vector<StoreValue> Values() const;

 private:
  friend class ConfigStoreObject;
  friend class objectmodel::Access;

  // The values are kept as the store writes them, one encoded section. A
  // read object's section lies in the body it was read into (data_ set, the
  // body kept by body_, or for a sub-object by its parent); the first change
  // copies it into own_, where a new object keeps its values from the start.
  std::string own_;
  const char* data_ = nullptr;
  std::size_t size_ = 0;
  std::shared_ptr<const void> body_;
};

// One sub-object together with its identifier.
struct SubObjectEntry {
  SubObjectId id;
  std::shared_ptr<StoreObject> object;
};

// A stored object: identifier, values and arrays of sub-objects. The store
// copies an object when it is written and hands out fresh objects when it is
// read, so changing an object never changes the store behind the caller's back.
class CONFIGSTORE_EXPORT ConfigStoreObject : public StoreObject {
 public:
  explicit ConfigStoreObject(const ConfigStoreObjectId& id);
  explicit ConfigStoreObject(ConfigStoreObjectId&& id);
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

  // Every sub-object the filter matches (all for a null filter), in the
  // order they were created.
  virtual std::vector<std::shared_ptr<StoreObject>> GetSubObjectInstances(
      const std::shared_ptr<FilterSpecObject>& filter) const;

  // Every sub-object.
  std::vector<SubObjectEntry> SubObjects() const;

 private:
  friend class objectmodel::Access;

  // The index of a read object's sub-objects, made when first needed.
  const objectmodel::SubIndex& Index() const;

  ConfigStoreObjectId id_;
  // A read object's sub-objects are its body's encoded section (encodedSubs_
  // set), read through an index of objects over their values there, made
  // once (index_, owned by indexOwner_). The first CreateSubObject moves them
  // into subs_, where a new object keeps them from the start.
  std::vector<SubObjectEntry> subs_;
  const char* encodedSubs_ = nullptr;
  std::size_t encodedSubsSize_ = 0;
  mutable std::atomic<objectmodel::SubIndex*> index_{nullptr};
  mutable std::shared_ptr<objectmodel::SubIndex> indexOwner_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_STORE_OBJECT_H_
