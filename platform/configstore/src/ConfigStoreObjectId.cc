#include "TavoConfigStore/ConfigStoreObjectId.h"

namespace TavoConfigStore {

const std::string kEmptyString;

ConfigStoreObjectId::ConfigStoreObjectId(const std::string& key, const std::string& group,
                                         const std::string& component)
    : key_(key), group_(group), component_(component) {}

ConfigStoreObjectId::ConfigStoreObjectId(const std::string& key, const std::string& group,
                                         const std::string& component,
                                         const std::string& instanceId)
    : key_(key), group_(group), component_(component), instanceId_(instanceId) {}

bool ConfigStoreObjectId::operator==(const ConfigStoreObjectId& other) const {
  return key_ == other.key_ && group_ == other.group_ && component_ == other.component_ &&
         instanceId_ == other.instanceId_;
}

SubObjectId::SubObjectId(const std::string& array, const std::string& key)
    : array_(array), key_(key) {}

FilterSpecObject::FilterSpecObject(const ConfigStoreObjectId& id) : id_(id) {}

namespace {
bool PartMatches(const std::string& filterPart, const std::string& part) {
  return filterPart.empty() || filterPart == part;
}
}  // namespace

bool FilterSpecObject::Matches(const ConfigStoreObjectId& id) const {
  return PartMatches(id_.Key(), id.Key()) && PartMatches(id_.Group(), id.Group()) &&
         PartMatches(id_.Component(), id.Component()) &&
         PartMatches(id_.InstanceId(), id.InstanceId());
}

bool FilterSpecObject::Matches(const SubObjectId& id) const {
  return PartMatches(id_.Key(), id.Array()) && PartMatches(id_.InstanceId(), id.Key());
}

}  // namespace TavoConfigStore
