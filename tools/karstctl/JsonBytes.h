#ifndef KARSTCTL_JSON_BYTES_H_
#define KARSTCTL_JSON_BYTES_H_

#include <string>

#include <nlohmann/json.hpp>

namespace karstctl {

using Json = nlohmann::ordered_json;

// A byte string as JSON: a plain string when the bytes are valid UTF-8, else
// {"base64": "..."}. The result never holds invalid UTF-8, so dumping it
// cannot fail.
Json EncodeBytes(const std::string& bytes);

// The bytes a JSON value stands for: a string's UTF-8 bytes, or the decoded
// content of {"base64": "..."}. Throws InputError naming "path" otherwise.
std::string DecodeBytes(const Json& value, const std::string& path);

}  // namespace karstctl

#endif  // KARSTCTL_JSON_BYTES_H_
