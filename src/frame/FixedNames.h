#ifndef KARST_FRAME_FIXED_NAMES_H_
#define KARST_FRAME_FIXED_NAMES_H_

#include <string>

namespace TavoKarst {

// The persisted names of both catalogues. Built once when the library is
// loaded and only read afterwards, so every thread may use them freely.
extern const std::string kPoliciesKey;
extern const std::string kTavoComponent;
extern const std::string kNameValue;
extern const std::string kPolicyIdValue;
extern const std::string kDescriptionValue;
extern const std::string kGenerationNumberValue;
extern const std::string kBlobsArray;
extern const std::string kBlobValue;
extern const std::string kDatastoreNamespaceValue;
extern const std::string kDatastoresKey;
extern const std::string kUrlValue;
extern const std::string kDrpPolicyIdValue;

// The namespace of the two Corra look-ups.
extern const char kCorraNamespace[];

}  // namespace TavoKarst

#endif  // KARST_FRAME_FIXED_NAMES_H_
