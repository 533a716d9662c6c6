#include "frame/CollectionList.h"
#include "frame/FixedNames.h"
#include "policy/PolicyStore.h"

namespace TavoKarst {

namespace {
KarstPolicyInfo ReadPolicy(const TavoConfigStore::ConfigStoreObject& object) {
  KarstPolicyInfo policy;
  policy.name = ReadString(object, kNameValue);
  policy.policy_id = ReadString(object, kPolicyIdValue);
  policy.description = ReadString(object, kDescriptionValue);
  // A policy stored without a generation number lists it as 0.
  long long generation = 0;
  object.GetValue(kGenerationNumberValue.c_str(), &generation);
  policy.generation_number = generation;

  TavoConfigStore::ConfigStoreObjectId blobsId(kBlobsArray, TavoConfigStore::kEmptyString,
                                               TavoConfigStore::kEmptyString, std::string());
  auto blobsFilter = std::make_shared<TavoConfigStore::FilterSpecObject>(blobsId);
  const auto instances = object.GetSubObjectInstances(blobsFilter);
  policy.blobs.reserve(instances.size());
  for (const auto& instance : instances) {
    KarstPolicyBlob blob;
    blob.blob = ReadString(*instance, kBlobValue);
    blob.datastore_namespace = ReadString(*instance, kDatastoreNamespaceValue);
    policy.blobs.push_back(std::move(blob));
  }
  return policy;
}
}  // namespace

std::vector<KarstPolicyInfo> ListPolicies() {
  return ListCollection<KarstPolicyInfo>(kPoliciesKey, ReadPolicy);
}

}  // namespace TavoKarst
