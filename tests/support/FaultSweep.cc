#include "FaultSweep.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <new>

#include "Child.h"
#include "Records.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace karst_test {

using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;

Catalogue ListCatalogue() { return {KarstLib::ListPolicyInfo(), KarstLib::ListDatastoreInfo()}; }

void StoreCatalogue(const Catalogue& catalogue) {
  KarstLib::AddPolicyInfo(catalogue.policies);
  KarstLib::AddDatastoreInfo(catalogue.datastores);
}

namespace {

int gSweptPoints = 0;

// "" when what escaped is what the fault kind allows, else what escaped.
std::string RunFaulted(const SweepOperation& op, FaultKind kind, bool* returned) {
  *returned = false;
  try {
    op.run();
    *returned = true;
    return "";
  } catch (const ConfigStoreException& e) {
    const bool planned =
        (kind == FaultKind::kStoreErrorOnce || kind == FaultKind::kStoreErrorFromThenOn) &&
        e.Message() == kFaultMessage && e.Code() == kFaultCode;
    return planned ? "" : "ConfigStoreException " + std::to_string(e.Code()) + " " + e.Message();
  } catch (const std::bad_alloc&) {
    return kind == FaultKind::kBadAlloc ? "" : "std::bad_alloc";
  } catch (const std::exception& e) {
    return std::string("exception ") + e.what();
  }
}

// "" when each collection is as "before", or as "after" where "mayBeAfter".
std::string CheckCollections(const Catalogue& now, const Catalogue& before, const Catalogue& after,
                             bool mayBeAfter) {
  std::string out;
  if (!(now.policies == before.policies || (mayBeAfter && now.policies == after.policies))) {
    out += " policies are " + ::testing::PrintToString(now.policies);
  }
  if (!(now.datastores == before.datastores ||
        (mayBeAfter && now.datastores == after.datastores))) {
    out += " datastores are " + ::testing::PrintToString(now.datastores);
  }
  return out;
}

bool EndsTransaction(const std::string& call) {
  return call == "CommitTransaction" || call == "AbortTransaction";
}

// One in-process fault point; "" when it passed.
std::string InProcessPoint(FaultStore& store, const Catalogue& before, const SweepOperation& op,
                           int call, FaultKind kind) {
  store.ClearFaults();
  StoreCatalogue(before);
  store.ClearLog();
  store.FailAtCall(call, kind);
  bool returned = false;
  std::string problem = RunFaulted(op, kind, &returned);
  store.ClearFaults();
  if (!problem.empty()) problem = " let through " + problem;
  if (kind == FaultKind::kBadAlloc && !returned) {
    // Another exception type passes with neither Commit nor Abort; the host
    // that caught it ends the transaction.
    const std::vector<std::string> calls = store.Calls();
    if (std::any_of(calls.begin() + std::min<std::size_t>(calls.size(), call), calls.end(),
                    EndsTransaction)) {
      problem += " ended the transaction after bad_alloc";
    }
    store.AbortTransaction();
  } else if (store.TransactionOpen()) {
    problem += " left the transaction open";
  }
  problem += CheckCollections(ListCatalogue(), before, op.after, returned);
  return problem;
}

// One process-death point: the operation dies in a child at that call.
std::string DeathPoint(const StoreOpener& open, const Catalogue& before, const SweepOperation& op,
                       int call) {
  {
    ScopedFaultStore store(open());
    StoreCatalogue(before);
  }
  const ChildResult child = RunChild([&](int) {
    ScopedFaultStore store(open());
    store->FailAtCall(call, FaultKind::kProcessDeath);
    op.run();
  });
  std::string problem;
  if (!child.exited || child.code != kDeathStatus) problem = " child: " + child.Describe();
  ScopedFaultStore store(open());
  return problem + CheckCollections(ListCatalogue(), before, op.after, true);
}

}  // namespace

int SweptPoints() { return gSweptPoints; }

std::vector<std::string> SweepFaults(const StoreOpener& open, const Catalogue& before,
                                     const std::vector<SweepOperation>& operations,
                                     const std::vector<FaultKind>& kinds) {
  std::vector<std::string> failures;
  gSweptPoints = 0;
  for (const SweepOperation& op : operations) {
    std::vector<std::string> names;
    {
      ScopedFaultStore store(open());
      StoreCatalogue(before);
      store->ClearLog();
      op.run();
      names = store->Calls();
    }
    for (int call = 1; call <= static_cast<int>(names.size()); ++call) {
      for (FaultKind kind : kinds) {
        ++gSweptPoints;
        std::string problem;
        if (kind == FaultKind::kProcessDeath) {
          problem = DeathPoint(open, before, op, call);
        } else {
          ScopedFaultStore store(open());
          problem = InProcessPoint(*store, before, op, call, kind);
        }
        // The next call, without faults, does the whole job.
        ScopedFaultStore store(open());
        try {
          op.run();
          problem += CheckCollections(ListCatalogue(), op.after, op.after, false);
        } catch (const std::exception& e) {
          problem += std::string(" next call failed: ") + e.what();
        }
        if (!problem.empty()) {
          failures.push_back(op.name + ": " + Describe(kind) + " at call " + std::to_string(call) +
                             " (" + names[call - 1] + "):" + problem);
        }
      }
    }
  }
  return failures;
}

}  // namespace karst_test
