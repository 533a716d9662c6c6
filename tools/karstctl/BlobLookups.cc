#include "BlobLookups.h"

#include <algorithm>

#include "Json.h"
#include "TavoKarst/KarstLib.h"

namespace karstctl {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstLib;
using TavoKarst::KarstPolicyInfo;

namespace {

constexpr char kCorra[] = "CORRA";

std::string Shown(const std::string& bytes) { return EncodeBytes(bytes).dump(); }

// The first stored record whose "field" is "value", as the look-ups take it.
template <typename Record>
const Record* First(const std::vector<Record>& records, std::string Record::*field,
                    const std::string& value) {
  auto it = std::find_if(records.begin(), records.end(),
                         [&](const Record& record) { return record.*field == value; });
  return it == records.end() ? nullptr : &*it;
}

// Why "policy" (found by "how") has no blob for "ns"; "" when it has one.
std::string WhyNoBlobOf(const KarstPolicyInfo* policy, const std::string& how,
                        const std::string& ns) {
  if (policy == nullptr) return "no policy " + how;
  const bool has = std::any_of(policy->blobs.begin(), policy->blobs.end(),
                               [&ns](const auto& blob) { return blob.datastore_namespace == ns; });
  return has ? "" : "the policy " + how + " has no blob for namespace " + Shown(ns);
}

// The policy "id" names and its blob for the namespace of the datastore at
// "url".
std::string WhyNoDatastoreBlob(const std::vector<KarstPolicyInfo>& policies,
                               const KarstDatastoreInfo* datastore, const std::string& url,
                               const std::string& id) {
  if (datastore == nullptr) return "no datastore with url " + Shown(url);
  if (datastore->datastore_namespace.empty()) {
    return "the datastore with url " + Shown(url) + " has an empty namespace";
  }
  if (id.empty()) return "the datastore with url " + Shown(url) + " has no drp_policy_id";
  return WhyNoBlobOf(First(policies, &KarstPolicyInfo::policy_id, id), "with id " + Shown(id),
                     datastore->datastore_namespace);
}

}  // namespace

std::string WhyNoBlob(BlobLookup lookup, const std::vector<std::string>& operands) {
  // The library looks nothing up for an empty argument.
  for (const auto& operand : operands) {
    if (operand.empty()) return "an empty argument finds no blob";
  }
  const auto policies = KarstLib::ListPolicyInfo();
  switch (lookup) {
    case BlobLookup::kCorraById:
      return WhyNoBlobOf(First(policies, &KarstPolicyInfo::policy_id, operands[0]),
                         "with id " + Shown(operands[0]), kCorra);
    case BlobLookup::kCorraByName:
      return WhyNoBlobOf(First(policies, &KarstPolicyInfo::name, operands[0]),
                         "named " + Shown(operands[0]), kCorra);
    case BlobLookup::kById:
    case BlobLookup::kDefault:
      break;
  }
  const auto datastores = KarstLib::ListDatastoreInfo();
  const std::string& url = operands.back();
  const KarstDatastoreInfo* datastore = First(datastores, &KarstDatastoreInfo::url, url);
  const std::string id = lookup == BlobLookup::kById ? operands[0]
                         : datastore                 ? datastore->drp_policy_id
                                                     : "";
  return WhyNoDatastoreBlob(policies, datastore, url, id);
}

}  // namespace karstctl
