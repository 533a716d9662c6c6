// Building, comparing and printing the library's records in tests.

#ifndef KARST_TESTS_SUPPORT_RECORDS_H_
#define KARST_TESTS_SUPPORT_RECORDS_H_

#include <cstdint>
#include <ostream>
#include <string>
#include <vector>

#include "TavoKarst/KarstLib.h"

namespace karst_test {

TavoKarst::KarstPolicyInfo Policy(const std::string& name, const std::string& id,
                                  std::vector<TavoKarst::KarstPolicyBlob> blobs = {},
                                  const std::string& description = "", std::int64_t generation = 1);
TavoKarst::KarstDatastoreInfo Datastore(const std::string& url, const std::string& ns,
                                        const std::string& drp);

}  // namespace karst_test

namespace TavoKarst {
// Found by argument-dependent lookup, so EXPECT_EQ and matchers print records.
// The comparisons are inline, for the fuzzer's check that links no gtest.
inline bool operator==(const KarstPolicyBlob& a, const KarstPolicyBlob& b) {
  return a.blob == b.blob && a.datastore_namespace == b.datastore_namespace;
}
inline bool operator==(const KarstPolicyInfo& a, const KarstPolicyInfo& b) {
  return a.name == b.name && a.policy_id == b.policy_id && a.description == b.description &&
         a.generation_number == b.generation_number && a.blobs == b.blobs;
}
inline bool operator==(const KarstDatastoreInfo& a, const KarstDatastoreInfo& b) {
  return a.url == b.url && a.datastore_namespace == b.datastore_namespace &&
         a.drp_policy_id == b.drp_policy_id;
}
void PrintTo(const KarstPolicyBlob& b, std::ostream* os);
void PrintTo(const KarstPolicyInfo& p, std::ostream* os);
void PrintTo(const KarstDatastoreInfo& d, std::ostream* os);
}  // namespace TavoKarst

#endif  // KARST_TESTS_SUPPORT_RECORDS_H_
