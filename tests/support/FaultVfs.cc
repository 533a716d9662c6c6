#include "FaultVfs.h"

#include <sqlite3.h>
#include <unistd.h>

#include <map>
#include <mutex>

namespace karst_test {
namespace {

// The shim hands SQLite the default VFS's own files with a copy of their
// methods in which the counted calls go through Intercept first.
sqlite3_vfs* gReal = nullptr;
sqlite3_vfs gVfs;

std::mutex gMu;  // guards everything below
IoFault gFault;
int gCount = 0, gFailed = 0;
bool gKeepLog = false;
std::vector<std::string> gLog;
struct Watched {
  const char* kind;  // "db", "wal", "journal" or "file"
  const sqlite3_io_methods* real;
};
std::map<const sqlite3_file*, Watched> gFiles;
std::map<const sqlite3_io_methods*, sqlite3_io_methods> gCopies;  // of each real set of methods

const sqlite3_io_methods* Real(sqlite3_file* f) {
  std::lock_guard<std::mutex> lock(gMu);
  return gFiles.at(f).real;
}

constexpr int kTearThenExit = -1;

// Counts the call and returns what to do instead of running it: 0 to run it,
// kTearThenExit, else the error to return. May end the process.
int Intercept(sqlite3_file* f, unsigned op, int defaultCode) {
  std::lock_guard<std::mutex> lock(gMu);
  if ((gFault.ops & op) == 0) return 0;
  ++gCount;
  if (gKeepLog) {
    const char* name = op == io::kWrite  ? "write "
                       : op == io::kSync ? "sync "
                       : op == io::kRead ? "read "
                                         : "truncate ";
    gLog.push_back(name + std::string(gFiles.at(f).kind));
  }
  if (gFault.action == IoFault::kNone) return 0;
  if (gCount != gFault.nth && !(gFault.persistent && gCount > gFault.nth)) return 0;
  if (gFault.action == IoFault::kExit ||
      (gFault.action == IoFault::kTornExit && op != io::kWrite)) {
    _exit(gFault.exitCode);
  }
  if (gFault.action == IoFault::kTornExit) return kTearThenExit;
  ++gFailed;
  return gFault.code != 0 ? gFault.code : defaultCode;
}

int Write(sqlite3_file* f, const void* buf, int amt, sqlite3_int64 off) {
  const int rc = Intercept(f, io::kWrite, SQLITE_IOERR_WRITE);
  if (rc == kTearThenExit) {
    Real(f)->xWrite(f, buf, amt / 2, off);
    _exit(gFault.exitCode);
  }
  return rc != 0 ? rc : Real(f)->xWrite(f, buf, amt, off);
}
int Read(sqlite3_file* f, void* buf, int amt, sqlite3_int64 off) {
  const int rc = Intercept(f, io::kRead, SQLITE_IOERR_READ);
  return rc != 0 ? rc : Real(f)->xRead(f, buf, amt, off);
}
int Truncate(sqlite3_file* f, sqlite3_int64 size) {
  const int rc = Intercept(f, io::kTruncate, SQLITE_IOERR_TRUNCATE);
  return rc != 0 ? rc : Real(f)->xTruncate(f, size);
}
int Sync(sqlite3_file* f, int flags) {
  const int rc = Intercept(f, io::kSync, SQLITE_IOERR_FSYNC);
  return rc != 0 ? rc : Real(f)->xSync(f, flags);
}
int Close(sqlite3_file* f) {
  const sqlite3_io_methods* real = Real(f);
  {
    std::lock_guard<std::mutex> lock(gMu);
    gFiles.erase(f);
  }
  return real->xClose(f);
}

int Open(sqlite3_vfs*, sqlite3_filename name, sqlite3_file* file, int flags, int* outFlags) {
  const int rc = gReal->xOpen(gReal, name, file, flags, outFlags);
  if (file->pMethods == nullptr) return rc;
  std::lock_guard<std::mutex> lock(gMu);
  auto [copy, added] = gCopies.try_emplace(file->pMethods, *file->pMethods);
  if (added) {
    copy->second.xWrite = Write;
    copy->second.xRead = Read;
    copy->second.xTruncate = Truncate;
    copy->second.xSync = Sync;
    copy->second.xClose = Close;
  }
  gFiles[file] = {(flags & SQLITE_OPEN_MAIN_DB)        ? "db"
                  : (flags & SQLITE_OPEN_WAL)          ? "wal"
                  : (flags & SQLITE_OPEN_MAIN_JOURNAL) ? "journal"
                                                       : "file",
                  file->pMethods};
  file->pMethods = &copy->second;
  return rc;
}

}  // namespace

void FaultVfs::Install() {
  static std::once_flag once;
  std::call_once(once, [] {
    gReal = sqlite3_vfs_find(nullptr);
    gVfs = *gReal;
    gVfs.pNext = nullptr;
    gVfs.zName = "karst-fault";
    gVfs.xOpen = Open;
    sqlite3_vfs_register(&gVfs, 1);
  });
}

void FaultVfs::Arm(const IoFault& fault) {
  std::lock_guard<std::mutex> lock(gMu);
  gFault = fault;
  gCount = 0;
  gFailed = 0;
  gLog.clear();
}

int FaultVfs::Failed() {
  std::lock_guard<std::mutex> lock(gMu);
  return gFailed;
}

void FaultVfs::KeepLog(bool keep) {
  std::lock_guard<std::mutex> lock(gMu);
  gKeepLog = keep;
  gLog.clear();
}

std::vector<std::string> FaultVfs::Log() {
  std::lock_guard<std::mutex> lock(gMu);
  return gLog;
}

}  // namespace karst_test
