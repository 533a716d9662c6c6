// Crashes, I/O errors and a full disk under the SQLite store.
//
// Injected: the fault VFS fails every write, sync, truncate and read SQLite
// makes during a replace, during Reset and during a rollback to a kept
// version, in turn: once, from then on, and
// (writes) as a full disk. Each runs on a new connection with a cold cache, so
// reads happen inside the write statements; an I/O error there makes SQLite
// roll the whole transaction back by itself, and the store must not go on
// writing outside it. The caller must get the error, a new process must find
// the catalogue as it was, nothing may stay open, and the next write on the
// same connection must work. An error during the checkpoint after a commit
// must not undo the commit. The fault VFS also ends the process at, or half
// way through, each of those calls: a new process must find each collection
// old or new, and once a crash point leaves the new state, every later one
// must too. The checkpoint puts crash points inside the copy of the log into
// the database file as well. A failed fsync of a commit leaves a complete
// transaction in the log that SQLite has not made visible; when the process
// then dies, the next one reads the log afresh: the write must come back
// whole or not at all.
//
// Real: a file-size limit (RLIMIT_FSIZE, SIGXFSZ ignored) and a small tmpfs
// filled to the brim (in a private mount namespace; skipped where the
// machine does not allow it).

#include "TavoConfigStore/StoreHistory.h"
#include "reliability_util.h"

namespace karst_reliability {

const Tag kOld{1, 5}, kNew{2, 9}, kLarge{2, 9, 300}, kHuge{2, 9, 1500};

// A copy of "seed" (the old catalogue, cleanly closed: no log) under a new
// connection with a cold cache: every run starts from the same state and
// makes the same I/O calls.
void Restore(const std::string& path, const std::string& seed) {
  TavoConfigStore::SetGlobalStore(nullptr);
  for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path + suffix);
  std::filesystem::copy_file(seed, path);
  TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(path));
}

// Which of an operation's I/O calls (as FaultVfs logs them) to crash or
// fail at: every call of a short one; of a long one an even sample of about
// "limit" and every call around its last write to the log, where the commit
// becomes durable.
std::vector<int> IoPoints(const std::vector<std::string>& calls, int limit) {
  const int total = static_cast<int>(calls.size());
  int lastLogWrite = total;
  while (lastLogWrite > 1 && calls[lastLogWrite - 1] != "write wal") --lastLogWrite;
  std::vector<int> points;
  for (int k = 1; k <= total; ++k) {
    if (total <= limit || k % (total / limit + 1) == 0 || std::abs(k - lastLogWrite) <= 3) {
      points.push_back(k);
    }
  }
  return points;
}

// The I/O error itself, or the rollback it caused.
bool IoError(int code) {
  return code % 256 == SQLITE_IOERR || code % 256 == SQLITE_FULL || code == SQLITE_ABORT_ROLLBACK;
}

// Whether some connection still keeps a write transaction open on "path".
bool LeftOpen(const std::string& path) {
  return RawDb(path).Exec("BEGIN IMMEDIATE; ROLLBACK;") != SQLITE_OK;
}

