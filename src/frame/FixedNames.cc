#include "frame/FixedNames.h"

namespace TavoKarst {

// Defined in one translation unit, so they are constructed in this order.
const std::string kPoliciesKey = "karst_policies";
const std::string kTavoComponent = "tavo";
const std::string kNameValue = "name";
const std::string kPolicyIdValue = "policy_id";
const std::string kDescriptionValue = "description";
const std::string kGenerationNumberValue = "generation_number";
const std::string kBlobsArray = "blobs";
const std::string kBlobValue = "blob";
const std::string kDatastoreNamespaceValue = "datastore_namespace";
const std::string kDatastoresKey = "karst_datastores";
const std::string kUrlValue = "url";
const std::string kDrpPolicyIdValue = "drp_policy_id";

const char kCorraNamespace[] = "CORRA";

}  // namespace TavoKarst
