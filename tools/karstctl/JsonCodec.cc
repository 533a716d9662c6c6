#include "JsonCodec.h"

#include <cmath>
#include <cstdint>
#include <limits>

#include "Errors.h"

namespace karstctl {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyBlob;
using TavoKarst::KarstPolicyInfo;

namespace {

constexpr char kPolicies[] = "policies";
constexpr char kDatastores[] = "datastores";

void RequireType(const Json& value, Json::value_t type, const std::string& path) {
  if (value.type() != type) {
    throw InputError(path + ": expected " + Json(type).type_name() + ", got " + value.type_name());
  }
}

InputError UnknownKey(const std::string& path, const std::string& key) {
  return InputError(path + ": unknown key " + Json(key).dump());
}

std::string Member(const std::string& path, const std::string& key) {
  std::string out = path;
  out += '.';
  out += key;
  return out;
}

std::string Indexed(const std::string& path, std::size_t index) {
  return path + "[" + std::to_string(index) + "]";
}

std::int64_t DecodeInt64(const Json& value, const std::string& path) {
  if (value.is_number_unsigned()) {
    // nlohmann keeps non-negative integers unsigned, up to UINT64_MAX.
    auto n = value.get<std::uint64_t>();
    if (n > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
      throw InputError(path + ": out of the signed 64-bit range");
    }
    return static_cast<std::int64_t>(n);
  }
  if (value.is_number_integer()) return value.get<std::int64_t>();
  if (value.is_number_float()) {
    // Integers too large for 64 bits come back as floats; say so rather
    // than complain about a fraction that was never written.
    double d = value.get<double>();
    bool integral = std::isfinite(d) && std::trunc(d) == d;
    if (integral && std::fabs(d) >= 9223372036854775808.0) {
      throw InputError(path + ": out of the signed 64-bit range");
    }
    throw InputError(path + ": expected an integer, got a number with a fraction or exponent");
  }
  throw InputError(path + ": expected an integer, got " + value.type_name());
}

Json BlobToJson(const KarstPolicyBlob& blob) {
  Json out = Json::object();
  out["datastore_namespace"] = EncodeBytes(blob.datastore_namespace);
  out["blob"] = EncodeBytes(blob.blob);
  return out;
}

KarstPolicyBlob BlobFromJson(const Json& value, const std::string& path) {
  RequireType(value, Json::value_t::object, path);
  KarstPolicyBlob blob;
  for (const auto& item : value.items()) {
    const std::string& key = item.key();
    const std::string field = Member(path, key);
    if (key == "datastore_namespace") {
      blob.datastore_namespace = DecodeBytes(item.value(), field);
    } else if (key == "blob") {
      blob.blob = DecodeBytes(item.value(), field);
    } else {
      throw UnknownKey(path, key);
    }
  }
  return blob;
}

Json PolicyToJson(const KarstPolicyInfo& policy) {
  Json out = Json::object();
  out["name"] = EncodeBytes(policy.name);
  out["policy_id"] = EncodeBytes(policy.policy_id);
  out["description"] = EncodeBytes(policy.description);
  out["generation_number"] = policy.generation_number;
  Json blobs = Json::array();
  for (const auto& blob : policy.blobs) blobs.push_back(BlobToJson(blob));
  out["blobs"] = std::move(blobs);
  return out;
}

KarstPolicyInfo PolicyFromJson(const Json& value, const std::string& path) {
  RequireType(value, Json::value_t::object, path);
  KarstPolicyInfo policy;
  for (const auto& item : value.items()) {
    const std::string& key = item.key();
    const std::string field = Member(path, key);
    if (key == "name") {
      policy.name = DecodeBytes(item.value(), field);
    } else if (key == "policy_id") {
      policy.policy_id = DecodeBytes(item.value(), field);
    } else if (key == "description") {
      policy.description = DecodeBytes(item.value(), field);
    } else if (key == "generation_number") {
      policy.generation_number = DecodeInt64(item.value(), field);
    } else if (key == "blobs") {
      RequireType(item.value(), Json::value_t::array, field);
      for (std::size_t i = 0; i < item.value().size(); ++i) {
        policy.blobs.push_back(BlobFromJson(item.value()[i], Indexed(field, i)));
      }
    } else {
      throw UnknownKey(path, key);
    }
  }
  return policy;
}

Json DatastoreToJson(const KarstDatastoreInfo& datastore) {
  Json out = Json::object();
  out["url"] = EncodeBytes(datastore.url);
  out["datastore_namespace"] = EncodeBytes(datastore.datastore_namespace);
  out["drp_policy_id"] = EncodeBytes(datastore.drp_policy_id);
  return out;
}

KarstDatastoreInfo DatastoreFromJson(const Json& value, const std::string& path) {
  RequireType(value, Json::value_t::object, path);
  KarstDatastoreInfo datastore;
  for (const auto& item : value.items()) {
    const std::string& key = item.key();
    const std::string field = Member(path, key);
    if (key == "url") {
      datastore.url = DecodeBytes(item.value(), field);
    } else if (key == "datastore_namespace") {
      datastore.datastore_namespace = DecodeBytes(item.value(), field);
    } else if (key == "drp_policy_id") {
      datastore.drp_policy_id = DecodeBytes(item.value(), field);
    } else {
      throw UnknownKey(path, key);
    }
  }
  return datastore;
}

}  // namespace

Json PoliciesToJson(const std::vector<KarstPolicyInfo>& policies) {
  Json out = Json::array();
  for (const auto& policy : policies) out.push_back(PolicyToJson(policy));
  return out;
}

Json DatastoresToJson(const std::vector<KarstDatastoreInfo>& datastores) {
  Json out = Json::array();
  for (const auto& datastore : datastores) out.push_back(DatastoreToJson(datastore));
  return out;
}

std::vector<KarstPolicyInfo> PoliciesFromJson(const Json& value, const std::string& path) {
  RequireType(value, Json::value_t::array, path);
  std::vector<KarstPolicyInfo> policies;
  policies.reserve(value.size());
  for (std::size_t i = 0; i < value.size(); ++i) {
    policies.push_back(PolicyFromJson(value[i], Indexed(path, i)));
  }
  return policies;
}

std::vector<KarstDatastoreInfo> DatastoresFromJson(const Json& value, const std::string& path) {
  RequireType(value, Json::value_t::array, path);
  std::vector<KarstDatastoreInfo> datastores;
  datastores.reserve(value.size());
  for (std::size_t i = 0; i < value.size(); ++i) {
    datastores.push_back(DatastoreFromJson(value[i], Indexed(path, i)));
  }
  return datastores;
}

Json CatalogueToJson(const std::vector<KarstPolicyInfo>& policies,
                     const std::vector<KarstDatastoreInfo>& datastores) {
  Json out = Json::object();
  out[kPolicies] = PoliciesToJson(policies);
  out[kDatastores] = DatastoresToJson(datastores);
  return out;
}

Catalogue CatalogueFromJson(const Json& value) {
  RequireType(value, Json::value_t::object, "top level");
  Catalogue catalogue;
  for (const auto& item : value.items()) {
    if (item.key() == kPolicies) {
      catalogue.policies = PoliciesFromJson(item.value(), kPolicies);
    } else if (item.key() == kDatastores) {
      catalogue.datastores = DatastoresFromJson(item.value(), kDatastores);
    } else {
      throw UnknownKey("top level", item.key());
    }
  }
  return catalogue;
}

}  // namespace karstctl
