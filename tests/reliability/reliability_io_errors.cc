// I/O errors and a full disk under the SQLite store.
//
// Injected: the fault VFS fails every write, sync and truncate SQLite makes
// during a replace and during Reset, in turn: once, from then on, and as a
// full disk. The caller must get the I/O error, the catalogue must stay as
// it was (checked from a new process), nothing may stay open, and the next
// write must succeed once the disk works again. An error during the
// checkpoint that follows a commit must not undo the commit.
//
// Real: a file-size limit (RLIMIT_FSIZE, SIGXFSZ ignored) and a small tmpfs
// filled to the brim (in a private mount namespace; skipped where the
// machine does not allow it).

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <functional>
#include <iostream>
#include <set>
#include <string>
#include <vector>

#include "SqliteStoreTesting.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"
#include "fault_vfs.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoConfigStore::ConfigStore;
using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;

const Tag kOld{1, 5};
const Tag kNew{2, 9};

struct Write {
  const char* name;
  std::function<void()> run;
  bool resets;  // success empties both collections
};

std::vector<Write> Writes() {
  return {{"replace policies", [] { KarstLib::AddPolicyInfo(PoliciesFor(kNew)); }, false},
          {"replace datastores", [] { KarstLib::AddDatastoreInfo(DatastoresFor(kNew)); }, false},
          {"reset", [] { KarstLib::Reset(); }, true},
          // A checkpoint follows the commit.
          {"checkpointing replace",
           [] {
             CheckpointEveryCommit checkpoint;
             KarstLib::AddPolicyInfo(PoliciesFor(kNew, 300));
           },
           false}};
}

bool Is(const Observed& o, Tag tag) { return o.kind == Observed::kWhole && o.tag == tag; }

// Whether this thread's cached connection has a transaction open.
bool ThreadInTransaction() {
  auto store = ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  sqlite3* db = TavoConfigStore::SqliteConnectionForTesting(*store);
  return db != nullptr && sqlite3_get_autocommit(db) == 0;
}

class IoErrorTest : public ::testing::Test {
 protected:
  void SetUp() override {
    FaultVfs::Install();
    path_ = dir_.File("store.db");
    UseStoreAt(path_);
    Restore();
  }
  void TearDown() override { FaultVfs::Disarm(); }

  void Restore() {
    KarstLib::AddPolicyInfo(PoliciesFor(kOld));
    KarstLib::AddDatastoreInfo(DatastoresFor(kOld));
  }

  ScratchDir dir_;
  std::string path_;
};

