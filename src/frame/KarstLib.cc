// The exported facade: every operation forwards to one worker.

#include "TavoKarst/KarstLib.h"

#include "datastore/DatastoreStore.h"
#include "frame/Reset.h"
#include "hash/DbHash.h"
#include "policy/PolicyStore.h"

namespace TavoKarst {

void KarstLib::Init() {}

void KarstLib::Reset() { ResetCatalogue(); }

void KarstLib::AddPolicyInfo(const std::vector<KarstPolicyInfo>& policies) {
  StorePolicies(policies);
}

std::vector<KarstPolicyInfo> KarstLib::ListPolicyInfo() { return ListPolicies(); }

void KarstLib::AddDatastoreInfo(const std::vector<KarstDatastoreInfo>& datastores) {
  StoreDatastores(datastores);
}

std::vector<KarstDatastoreInfo> KarstLib::ListDatastoreInfo() { return ListDatastores(); }

std::string KarstLib::GetPolicyBlobById(const std::string& policyId, const std::string& url) {
  return PolicyBlobById(policyId, url);
}

std::string KarstLib::GetCorraPolicyBlobById(const std::string& policyId) {
  return CorraPolicyBlobById(policyId);
}

std::string KarstLib::GetCorraPolicyBlobByName(const std::string& name) {
  return CorraPolicyBlobByName(name);
}

std::string KarstLib::GetDefaultPolicyBlob(const std::string& url) {
  return DefaultPolicyBlob(url);
}

std::pair<std::string, std::string> KarstLib::GetDbHash() { return ComputeDbHash(); }

}  // namespace TavoKarst
