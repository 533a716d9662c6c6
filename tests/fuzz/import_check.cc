#include "import_check.h"

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Errors.h"
#include "Json.h"
#include "Records.h"

namespace karst_fuzz {

namespace {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyInfo;

struct Records {
  std::vector<KarstPolicyInfo> policies;
  std::vector<KarstDatastoreInfo> datastores;
};

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
  if (first.policies != second.policies || first.datastores != second.datastores) {
    Violation("records changed", exported);
  }
  if (Export(second) != exported) Violation("second export differs", exported);
  return ImportResult::kAccepted;
}

}  // namespace karst_fuzz