TEST_F(IoErrorTest, EveryWriteSyncAndTruncateFails) {
  struct Mode {
    const char* name;
    bool persistent;
    int code;  // 0: the matching SQLITE_IOERR_*
  };
  const Mode modes[] = {{"once", false, 0}, {"from then on", true, 0}, {"disk full", true, 0}};
  int faults = 0, errorReached = 0, reportedDone = 0, intact = 0, openAfter = 0, nextOk = 0,
      wrong = 0;
  std::set<int> codes;
  std::string perWrite;
  for (const Write& w : Writes()) {
    SCOPED_TRACE(w.name);
    FaultVfs::KeepLog(true);
    FaultVfs::Arm(IoFault{});
    w.run();
    const std::vector<std::string> calls = FaultVfs::Log();
    FaultVfs::KeepLog(false);
    Restore();
    const int total = static_cast<int>(calls.size());
    ASSERT_GT(total, 0);

    // Every call of a small write; of the large one, a sample of the log
    // writes and everything from its last log write on.
    std::set<int> points;
    const int limit = Scaled(120, 12);
    if (total <= limit) {
      for (int k = 1; k <= total; ++k) points.insert(k);
    } else {
      int lastLogWrite = total;
      while (lastLogWrite > 1 && calls[lastLogWrite - 1] != "write wal") --lastLogWrite;
      for (int i = 0; i < limit / 2; ++i) points.insert(1 + i * (lastLogWrite - 1) / (limit / 2));
      for (int k = lastLogWrite; k <= total;
           k += std::max(1, (total - lastLogWrite) / (limit / 2))) {
        points.insert(k);
      }
      points.insert(total);
    }
    perWrite += std::string(perWrite.empty() ? "" : ", ") + w.name + " " +
                std::to_string(points.size()) + " of " + std::to_string(total);

    for (const Mode& mode : modes) {
      for (int k : points) {
        const bool isWrite = calls[k - 1].rfind("write", 0) == 0;
        if (mode.name == std::string("disk full") && !isWrite) continue;
        SCOPED_TRACE(std::string(mode.name) + " at I/O call " + std::to_string(k) + " (" +
                     calls[k - 1] + ")");
        IoFault fault;
        fault.action = IoFault::kFail;
        fault.nth = k;
        fault.persistent = mode.persistent;
        fault.code = mode.name == std::string("disk full") ? SQLITE_FULL : mode.code;
        FaultVfs::Arm(fault);
        bool threw = false;
        int code = 0;
        std::string message;
        try {
          w.run();
        } catch (const ConfigStoreException& e) {
          threw = true;
          code = e.Code();
          message = e.Message();
        }
        const int failed = FaultVfs::Failed();
        FaultVfs::Disarm();
        ++faults;
        EXPECT_GT(failed, 0) << "the fault never fired";

        const Verdict v = VerifyInFreshProcess();
        if (threw) {
          codes.insert(code);
          const int primary = code & 0xff;
          // The I/O error itself, or the rollback it caused.
          if (primary == SQLITE_IOERR || primary == SQLITE_FULL || code == SQLITE_ABORT_ROLLBACK) {
            ++errorReached;
          } else {
            ++wrong;
            ADD_FAILURE() << "unexpected error " << code << ": " << message;
          }
          if (Is(v.policies, kOld) && Is(v.datastores, kOld)) {
            ++intact;
          } else {
            ADD_FAILURE() << "failed write changed the store: " << v.Describe();
          }
        } else {
          // SQLite may survive a failed call (the checkpoint after the
          // commit); then the write must be there in full.
          ++reportedDone;
          const bool done = w.resets ? v.policies.kind == Observed::kEmpty &&
                                           v.datastores.kind == Observed::kEmpty
                                     : (Is(v.policies, kNew) || Is(v.datastores, kNew));
          if (!done) {
            ++wrong;
            ADD_FAILURE() << "reported done, store holds " << v.Describe();
          }
        }
        if (ThreadInTransaction()) {
          ++openAfter;
          ADD_FAILURE() << "transaction left open";
        }
        try {
          w.run();
          ++nextOk;
        } catch (const ConfigStoreException& e) {
          ADD_FAILURE() << "next write failed: " << e.what();
        }
        Restore();
      }
    }
  }
  std::string codeList;
  for (int c : codes) codeList += (codeList.empty() ? "" : "/") + std::to_string(c);
  ReportFigures("io-errors", "io-errors: " + std::to_string(faults) +
                                 " injected write/sync/truncate failures (once, from then on, "
                                 "disk full) at I/O calls of " +
                                 perWrite + ": error reached the caller " +
                                 std::to_string(errorReached) + " (codes " + codeList +
                                 "), catalogue intact after the error " + std::to_string(intact) +
                                 ", reported done with the write in full " +
                                 std::to_string(reportedDone) + ", left open " +
                                 std::to_string(openAfter) + ", next write ok " +
                                 std::to_string(nextOk) + ", wrong " + std::to_string(wrong));
  EXPECT_EQ(intact, errorReached);
  EXPECT_EQ(errorReached + reportedDone, faults);
  EXPECT_EQ(nextOk, faults);
  EXPECT_EQ(openAfter, 0);
  EXPECT_EQ(wrong, 0);
}

// A failed fsync of the commit leaves a complete transaction in the log that
// SQLite has not made visible. If the process then dies, the next process
// reads the log afresh: the write must come back whole or not at all.
TEST_F(IoErrorTest, FailedCommitSyncThenCrash) {
  int oldAfter = 0, newAfter = 0;
  const int rounds = 2;
  for (int round = 0; round < rounds; ++round) {
    ChildResult r = RunChild([](int fd) {
      KarstLib::ListPolicyInfo();
      IoFault fault;
      fault.action = IoFault::kFail;
      fault.ops = io::kSync;
      fault.nth = 1;
      FaultVfs::Arm(fault);
      try {
        KarstLib::AddPolicyInfo(PoliciesFor(kNew));
        WriteAll(fd, "returned");
      } catch (const ConfigStoreException& e) {
        WriteAll(fd, std::to_string(e.Code()));
      }
      _exit(0);  // dies without closing the store
    });
    ASSERT_EQ(r.code, 0) << r.Describe();
    EXPECT_EQ(r.output, std::to_string(SQLITE_IOERR_FSYNC));
    const Verdict v = VerifyInFreshProcess();
    ASSERT_TRUE(v.ok) << v.error;
    EXPECT_TRUE(Is(v.datastores, kOld));
    if (Is(v.policies, kOld)) {
      ++oldAfter;
    } else if (Is(v.policies, kNew)) {
      ++newAfter;
    } else {
      ADD_FAILURE() << v.Describe();
    }
    Restore();
  }
  ReportFigures("io-sync-crash", "io-sync-crash: commit fsync failed (error " +
                                     std::to_string(SQLITE_IOERR_FSYNC) +
                                     " to the caller), then the process died: next process "
                                     "found the old list " +
                                     std::to_string(oldAfter) + " times, the new list " +
                                     std::to_string(newAfter) + ", a mixture 0");
}

std::uintmax_t SizeOr0(const std::string& path) {
  std::error_code ec;
  const std::uintmax_t size = std::filesystem::file_size(path, ec);
  return ec ? 0 : size;
}

