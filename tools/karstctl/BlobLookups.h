#ifndef KARSTCTL_BLOB_LOOKUPS_H_
#define KARSTCTL_BLOB_LOOKUPS_H_

#include <string>
#include <vector>

namespace karstctl {

// The library's four blob look-ups, named as the blob commands name them.
enum class BlobLookup { kById, kCorraById, kCorraByName, kDefault };

// Why "lookup" with "operands" (as the blob command takes them) finds no
// blob, read from the stored catalogues: the policy, datastore or blob that
// is missing, in one line. "" when the look-up does find a blob, which is
// then empty. Opens nothing: the caller has opened the store.
std::string WhyNoBlob(BlobLookup lookup, const std::vector<std::string>& operands);

}  // namespace karstctl

#endif  // KARSTCTL_BLOB_LOOKUPS_H_
