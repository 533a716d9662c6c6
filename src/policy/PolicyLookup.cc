#include "frame/FixedNames.h"
#include "frame/StoreAccess.h"
#include "policy/PolicyStore.h"

namespace TavoKarst {

namespace {
std::string BlobFor(const TavoConfigStore::ConfigStoreObject& policy,
                    const std::string& nameSpace) {
  auto sub = policy.GetSubObject(TavoConfigStore::SubObjectId(kBlobsArray, nameSpace));
  if (!sub) return std::string();
  return ReadString(*sub, kBlobValue);
}

std::string FindDatastoreValue(const std::string& url, const std::string& valueName) {
  if (url.empty()) return std::string();
  StorePtr store = OpenStore();
  ObjectPtr datastore = store->GetObject(ObjectId(kDatastoresKey, url));
  if (!datastore) return std::string();
  return ReadString(*datastore, valueName);
}
}  // namespace

std::string FindPolicyBlobById(const std::string& policyId, const std::string& nameSpace) {
  if (policyId.empty() || nameSpace.empty()) return std::string();
  StorePtr store = OpenStore();
  // policy_id is not a key of the store: scan in store order, first match decides.
  for (const ObjectPtr& policy : store->GetObjects(CollectionFilter(kPoliciesKey))) {
    if (ReadString(*policy, kPolicyIdValue) == policyId) return BlobFor(*policy, nameSpace);
  }
  return std::string();
}

std::string FindPolicyBlobByName(const std::string& name, const std::string& nameSpace) {
  if (name.empty() || nameSpace.empty()) return std::string();
  StorePtr store = OpenStore();
  ObjectPtr policy = store->GetObject(ObjectId(kPoliciesKey, name));
  if (!policy) return std::string();
  return BlobFor(*policy, nameSpace);
}

std::string FindDatastoreNamespace(const std::string& url) {
  return FindDatastoreValue(url, kDatastoreNamespaceValue);
}

std::string FindDatastoreDrpPolicyId(const std::string& url) {
  return FindDatastoreValue(url, kDrpPolicyIdValue);
}

std::string PolicyBlobById(const std::string& policyId, const std::string& url) {
  const std::string nameSpace = FindDatastoreNamespace(url);
  return FindPolicyBlobById(policyId, nameSpace);
}

std::string CorraPolicyBlobById(const std::string& policyId) {
  return FindPolicyBlobById(policyId, kCorraNamespace);
}

std::string CorraPolicyBlobByName(const std::string& name) {
  return FindPolicyBlobByName(name, kCorraNamespace);
}

std::string DefaultPolicyBlob(const std::string& url) {
  const std::string policyId = FindDatastoreDrpPolicyId(url);
  if (policyId.empty()) return std::string();
  const std::string nameSpace = FindDatastoreNamespace(url);
  return FindPolicyBlobById(policyId, nameSpace);
}

}  // namespace TavoKarst
