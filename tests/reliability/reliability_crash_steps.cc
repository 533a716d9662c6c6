// Crash at every step of one replace, then read the store from a new process.
//
// Store steps: a wrapper store ends the process just before the k-th store
// call of the replace (Begin, Delete, each SetObject, Commit), for both
// collections; before the commit the old list must be there in full, after
// it the new one.
//
// I/O steps: the fault VFS ends the process at the k-th write, sync or
// truncate SQLite makes during the replace. Each collection must be old or
// new, and once a crash point leaves the new list, every later one must too.
// A replace followed by a checkpoint puts crash points inside the copy of the
// log back into the database file as well.

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"
#include "fault_vfs.h"
#include "forwarding_store.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoKarst::KarstLib;

constexpr int kCrashExit = 77;
// Old and new lists differ in length as well as content.
const Tag kOldPolicies{1, 10};
const Tag kOldDatastores{1, 11};
const Tag kNewPolicies{2, 13};
const Tag kNewDatastores{2, 13};

struct Target {
  const char* name;
  int collection;  // 0 policies, 1 datastores
  Tag oldTag;
  Tag newTag;
  int count;                // 0: the tag's own length
  bool checkpoint = false;  // a checkpoint follows the commit
};

void Replace(const Target& t) {
  if (t.collection == 0) {
    KarstLib::AddPolicyInfo(PoliciesFor(t.newTag, t.count));
  } else {
    KarstLib::AddDatastoreInfo(DatastoresFor(t.newTag));
  }
}

class CrashStepsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    FaultVfs::Install();
    path_ = dir_.File("store.db");
    template_ = dir_.File("template.db");
    // The template is written and closed cleanly, so it is one file with no
    // log; every crash run starts from a byte-identical copy of it.
    UseStoreAt(template_);
    ChildResult r = RunChild([this](int) {
      TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(template_));
      KarstLib::AddPolicyInfo(PoliciesFor(kOldPolicies));
      KarstLib::AddDatastoreInfo(DatastoresFor(kOldDatastores));
      TavoConfigStore::SetGlobalStore(nullptr);
    });
    ASSERT_EQ(r.code, 0) << r.Describe();
    ASSERT_FALSE(std::filesystem::exists(template_ + "-wal"));
    UseStoreAt(path_);
  }

  void FreshCopy() {
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path_ + suffix);
    std::filesystem::copy_file(template_, path_);
  }

  // The expected verdict: "isNew" for the target collection, the other as seeded.
  static bool Matches(const Verdict& v, const Target& t, bool isNew) {
    const Observed& target = t.collection == 0 ? v.policies : v.datastores;
    const Observed& other = t.collection == 0 ? v.datastores : v.policies;
    const Tag otherTag = t.collection == 0 ? kOldDatastores : kOldPolicies;
    return v.ok && target.kind == Observed::kWhole && target.tag == (isNew ? t.newTag : t.oldTag) &&
           other.kind == Observed::kWhole && other.tag == otherTag;
  }

  ScratchDir dir_;
  std::string path_;
  std::string template_;
};

TEST_F(CrashStepsTest, CrashBeforeEveryStoreCallOfAReplace) {
  int tried = 0, oldOrNew = 0, partial = 0;
  std::string perTarget;
  for (const Target& t : {Target{"policies", 0, kOldPolicies, kNewPolicies, 0},
                          Target{"datastores", 1, kOldDatastores, kNewDatastores, 0}}) {
    SCOPED_TRACE(t.name);
    // The calls of an undisturbed replace, as the wrapper sees them.
    FreshCopy();
    ChildResult dry = RunChild([&](int fd) {
      auto store = std::make_shared<ForwardingStore>(TavoConfigStore::NewSqliteStore(path_),
                                                     ForwardingStore::Hook());
      TavoConfigStore::SetGlobalStore(store);
      Replace(t);
      for (const std::string& call : store->Log()) WriteAll(fd, call + " ");
    });
    ASSERT_EQ(dry.code, 0) << dry.Describe();
    std::vector<std::string> calls;
    std::istringstream words(dry.output);
    for (std::string w; words >> w;) calls.push_back(w);
    ASSERT_GE(calls.size(), 3u);
    EXPECT_EQ(calls.front(), "BeginTransaction");
    EXPECT_EQ(calls.back(), "CommitTransaction");
    const int total = static_cast<int>(calls.size());

    // k = total + 1 ends the process right after the replace returned.
    for (int k = 1; k <= total + 1; ++k) {
      SCOPED_TRACE("crash before call " + std::to_string(k) + " of " + std::to_string(total) +
                   (k <= total ? " (" + calls[k - 1] + ")" : " (after the commit)"));
      FreshCopy();
      ChildResult crash = RunChild([&](int) {
        TavoConfigStore::SetGlobalStore(std::make_shared<ForwardingStore>(
            TavoConfigStore::NewSqliteStore(path_), [k](const char*, int index) {
              if (index == k) _exit(kCrashExit);
            }));
        Replace(t);
        _exit(0);  // no clean-up, as in a crash
      });
      EXPECT_TRUE(crash.exited) << crash.Describe();
      EXPECT_EQ(crash.code, k <= total ? kCrashExit : 0) << crash.Describe();
      const Verdict v = VerifyInFreshProcess();
      ++tried;
      const bool isNew = k > total;
      if (Matches(v, t, isNew)) {
        ++oldOrNew;
      } else {
        if (v.policies.kind == Observed::kTorn || v.datastores.kind == Observed::kTorn) ++partial;
        ADD_FAILURE() << "expected the " << (isNew ? "new" : "old") << " list, found "
                      << v.Describe();
      }
    }
    perTarget +=
        std::string(perTarget.empty() ? "" : ", ") + t.name + " " + std::to_string(total + 1);
  }
  ReportFigures("crash-steps", "crash-steps: " + std::to_string(tried) +
                                   " store-call crash points (" + perTarget + "), old-or-new " +
                                   std::to_string(oldOrNew) + ", partial " +
                                   std::to_string(partial));
  EXPECT_EQ(oldOrNew, tried);
}

