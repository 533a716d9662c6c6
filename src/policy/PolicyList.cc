#include "frame/CollectionList.h"
#include "frame/FixedNames.h"
#include "policy/PolicyStore.h"

namespace TavoKarst {

namespace {
// Each string is read straight into its field; a missing value leaves the
// field empty, as ReadString would.
KarstPolicyInfo ReadPolicy(const TavoConfigStore::ConfigStoreObject& object) {
  KarstPolicyInfo policy;
  object.GetValue(kNameValue.c_str(), &policy.name);
  object.GetValue(kPolicyIdValue.c_str(), &policy.policy_id);
  object.GetValue(kDescriptionValue.c_str(), &policy.description);
  // A policy stored without a generation number lists it as 0.
  long long generation = 0;
  object.GetValue(kGenerationNumberValue.c_str(), &generation);
  policy.generation_number = generation;

  // The filter over the "blobs" array is built anew for each policy: the
  // library keeps nothing between calls but its fixed names.
  TavoConfigStore::ConfigStoreObjectId blobsId(kBlobsArray, TavoConfigStore::kEmptyString,
                                               TavoConfigStore::kEmptyString, std::string());
  const auto instances =
      object.GetSubObjectInstances(std::make_shared<TavoConfigStore::FilterSpecObject>(blobsId));
  policy.blobs.resize(instances.size());
  for (std::size_t i = 0; i < instances.size(); ++i) {
    instances[i]->GetValue(kBlobValue.c_str(), &policy.blobs[i].blob);
    instances[i]->GetValue(kDatastoreNamespaceValue.c_str(), &policy.blobs[i].datastore_namespace);
  }
  return policy;
}
}  // namespace

std::vector<KarstPolicyInfo> ListPolicies() {
  return ListCollection<KarstPolicyInfo>(kPoliciesKey, ReadPolicy);
}

}  // namespace TavoKarst
