// The benchmark's workload and where its store files live.

#ifndef KARST_BENCH_BENCH_DATA_H_
#define KARST_BENCH_BENCH_DATA_H_

#include <cstddef>
#include <string>
#include <vector>

#include "TavoKarst/KarstLib.h"

namespace karst_bench {

// Policies with name, policy_id and description of 10-30 bytes, a generation
// number and 4 blobs of 256 random bytes; the same for every call with the
// same n, and built once per n.
const std::vector<TavoKarst::KarstPolicyInfo>& Policies(std::size_t n);

// Datastores with 3 short strings, each naming one of the policies above as
// its default.
const std::vector<TavoKarst::KarstDatastoreInfo>& Datastores(std::size_t n);

// Field by field, blobs in order.
bool SameListing(const std::vector<TavoKarst::KarstPolicyInfo>& a,
                 const std::vector<TavoKarst::KarstPolicyInfo>& b);

// Random bytes from a fixed seed.
std::string RandomBytes(std::size_t n, std::uint64_t seed);

// The directory holding the store files: $KARST_BENCH_DIR, else a directory
// in the system temp dir. Created on first use.
const std::string& StoreDir();
// "disk" or "tmpfs" (or the file system's magic number), for the report.
std::string StoreDirKind();

// Points ConfigStore::GetStore at the store file "name" in StoreDir().
void UseKarstStore(const std::string& name);

// A karst store holding Policies(n) and Datastores(n), written once per
// process (and then only read), made the current store.
void UseFilledKarstStore(std::size_t n);
std::string FilledKarstStorePath(std::size_t n);

}  // namespace karst_bench

#endif  // KARST_BENCH_BENCH_DATA_H_
