#include "policy/PolicyStore.h"

#include "frame/FixedNames.h"
#include "frame/WriteBracket.h"

namespace TavoKarst {

namespace {
// The whole object, sub-objects included, is built in memory so the store
// sees exactly one SetObject per policy.
ObjectPtr BuildPolicyObject(const KarstPolicyInfo& policy) {
  ObjectPtr object = NewObject(kPoliciesKey, policy.name);
  object->SetValue(kNameValue.c_str(), policy.name);
  object->SetValue(kPolicyIdValue.c_str(), policy.policy_id);
  object->SetValue(kDescriptionValue.c_str(), policy.description);
  object->SetValue(kGenerationNumberValue.c_str(),
                   static_cast<long long>(policy.generation_number));
  for (const KarstPolicyBlob& blob : policy.blobs) {
    if (blob.datastore_namespace.empty()) continue;
    auto sub = object->CreateSubObject(
        TavoConfigStore::SubObjectId(kBlobsArray, blob.datastore_namespace));
    sub->SetValue(kBlobValue.c_str(), blob.blob);
    sub->SetValue(kDatastoreNamespaceValue.c_str(), blob.datastore_namespace);
  }
  return object;
}
}  // namespace

void StorePolicies(const std::vector<KarstPolicyInfo>& policies) {
  ReplaceCollection(ClearPolicies, policies, BuildPolicyObject);
}

}  // namespace TavoKarst
