#include "TavoConfigStore/StoreObject.h"

#include <cstring>

#include "TavoConfigStore/CallProbe.h"

namespace TavoConfigStore {

StoreObject::~StoreObject() = default;

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
  values_.push_back(StoreValue{name, {}});
  return values_.back();
}

void StoreObject::SetValue(const char* name, const std::string& value) {
  NotifyCall("SetValue");
  Slot(name).value = value;
}

void StoreObject::SetValue(const char* name, long long value) {
  NotifyCall("SetValue");
  Slot(name).value = value;
}

bool StoreObject::GetValue(const char* name, std::string* value) const {
  NotifyCall("GetValue");
  const StoreValue* v = Find(name);
  if (v == nullptr) return false;
  const auto* s = std::get_if<std::string>(&v->value);
  if (s == nullptr) return false;
  *value = *s;
  return true;
}

bool StoreObject::GetValue(const char* name, long long* value) const {
  NotifyCall("GetValue");
  const StoreValue* v = Find(name);
  if (v == nullptr) return false;
  const auto* n = std::get_if<long long>(&v->value);
  if (n == nullptr) return false;
  *value = *n;
  return true;
}

ConfigStoreObject::ConfigStoreObject(const ConfigStoreObjectId& id) : id_(id) {}

ConfigStoreObject::ConfigStoreObject(const ConfigStoreObjectId& id, std::vector<StoreValue> values,
                                     std::vector<SubObjectEntry> subObjects)
    : StoreObject(std::move(values)), id_(id), subObjects_(std::move(subObjects)) {}

ConfigStoreObject::~ConfigStoreObject() = default;

std::shared_ptr<StoreObject> ConfigStoreObject::CreateSubObject(const SubObjectId& id) {
  NotifyCall("CreateSubObject");
  auto sub = std::make_shared<StoreObject>();
  for (SubObjectEntry& e : subObjects_) {
    if (e.id.Array() == id.Array() && e.id.Key() == id.Key()) {
      e.object = sub;
      return sub;
    }
  }
  subObjects_.push_back(SubObjectEntry{id, sub});
  return sub;
}

std::shared_ptr<StoreObject> ConfigStoreObject::GetSubObject(const SubObjectId& id) const {
  NotifyCall("GetSubObject");
  for (const SubObjectEntry& e : subObjects_) {
    if (e.id.Array() == id.Array() && e.id.Key() == id.Key()) return e.object;
  }
  return nullptr;
}

std::vector<std::shared_ptr<StoreObject>> ConfigStoreObject::GetSubObjectInstances(
    const std::shared_ptr<FilterSpecObject>& filter) const {
  NotifyCall("GetSubObjectInstances");
  std::vector<std::shared_ptr<StoreObject>> out;
  for (const SubObjectEntry& e : subObjects_) {
    if (filter == nullptr || filter->Matches(e.id)) out.push_back(e.object);
  }
  return out;
}

std::shared_ptr<ConfigStoreObject> ConfigStoreObject::Clone() const {
  std::vector<SubObjectEntry> subs;
  subs.reserve(subObjects_.size());
  for (const SubObjectEntry& e : subObjects_) {
    subs.push_back(SubObjectEntry{e.id, std::make_shared<StoreObject>(e.object->Values())});
  }
  return std::make_shared<ConfigStoreObject>(id_, Values(), std::move(subs));
}

}  // namespace TavoConfigStore