// Crash points inside SQLite's own I/O, each tried twice: the process ends
// before the call, and it ends half way through the call (a torn write).
TEST_F(CrashStepsTest, CrashAtEveryWriteAndSyncOfAReplace) {
  int tried = 0, oldOrNew = 0, partial = 0, regressed = 0;
  std::string counts, durable;
  for (const Target& t :
       {Target{"policies", 0, kOldPolicies, kNewPolicies, 0},
        Target{"datastores", 1, kOldDatastores, kNewDatastores, 0},
        Target{"checkpointing policies", 0, kOldPolicies, kNewPolicies, 300, true}}) {
    SCOPED_TRACE(t.name);
    FreshCopy();
    ChildResult dry = RunChild([&](int fd) {
      KarstLib::ListPolicyInfo();  // opened: only the replace's own I/O is counted
      if (t.checkpoint) new CheckpointEveryCommit();  // the process ends with it
      FaultVfs::KeepLog(true);
      FaultVfs::Arm(IoFault{});
      Replace(t);
      for (const std::string& call : FaultVfs::Log()) WriteAll(fd, call + ",");
    });
    ASSERT_EQ(dry.code, 0) << dry.Describe();
    std::vector<std::string> calls;
    std::istringstream items(dry.output);
    for (std::string item; std::getline(items, item, ',');) calls.push_back(item);
    const int total = static_cast<int>(calls.size());
    ASSERT_GT(total, 0);

    // Every call of a small replace. Of a large one, an even sample, every
    // call around the last write to the log, and a sample of the checkpoint.
    std::set<int> points;
    const int limit = Scaled(120, 20);
    if (total <= limit) {
      for (int k = 1; k <= total; ++k) points.insert(k);
    } else {
      int lastLogWrite = total;
      while (lastLogWrite > 1 && calls[lastLogWrite - 1] != "write wal") --lastLogWrite;
      for (int i = 0; i < limit / 3; ++i) points.insert(1 + i * (total - 1) / (limit / 3));
      for (int k = std::max(1, lastLogWrite - 2); k <= std::min(total, lastLogWrite + 3); ++k) {
        points.insert(k);
      }
      for (int i = 0; i < limit / 3; ++i) {
        points.insert(lastLogWrite + (total - lastLogWrite) * (i + 1) / (limit / 3));
      }
    }

    int lastOld = 0, firstNew = 0;
    for (IoFault::Action action : {IoFault::kExit, IoFault::kTornExit}) {
      bool seenNew = false;
      for (int k : points) {
        SCOPED_TRACE(std::string(action == IoFault::kExit ? "crash before" : "crash half way in") +
                     " I/O call " + std::to_string(k) + " of " + std::to_string(total) + " (" +
                     calls[k - 1] + ")");
        FreshCopy();
        ChildResult crash = RunChild([&](int) {
          KarstLib::ListPolicyInfo();
          if (t.checkpoint) new CheckpointEveryCommit();
          IoFault fault;
          fault.action = action;
          fault.nth = k;
          fault.exitCode = kCrashExit;
          FaultVfs::Arm(fault);
          Replace(t);
          _exit(0);
        });
        EXPECT_EQ(crash.code, kCrashExit) << crash.Describe();
        const Verdict v = VerifyInFreshProcess();
        ++tried;
        const bool isOld = Matches(v, t, false);
        const bool isNew = Matches(v, t, true);
        if (isOld || isNew) {
          ++oldOrNew;
        } else {
          ADD_FAILURE() << "found " << v.Describe();
        }
        if (v.policies.kind == Observed::kTorn || v.datastores.kind == Observed::kTorn) {
          ++partial;
        }
        if (isOld && seenNew) {
          ++regressed;
          ADD_FAILURE() << "old list back after an earlier crash point had left the new one";
        }
        if (action == IoFault::kExit && isOld) lastOld = k;
        if (isNew && !seenNew && action == IoFault::kExit) firstNew = k;
        seenNew = seenNew || isNew;
      }
    }
    EXPECT_GT(firstNew, 0) << "no crash point left the new list";
    counts += std::string(counts.empty() ? "" : ", ") + std::to_string(points.size()) + " of " +
              std::to_string(total) + " (" + t.name + ")";
    durable += std::string(durable.empty() ? "" : ", ") + t.name + " old up to call " +
               std::to_string(lastOld) + (lastOld > 0 ? " (" + calls[lastOld - 1] + ")" : "") +
               ", new from " + std::to_string(firstNew) +
               (firstNew > 0 ? " (" + calls[firstNew - 1] + ")" : "");
  }
  ReportFigures("crash-io", "crash-io: I/O crash points " + counts +
                                ", each before the call and half way in: old-or-new " +
                                std::to_string(oldOrNew) + " of " + std::to_string(tried) +
                                ", partial " + std::to_string(partial) + ", new-then-old " +
                                std::to_string(regressed) + "; " + durable);
  EXPECT_EQ(oldOrNew, tried);
  EXPECT_EQ(partial, 0);
  EXPECT_EQ(regressed, 0);
}

}  // namespace
}  // namespace karst_reliability
