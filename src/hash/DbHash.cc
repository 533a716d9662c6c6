#include "hash/DbHash.h"

#include <algorithm>
#include <vector>

#include "Velk/Misc.h"
#include "datastore/DatastoreStore.h"
#include "hash/Crc32.h"
#include "policy/PolicyStore.h"

namespace TavoKarst {

// Sort keys compare as std::string does: unsigned bytes, shorter first on a
// common prefix. Records tied on their key are ordered by their whole text,
// so the digest does not depend on the store's order even then.
namespace {
struct KeyedText {
  std::string key;
  std::string text;
  bool operator<(const KeyedText& other) const {
    const int byKey = key.compare(other.key);
    return byKey != 0 ? byKey < 0 : text < other.text;
  }
};

std::string DigestOfDigests(std::vector<KeyedText>& records) {
  std::sort(records.begin(), records.end());
  std::string accumulator;
  accumulator.reserve(records.size() * 8);
  for (const KeyedText& record : records) accumulator += Crc32Hex(record.text);
  return Crc32Hex(accumulator);
}

std::string PolicyText(KarstPolicyInfo& policy) {
  // "%s" stops at a NUL: name, policy_id and description count only up to it.
  std::string text =
      Velk::Misc::StrPrintf("%s%s%s%ld", policy.name.c_str(), policy.policy_id.c_str(),
                            policy.description.c_str(), policy.generation_number);
  std::vector<KeyedText> blobs;
  blobs.reserve(policy.blobs.size());
  for (KarstPolicyBlob& blob : policy.blobs) {
    blobs.push_back({std::move(blob.datastore_namespace), std::move(blob.blob)});
  }
  std::sort(blobs.begin(), blobs.end());
  for (const KeyedText& blob : blobs) {
    text += blob.key;
    text += blob.text;
  }
  return text;
}
}  // namespace

std::string GetPolicyDbHash() {
  std::vector<KarstPolicyInfo> policies = ListPolicies();
  std::vector<KeyedText> records;
  records.reserve(policies.size());
  for (KarstPolicyInfo& policy : policies) {
    std::string text = PolicyText(policy);
    records.push_back({std::move(policy.policy_id), std::move(text)});
  }
  return DigestOfDigests(records);
}

std::string GetDatastoreDbHash() {
  std::vector<KarstDatastoreInfo> datastores = ListDatastores();
  std::vector<KeyedText> records;
  records.reserve(datastores.size());
  for (KarstDatastoreInfo& d : datastores) {
    std::string text = Velk::Misc::StrCat(d.url.data(), d.url.size(), d.datastore_namespace.data(),
                                          d.datastore_namespace.size(), d.drp_policy_id.data(),
                                          d.drp_policy_id.size());
    records.push_back({std::move(d.url), std::move(text)});
  }
  return DigestOfDigests(records);
}

std::pair<std::string, std::string> ComputeDbHash() {
  std::pair<std::string, std::string> result;
  result.first = GetPolicyDbHash();
  result.second = GetDatastoreDbHash();
  return result;
}

}  // namespace TavoKarst
