#ifndef KARSTCTL_WARNINGS_H_
#define KARSTCTL_WARNINGS_H_

#include <string>
#include <vector>

#include "Json.h"
#include "TavoKarst/KarstLib.h"

namespace karstctl {

// Valid records the store would collapse, drop or leave dangling, one
// message each, naming the record by its path ("policies[3].name"):
// policies are stored under their name, blobs under their namespace within
// the policy (an empty one is not stored) and datastores under their url, so
// a repeat keeps only the last; look-ups by an empty name or url, or by a
// policy id that several policies share, cannot reach every record.
std::vector<std::string> PolicyWarnings(const std::vector<TavoKarst::KarstPolicyInfo>& policies);

// As PolicyWarnings, and a drp_policy_id that names none of "policies"
// (which come from "policiesFrom", e.g. "the file"); that check is skipped
// when "policies" is null.
std::vector<std::string> DatastoreWarnings(
    const std::vector<TavoKarst::KarstDatastoreInfo>& datastores,
    const std::vector<TavoKarst::KarstPolicyInfo>* policies, const std::string& policiesFrom);

// Both of the above for an import file. Datastores are checked against the
// file's policies when it holds some, else against "stored" (if not null).
std::vector<std::string> CatalogueWarnings(const Catalogue& catalogue,
                                           const std::vector<TavoKarst::KarstPolicyInfo>* stored);

}  // namespace karstctl

#endif  // KARSTCTL_WARNINGS_H_