// Seeds the store at "path", takes the space away, tries a large replace,
// gives the space back, verifies and tries again, all on the same connection.
// Reports "code open old-after-failure retried new-after-retry".
void FillUpThenRetry(int fd, const std::string& path, const std::function<void()>& takeSpace,
                     const std::function<void()>& giveSpace) {
  UseStoreAt(path);
  KarstLib::AddPolicyInfo(PoliciesFor(kOld));
  KarstLib::AddDatastoreInfo(DatastoresFor(kOld));
  takeSpace();
  int code = 0;
  try {
    KarstLib::AddPolicyInfo(PoliciesFor(kNew, 1500));
  } catch (const ConfigStoreException& e) {
    code = e.Code();
  }
  const bool open = ThreadInTransaction();
  giveSpace();
  const Verdict before = VerifyInFreshProcess();
  bool retried = true;
  try {
    KarstLib::AddPolicyInfo(PoliciesFor(kNew, 1500));
  } catch (const ConfigStoreException&) {
    retried = false;
  }
  const Verdict after = VerifyInFreshProcess();
  WriteAll(fd, std::to_string(code) + " " + std::to_string(open) + " " +
                   std::to_string(Is(before.policies, kOld) && Is(before.datastores, kOld)) + " " +
                   std::to_string(retried) + " " +
                   std::to_string(Is(after.policies, kNew) && Is(after.datastores, kOld)));
}

struct SpaceResult {
  int code = 0, open = 1, oldAfterFailure = 0, retried = 0, newAfterRetry = 0;
  std::string Describe() const {
    return "error " + std::to_string(code) + " to the caller, left open " + std::to_string(open) +
           ", old list intact " + std::to_string(oldAfterFailure) +
           ", write after space returned " + (retried && newAfterRetry ? "ok" : "FAILED");
  }
};

SpaceResult Parse(const ChildResult& r) {
  SpaceResult s;
  EXPECT_EQ(r.code, 0) << r.Describe();
  EXPECT_EQ(std::sscanf(r.output.c_str(), "%d %d %d %d %d", &s.code, &s.open, &s.oldAfterFailure,
                        &s.retried, &s.newAfterRetry),
            5)
      << r.Describe();
  return s;
}

void ExpectFullDiskHandled(const SpaceResult& s) {
  EXPECT_TRUE((s.code & 0xff) == SQLITE_FULL || (s.code & 0xff) == SQLITE_IOERR) << s.code;
  EXPECT_EQ(s.open, 0);
  EXPECT_EQ(s.oldAfterFailure, 1);
  EXPECT_EQ(s.retried, 1);
  EXPECT_EQ(s.newAfterRetry, 1);
}

TEST_F(IoErrorTest, FileSizeLimit) {
  const std::string path = dir_.File("limited.db");
  const ChildResult r = RunChild([&](int fd) {
    signal(SIGXFSZ, SIG_IGN);  // the write fails with EFBIG instead
    FillUpThenRetry(
        fd, path,
        [&] {
          rlimit limit{};
          getrlimit(RLIMIT_FSIZE, &limit);
          limit.rlim_cur = std::max(SizeOr0(path), SizeOr0(path + "-wal")) + 64 * 1024;
          setrlimit(RLIMIT_FSIZE, &limit);
        },
        [] {
          rlimit limit{};
          getrlimit(RLIMIT_FSIZE, &limit);
          limit.rlim_cur = limit.rlim_max;
          setrlimit(RLIMIT_FSIZE, &limit);
        });
  });
  const SpaceResult s = Parse(r);
  ReportFigures("io-file-size-limit", "io-file-size-limit: " + s.Describe());
  ExpectFullDiskHandled(s);
}

TEST_F(IoErrorTest, FullTmpfs) {
  const std::string mountPoint = dir_.File("tmpfs");
  ASSERT_EQ(mkdir(mountPoint.c_str(), 0700), 0);
  const ChildResult r = RunChild([&](int fd) {
    // A private mount namespace: the tmpfs is seen by this process and its
    // children only, and goes away with them.
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) ||
        mount("tmpfs", mountPoint.c_str(), "tmpfs", 0, "size=8m,mode=0700") != 0) {
      WriteAll(fd, std::string("skip: cannot mount a tmpfs here: ") + std::strerror(errno));
      return;
    }
    const std::string filler = mountPoint + "/filler";
    FillUpThenRetry(
        fd, mountPoint + "/store.db",
        [&] {
          const int f = open(filler.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
          const std::string chunk(64 * 1024, 'f');
          while (write(f, chunk.data(), chunk.size()) > 0) {
          }
          const std::string tail(512, 'f');
          while (write(f, tail.data(), tail.size()) > 0) {
          }
          close(f);
        },
        [&] { unlink(filler.c_str()); });
  });
  if (r.output.rfind("skip:", 0) == 0) {
    std::cout << r.output << std::endl;
    ReportFigures("io-tmpfs-full", "io-tmpfs-full: skipped (" + r.output + ")");
    GTEST_SKIP() << r.output;
  }
  const SpaceResult s = Parse(r);
  ReportFigures("io-tmpfs-full", "io-tmpfs-full: 8 MiB tmpfs filled up: " + s.Describe());
  ExpectFullDiskHandled(s);
}

}  // namespace
}  // namespace karst_reliability
