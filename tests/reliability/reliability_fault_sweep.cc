// Fault sweep on the SQLite store: every call each operation makes (store
// calls and the reads of what it gets back) fails in turn, with a store error
// once, from then on, and with std::bad_alloc, each on a new connection to one
// file. SweepFaults checks the caller got the planned failure, no transaction
// stayed open, each collection is old or new byte for byte, and the next call
// works.
//
// Then the process dies just before each call a replace or Reset makes; a
// new connection must find the old catalogue before the commit and the new
// one after.

#include "reliability_util.h"

namespace karst_reliability {

TEST(FaultSweep, EveryCallOfEveryOperationFailsOnTheSqliteStore) {
  ScratchDir dir;
  const std::string path = dir.File("store.db");
  const Catalogue old{PoliciesFor(Tag{1, 5}), DatastoresFor(Tag{1, 5})};
  const auto replacePolicies = [] { KarstLib::AddPolicyInfo(PoliciesFor(Tag{2, 9})); };
  const auto replaceDatastores = [] { KarstLib::AddDatastoreInfo(DatastoresFor(Tag{2, 9})); };
  // Reads leave the catalogue as it was.
  const std::vector<SweepOperation> operations = {
      {"replace policies", replacePolicies, {PoliciesFor(Tag{2, 9}), old.datastores}},
      {"replace datastores", replaceDatastores, {old.policies, DatastoresFor(Tag{2, 9})}},
      {"reset", KarstLib::Reset, {}},
      {"list policies", KarstLib::ListPolicyInfo, old},
      {"list datastores", KarstLib::ListDatastoreInfo, old},
      {"blob by id", [&] { KarstLib::GetPolicyBlobById("id-1", old.datastores[1].url); }, old},
      {"corra by id", [] { KarstLib::GetCorraPolicyBlobById("id-2"); }, old},
      {"corra by name", [] { KarstLib::GetCorraPolicyBlobByName("policy-3"); }, old},
      {"default blob", [&] { KarstLib::GetDefaultPolicyBlob(old.datastores[1].url); }, old},
      {"digests", KarstLib::GetDbHash, old}};
  const std::vector<std::string> failures = SweepFaults(
      [path] { return TavoConfigStore::NewSqliteStore(path); }, old, operations,
      {FaultKind::kStoreErrorOnce, FaultKind::kStoreErrorFromThenOn, FaultKind::kBadAlloc});
  for (const std::string& f : failures) ADD_FAILURE() << f;
  ReportFigures("fault-sweep",
                "fault-sweep: %d fault points (every call of %zu operations x store error once, "
                "from then on, bad_alloc) on the SQLite store: failed %zu",
                SweptPoints(), operations.size(), failures.size());

  const std::vector<std::string> crashes =
      SweepFaults([path] { return TavoConfigStore::NewSqliteStore(path); }, old,
                  {operations.begin(), operations.begin() + 3}, {FaultKind::kProcessDeath});
  for (const std::string& f : crashes) ADD_FAILURE() << "crash: " << f;
  ReportFigures("crash-steps",
                "crash-steps: %d call crash points in a replace of either collection or Reset, "
                "partial or lost %zu",
                SweptPoints(), crashes.size());
}

}  // namespace karst_reliability