TEST(IoErrors, EveryWriteSyncTruncateAndReadFailsOrCrashes) {
  FaultVfs::Install();
  ScratchDir dir;
  const std::string path = dir.File("store.db"), seed = dir.File("seed.db");
  UseStoreAt(path);
  TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(seed));
  StoreCatalogue({PoliciesFor(kNew), DatastoresFor(kNew)});  // version 2, for the rollback
  StoreCatalogue({PoliciesFor(kOld), DatastoresFor(kOld)});
  const auto replacePolicies = [] { KarstLib::AddPolicyInfo(PoliciesFor(kNew)); };
  const auto replaceDatastores = [] { KarstLib::AddDatastoreInfo(DatastoresFor(kNew)); };
  const auto replaceAndCheckpoint = [path] {
    KarstLib::AddPolicyInfo(PoliciesFor(kLarge));
    // A full checkpoint (the copy of the log into the database file) through
    // a connection of its own, as after a commit, so faults land inside one
    // without writing the thousand pages SQLite waits for. Its failures are
    // not the commit's: the log keeps the transaction.
    sqlite3* db = nullptr;
    sqlite3_open(path.c_str(), &db);
    sqlite3_exec(db, "PRAGMA wal_checkpoint(FULL);", nullptr, nullptr, nullptr);
    sqlite3_close(db);
  };
  const auto rollBack = [] {
    TavoConfigStore::Rollback(
        *TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace), 2);
  };
  const SweepOperation writes[] = {
      {"replace policies", replacePolicies, {PoliciesFor(kNew), DatastoresFor(kOld)}},
      {"replace datastores", replaceDatastores, {PoliciesFor(kOld), DatastoresFor(kNew)}},
      {"reset", KarstLib::Reset, {}},
      {"rollback", rollBack, {PoliciesFor(kNew), DatastoresFor(kNew)}},
      {"checkpointing replace", replaceAndCheckpoint, {PoliciesFor(kLarge), DatastoresFor(kOld)}}};
  // The call fails once, from then on, or as a full disk; or the process
  // ends before the call, half way through it (a torn write), or after a
  // failed sync (the commit may be in the log unseen).
  const unsigned ops = io::kChanges | io::kRead;
  struct Mode {
    IoFault fault;
    const char* only;  // the kind of call, "" for all
    bool dies;         // runs in a child that then ends
  };
  const Mode modes[] = {{{IoFault::kFail, ops, 0, false}, "", false},
                        {{IoFault::kFail, ops, 0, true}, "", false},
                        {{IoFault::kFail, ops, 0, true, SQLITE_FULL}, "write", false},
                        {{IoFault::kExit, ops}, "", true},
                        {{IoFault::kTornExit, ops}, "", true},
                        {{IoFault::kFail, ops}, "sync", true}};
  const std::string old = State(kOld, kOld);
  // By the kind of call that failed: [0] write, sync or truncate, [1] read.
  int faults[2] = {}, errors[2] = {}, wrong[2] = {};
  // [0] crashes, [1] failed syncs followed by the end of the process.
  int deaths[2] = {}, torn[2] = {}, neither[2] = {}, news[2] = {}, newThenOld = 0;
  std::string perWrite;
  for (const SweepOperation& w : writes) {
    const std::string after = State(w.after);
    Restore(path, seed);
    FaultVfs::KeepLog(true);
    FaultVfs::Arm({IoFault::kNone, ops});
    w.run();
    const std::vector<std::string> calls = FaultVfs::Log();
    FaultVfs::KeepLog(false);
    const std::vector<int> points = IoPoints(calls, Scaled(140, 12));
    perWrite +=
        w.name + " " + std::to_string(points.size()) + " of " + std::to_string(calls.size()) + ", ";
    for (const Mode& m : modes) {
      IoFault fault = m.fault;
      bool seenNew = false;
      for (int k : points) {
        if (calls[k - 1].rfind(m.only, 0) != 0) continue;
        SCOPED_TRACE(w.name + ", I/O call " + std::to_string(k) + " " + calls[k - 1] + ", mode " +
                     std::to_string(&m - modes));
        Restore(path, seed);
        fault.nth = k;
        int code = 0;
        auto run = [&] {
          FaultVfs::Arm(fault);
          try {
            w.run();
          } catch (const ConfigStoreException& e) {
            code = e.Code();
            if (e.Message().find(path) == std::string::npos) code = -1;  // names no file
          }
        };
        if (m.dies) {
          // A new connection in the child, as the one Restore opened.
          TavoConfigStore::SetGlobalStore(nullptr);
          const ChildResult r = RunChild([&](int) {
            TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(path));
            run();
            _exit(0);
          });
          EXPECT_EQ(r.code, fault.action == IoFault::kFail ? 0 : fault.exitCode);
          // Once a crash point left the new state, every later one must too.
          const std::string seen = ReadInFreshProcess();
          const int i = fault.action == IoFault::kFail;
          ++deaths[i];
          torn[i] += seen.find("torn") != std::string::npos;
          neither[i] += seen != old && seen != after;
          news[i] += seen == after;
          newThenOld += seen == old && seenNew;
          EXPECT_TRUE(seen == after || (seen == old && !seenNew)) << seen;
          seenNew = seenNew || seen == after;
          continue;
        }
        const bool isRead = calls[k - 1].rfind("read", 0) == 0;
        run();
        EXPECT_GT(FaultVfs::Failed(), 0) << "the fault never fired";
        FaultVfs::Disarm();
        // SQLite may survive a failed call (a read it retries, the checkpoint
        // after the commit); then the write is there in full. Either way no
        // transaction stays open and the next write works.
        const std::string seen = ReadInFreshProcess();
        const bool right =
            (code == 0 ? seen == after : IoError(code) && seen == old) && !LeftOpen(path);
        EXPECT_TRUE(right) << "error " << code << ", store holds " << seen;
        ++faults[isRead];
        errors[isRead] += code != 0;
        wrong[isRead] += !right;
        w.run();
      }
      EXPECT_TRUE(fault.action == IoFault::kFail || seenNew) << "no crash left the new state";
    }
  }
  TavoConfigStore::SetGlobalStore(nullptr);
  ReportFigures("crash-io",
                "crash-io: %d crashes at the I/O calls of %seach before the call and half way "
                "in: partial %d, neither old nor new %d, new-then-old %d",
                deaths[0], perWrite.c_str(), torn[0], neither[0], newThenOld);
  ReportFigures("io-errors",
                "io-errors: %d write/sync/truncate/read failures (once, from then on, disk full) "
                "at the same calls: error to the caller %d, wrong (error lost or unclear, "
                "catalogue changed, transaction left open) %d; every next write worked",
                faults[0] + faults[1], errors[0] + errors[1], wrong[0] + wrong[1]);
  ReportFigures("sqlite-rollback",
                "sqlite-rollback: %d reads failed inside those writes (an I/O error in a "
                "statement makes SQLite roll the transaction back itself): error to the caller "
                "%d, wrong %d",
                faults[1], errors[1], wrong[1]);
  ReportFigures("io-sync-crash",
                "io-sync-crash: %d syncs failed, then the process died: next process found the "
                "old state %d times, the new %d, partial %d, neither %d",
                deaths[1], deaths[1] - news[1] - neither[1], news[1], torn[1], neither[1]);
  EXPECT_GT(errors[1], 0) << "no read failure reached the caller";
}

