#include "Records.h"

#include <gtest/gtest.h>

#include <utility>

namespace karst_test {

TavoKarst::KarstPolicyInfo Policy(const std::string& name, const std::string& id,
                                  std::vector<TavoKarst::KarstPolicyBlob> blobs,
                                  const std::string& description, std::int64_t generation) {
  return {std::move(blobs), name, id, description, generation};
}

TavoKarst::KarstDatastoreInfo Datastore(const std::string& url, const std::string& ns,
                                        const std::string& drp) {
  return TavoKarst::KarstDatastoreInfo{url, ns, drp};
}

}  // namespace karst_test

namespace TavoKarst {

// Long byte strings print by length and a prefix, so a failure over a
// 10 MiB blob stays readable.
namespace {
std::string Show(const std::string& bytes) {
  if (bytes.size() <= 64) return ::testing::PrintToString(bytes);
  return ::testing::PrintToString(bytes.substr(0, 32)) + "...(" + std::to_string(bytes.size()) +
         " bytes)";
}
}  // namespace

void PrintTo(const KarstPolicyBlob& b, std::ostream* os) {
  *os << Show(b.datastore_namespace) << ":" << Show(b.blob);
}
void PrintTo(const KarstPolicyInfo& p, std::ostream* os) {
  *os << "{name=" << Show(p.name) << " policy_id=" << Show(p.policy_id)
      << " description=" << Show(p.description) << " generation=" << p.generation_number
      << " blobs=[";
  for (const KarstPolicyBlob& b : p.blobs) {
    PrintTo(b, os);
    *os << " ";
  }
  *os << "]}";
}
void PrintTo(const KarstDatastoreInfo& d, std::ostream* os) {
  *os << "{" << Show(d.url) << ", " << Show(d.datastore_namespace) << ", " << Show(d.drp_policy_id)
      << "}";
}

}  // namespace TavoKarst
