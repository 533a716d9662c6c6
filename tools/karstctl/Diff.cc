#include "Diff.h"

#include <map>

namespace karstctl {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyBlob;
using TavoKarst::KarstPolicyInfo;

namespace {

constexpr const char* kKindNames[] = {"added", "removed", "changed"};

// Records by the key the store keeps them under, the last of each key
// winning as it does in the store.
template <typename Record>
std::map<std::string, Record> ByKey(const std::vector<Record>& records, std::string Record::*key) {
  std::map<std::string, Record> out;
  for (const Record& record : records) out.insert_or_assign(record.*key, record);
  return out;
}

std::map<std::string, std::string> BlobsKept(const KarstPolicyInfo& policy) {
  std::map<std::string, std::string> out;
  for (const KarstPolicyBlob& blob : policy.blobs) {
    if (!blob.datastore_namespace.empty()) out[blob.datastore_namespace] = blob.blob;
  }
  return out;
}

// The policy as the store keeps it: the last blob of each namespace, in the
// order of their namespaces.
KarstPolicyInfo Kept(KarstPolicyInfo policy) {
  const auto blobs = BlobsKept(policy);
  policy.blobs.clear();
  for (const auto& [ns, blob] : blobs) policy.blobs.push_back({blob, ns});
  return policy;
}

Json ToJson(const KarstPolicyInfo& policy) { return PoliciesToJson({Kept(policy)})[0]; }
Json ToJson(const KarstDatastoreInfo& datastore) { return DatastoresToJson({datastore})[0]; }

void CompareBytes(const char* field, const std::string& before, const std::string& after,
                  std::vector<FieldChange>& out) {
  if (before != after) out.push_back({field, "", EncodeBytes(before), EncodeBytes(after)});
}

std::vector<FieldChange> Compare(const KarstPolicyInfo& before, const KarstPolicyInfo& after) {
  std::vector<FieldChange> out;
  CompareBytes("policy_id", before.policy_id, after.policy_id, out);
  CompareBytes("description", before.description, after.description, out);
  if (before.generation_number != after.generation_number) {
    out.push_back(
        {"generation_number", "", Json(before.generation_number), Json(after.generation_number)});
  }
  const auto oldBlobs = BlobsKept(before), newBlobs = BlobsKept(after);
  std::map<std::string, std::pair<const std::string*, const std::string*>> namespaces;
  for (const auto& [ns, blob] : oldBlobs) namespaces[ns].first = &blob;
  for (const auto& [ns, blob] : newBlobs) namespaces[ns].second = &blob;
  for (const auto& [ns, sides] : namespaces) {
    const auto [was, is] = sides;
    if (was && is && *was == *is) continue;
    FieldChange change{"blob", ns, std::nullopt, std::nullopt};
    if (was) change.before = EncodeBytes(*was);
    if (is) change.after = EncodeBytes(*is);
    out.push_back(std::move(change));
  }
  return out;
}

std::vector<FieldChange> Compare(const KarstDatastoreInfo& before,
                                 const KarstDatastoreInfo& after) {
  std::vector<FieldChange> out;
  CompareBytes("datastore_namespace", before.datastore_namespace, after.datastore_namespace, out);
  CompareBytes("drp_policy_id", before.drp_policy_id, after.drp_policy_id, out);
  return out;
}

template <typename Record>
std::vector<RecordChange> DiffRecords(const std::vector<Record>& stored,
                                      const std::vector<Record>& proposed,
                                      std::string Record::*key) {
  const auto before = ByKey(stored, key), after = ByKey(proposed, key);
  std::map<std::string, std::pair<const Record*, const Record*>> keys;
  for (const auto& [k, record] : before) keys[k].first = &record;
  for (const auto& [k, record] : after) keys[k].second = &record;
  std::vector<RecordChange> out;
  for (const auto& [k, sides] : keys) {
    const auto [was, is] = sides;
    if (!was) {
      out.push_back({RecordChange::kAdded, k, ToJson(*is), {}});
    } else if (!is) {
      out.push_back({RecordChange::kRemoved, k, ToJson(*was), {}});
    } else if (auto fields = Compare(*was, *is); !fields.empty()) {
      out.push_back({RecordChange::kChanged, k, nullptr, std::move(fields)});
    }
  }
  return out;
}

Json Side(const std::optional<Json>& value) { return value ? *value : Json(nullptr); }

Json ChangesToJson(const std::vector<RecordChange>& changes, const char* keyName) {
  Json out = Json::array();
  for (const RecordChange& change : changes) {
    Json item = Json::object();
    item["change"] = kKindNames[change.kind];
    item[keyName] = EncodeBytes(change.key);
    if (change.kind != RecordChange::kChanged) {
      item["record"] = change.record;
    } else {
      item["fields"] = Json::array();
      for (const FieldChange& field : change.fields) {
        Json f = Json::object();
        f["field"] = field.field;
        if (field.field == "blob") f["datastore_namespace"] = EncodeBytes(field.blobNamespace);
        f["old"] = Side(field.before);
        f["new"] = Side(field.after);
        item["fields"].push_back(std::move(f));
      }
    }
    out.push_back(std::move(item));
  }
  return out;
}

// A blob can be large and binary: the text names its size only.
std::string BlobSize(const std::optional<Json>& value) {
  if (!value) return "none";
  const std::string bytes = DecodeBytes(*value, "blob");
  return std::to_string(bytes.size()) + (bytes.size() == 1 ? " byte" : " bytes");
}

std::string ChangesToText(const std::vector<RecordChange>& changes, const char* what) {
  std::string out;
  for (const RecordChange& change : changes) {
    const std::string head = std::string(what) + " " + EncodeBytes(change.key).dump();
    if (change.kind != RecordChange::kChanged) {
      out += head + ": " + kKindNames[change.kind] + "\n";
      continue;
    }
    for (const FieldChange& field : change.fields) {
      if (field.field == "blob") {
        out += head + ": blob " + EncodeBytes(field.blobNamespace).dump() + " " +
               (!field.before  ? "added"
                : !field.after ? "removed"
                               : "changed") +
               " (" + BlobSize(field.before) + " -> " + BlobSize(field.after) + ")\n";
      } else {
        out += head + ": " + field.field + " " + field.before->dump() + " -> " +
               field.after->dump() + "\n";
      }
    }
  }
  return out;
}

std::string Counts(const std::vector<RecordChange>& changes, const char* what) {
  std::size_t counts[3] = {0, 0, 0};
  for (const RecordChange& change : changes) ++counts[change.kind];
  return std::string(what) + ": " + std::to_string(counts[0]) + " added, " +
         std::to_string(counts[1]) + " removed, " + std::to_string(counts[2]) + " changed";
}

}  // namespace

CatalogueDiff DiffCatalogues(const Catalogue& stored, const Catalogue& proposed) {
  const std::vector<KarstPolicyInfo> noPolicies;
  const std::vector<KarstDatastoreInfo> noDatastores;
  const auto& oldPolicies = stored.policies ? *stored.policies : noPolicies;
  const auto& oldDatastores = stored.datastores ? *stored.datastores : noDatastores;
  CatalogueDiff diff;
  diff.policies = DiffRecords(oldPolicies, proposed.policies ? *proposed.policies : oldPolicies,
                              &KarstPolicyInfo::name);
  diff.datastores =
      DiffRecords(oldDatastores, proposed.datastores ? *proposed.datastores : oldDatastores,
                  &KarstDatastoreInfo::url);
  return diff;
}

Json DiffToJson(const CatalogueDiff& diff) {
  Json out = Json::object();
  out["policies"] = ChangesToJson(diff.policies, "name");
  out["datastores"] = ChangesToJson(diff.datastores, "url");
  return out;
}

std::string DiffToText(const CatalogueDiff& diff) {
  if (diff.Empty()) return "no changes\n";
  return ChangesToText(diff.policies, "policy") + ChangesToText(diff.datastores, "datastore") +
         Counts(diff.policies, "policies") + "; " + Counts(diff.datastores, "datastores") + "\n";
}

}  // namespace karstctl
