#include "StoreErrors.h"

#include <sqlite3.h>

#include <iterator>
#include <utility>
#include <vector>

namespace karstctl {

namespace {

using Names = std::vector<std::pair<std::int32_t, const char*>>;

#define KARSTCTL_CODE(name) \
  { name, #name }

// The codes a store can meet: every primary code, and the extended codes of
// locking, I/O, opening, corruption and rollback.
const Names& SqliteNames() {
  static const Names names = {
      KARSTCTL_CODE(SQLITE_ERROR),
      KARSTCTL_CODE(SQLITE_INTERNAL),
      KARSTCTL_CODE(SQLITE_PERM),
      KARSTCTL_CODE(SQLITE_ABORT),
      KARSTCTL_CODE(SQLITE_BUSY),
      KARSTCTL_CODE(SQLITE_LOCKED),
      KARSTCTL_CODE(SQLITE_NOMEM),
      KARSTCTL_CODE(SQLITE_READONLY),
      KARSTCTL_CODE(SQLITE_INTERRUPT),
      KARSTCTL_CODE(SQLITE_IOERR),
      KARSTCTL_CODE(SQLITE_CORRUPT),
      KARSTCTL_CODE(SQLITE_NOTFOUND),
      KARSTCTL_CODE(SQLITE_FULL),
      KARSTCTL_CODE(SQLITE_CANTOPEN),
      KARSTCTL_CODE(SQLITE_PROTOCOL),
      KARSTCTL_CODE(SQLITE_EMPTY),
      KARSTCTL_CODE(SQLITE_SCHEMA),
      KARSTCTL_CODE(SQLITE_TOOBIG),
      KARSTCTL_CODE(SQLITE_CONSTRAINT),
      KARSTCTL_CODE(SQLITE_MISMATCH),
      KARSTCTL_CODE(SQLITE_MISUSE),
      KARSTCTL_CODE(SQLITE_NOLFS),
      KARSTCTL_CODE(SQLITE_AUTH),
      KARSTCTL_CODE(SQLITE_FORMAT),
      KARSTCTL_CODE(SQLITE_RANGE),
      KARSTCTL_CODE(SQLITE_NOTADB),
      KARSTCTL_CODE(SQLITE_ABORT_ROLLBACK),
      KARSTCTL_CODE(SQLITE_BUSY_RECOVERY),
      KARSTCTL_CODE(SQLITE_BUSY_SNAPSHOT),
      KARSTCTL_CODE(SQLITE_BUSY_TIMEOUT),
      KARSTCTL_CODE(SQLITE_LOCKED_SHAREDCACHE),
      KARSTCTL_CODE(SQLITE_READONLY_RECOVERY),
      KARSTCTL_CODE(SQLITE_READONLY_CANTLOCK),
      KARSTCTL_CODE(SQLITE_READONLY_ROLLBACK),
      KARSTCTL_CODE(SQLITE_READONLY_DBMOVED),
      KARSTCTL_CODE(SQLITE_READONLY_CANTINIT),
      KARSTCTL_CODE(SQLITE_READONLY_DIRECTORY),
      KARSTCTL_CODE(SQLITE_CANTOPEN_NOTEMPDIR),
      KARSTCTL_CODE(SQLITE_CANTOPEN_ISDIR),
      KARSTCTL_CODE(SQLITE_CANTOPEN_FULLPATH),
      KARSTCTL_CODE(SQLITE_CANTOPEN_CONVPATH),
      KARSTCTL_CODE(SQLITE_CANTOPEN_SYMLINK),
      KARSTCTL_CODE(SQLITE_CORRUPT_VTAB),
      KARSTCTL_CODE(SQLITE_CORRUPT_SEQUENCE),
      KARSTCTL_CODE(SQLITE_CORRUPT_INDEX),
      KARSTCTL_CODE(SQLITE_IOERR_READ),
      KARSTCTL_CODE(SQLITE_IOERR_SHORT_READ),
      KARSTCTL_CODE(SQLITE_IOERR_WRITE),
      KARSTCTL_CODE(SQLITE_IOERR_FSYNC),
      KARSTCTL_CODE(SQLITE_IOERR_DIR_FSYNC),
      KARSTCTL_CODE(SQLITE_IOERR_TRUNCATE),
      KARSTCTL_CODE(SQLITE_IOERR_FSTAT),
      KARSTCTL_CODE(SQLITE_IOERR_UNLOCK),
      KARSTCTL_CODE(SQLITE_IOERR_RDLOCK),
      KARSTCTL_CODE(SQLITE_IOERR_DELETE),
      KARSTCTL_CODE(SQLITE_IOERR_NOMEM),
      KARSTCTL_CODE(SQLITE_IOERR_ACCESS),
      KARSTCTL_CODE(SQLITE_IOERR_CHECKRESERVEDLOCK),
      KARSTCTL_CODE(SQLITE_IOERR_LOCK),
      KARSTCTL_CODE(SQLITE_IOERR_CLOSE),
      KARSTCTL_CODE(SQLITE_IOERR_SHMOPEN),
      KARSTCTL_CODE(SQLITE_IOERR_SHMSIZE),
      KARSTCTL_CODE(SQLITE_IOERR_SHMLOCK),
      KARSTCTL_CODE(SQLITE_IOERR_SHMMAP),
      KARSTCTL_CODE(SQLITE_IOERR_SEEK),
      KARSTCTL_CODE(SQLITE_IOERR_DELETE_NOENT),
      KARSTCTL_CODE(SQLITE_IOERR_MMAP),
      KARSTCTL_CODE(SQLITE_IOERR_GETTEMPPATH),
      KARSTCTL_CODE(SQLITE_IOERR_CONVPATH),
      KARSTCTL_CODE(SQLITE_IOERR_AUTH),
      KARSTCTL_CODE(SQLITE_IOERR_DATA),
      KARSTCTL_CODE(SQLITE_IOERR_CORRUPTFS),
  };
  return names;
}

#undef KARSTCTL_CODE

const Names& StoreNames() {
  using namespace TavoConfigStore;
  static const Names names = {
      {kErrorUnknownNamespace, "unknown namespace"},
      {kErrorNotAStore, "not a store"},
      {kErrorCorruptObject, "corrupt object"},
      {kErrorNoTransaction, "no transaction"},
      {kErrorNestedTransaction, "nested transaction"},
      {kErrorNullArgument, "null argument"},
      {kErrorNoStorePath, "no store path"},
      {kErrorSymlink, "symbolic link"},
      {kErrorBadLocator, "bad locator"},
      {kErrorConflict, "conflict"},
      {kErrorEtcdReply, "bad etcd reply"},
      {kErrorTlsFile, "TLS file"},
      {kErrorTlsUntrusted, "TLS untrusted"},
      {kErrorTlsExpired, "TLS expired"},
      {kErrorTlsName, "TLS name mismatch"},
      {kErrorTlsClientCertificate, "TLS client certificate"},
      {kErrorTlsProtocol, "TLS or plain text"},
      {kErrorNoHistory, "no history"},
      {kErrorNoSuchVersion, "version not kept"},
  };
  return names;
}

// etcd's failures are kErrorEtcdBase plus the gRPC status code.
const char* EtcdName(std::int32_t code) {
  static const char* const kGrpc[] = {"OK",
                                      "CANCELLED",
                                      "UNKNOWN",
                                      "INVALID_ARGUMENT",
                                      "DEADLINE_EXCEEDED",
                                      "NOT_FOUND",
                                      "ALREADY_EXISTS",
                                      "PERMISSION_DENIED",
                                      "RESOURCE_EXHAUSTED",
                                      "FAILED_PRECONDITION",
                                      "ABORTED",
                                      "OUT_OF_RANGE",
                                      "UNIMPLEMENTED",
                                      "INTERNAL",
                                      "UNAVAILABLE",
                                      "DATA_LOSS",
                                      "UNAUTHENTICATED"};
  const std::int32_t status = code - TavoConfigStore::kErrorEtcdBase;
  return status >= 0 && status < static_cast<std::int32_t>(std::size(kGrpc)) ? kGrpc[status]
                                                                             : nullptr;
}

const char* Find(const Names& names, std::int32_t code) {
  for (const auto& [known, name] : names) {
    if (known == code) return name;
  }
  return nullptr;
}

}  // namespace

std::string StoreErrorName(std::int32_t code) {
  if (const char* name = Find(StoreNames(), code)) return name;
  if (const char* name = EtcdName(code)) return std::string("etcd ") + name;
  if (const char* name = Find(SqliteNames(), code)) return name;
  if (const char* name = Find(SqliteNames(), code & 0xFF)) return name;
  return "unknown code";
}

std::string DescribeStoreError(const TavoConfigStore::ConfigStoreException& error) {
  return error.Message() + " (" + StoreErrorName(error.Code()) + ", " +
         std::to_string(error.Code()) + ")";
}

}  // namespace karstctl
