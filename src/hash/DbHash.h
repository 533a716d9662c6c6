#ifndef KARST_HASH_DB_HASH_H_
#define KARST_HASH_DB_HASH_H_

#include <string>
#include <utility>

namespace TavoKarst {

// Digest of the stored policies, and of the stored datastores; "" when the
// collection is empty. Each lists its collection afresh.
std::string GetPolicyDbHash();
std::string GetDatastoreDbHash();

std::pair<std::string, std::string> ComputeDbHash();

}  // namespace TavoKarst

#endif  // KARST_HASH_DB_HASH_H_
