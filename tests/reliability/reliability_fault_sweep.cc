// Fault sweep: every call an operation makes (store calls and the object
// calls the library makes on what it reads or builds) fails in turn: with a
// store error once, with a store error from then on, and with std::bad_alloc.
// The operations run on the real SQLite store through the per-thread cached
// connection, as a host calls them. After each fault:
//  - the caller got the injected error unchanged (message and code), or
//    bad_alloc, unless the operation is documented to skip that failure;
//  - no transaction is left open on the thread's connection, and another
//    connection can take the write lock;
//  - a listing on the same thread and a new connection both see each
//    collection whole: old, or new when the operation reported success;
//  - the next operation succeeds.
// A second sweep makes SQLite itself roll the transaction back (an
// interrupted statement) at every write of a replace and of Reset, so the
// store's abort has to cope with a transaction that is already gone.

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <functional>
#include <map>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "SqliteStoreTesting.h"
#include "TavoConfigStore/CallProbe.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"
#include "forwarding_store.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoConfigStore::ConfigStore;
using TavoConfigStore::ConfigStoreException;
using TavoConfigStore::FaultInjector;
using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstLib;
using TavoKarst::KarstPolicyInfo;

const Tag kOld{1, 5};  // 6 policies, 6 datastores
const Tag kNew{2, 9};  // 4 policies, 6 datastores

// What reached the caller.
struct Outcome {
  enum Kind { kReturned, kStoreError, kBadAlloc, kOther };
  Kind kind = kReturned;
  std::string message;
  int code = 0;
  std::string value;  // a look-up's or digest's result, or a listing's verdict
  std::string Describe() const {
    switch (kind) {
      case kReturned:
        return "returned";
      case kStoreError:
        return "store error " + std::to_string(code) + " \"" + message + "\"";
      case kBadAlloc:
        return "bad_alloc";
      case kOther:
        break;
    }
    return "other exception: " + message;
  }
};

enum class OpKind { kWrite, kList, kLookup, kReset };

struct Operation {
  std::string name;
  OpKind kind;
  std::function<std::string()> run;  // returns what a read returned
};

Outcome Attempt(const Operation& op) {
  Outcome o;
  try {
    o.value = op.run();
  } catch (const ConfigStoreException& e) {
    o.kind = Outcome::kStoreError;
    o.message = e.Message();
    o.code = e.Code();
  } catch (const std::bad_alloc&) {
    o.kind = Outcome::kBadAlloc;
  } catch (const std::exception& e) {
    o.kind = Outcome::kOther;
    o.message = e.what();
  }
  return o;
}

std::string PolicyNames(const std::vector<KarstPolicyInfo>& list) {
  std::string out;
  for (const auto& p : list) out += p.description + ";";
  return out;
}

std::vector<Operation> Operations() {
  const std::string url = DatastoresFor(kOld)[1].url;
  return {
      {"replace policies", OpKind::kWrite,
       [] {
         KarstLib::AddPolicyInfo(PoliciesFor(kNew));
         return std::string();
       }},
      {"replace datastores", OpKind::kWrite,
       [] {
         KarstLib::AddDatastoreInfo(DatastoresFor(kNew));
         return std::string();
       }},
      // A listing's value names every record, so a record left out shows.
      {"list policies", OpKind::kList, [] { return PolicyNames(KarstLib::ListPolicyInfo()); }},
      {"list datastores", OpKind::kList,
       [] {
         std::string out;
         for (const auto& d : KarstLib::ListDatastoreInfo()) out += d.url + ";";
         return out;
       }},
      {"blob by id", OpKind::kLookup, [url] { return KarstLib::GetPolicyBlobById("id-1", url); }},
      {"corra by id", OpKind::kLookup, [] { return KarstLib::GetCorraPolicyBlobById("id-2"); }},
      {"corra by name", OpKind::kLookup,
       [] { return KarstLib::GetCorraPolicyBlobByName("policy-3"); }},
      {"default blob", OpKind::kLookup, [url] { return KarstLib::GetDefaultPolicyBlob(url); }},
      {"digests", OpKind::kList,
       [] {
         auto h = KarstLib::GetDbHash();
         return h.first + "/" + h.second;
       }},
      {"reset", OpKind::kReset,
       [] {
         KarstLib::Reset();
         return std::string();
       }},
  };
}

