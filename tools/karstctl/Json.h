#ifndef KARSTCTL_JSON_H_
#define KARSTCTL_JSON_H_

#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "TavoKarst/KarstLib.h"

namespace karstctl {

using Json = nlohmann::ordered_json;

// ---- Bytes as JSON text --------------------------------------------------

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF, no
// truncated sequences. NUL is valid.
bool IsValidUtf8(const std::string& bytes);

// Standard base64 (RFC 4648 alphabet, '=' padding).
std::string EncodeBase64(const std::string& bytes);

// Strict decoding: only the standard alphabet, length a multiple of 4,
// padding only at the end, and unused trailing bits zero, so every byte
// string has exactly one accepted encoding. Returns nullopt otherwise.
std::optional<std::string> DecodeBase64(const std::string& text);

// A byte string as JSON: a plain string when the bytes are valid UTF-8, else
// {"base64": "..."}. The result never holds invalid UTF-8, so dumping it
// cannot fail.
Json EncodeBytes(const std::string& bytes);

// The bytes a JSON value stands for: a string's UTF-8 bytes, or the decoded
// content of {"base64": "..."}. Throws InputError naming "path" otherwise.
std::string DecodeBytes(const Json& value, const std::string& path);

// ---- Documents -----------------------------------------------------------

// Parses a whole JSON document. Malformed text, and an object with the same
// key twice (which would silently drop a value), throw InputError naming
// "source" and the line and column.
Json ParseJsonText(const std::string& text, const std::string& source);

// Pretty-printed (indent 2) with a final newline. UTF-8 is written as is;
// only what JSON requires is escaped.
std::string DumpJsonText(const Json& value);

// ---- Catalogue records ---------------------------------------------------

// Records as JSON, keyed by the record field names. Every string field goes
// through EncodeBytes/DecodeBytes, so any bytes survive a round trip.
// Decoding throws InputError naming the offending field by its path, e.g.
// "policies[3].generation_number"; "path" is the path of the value given.
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

// Any form karstctl reads: the import form, or a list of policies or of
// datastores as "policies set" and "datastores set" take them. A list is of
// datastores when its first record that is not empty has a datastore's key,
// else of policies; an empty list is neither (both catalogues absent).
Catalogue CatalogueFromAnyJson(const Json& value);

}  // namespace karstctl

#endif  // KARSTCTL_JSON_H_
