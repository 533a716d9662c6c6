#ifndef TAVOCONFIGSTORE_CONFIG_STORE_OBJECT_ID_H_
#define TAVOCONFIGSTORE_CONFIG_STORE_OBJECT_ID_H_

#include <string>

#include "TavoConfigStore/Export.h"

namespace TavoConfigStore {

// Identifies a stored object by four byte strings. Objects of one collection
// share key, group and component and differ in their instance id.
class CONFIGSTORE_EXPORT ConfigStoreObjectId {
 public:
  ConfigStoreObjectId(const std::string& key, const std::string& group,
                      const std::string& component);
  ConfigStoreObjectId(const std::string& key, const std::string& group,
                      const std::string& component, const std::string& instanceId);

  const std::string& Key() const noexcept { return key_; }
  const std::string& Group() const noexcept { return group_; }
  const std::string& Component() const noexcept { return component_; }
  const std::string& InstanceId() const noexcept { return instanceId_; }
  void SetInstanceId(const std::string& instanceId) { instanceId_ = instanceId; }

  bool operator==(const ConfigStoreObjectId& other) const;
  bool operator!=(const ConfigStoreObjectId& other) const { return !(*this == other); }

 private:
  std::string key_;
  std::string group_;
  std::string component_;
  std::string instanceId_;
};

// Names one sub-object: the array it belongs to and its key within the array.
class CONFIGSTORE_EXPORT SubObjectId {
 public:
  SubObjectId(const std::string& array, const std::string& key);

  const std::string& Array() const noexcept { return array_; }
  const std::string& Key() const noexcept { return key_; }

 private:
  std::string array_;
  std::string key_;
};

// Selects objects by identifier: an empty part of the filter's id matches
// anything. (key, group, component, "") thus selects a whole collection.
// Over sub-objects the filter's key is matched against the array name and its
// instance id against the sub-object's key, so ("blobs", "", "", "") selects
// every instance of the array "blobs".
class CONFIGSTORE_EXPORT FilterSpecObject {
 public:
  explicit FilterSpecObject(const ConfigStoreObjectId& id);

  const ConfigStoreObjectId& Id() const noexcept { return id_; }
  bool Matches(const ConfigStoreObjectId& id) const;
  bool Matches(const SubObjectId& id) const;

 private:
  ConfigStoreObjectId id_;
};

// The platform's shared empty string.
extern CONFIGSTORE_EXPORT const std::string kEmptyString;

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_CONFIG_STORE_OBJECT_ID_H_