// The calls the library makes on what it reads: failures there may, by
// contract, only drop the record being read from a listing.
bool IsRecordRead(const std::string& call) {
  return call == "GetValue" || call == "GetSubObjectInstances" || call == "GetSubObject";
}

class FaultSweepTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = dir_.File("store.db");
    UseStoreAt(path_);
    Restore();
  }
  void TearDown() override {
    TavoConfigStore::InstallCallProbe(nullptr);
    TavoConfigStore::SetGlobalStore(nullptr);
  }

  // Back to the old lists, through the thread's own connection.
  void Restore() {
    KarstLib::AddPolicyInfo(PoliciesFor(kOld));
    KarstLib::AddDatastoreInfo(DatastoresFor(kOld));
  }

  // Whether the thread's cached connection has a transaction open.
  static bool ThreadConnectionInTransaction() {
    auto store = ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
    sqlite3* db = TavoConfigStore::SqliteConnectionForTesting(*store);
    return db != nullptr && sqlite3_get_autocommit(db) == 0;
  }

  // Whether another connection can take the write lock at once.
  bool WriteLockFree() const {
    sqlite3* db = nullptr;
    bool free = false;
    if (sqlite3_open_v2(path_.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) == SQLITE_OK) {
      free = sqlite3_exec(db, "BEGIN IMMEDIATE; ROLLBACK;", nullptr, nullptr, nullptr) == SQLITE_OK;
    }
    sqlite3_close(db);
    return free;
  }

  // Both collections as a new connection sees them: committed data only.
  Verdict Committed() const {
    TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(path_));
    Verdict v;
    v.policies = Classify(KarstLib::ListPolicyInfo());
    v.datastores = Classify(KarstLib::ListDatastoreInfo());
    v.ok = true;
    TavoConfigStore::SetGlobalStore(nullptr);
    return v;
  }

  ScratchDir dir_;
  std::string path_;
};

bool Is(const Observed& o, Tag tag) { return o.kind == Observed::kWhole && o.tag == tag; }

struct ModeFigures {
  int faults = 0, passedIntact = 0, skippedByContract = 0, leftOpen = 0, oldOrNew = 0, torn = 0,
      nextFailedOnce = 0, stuck = 0;
};

