#ifndef KARSTCTL_BASE64_H_
#define KARSTCTL_BASE64_H_

#include <optional>
#include <string>

namespace karstctl {

// Standard base64 (RFC 4648 alphabet, '=' padding).
std::string EncodeBase64(const std::string& bytes);

// Strict decoding: only the standard alphabet, length a multiple of 4,
// padding only at the end, and unused trailing bits zero, so every byte
// string has exactly one accepted encoding. Returns nullopt otherwise.
std::optional<std::string> DecodeBase64(const std::string& text);

}  // namespace karstctl

#endif  // KARSTCTL_BASE64_H_
