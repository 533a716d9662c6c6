#ifndef KARSTCTL_JSON_CODEC_H_
#define KARSTCTL_JSON_CODEC_H_

#include <optional>
#include <string>
#include <vector>

#include "JsonBytes.h"
#include "TavoKarst/KarstLib.h"

namespace karstctl {

// Catalogue records as JSON, keyed by the record field names. Every string
// field goes through EncodeBytes/DecodeBytes, so any bytes survive a round
// trip. Decoding throws InputError naming the offending field by its path,
// e.g. "policies[3].generation_number"; "path" is the path of the value given.
// Missing fields decode as "", 0 or [].

Json PoliciesToJson(const std::vector<TavoKarst::KarstPolicyInfo>& policies);
Json DatastoresToJson(const std::vector<TavoKarst::KarstDatastoreInfo>& datastores);

std::vector<TavoKarst::KarstPolicyInfo> PoliciesFromJson(const Json& value,
                                                         const std::string& path);
std::vector<TavoKarst::KarstDatastoreInfo> DatastoresFromJson(const Json& value,
                                                              const std::string& path);

// {"policies": [...], "datastores": [...]}; either key may be absent.
struct Catalogue {
  std::optional<std::vector<TavoKarst::KarstPolicyInfo>> policies;
  std::optional<std::vector<TavoKarst::KarstDatastoreInfo>> datastores;
};

Json CatalogueToJson(const std::vector<TavoKarst::KarstPolicyInfo>& policies,
                     const std::vector<TavoKarst::KarstDatastoreInfo>& datastores);
Catalogue CatalogueFromJson(const Json& value);

}  // namespace karstctl

#endif  // KARSTCTL_JSON_CODEC_H_