TEST_F(FaultSweepTest, EveryCallOfEveryOperationFails) {
  const char* modeNames[] = {"store error once", "store error from then on", "bad_alloc"};
  ModeFigures figures[3];
  std::map<std::string, int> callsPerOperation;
  // Under the sanitizers only every third record read fails; every store
  // call and every write still does.
  const int readStride = Scaled(1, 3);
  for (const Operation& op : Operations()) {
    SCOPED_TRACE(op.name);
    // The calls of an undisturbed run and what it returns.
    auto probe = std::make_shared<FaultInjector>();
    TavoConfigStore::InstallCallProbe(probe);
    const Outcome clean = Attempt(op);
    TavoConfigStore::InstallCallProbe(nullptr);
    ASSERT_EQ(clean.kind, Outcome::kReturned) << clean.Describe();
    const std::vector<std::string> calls = probe->Calls();
    callsPerOperation[op.name] = static_cast<int>(calls.size());
    Restore();

    std::map<std::string, int> seen;
    for (std::size_t k = 0; k < calls.size(); ++k) {
      const std::string& call = calls[k];
      const int nth = ++seen[call];
      if (IsRecordRead(call) && nth % readStride != 0) continue;
      for (int mode = 0; mode < 3; ++mode) {
        SCOPED_TRACE(std::string(modeNames[mode]) + " at call " + std::to_string(k + 1) + " (" +
                     call + " #" + std::to_string(nth) + ")");
        ModeFigures& f = figures[mode];
        const std::string message = "injected at " + call + " #" + std::to_string(nth);
        probe = std::make_shared<FaultInjector>();
        if (mode == 2) {
          probe->FailWith(call, nth, [] { throw std::bad_alloc(); });
        } else {
          probe->FailStoreError(call, nth, message, TavoConfigStore::kErrorInjected, mode == 1);
        }
        TavoConfigStore::InstallCallProbe(probe);
        const Outcome got = Attempt(op);
        TavoConfigStore::InstallCallProbe(nullptr);
        ++f.faults;

        // What reached the caller.
        const bool skippable = (op.kind == OpKind::kList && IsRecordRead(call) && mode != 2) ||
                               (op.kind == OpKind::kReset && call == "DeleteObjects" && mode != 2);
        if (mode == 2 && got.kind == Outcome::kBadAlloc) {
          ++f.passedIntact;
        } else if (mode != 2 && got.kind == Outcome::kStoreError && got.message == message &&
                   got.code == TavoConfigStore::kErrorInjected) {
          ++f.passedIntact;
        } else if (skippable && got.kind == Outcome::kReturned) {
          ++f.skippedByContract;
          if (op.kind == OpKind::kList && op.name != "digests") {
            // Records may be missing; none may be altered or added.
            EXPECT_NE(got.value, clean.value) << "the failure left no trace";
            std::size_t at = 0;
            bool subList = true;
            for (std::size_t start = 0, end;
                 subList && (end = got.value.find(';', start)) != std::string::npos;
                 start = end + 1) {
              at = clean.value.find(got.value.substr(start, end - start + 1), at);
              subList = at != std::string::npos;
            }
            EXPECT_TRUE(subList) << "records not in the store: " << got.value;
          }
        } else {
          ADD_FAILURE() << "the caller got " << got.Describe();
        }

        // Nothing left open.
        const bool open = ThreadConnectionInTransaction();
        const bool lockFree = WriteLockFree();
        if (open || !lockFree) {
          ++f.leftOpen;
          ADD_FAILURE() << "left open: transaction on the thread's connection " << open
                        << ", write lock held " << !lockFree;
        }

        // Whole collections, on this thread and for everyone else.
        const bool reported = got.kind == Outcome::kReturned;
        Tag wantPolicies = kOld, wantDatastores = kOld;
        if (reported && op.name == "replace policies") wantPolicies = kNew;
        if (reported && op.name == "replace datastores") wantDatastores = kNew;
        auto fits = [&](const Observed& o, Tag want) {
          if (op.kind == OpKind::kReset) {
            return reported ? o.kind == Observed::kEmpty || (skippable && Is(o, kOld))
                            : Is(o, kOld);
          }
          return Is(o, want);
        };
        const Observed ownPolicies = Classify(KarstLib::ListPolicyInfo());
        const Observed ownDatastores = Classify(KarstLib::ListDatastoreInfo());
        const Verdict committed = Committed();
        if (ownPolicies.kind == Observed::kTorn || ownDatastores.kind == Observed::kTorn ||
            committed.policies.kind == Observed::kTorn ||
            committed.datastores.kind == Observed::kTorn) {
          ++f.torn;
        }
        if (fits(ownPolicies, wantPolicies) && fits(ownDatastores, wantDatastores) &&
            fits(committed.policies, wantPolicies) && fits(committed.datastores, wantDatastores)) {
          ++f.oldOrNew;
        } else {
          ADD_FAILURE() << "this thread sees policies " << ownPolicies.Describe() << ", datastores "
                        << ownDatastores.Describe() << "; committed " << committed.Describe();
        }

        // The next operation succeeds; a second try shows whether the first
        // failure was a one-off or the thread is stuck.
        Outcome next = Attempt(op);
        if (next.kind != Outcome::kReturned) {
          ++f.nextFailedOnce;
          ADD_FAILURE() << "next " << op.name << ": " << next.Describe();
          next = Attempt(op);
          if (next.kind != Outcome::kReturned) {
            ++f.stuck;
            FAIL() << "stuck: " << next.Describe();
          }
        }
        if (op.kind != OpKind::kWrite && op.kind != OpKind::kReset) {
          EXPECT_EQ(next.value, clean.value);
        }
        Restore();
      }
    }
  }

  std::string sizes;
  for (const auto& [name, n] : callsPerOperation) {
    sizes += (sizes.empty() ? "" : ", ") + name + " " + std::to_string(n);
  }
  std::string line = "fault-sweep: calls per operation: " + sizes + ".";
  for (int mode = 0; mode < 3; ++mode) {
    const ModeFigures& f = figures[mode];
    line += std::string(" ") + modeNames[mode] + ": " + std::to_string(f.faults) +
            " faults, passed to the caller " + std::to_string(f.passedIntact) +
            ", skipped by contract " + std::to_string(f.skippedByContract) + ", left open " +
            std::to_string(f.leftOpen) + ", old-or-new " + std::to_string(f.oldOrNew) + ", torn " +
            std::to_string(f.torn) + ", next call failed " + std::to_string(f.nextFailedOnce) +
            ", stuck " + std::to_string(f.stuck) + ".";
  }
  ReportFigures("fault-sweep", line);
  for (const ModeFigures& f : figures) {
    EXPECT_EQ(f.passedIntact + f.skippedByContract, f.faults);
    EXPECT_EQ(f.oldOrNew, f.faults);
    EXPECT_EQ(f.leftOpen, 0);
    EXPECT_EQ(f.torn, 0);
    EXPECT_EQ(f.nextFailedOnce, 0);
  }
}

