#ifndef KARSTCTL_WARNINGS_H_
#define KARSTCTL_WARNINGS_H_

#include <string>
#include <vector>

#include "Json.h"
#include "TavoKarst/KarstLib.h"

namespace karstctl {

// One warning: its kind ("repeated url"), by which --quiet counts them, and
// the message naming the record.
struct Warning {
  std::string kind;
  std::string message;
};

// Valid records the store would collapse, drop or leave dangling, one
// warning each, naming the record by its path ("policies[3].name"):
// policies are stored under their name, blobs under their namespace within
// the policy (an empty one is not stored) and datastores under their url, so
// a repeat keeps only the last; look-ups by an empty name or url, or by a
// policy id that several policies share, cannot reach every record.
std::vector<Warning> PolicyWarnings(const std::vector<TavoKarst::KarstPolicyInfo>& policies);

// As PolicyWarnings, and a drp_policy_id that names none of "policies"
// (which come from "policiesFrom", e.g. "the file"), or only one that the
// store drops for a repeated name; that check is skipped when "policies" is
// null.
std::vector<Warning> DatastoreWarnings(const std::vector<TavoKarst::KarstDatastoreInfo>& datastores,
                                       const std::vector<TavoKarst::KarstPolicyInfo>* policies,
                                       const std::string& policiesFrom);

// The stored datastores whose drp_policy_id would name no policy once
// "policies" (from "policiesFrom") replace the stored ones.
std::vector<Warning> StoredDatastoreWarnings(
    const std::vector<TavoKarst::KarstDatastoreInfo>& stored,
    const std::vector<TavoKarst::KarstPolicyInfo>& policies, const std::string& policiesFrom);

// What the store holds beside a write, for the checks that need it; null
// where it is not known (check opens no store).
struct StoredBeside {
  const std::vector<TavoKarst::KarstPolicyInfo>* policies = nullptr;
  const std::vector<TavoKarst::KarstDatastoreInfo>* datastores = nullptr;
};

// All of the above for a catalogue about to be written: datastores are
// checked against the file's policies when it holds some, else against the
// stored ones, and policies without datastores beside them against the
// stored datastores.
std::vector<Warning> CatalogueWarnings(const Catalogue& catalogue, const StoredBeside& stored);

}  // namespace karstctl

#endif  // KARSTCTL_WARNINGS_H_
