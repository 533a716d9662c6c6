#include "fault_vfs.h"

#include <sqlite3.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <mutex>

namespace karst_reliability {
namespace {

// The shim's file: its own header, then the wrapped VFS's file.
struct ShimFile {
  sqlite3_file base;
  sqlite3_file* real;
  const char* kind;  // "db", "wal", "journal" or "file"
};

sqlite3_vfs* gReal = nullptr;
sqlite3_vfs gVfs;
sqlite3_io_methods gMethods;

std::mutex gMu;  // guards the fault and the log; calls are counted under it
IoFault gFault;
int gCount = 0;
int gFailed = 0;
bool gKeepLog = false;
std::vector<std::string> gLog;

sqlite3_file* Real(sqlite3_file* f) { return reinterpret_cast<ShimFile*>(f)->real; }

constexpr int kTearThenExit = -1;

// Counts the call and returns what to do instead of running it: 0 to run it,
// kTearThenExit, else the error to return. May end the process.
int Intercept(sqlite3_file* f, unsigned op, int defaultCode) {
  std::lock_guard<std::mutex> lock(gMu);
  if ((gFault.ops & op) == 0) return 0;
  ++gCount;
  if (gKeepLog) {
    const char* name = op == io::kWrite ? "write " : op == io::kSync ? "sync " : "truncate ";
    gLog.push_back(std::string(name) + reinterpret_cast<ShimFile*>(f)->kind);
  }
  if (gFault.action == IoFault::kNone) return 0;
  if (gCount != gFault.nth && !(gFault.persistent && gCount > gFault.nth)) return 0;
  if (gFault.action == IoFault::kExit) _exit(gFault.exitCode);
  if (gFault.action == IoFault::kTornExit) {
    if (op != io::kWrite) _exit(gFault.exitCode);
    return kTearThenExit;
  }
  ++gFailed;
  return gFault.code != 0 ? gFault.code : defaultCode;
}

int Close(sqlite3_file* f) {
  sqlite3_file* real = Real(f);
  return real->pMethods->xClose(real);
}
int Read(sqlite3_file* f, void* buf, int amt, sqlite3_int64 off) {
  return Real(f)->pMethods->xRead(Real(f), buf, amt, off);
}
int Write(sqlite3_file* f, const void* buf, int amt, sqlite3_int64 off) {
  const int rc = Intercept(f, io::kWrite, SQLITE_IOERR_WRITE);
  if (rc == kTearThenExit) {
    Real(f)->pMethods->xWrite(Real(f), buf, amt / 2, off);
    _exit(gFault.exitCode);
  }
  if (rc != 0) return rc;
  return Real(f)->pMethods->xWrite(Real(f), buf, amt, off);
}
int Truncate(sqlite3_file* f, sqlite3_int64 size) {
  if (int rc = Intercept(f, io::kTruncate, SQLITE_IOERR_TRUNCATE)) return rc;
  return Real(f)->pMethods->xTruncate(Real(f), size);
}
int Sync(sqlite3_file* f, int flags) {
  if (int rc = Intercept(f, io::kSync, SQLITE_IOERR_FSYNC)) return rc;
  return Real(f)->pMethods->xSync(Real(f), flags);
}
int FileSize(sqlite3_file* f, sqlite3_int64* size) {
  return Real(f)->pMethods->xFileSize(Real(f), size);
}
int Lock(sqlite3_file* f, int level) { return Real(f)->pMethods->xLock(Real(f), level); }
int Unlock(sqlite3_file* f, int level) { return Real(f)->pMethods->xUnlock(Real(f), level); }
int CheckReservedLock(sqlite3_file* f, int* out) {
  return Real(f)->pMethods->xCheckReservedLock(Real(f), out);
}
int FileControl(sqlite3_file* f, int op, void* arg) {
  return Real(f)->pMethods->xFileControl(Real(f), op, arg);
}
int SectorSize(sqlite3_file* f) { return Real(f)->pMethods->xSectorSize(Real(f)); }
int DeviceCharacteristics(sqlite3_file* f) {
  return Real(f)->pMethods->xDeviceCharacteristics(Real(f));
}
int ShmMap(sqlite3_file* f, int region, int size, int extend, void volatile** out) {
  return Real(f)->pMethods->xShmMap(Real(f), region, size, extend, out);
}
int ShmLock(sqlite3_file* f, int offset, int n, int flags) {
  return Real(f)->pMethods->xShmLock(Real(f), offset, n, flags);
}
void ShmBarrier(sqlite3_file* f) { Real(f)->pMethods->xShmBarrier(Real(f)); }
int ShmUnmap(sqlite3_file* f, int deleteFlag) {
  return Real(f)->pMethods->xShmUnmap(Real(f), deleteFlag);
}
int Fetch(sqlite3_file* f, sqlite3_int64 off, int amt, void** out) {
  return Real(f)->pMethods->xFetch(Real(f), off, amt, out);
}
int Unfetch(sqlite3_file* f, sqlite3_int64 off, void* p) {
  return Real(f)->pMethods->xUnfetch(Real(f), off, p);
}

int Open(sqlite3_vfs*, sqlite3_filename name, sqlite3_file* file, int flags, int* outFlags) {
  auto* shim = reinterpret_cast<ShimFile*>(file);
  shim->real = reinterpret_cast<sqlite3_file*>(shim + 1);
  shim->kind = (flags & SQLITE_OPEN_MAIN_DB)        ? "db"
               : (flags & SQLITE_OPEN_WAL)          ? "wal"
               : (flags & SQLITE_OPEN_MAIN_JOURNAL) ? "journal"
                                                    : "file";
  const int rc = gReal->xOpen(gReal, name, shim->real, flags, outFlags);
  // SQLite closes the file only when pMethods is set; mirror the real one.
  file->pMethods = shim->real->pMethods != nullptr ? &gMethods : nullptr;
  return rc;
}

int Delete(sqlite3_vfs*, const char* name, int syncDir) {
  return gReal->xDelete(gReal, name, syncDir);
}
int Access(sqlite3_vfs*, const char* name, int flags, int* out) {
  return gReal->xAccess(gReal, name, flags, out);
}
int FullPathname(sqlite3_vfs*, const char* name, int n, char* out) {
  return gReal->xFullPathname(gReal, name, n, out);
}
void* DlOpen(sqlite3_vfs*, const char* name) { return gReal->xDlOpen(gReal, name); }
void DlError(sqlite3_vfs*, int n, char* out) { gReal->xDlError(gReal, n, out); }
void (*DlSym(sqlite3_vfs*, void* handle, const char* symbol))(void) {
  return gReal->xDlSym(gReal, handle, symbol);
}
void DlClose(sqlite3_vfs*, void* handle) { gReal->xDlClose(gReal, handle); }
int Randomness(sqlite3_vfs*, int n, char* out) { return gReal->xRandomness(gReal, n, out); }
int Sleep(sqlite3_vfs*, int us) { return gReal->xSleep(gReal, us); }
int CurrentTime(sqlite3_vfs*, double* out) { return gReal->xCurrentTime(gReal, out); }
int GetLastError(sqlite3_vfs*, int n, char* out) { return gReal->xGetLastError(gReal, n, out); }
int CurrentTimeInt64(sqlite3_vfs*, sqlite3_int64* out) {
  return gReal->xCurrentTimeInt64(gReal, out);
}

}  // namespace

void FaultVfs::Install() {
  static std::once_flag once;
  std::call_once(once, [] {
    gReal = sqlite3_vfs_find(nullptr);
    gMethods = sqlite3_io_methods{3,
                                  Close,
                                  Read,
                                  Write,
                                  Truncate,
                                  Sync,
                                  FileSize,
                                  Lock,
                                  Unlock,
                                  CheckReservedLock,
                                  FileControl,
                                  SectorSize,
                                  DeviceCharacteristics,
                                  ShmMap,
                                  ShmLock,
                                  ShmBarrier,
                                  ShmUnmap,
                                  Fetch,
                                  Unfetch};
    std::memset(&gVfs, 0, sizeof gVfs);
    gVfs.iVersion = 2;
    gVfs.szOsFile = static_cast<int>(sizeof(ShimFile)) + gReal->szOsFile;
    gVfs.mxPathname = gReal->mxPathname;
    gVfs.zName = "karst-fault";
    gVfs.xOpen = Open;
    gVfs.xDelete = Delete;
    gVfs.xAccess = Access;
    gVfs.xFullPathname = FullPathname;
    gVfs.xDlOpen = DlOpen;
    gVfs.xDlError = DlError;
    gVfs.xDlSym = DlSym;
    gVfs.xDlClose = DlClose;
    gVfs.xRandomness = Randomness;
    gVfs.xSleep = Sleep;
    gVfs.xCurrentTime = CurrentTime;
    gVfs.xGetLastError = GetLastError;
    gVfs.xCurrentTimeInt64 = CurrentTimeInt64;
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

int FaultVfs::Count() {
  std::lock_guard<std::mutex> lock(gMu);
  return gCount;
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

}  // namespace karst_reliability