// Makes the next statement stop with SQLITE_INTERRUPT: an INSERT or DELETE
// interrupted inside a transaction makes SQLite roll the whole transaction
// back by itself, as it may after a full disk or an I/O error.
int InterruptOnce(void* armed) {
  bool* flag = static_cast<bool*>(armed);
  if (!*flag) return 0;
  *flag = false;
  return 1;
}

TEST_F(FaultSweepTest, SqliteRollsTheTransactionBackByItselfAtEveryWrite) {
  int points = 0, rolledBack = 0, abortTolerated = 0, errorPassed = 0, old = 0, nextOk = 0;
  for (const Operation& op : Operations()) {
    if (op.kind != OpKind::kWrite && op.kind != OpKind::kReset) continue;
    SCOPED_TRACE(op.name);
    auto dry = std::make_shared<ForwardingStore>(TavoConfigStore::NewSqliteStore(path_),
                                                 ForwardingStore::Hook());
    TavoConfigStore::SetGlobalStore(dry);
    ASSERT_EQ(Attempt(op).kind, Outcome::kReturned);
    TavoConfigStore::SetGlobalStore(nullptr);
    const std::vector<std::string> calls = dry->Log();
    dry.reset();
    Restore();

    for (std::size_t k = 1; k <= calls.size(); ++k) {
      if (calls[k - 1] != "SetObject" && calls[k - 1] != "DeleteObjects") continue;
      SCOPED_TRACE("interrupted at call " + std::to_string(k) + " (" + calls[k - 1] + ")");
      ++points;
      auto inner = TavoConfigStore::NewSqliteStore(path_);
      sqlite3* db = TavoConfigStore::SqliteConnectionForTesting(*inner);
      bool armed = false;
      sqlite3_progress_handler(db, 1, InterruptOnce, &armed);
      bool autocommitAfterFailure = false;
      std::size_t failedAt = 0;
      auto wrapper = std::make_shared<ForwardingStore>(inner, ForwardingStore::Hook());
      wrapper->SetHook([&, k](const char*, int index) {
        if (static_cast<std::size_t>(index) == k) armed = true;
        // The call after the failed one: has SQLite ended the transaction?
        if (failedAt == 0 && static_cast<std::size_t>(index) == k + 1) {
          autocommitAfterFailure = sqlite3_get_autocommit(db) != 0;
          failedAt = k;
        }
      });
      TavoConfigStore::SetGlobalStore(wrapper);
      const Outcome got = Attempt(op);
      TavoConfigStore::SetGlobalStore(nullptr);
      const std::vector<std::string> log = wrapper->Log();
      sqlite3_progress_handler(db, 0, nullptr, nullptr);

      ASSERT_GE(log.size(), k);
      EXPECT_EQ(log[k - 1], calls[k - 1] + "!" + std::to_string(SQLITE_INTERRUPT));
      if (autocommitAfterFailure) ++rolledBack;
      // The write bracket abandons the transaction SQLite already ended.
      for (const std::string& call : log) {
        if (call == "AbortTransaction") ++abortTolerated;
        EXPECT_NE(call.rfind("AbortTransaction!", 0), 0u) << "abort failed: " << call;
      }
      EXPECT_EQ(sqlite3_get_autocommit(db), 1) << "transaction left open";
      if (got.kind == Outcome::kStoreError && (got.code & 0xff) == SQLITE_INTERRUPT) {
        ++errorPassed;
      } else if (op.kind == OpKind::kReset && got.kind == Outcome::kStoreError) {
        // Reset skips a failed deletion; the commit then finds the
        // transaction gone and must say so.
        EXPECT_EQ(got.code, SQLITE_ABORT_ROLLBACK) << got.Describe();
        ++errorPassed;
      } else {
        ADD_FAILURE() << "the caller got " << got.Describe();
      }
      wrapper.reset();
      inner.reset();

      const Verdict committed = Committed();
      if (Is(committed.policies, kOld) && Is(committed.datastores, kOld)) {
        ++old;
      } else {
        ADD_FAILURE() << "after the failed " << op.name << ": " << committed.Describe();
      }
      if (Attempt(op).kind == Outcome::kReturned) ++nextOk;
      Restore();
    }
  }
  ReportFigures("sqlite-rollback",
                "sqlite-rollback: " + std::to_string(points) +
                    " writes interrupted (SQLite rolls the transaction back itself), rolled back "
                    "before the next call " +
                    std::to_string(rolledBack) + ", aborts of the ended transaction tolerated " +
                    std::to_string(abortTolerated) + ", error reached the caller " +
                    std::to_string(errorPassed) + ", catalogue old " + std::to_string(old) +
                    ", next operation ok " + std::to_string(nextOk));
  EXPECT_GT(points, 0);
  EXPECT_EQ(rolledBack, points);
  EXPECT_EQ(errorPassed, points);
  EXPECT_EQ(old, points);
  EXPECT_EQ(nextOk, points);
}

