#include "import_check.h"

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Errors.h"
#include "Json.h"

namespace karst_fuzz {

namespace {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyInfo;

struct Records {
  std::vector<KarstPolicyInfo> policies;
  std::vector<KarstDatastoreInfo> datastores;
};

bool SameRecords(const Records& a, const Records& b) {
  if (a.policies.size() != b.policies.size() || a.datastores.size() != b.datastores.size()) {
    return false;
  }
  for (std::size_t i = 0; i < a.policies.size(); ++i) {
    const KarstPolicyInfo& x = a.policies[i];
    const KarstPolicyInfo& y = b.policies[i];
    if (x.name != y.name || x.policy_id != y.policy_id || x.description != y.description ||
        x.generation_number != y.generation_number || x.blobs.size() != y.blobs.size()) {
      return false;
    }
    for (std::size_t j = 0; j < x.blobs.size(); ++j) {
      if (x.blobs[j].blob != y.blobs[j].blob ||
          x.blobs[j].datastore_namespace != y.blobs[j].datastore_namespace) {
        return false;
      }
    }
  }
  for (std::size_t i = 0; i < a.datastores.size(); ++i) {
    const KarstDatastoreInfo& x = a.datastores[i];
    const KarstDatastoreInfo& y = b.datastores[i];
    if (x.url != y.url || x.datastore_namespace != y.datastore_namespace ||
        x.drp_policy_id != y.drp_policy_id) {
      return false;
    }
  }
  return true;
}

// An absent collection is imported as nothing and exported as empty.
Records Import(const std::string& text) {
  karstctl::Catalogue catalogue =
      karstctl::CatalogueFromJson(karstctl::ParseJsonText(text, "<fuzz>"));
  Records r;
  if (catalogue.policies) r.policies = std::move(*catalogue.policies);
  if (catalogue.datastores) r.datastores = std::move(*catalogue.datastores);
  return r;
}

std::string Export(const Records& r) {
  return karstctl::DumpJsonText(karstctl::CatalogueToJson(r.policies, r.datastores));
}

[[noreturn]] void Violation(const char* what, const std::string& text) {
  std::fprintf(stderr, "import round trip: %s\n--- exported ---\n%s\n", what, text.c_str());
  std::abort();
}

}  // namespace

ImportResult CheckImport(const std::uint8_t* data, std::size_t size) {
  const std::string input(reinterpret_cast<const char*>(data), size);
  Records first;
  try {
    first = Import(input);
  } catch (const karstctl::InputError&) {
    return ImportResult::kRefused;
  }
  const std::string exported = Export(first);
  Records second;
  try {
    second = Import(exported);
  } catch (const karstctl::InputError& e) {
    Violation(e.what(), exported);
  }
  if (!SameRecords(first, second)) Violation("records changed", exported);
  if (Export(second) != exported) Violation("second export differs", exported);
  return ImportResult::kAccepted;
}

}  // namespace karst_fuzz
