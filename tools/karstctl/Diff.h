#ifndef KARSTCTL_DIFF_H_
#define KARSTCTL_DIFF_H_

#include <optional>
#include <string>
#include <vector>

#include "Json.h"

namespace karstctl {

// One field of a record that a write would change. For a blob, "field" is
// "blob" and "blobNamespace" the namespace the store keeps it under; a blob
// that would be added has no "before", one that would go has no "after".
struct FieldChange {
  std::string field;
  std::string blobNamespace;
  std::optional<Json> before, after;
};

// One record, by the key the store keeps it under: a policy's name or a
// datastore's url. An added or removed record comes whole, as the store
// would keep it; a changed one with the fields that change.
struct RecordChange {
  enum Kind { kAdded, kRemoved, kChanged };
  Kind kind;
  std::string key;
  Json record;
  std::vector<FieldChange> fields;
};

struct CatalogueDiff {
  std::vector<RecordChange> policies;
  std::vector<RecordChange> datastores;
  bool Empty() const { return policies.empty() && datastores.empty(); }
};

// What writing "proposed" over "stored" would change, record by record, in
// the store's terms: the last policy of each name, the last datastore of
// each url and the last blob of each namespace count, and a blob without a
// namespace does not. A catalogue "proposed" leaves out is kept as stored;
// one "stored" leaves out is empty. Records come in the order of their keys.
CatalogueDiff DiffCatalogues(const Catalogue& stored, const Catalogue& proposed);

// {"policies": [CHANGE...], "datastores": [CHANGE...]}, each CHANGE
// {"change": "added"|"removed"|"changed", "name"|"url": KEY, and "record"
// or "fields": [{"field", ("datastore_namespace",) "old", "new"}]}, where
// a side that does not exist is null.
Json DiffToJson(const CatalogueDiff& diff);

// One line per record added or removed and per field changed (blobs by
// their size), then a line of counts; "no changes" when there are none.
std::string DiffToText(const CatalogueDiff& diff);

}  // namespace karstctl

#endif  // KARSTCTL_DIFF_H_
