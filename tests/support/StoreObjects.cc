#include "StoreObjects.h"

#include <variant>

namespace karst_test {

using TavoConfigStore::ConfigStoreObjectId;
using TavoConfigStore::StoreObject;
using TavoConfigStore::StoreValue;
using TavoConfigStore::SubObjectEntry;

std::shared_ptr<ConfigStoreObject> Obj(const std::string& key, const std::string& group,
                                       const std::string& component, const std::string& instance) {
  return std::make_shared<ConfigStoreObject>(ConfigStoreObjectId(key, group, component, instance));
}

std::shared_ptr<FilterSpecObject> Filter(const std::string& key, const std::string& group,
                                         const std::string& component,
                                         const std::string& instance) {
  return std::make_shared<FilterSpecObject>(ConfigStoreObjectId(key, group, component, instance));
}

std::shared_ptr<ConfigStoreObject> Valued(const std::string& instance, const std::string& value,
                                          const std::string& key) {
  auto object = Obj(key, "g", "c", instance);
  object->SetValue("v", value);
  return object;
}

void Set(ConfigStore& store, const std::shared_ptr<ConfigStoreObject>& object) {
  std::int32_t flags = 0;
  store.SetObject(object, flags);
}

std::string Describe(const ConfigStoreObject& object) {
  const ConfigStoreObjectId& id = object.Id();
  std::string out = id.Key() + "|" + id.Group() + "|" + id.Component() + "|" + id.InstanceId();
  auto values = [&out](const StoreObject& s) {
    for (const StoreValue& v : s.Values()) {
      const auto* str = std::get_if<std::string>(&v.value);
      out += " " + v.name + (str ? "=s" + *str : "=i" + std::to_string(std::get<1>(v.value)));
    }
  };
  values(object);
  for (const SubObjectEntry& e : object.SubObjects()) {
    out += " [" + e.id.Array() + "/" + e.id.Key();
    values(*e.object);
  }
  return out;
}

std::vector<std::string> Dump(ConfigStore& store, const std::shared_ptr<FilterSpecObject>& filter) {
  std::vector<std::string> out;
  for (const auto& o : store.GetObjects(filter)) out.push_back(Describe(*o));
  return out;
}

std::vector<std::string> ValuesOf(ConfigStore& store,
                                  const std::shared_ptr<FilterSpecObject>& filter) {
  std::vector<std::string> out;
  for (const auto& o : store.GetObjects(filter)) {
    std::string v;
    o->GetValue("v", &v);
    out.push_back(o->Id().InstanceId() + "=" + v);
  }
  return out;
}

std::vector<std::string> List(ConfigStore& store, const std::shared_ptr<FilterSpecObject>& filter) {
  std::vector<std::string> out;
  for (const auto& o : store.GetObjects(filter)) out.push_back(o->Id().InstanceId());
  return out;
}

}  // namespace karst_test
