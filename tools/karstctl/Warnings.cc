#include "Warnings.h"

#include <map>
#include <optional>
#include <set>

namespace karstctl {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyInfo;

namespace {

constexpr char kKeepsLast[] = "; the store keeps only the last";

std::string Indexed(const std::string& path, std::size_t index) {
  return path + "[" + std::to_string(index) + "]";
}

// The bytes as they are written in the input: a JSON string or base64 form.
std::string Shown(const std::string& bytes) { return EncodeBytes(bytes).dump(); }

// Remembers where each key was first seen, to name it in a repeat.
class FirstSeen {
 public:
  std::optional<std::string> Repeats(const std::string& key, const std::string& path) {
    auto [it, inserted] = first_.emplace(key, path);
    if (inserted) return std::nullopt;
    return it->second;
  }

 private:
  std::map<std::string, std::string> first_;
};

// The ids of the policies that survive the store keeping the last of each
// name.
std::set<std::string> SurvivingIds(const std::vector<KarstPolicyInfo>& policies) {
  std::map<std::string, const KarstPolicyInfo*> byName;
  for (const auto& policy : policies) byName[policy.name] = &policy;
  std::set<std::string> ids;
  for (const auto& [name, policy] : byName) ids.insert(policy->policy_id);
  return ids;
}

// The field a record is stored and looked up under: empty, no look-up finds
// the record; repeated, the store keeps only the last of them.
void KeyWarnings(const std::string& field, const std::string& value, const std::string& at,
                 FirstSeen& seen, std::vector<std::string>& out) {
  if (value.empty()) {
    out.push_back(at + "." + field + " is empty; look-ups by " + field + " cannot find it");
  }
  if (auto first = seen.Repeats(value, at)) {
    out.push_back(at + "." + field + " " + Shown(value) + " repeats " + *first + kKeepsLast);
  }
}

void BlobWarnings(const KarstPolicyInfo& policy, const std::string& at,
                  std::vector<std::string>& out) {
  FirstSeen namespaces;
  for (std::size_t k = 0; k < policy.blobs.size(); ++k) {
    const std::string field = Indexed(at + ".blobs", k) + ".datastore_namespace";
    const std::string& ns = policy.blobs[k].datastore_namespace;
    if (ns.empty()) {
      out.push_back(field + " is empty; the store drops this blob");
    } else if (auto first = namespaces.Repeats(ns, Indexed(at + ".blobs", k))) {
      out.push_back(field + " " + Shown(ns) + " repeats " + *first + kKeepsLast);
    }
  }
}

}  // namespace

std::vector<std::string> PolicyWarnings(const std::vector<KarstPolicyInfo>& policies) {
  std::vector<std::string> out;
  FirstSeen names, ids;
  for (std::size_t i = 0; i < policies.size(); ++i) {
    const KarstPolicyInfo& policy = policies[i];
    const std::string at = Indexed("policies", i);
    KeyWarnings("name", policy.name, at, names, out);
    // An empty id is never looked up, so sharing it hides nothing.
    if (auto first = policy.policy_id.empty() ? std::nullopt : ids.Repeats(policy.policy_id, at)) {
      out.push_back(at + ".policy_id " + Shown(policy.policy_id) + " repeats " + *first +
                    "; look-ups by id find only one of them");
    }
    BlobWarnings(policy, at, out);
  }
  return out;
}

std::vector<std::string> DatastoreWarnings(const std::vector<KarstDatastoreInfo>& datastores,
                                           const std::vector<KarstPolicyInfo>* policies,
                                           const std::string& policiesFrom) {
  std::vector<std::string> out;
  const std::set<std::string> ids = policies ? SurvivingIds(*policies) : std::set<std::string>();
  FirstSeen urls;
  for (std::size_t i = 0; i < datastores.size(); ++i) {
    const KarstDatastoreInfo& datastore = datastores[i];
    const std::string at = Indexed("datastores", i);
    KeyWarnings("url", datastore.url, at, urls, out);
    // An empty drp_policy_id means no default policy.
    if (policies && !datastore.drp_policy_id.empty() && ids.count(datastore.drp_policy_id) == 0) {
      out.push_back(at + ".drp_policy_id " + Shown(datastore.drp_policy_id) +
                    " names no policy in " + policiesFrom);
    }
  }
  return out;
}

std::vector<std::string> CatalogueWarnings(const Catalogue& catalogue,
                                           const std::vector<KarstPolicyInfo>* stored) {
  std::vector<std::string> out;
  if (catalogue.policies) out = PolicyWarnings(*catalogue.policies);
  if (catalogue.datastores) {
    const bool inFile = catalogue.policies.has_value();
    std::vector<std::string> more =
        DatastoreWarnings(*catalogue.datastores, inFile ? &*catalogue.policies : stored,
                          inFile ? "the file" : "the store");
    out.insert(out.end(), more.begin(), more.end());
  }
  return out;
}

}  // namespace karstctl
