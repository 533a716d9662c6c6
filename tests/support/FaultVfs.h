// A SQLite VFS that wraps the default one and can fail, or end the process
// at, the Nth write, sync, truncate or read of any file SQLite opens through
// it.
// Installed as the default VFS, it sits under every connection the store
// opens afterwards, so the store is tested on the I/O errors SQLite itself
// sees from a failing disk.

#ifndef KARST_TESTS_SUPPORT_FAULT_VFS_H_
#define KARST_TESTS_SUPPORT_FAULT_VFS_H_

#include <string>
#include <vector>

namespace karst_test {

namespace io {
constexpr unsigned kWrite = 1;
constexpr unsigned kSync = 2;
constexpr unsigned kTruncate = 4;
constexpr unsigned kRead = 8;
constexpr unsigned kChanges = kWrite | kSync | kTruncate;
}  // namespace io

struct IoFault {
  // kTornExit writes the first half of the chosen write, then ends the
  // process, as a crash in the middle of a large write may; on a sync or
  // truncate it is kExit.
  enum Action { kNone, kFail, kExit, kTornExit };
  Action action = kNone;
  unsigned ops = io::kChanges;  // which calls are counted
  int nth = 1;                  // from 1, among the counted calls since arming
  bool persistent = false;      // also every counted call after the Nth
  // For kFail: the result the call returns instead of running. 0 picks the
  // matching SQLITE_IOERR_* code (write, fsync, truncate or read).
  int code = 0;
  int exitCode = 77;  // for kExit and kTornExit
};

class FaultVfs {
 public:
  // Registers the shim as the default VFS; once per process, idempotent.
  static void Install();
  // Replaces the armed fault and restarts the count.
  static void Arm(const IoFault& fault);
  static void Disarm() { Arm(IoFault{}); }
  // Counted calls since the last Arm that failed.
  static int Failed();
  // "write wal", "read db", ... for every counted call since the last Arm;
  // only kept while "keep" is set, for finding the calls of one operation.
  static void KeepLog(bool keep);
  static std::vector<std::string> Log();
};

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_FAULT_VFS_H_
