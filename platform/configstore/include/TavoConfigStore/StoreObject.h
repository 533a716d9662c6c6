#ifndef TAVOCONFIGSTORE_STORE_OBJECT_H_
#define TAVOCONFIGSTORE_STORE_OBJECT_H_

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

// A set of named values. Setting a name that is already present replaces its
// value (and may change its kind); values keep the order in which their names
// were first set.
class CONFIGSTORE_EXPORT StoreObject {
 public:
  StoreObject() = default;
  explicit StoreObject(std::vector<StoreValue> values) : values_(std::move(values)) {}
  virtual ~StoreObject();

  void SetValue(const char* name, const std::string& value);
  void SetValue(const char* name, long long value);

  // Fills "*value" and returns true when a value of that name and kind is
  // present. Otherwise returns false and leaves "*value" untouched.
  bool GetValue(const char* name, std::string* value) const;
  bool GetValue(const char* name, long long* value) const;

  // For backends: every value, without notifying the call probe.
  const std::vector<StoreValue>& Values() const noexcept { return values_; }

 private:
  StoreValue& Slot(const char* name);
  const StoreValue* Find(const char* name) const;

  std::vector<StoreValue> values_;
};

class ConfigStoreObject;

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
  ConfigStoreObject(const ConfigStoreObjectId& id, std::vector<StoreValue> values,
                    std::vector<SubObjectEntry> subObjects);
  ~ConfigStoreObject() override;

  const ConfigStoreObjectId& Id() const noexcept { return id_; }

  // Adds an empty sub-object. A sub-object with the same array and key is
  // replaced in its place by the new, empty one.
  std::shared_ptr<StoreObject> CreateSubObject(const SubObjectId& id);

  // The sub-object with that array and key, or null when there is none.
  std::shared_ptr<StoreObject> GetSubObject(const SubObjectId& id) const;

  // Every sub-object the filter matches, in the order they were created.
  std::vector<std::shared_ptr<StoreObject>> GetSubObjectInstances(
      const std::shared_ptr<FilterSpecObject>& filter) const;

  // For backends: every sub-object, without notifying the call probe.
  const std::vector<SubObjectEntry>& SubObjects() const noexcept { return subObjects_; }

  // A deep copy: values and sub-objects are not shared with this object.
  std::shared_ptr<ConfigStoreObject> Clone() const;

 private:
  ConfigStoreObjectId id_;
  std::vector<SubObjectEntry> subObjects_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_STORE_OBJECT_H_