// A real lack of space, in a child: the store is seeded, the space taken
// away (a file-size limit, with SIGXFSZ ignored so the write fails with
// EFBIG; or a small tmpfs filled to the brim), a large replace tried, the
// space given back and the replace tried again on the same connection.
TEST(IoErrors, FileSizeLimitAndFullTmpfs) {
  ScratchDir dir;
  const std::string tmpfs = dir.File("tmpfs"), filler = tmpfs + "/filler";
  std::filesystem::create_directory(tmpfs);
  for (const bool onTmpfs : {false, true}) {
    const std::string path = onTmpfs ? tmpfs + "/store.db" : dir.File("store.db");
    const ChildResult r = RunChild([&](int fd) {
      UseStoreAt(path);
      TavoConfigStore::SetGlobalStore(nullptr);
      // A private mount namespace: the tmpfs is seen by this process and its
      // children only, and goes away with them.
      if (onTmpfs && (unshare(CLONE_NEWNS) != 0 ||
                      mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
                      mount("tmpfs", tmpfs.c_str(), "tmpfs", 0, "size=8m,mode=0700") != 0)) {
        return WriteAll(fd, "skipped (cannot mount a tmpfs here)");
      }
      StoreCatalogue({PoliciesFor(kOld), DatastoresFor(kOld)});
      signal(SIGXFSZ, SIG_IGN);
      const rlimit none{RLIM_INFINITY, RLIM_INFINITY},
          limit{std::filesystem::file_size(path) + (1 << 16), RLIM_INFINITY};
      if (!onTmpfs) setrlimit(RLIMIT_FSIZE, &limit);
      if (onTmpfs) std::ofstream(filler) << std::string(8 << 20, 'f');
      int code = 0;
      try {
        KarstLib::AddPolicyInfo(PoliciesFor(kHuge));
      } catch (const ConfigStoreException& e) {
        code = e.Code();
      }
      setrlimit(RLIMIT_FSIZE, &none);
      std::filesystem::remove(filler);
      const bool intact = ReadInFreshProcess() == State(kOld, kOld), open = LeftOpen(path);
      KarstLib::AddPolicyInfo(PoliciesFor(kHuge));
      const bool retried = ReadInFreshProcess() == State(kHuge, kOld);
      const int wrong = !IoError(code) + open + !intact + !retried;
      WriteAll(fd, "error " + std::to_string(code) + " to the caller, left open " +
                       std::to_string(open) + ", old list intact " + std::to_string(intact) +
                       ", write after space returned " + (retried ? "ok" : "FAILED") + ", wrong " +
                       std::to_string(wrong));
      _exit(wrong);
    });
    EXPECT_TRUE(r.Ok()) << r.Describe();
    const char* part = onTmpfs ? "io-tmpfs-full" : "io-file-size-limit";
    ReportFigures(part, "%s: %s", part, r.output.c_str());
  }
}

