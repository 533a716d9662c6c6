#include "Warnings.h"

#include <map>
#include <optional>
#include <set>

namespace karstctl {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyInfo;

namespace {

constexpr char kKeepsLast[] = "; the store keeps only the last";
constexpr char kDangling[] = "drp_policy_id naming no policy";

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

// Which policy a drp_policy_id reaches once the store has kept the last
// policy of each name: the ids that survive, and for an id only dropped
// policies carry, the first of them.
class PolicyIds {
 public:
  explicit PolicyIds(const std::vector<KarstPolicyInfo>& policies) {
    std::map<std::string, std::size_t> lastOfName;
    for (std::size_t i = 0; i < policies.size(); ++i) lastOfName[policies[i].name] = i;
    for (const auto& [name, index] : lastOfName) surviving_.insert(policies[index].policy_id);
    for (std::size_t i = 0; i < policies.size(); ++i) dropped_.emplace(policies[i].policy_id, i);
  }

  // Why "id" names no policy the store keeps ("" when it names one).
  std::string WhyMissing(const std::string& id, const std::string& policiesFrom) const {
    if (surviving_.count(id) != 0) return "";
    auto it = dropped_.find(id);
    if (it == dropped_.end()) return "names no policy in " + policiesFrom;
    return "names only " + Indexed("policies", it->second) + " of " + policiesFrom +
           ", which the store drops for its repeated name";
  }

 private:
  std::set<std::string> surviving_;
  std::map<std::string, std::size_t> dropped_;  // id -> its first policy
};

// The field a record is stored and looked up under: empty, no look-up finds
// the record; repeated, the store keeps only the last of them.
void KeyWarnings(const std::string& field, const std::string& value, const std::string& at,
                 FirstSeen& seen, std::vector<Warning>& out) {
  if (value.empty()) {
    out.push_back({"empty " + field,
                   at + "." + field + " is empty; look-ups by " + field + " cannot find it"});
  }
  if (auto first = seen.Repeats(value, at)) {
    out.push_back({"repeated " + field,
                   at + "." + field + " " + Shown(value) + " repeats " + *first + kKeepsLast});
  }
}

void BlobWarnings(const KarstPolicyInfo& policy, const std::string& at, std::vector<Warning>& out) {
  FirstSeen namespaces;
  for (std::size_t k = 0; k < policy.blobs.size(); ++k) {
    const std::string field = Indexed(at + ".blobs", k) + ".datastore_namespace";
    const std::string& ns = policy.blobs[k].datastore_namespace;
    if (ns.empty()) {
      out.push_back({"empty blob namespace", field + " is empty; the store drops this blob"});
    } else if (auto first = namespaces.Repeats(ns, Indexed(at + ".blobs", k))) {
      out.push_back(
          {"repeated blob namespace", field + " " + Shown(ns) + " repeats " + *first + kKeepsLast});
    }
  }
}

}  // namespace

std::vector<Warning> PolicyWarnings(const std::vector<KarstPolicyInfo>& policies) {
  std::vector<Warning> out;
  FirstSeen names, ids;
  for (std::size_t i = 0; i < policies.size(); ++i) {
    const KarstPolicyInfo& policy = policies[i];
    const std::string at = Indexed("policies", i);
    KeyWarnings("name", policy.name, at, names, out);
    // An empty id is never looked up, so sharing it hides nothing.
    if (auto first = policy.policy_id.empty() ? std::nullopt : ids.Repeats(policy.policy_id, at)) {
      out.push_back({"repeated policy_id", at + ".policy_id " + Shown(policy.policy_id) +
                                               " repeats " + *first +
                                               "; look-ups by id find only one of them"});
    }
    BlobWarnings(policy, at, out);
  }
  return out;
}

std::vector<Warning> DatastoreWarnings(const std::vector<KarstDatastoreInfo>& datastores,
                                       const std::vector<KarstPolicyInfo>* policies,
                                       const std::string& policiesFrom) {
  std::vector<Warning> out;
  const std::optional<PolicyIds> ids =
      policies ? std::optional<PolicyIds>(*policies) : std::nullopt;
  FirstSeen urls;
  for (std::size_t i = 0; i < datastores.size(); ++i) {
    const KarstDatastoreInfo& datastore = datastores[i];
    const std::string at = Indexed("datastores", i);
    KeyWarnings("url", datastore.url, at, urls, out);
    // An empty drp_policy_id means no default policy.
    if (!ids || datastore.drp_policy_id.empty()) continue;
    const std::string why = ids->WhyMissing(datastore.drp_policy_id, policiesFrom);
    if (!why.empty()) {
      out.push_back(
          {kDangling, at + ".drp_policy_id " + Shown(datastore.drp_policy_id) + " " + why});
    }
  }
  return out;
}

std::vector<Warning> StoredDatastoreWarnings(const std::vector<KarstDatastoreInfo>& stored,
                                             const std::vector<KarstPolicyInfo>& policies,
                                             const std::string& policiesFrom) {
  std::vector<Warning> out;
  const PolicyIds ids(policies);
  for (const KarstDatastoreInfo& datastore : stored) {
    if (datastore.drp_policy_id.empty()) continue;
    const std::string why = ids.WhyMissing(datastore.drp_policy_id, policiesFrom);
    if (!why.empty()) {
      out.push_back({kDangling, "stored datastore " + Shown(datastore.url) + ": drp_policy_id " +
                                    Shown(datastore.drp_policy_id) + " " + why});
    }
  }
  return out;
}

std::vector<Warning> CatalogueWarnings(const Catalogue& catalogue, const StoredBeside& stored) {
  std::vector<Warning> out;
  auto append = [&out](std::vector<Warning> more) {
    out.insert(out.end(), more.begin(), more.end());
  };
  if (catalogue.policies) {
    append(PolicyWarnings(*catalogue.policies));
    if (!catalogue.datastores && stored.datastores) {
      append(StoredDatastoreWarnings(*stored.datastores, *catalogue.policies, "the file"));
    }
  }
  if (catalogue.datastores) {
    const bool inFile = catalogue.policies.has_value();
    append(DatastoreWarnings(*catalogue.datastores, inFile ? &*catalogue.policies : stored.policies,
                             inFile ? "the file" : "the store"));
  }
  return out;
}

}  // namespace karstctl