// The two sides of abandoning a transaction on release: a handle dropped in
// the ordinary way keeps its transaction, and a host that holds a handle of
// its own keeps the connection's transaction open past a library call that
// failed with bad_alloc; the next write on the thread then fails once and
// clears it.
TEST_F(FaultSweepTest, TransactionsAndHandles) {
  const auto ns = TavoConfigStore::sGlobalNamespace;
  ConfigStore::GetStore(ns)->BeginTransaction();
  ConfigStore::GetStore(ns)->DeleteObjects(std::make_shared<TavoConfigStore::FilterSpecObject>(
      TavoConfigStore::ConfigStoreObjectId("karst_policies", "", "")));
  EXPECT_TRUE(ThreadConnectionInTransaction());
  ConfigStore::GetStore(ns)->CommitTransaction();
  EXPECT_EQ(Classify(KarstLib::ListPolicyInfo()).kind, Observed::kEmpty);
  Restore();

  // The library's own handle is the last: abandoned at once.
  auto probe = std::make_shared<FaultInjector>();
  probe->FailWith("SetObject", 2, [] { throw std::bad_alloc(); });
  TavoConfigStore::InstallCallProbe(probe);
  EXPECT_THROW(KarstLib::AddPolicyInfo(PoliciesFor(kNew)), std::bad_alloc);
  TavoConfigStore::InstallCallProbe(nullptr);
  EXPECT_FALSE(ThreadConnectionInTransaction());
  EXPECT_TRUE(WriteLockFree());
  EXPECT_TRUE(Is(Classify(KarstLib::ListPolicyInfo()), kOld));

  // The host holds a handle: the transaction stays until the next write.
  auto held = ConfigStore::GetStore(ns);
  probe = std::make_shared<FaultInjector>();
  probe->FailWith("SetObject", 2, [] { throw std::bad_alloc(); });
  TavoConfigStore::InstallCallProbe(probe);
  EXPECT_THROW(KarstLib::AddPolicyInfo(PoliciesFor(kNew)), std::bad_alloc);
  TavoConfigStore::InstallCallProbe(nullptr);
  EXPECT_TRUE(ThreadConnectionInTransaction());
  EXPECT_FALSE(WriteLockFree());
  EXPECT_TRUE(Is(Committed().policies, kOld));
  try {
    KarstLib::AddPolicyInfo(PoliciesFor(kNew));
    ADD_FAILURE() << "a write succeeded inside the abandoned transaction";
  } catch (const ConfigStoreException& e) {
    EXPECT_EQ(e.Code(), TavoConfigStore::kErrorNestedTransaction);
  }
  EXPECT_FALSE(ThreadConnectionInTransaction());
  EXPECT_TRUE(WriteLockFree());
  KarstLib::AddPolicyInfo(PoliciesFor(kNew));
  EXPECT_TRUE(Is(Committed().policies, kNew));
}

}  // namespace
}  // namespace karst_reliability
