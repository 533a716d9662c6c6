#ifndef KARST_POLICY_POLICY_STORE_H_
#define KARST_POLICY_POLICY_STORE_H_

#include <string>
#include <vector>

#include "TavoKarst/KarstLib.h"

namespace TavoKarst {

// Replaces the policy collection with "policies" in one transaction.
void StorePolicies(const std::vector<KarstPolicyInfo>& policies);

// Every stored policy in the store's order; unreadable ones are left out.
std::vector<KarstPolicyInfo> ListPolicies();

// Internal look-ups; each opens the store itself and returns "" for any
// absence. Empty arguments return "" without opening the store.
std::string FindPolicyBlobById(const std::string& policyId, const std::string& nameSpace);
std::string FindPolicyBlobByName(const std::string& name, const std::string& nameSpace);
std::string FindDatastoreNamespace(const std::string& url);
std::string FindDatastoreDrpPolicyId(const std::string& url);

std::string PolicyBlobById(const std::string& policyId, const std::string& url);
std::string CorraPolicyBlobById(const std::string& policyId);
std::string CorraPolicyBlobByName(const std::string& name);
std::string DefaultPolicyBlob(const std::string& url);

}  // namespace TavoKarst

#endif  // KARST_POLICY_POLICY_STORE_H_