// A store file of either earlier format, as those builds wrote it, is
// upgraded in place by the first process that opens it, in one transaction:
// a crash at any write, sync or truncate of the upgrade, or an I/O error at
// any of its calls (reads included), leaves a file from which the next
// process reads the whole catalogue in its order.
void UpgradeIsAllOrNothing(const std::string& format);

TEST(IoErrors, UpgradeOfAnOldStoreFileIsAllOrNothing) {
  for (const char* format : {"1", "2"}) {
    SCOPED_TRACE(std::string("format ") + format);
    UpgradeIsAllOrNothing(format);
  }
}

void UpgradeIsAllOrNothing(const std::string& format) {
  FaultVfs::Install();
  ScratchDir dir;
  const std::string path = dir.File("store.db");
  const std::string fixture =
      ReadFile(std::string(KARST_FIXTURES_DIR) + "/store-format" + format + ".db");
  auto restore = [&] {
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path + suffix);
    WriteFile(path, fixture);
  };
  // What a new process lists (names in order and both digests), and the
  // format the file has after it.
  auto readAfresh = [&] {
    const ChildResult r = RunChild([&](int fd) {
      UseStoreAt(path);
      std::string seen;
      for (const auto& p : KarstLib::ListPolicyInfo()) seen += p.name + ",";
      for (const auto& d : KarstLib::ListDatastoreInfo()) seen += d.url + ",";
      const auto hash = KarstLib::GetDbHash();
      WriteAll(fd, seen + hash.first + " " + hash.second);
    });
    return (r.Ok() ? r.output : r.Describe()) + " format " +
           RawDb(path).QueryText("PRAGMA user_version");
  };
  const std::string whole =
      "gold,silver,bronze,ds://cluster-a/pool-ssd,ds://archive-01/export,"
      "ds://cluster-b/pool-ssd,42207bee 14fc1308 format 3";

  restore();
  FaultVfs::KeepLog(true);
  FaultVfs::Arm({IoFault::kNone, io::kChanges | io::kRead});
  TavoConfigStore::NewSqliteStore(path);  // upgrades, and closes
  const int calls = static_cast<int>(FaultVfs::Log().size());
  FaultVfs::KeepLog(false);
  FaultVfs::Disarm();
  ASSERT_EQ(readAfresh(), whole);

  int points = 0, refused = 0, wrong = 0;
  for (const IoFault::Action action : {IoFault::kExit, IoFault::kTornExit, IoFault::kFail}) {
    for (int k = 1; k <= calls; ++k) {
      restore();
      const ChildResult r = RunChild([&](int fd) {
        FaultVfs::Arm({action, io::kChanges | io::kRead, k});
        try {
          TavoConfigStore::NewSqliteStore(path);
        } catch (const ConfigStoreException& e) {
          WriteAll(fd, e.Message().find(path) != std::string::npos ? "refused" : e.Message());
        }
        _exit(0);
      });
      const bool died = action != IoFault::kFail;
      EXPECT_EQ(r.code, died ? 77 : 0) << k << " " << r.Describe();
      EXPECT_TRUE(r.output.empty() || r.output == "refused") << r.output;
      refused += r.output == "refused";
      const std::string seen = readAfresh();
      wrong += seen != whole;
      EXPECT_EQ(seen, whole) << "action " << action << " at I/O call " << k;
      ++points;
    }
  }
  ReportFigures(
      ("upgrade" + format).c_str(),
      "upgrade%s: a store file of format %s, a crash (whole or torn write) or an I/O error at "
      "each of the %d reads, writes, syncs and truncates of its upgrade: %d points, errors "
      "naming the file %d, next process read the catalogue whole %d, wrong %d",
      format.c_str(), format.c_str(), calls, points, refused, points - wrong, wrong);
}

}  // namespace karst_reliability
