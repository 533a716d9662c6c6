#ifndef TAVOKARST_KARST_LIB_H_
#define TAVOKARST_KARST_LIB_H_

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "TavoKarst/Export.h"

namespace TavoKarst {

// All strings below are opaque byte strings: stored and returned unchanged,
// compared byte by byte, NUL and non-UTF-8 bytes included.

// One blob of a policy: its content for one datastore namespace.
struct KarstPolicyBlob {
  std::string blob;
  // The key of the blob inside its policy. A blob with an empty namespace is
  // not stored.
  std::string datastore_namespace;
};

// One storage policy. It is stored under its name.
struct KarstPolicyInfo {
  std::vector<KarstPolicyBlob> blobs;
  std::string name;
  std::string policy_id;
  std::string description;
  std::int64_t generation_number = 0;
};

// One datastore. It is stored under its url.
struct KarstDatastoreInfo {
  std::string url;
  std::string datastore_namespace;
  // The policy_id of the datastore's default policy.
  std::string drp_policy_id;
};

// The host's catalogue of storage policies and datastores, kept in the host's
// configuration store. Every operation opens the store, works and lets go of
// it before returning; nothing is kept between calls, and no set-up is needed.
//
// Errors are exceptions; the library raises none of its own. Store failures
// arrive as TavoConfigStore::ConfigStoreException (declared in
// "TavoConfigStore/ConfigStoreException.h", a Velk::Lib::VelkException) with
// the store's message and code. Exceptions of any other type (std::bad_alloc,
// say) pass unchanged.
class KARST_EXPORT KarstLib {
 public:
  KarstLib() = delete;

  // Does nothing; no operation depends on it.
  static void Init();

  // Deletes both catalogues in one transaction. A failure to delete either is
  // ignored and the transaction is still committed; a failure to obtain the
  // store, to begin or to commit throws ConfigStoreException (the
  // transaction is abandoned where one was begun).
  static void Reset();

  // ---- Policies --------------------------------------------------------

  // Replaces the whole policy catalogue with "policies", in one transaction.
  // Blobs with an empty datastore_namespace are not stored. On a store error
  // the transaction is abandoned, the stored catalogue is as it was, and a
  // ConfigStoreException with the store's message and code is thrown. The
  // datastore catalogue is never touched.
  static void AddPolicyInfo(const std::vector<KarstPolicyInfo>& policies);

  // Every stored policy with its blobs, in the store's order (the order of
  // writing). A policy whose reading fails is left out and the listing goes
  // on; a failure to open the store or to fetch the collection throws.
  // A stored policy without a generation number lists it as 0.
  static std::vector<KarstPolicyInfo> ListPolicyInfo();

  // ---- Datastores ------------------------------------------------------

  // Replaces the whole datastore catalogue, as AddPolicyInfo does for
  // policies. The policy catalogue is never touched.
  static void AddDatastoreInfo(const std::vector<KarstDatastoreInfo>& datastores);

  // Every stored datastore, in the store's order; as ListPolicyInfo.
  static std::vector<KarstDatastoreInfo> ListDatastoreInfo();

  // ---- Blob look-ups ---------------------------------------------------
  // Each returns "" when anything along the way is missing or an argument is
  // empty; finding nothing is not an error. Store errors pass unchanged.

  // The blob, for the namespace of the datastore stored under "url", of the
  // first policy in store order whose policy_id is "policyId".
  static std::string GetPolicyBlobById(const std::string& policyId, const std::string& url);

  // The "CORRA" blob of the first policy in store order whose policy_id is
  // "policyId". If that policy has no such blob, "" (later policies with the
  // same id are not consulted).
  static std::string GetCorraPolicyBlobById(const std::string& policyId);

  // The "CORRA" blob of the policy stored under "name".
  static std::string GetCorraPolicyBlobByName(const std::string& name);

  // The blob of the default policy (drp_policy_id) of the datastore stored
  // under "url", for that datastore's own namespace.
  static std::string GetDefaultPolicyBlob(const std::string& url);

  // ---- Change detection ------------------------------------------------

  // Two CRC-32 digests in lower-case hex: first over the policies, second
  // over the datastores; "" for an empty catalogue. Independent of the order
  // in which the store lists records. Throws what the listings throw.
  // Blind spots: fields are joined without separators, a NUL ends a name, id
  // or description, and numbers carry no leading zeros, so some changes keep
  // the digest; compare the listings where every change must count.
  static std::pair<std::string, std::string> GetDbHash();
};

}  // namespace TavoKarst

#endif  // TAVOKARST_KARST_LIB_H_
