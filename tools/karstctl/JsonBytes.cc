#include "JsonBytes.h"

#include "Base64.h"
#include "Errors.h"
#include "Utf8.h"

namespace karstctl {

namespace {
constexpr char kBase64Key[] = "base64";
}  // namespace

Json EncodeBytes(const std::string& bytes) {
  if (IsValidUtf8(bytes)) return Json(bytes);
  Json wrapped = Json::object();
  wrapped[kBase64Key] = EncodeBase64(bytes);
  return wrapped;
}

std::string DecodeBytes(const Json& value, const std::string& path) {
  if (value.is_string()) return value.get_ref<const std::string&>();
  if (!value.is_object()) {
    throw InputError(path + ": expected a string or {\"base64\": \"...\"}, got " +
                     value.type_name());
  }
  for (const auto& item : value.items()) {
    if (item.key() != kBase64Key) {
      throw InputError(path + ": unknown key " + Json(item.key()).dump());
    }
  }
  if (!value.contains(kBase64Key)) throw InputError(path + ": missing \"base64\"");
  const Json& text = value.at(kBase64Key);
  if (!text.is_string()) {
    throw InputError(path + ".base64: expected a string, got " + text.type_name());
  }
  auto bytes = DecodeBase64(text.get_ref<const std::string&>());
  if (!bytes) throw InputError(path + ".base64: invalid base64");
  return *bytes;
}

}  // namespace karstctl
