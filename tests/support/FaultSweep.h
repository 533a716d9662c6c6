// The fault-point sweep: every call an operation makes fails in turn, in each
// of the ways asked for, and after each fault the outcome is checked.

#ifndef KARST_TESTS_SUPPORT_FAULT_SWEEP_H_
#define KARST_TESTS_SUPPORT_FAULT_SWEEP_H_

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "FaultStore.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"

namespace karst_test {

// Both collections as the library lists them.
struct Catalogue {
  std::vector<TavoKarst::KarstPolicyInfo> policies;
  std::vector<TavoKarst::KarstDatastoreInfo> datastores;
};
Catalogue ListCatalogue();
// Replaces both collections (two library writes).
void StoreCatalogue(const Catalogue& catalogue);

struct SweepOperation {
  std::string name;
  std::function<void()> run;
  // What a run that returns leaves behind: the catalogue before it, for a reader.
  Catalogue after;
};

// Opens the store each fault point works on: the same in-memory store every
// time, or a new SQLite connection to one file. A process-death point calls
// it in the child and again in the parent, so it must open a store that
// outlives the child.
using StoreOpener = std::function<std::shared_ptr<TavoConfigStore::ConfigStore>()>;

// For each operation: a clean run counts its calls; then for every call
// number and every kind, "before" is stored, the fault is planned at that
// call and the operation runs. A point passes when
//  - whatever escaped is the planned fault: a ConfigStoreException with
//    kFaultMessage and kFaultCode (a copy) for a store error, std::bad_alloc
//    for bad_alloc; returning is fine too (listings drop a record, Reset
//    ignores failed deletions);
//  - no transaction is left open;
//  - each collection is as "before", or as "after" when the operation
//    returned (for a process death: either), byte for byte;
//  - the operation then runs without faults and leaves "after".
// Returns one line per failed point; empty when every point passed.
std::vector<std::string> SweepFaults(const StoreOpener& open, const Catalogue& before,
                                     const std::vector<SweepOperation>& operations,
                                     const std::vector<FaultKind>& kinds);

// Fault points the last SweepFaults visited.
int SweptPoints();

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_FAULT_SWEEP_H_
