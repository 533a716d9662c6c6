#ifndef TAVOCONFIGSTORE_CONFIG_STORE_EXCEPTION_H_
#define TAVOCONFIGSTORE_CONFIG_STORE_EXCEPTION_H_

#include <cstdint>
#include <memory>
#include <string>

#include "TavoConfigStore/Export.h"
#include "Velk/VelkException.h"

namespace TavoConfigStore {

// Every failure of the configuration store. The code is the backend's own
// (SQLite's extended result code for the SQLite store); a copy keeps message
// and code and shares the detail.
class CONFIGSTORE_EXPORT ConfigStoreException : public Velk::Lib::VelkException {
 public:
  ConfigStoreException(std::string message, std::int32_t code,
                       std::shared_ptr<const void> detail = nullptr);
  ConfigStoreException(const ConfigStoreException&) = default;
  ConfigStoreException& operator=(const ConfigStoreException&) = default;
  ~ConfigStoreException() override;

  std::int32_t Code() const noexcept { return code_; }

 private:
  std::int32_t code_;
};

// Codes raised by the store itself rather than passed on from SQLite.
enum StoreErrorCode : std::int32_t {
  kErrorUnknownNamespace = 1001,   // GetStore with a namespace it does not serve
  kErrorNotAStore = 1002,          // a file that is not a store, or of an unknown schema version
  kErrorCorruptObject = 1003,      // an object whose stored encoding cannot be read
  kErrorNoTransaction = 1004,      // Commit or Abort with no open transaction
  kErrorNestedTransaction = 1005,  // no longer raised: transactions nest
  kErrorNullArgument = 1007,       // a null object or filter handed to an operation
  kErrorNoStorePath = 1008,        // no store path given and no default to derive one from
  kErrorSymlink = 1009,            // a store path that names a symbolic link
  kErrorBadLocator = 1010,         // a store locator or etcd option that cannot be used
  kErrorConflict = 1011,           // another writer changed what this transaction read or wrote
  kErrorEtcdReply = 1012,          // a reply from etcd that the store cannot read
  // TLS with an etcd cluster, by what is wrong:
  kErrorTlsFile = 1013,       // a CA, certificate or key file unreadable, not PEM of its kind,
                              // or a key that is not the certificate's
  kErrorTlsUntrusted = 1014,  // a member's certificate not signed by the CA given
  kErrorTlsExpired = 1015,    // a certificate out of its validity: the CA's, the client's or a
                              // member's
  kErrorTlsName = 1016,       // a member's certificate that does not name the host dialled
  kErrorTlsClientCertificate = 1017,  // a member that asks for a client certificate, or
                                      // refuses the one given
  kErrorTlsProtocol = 1018,           // plain text to a member that speaks TLS, or the reverse
  kErrorNoHistory = 1019,             // a history function on a store that keeps none
  kErrorNoSuchVersion = 1020,         // a version the store does not keep (any longer)
  // etcd's own failures: this plus the gRPC status code, so 1104 is a
  // request that ran out of time (DEADLINE_EXCEEDED), 1114 a cluster that
  // cannot be reached (UNAVAILABLE: every member refused the connection, or
  // one was lost mid-request), 1116 refused credentials
  // (UNAUTHENTICATED) and 1107 a user without the right (PERMISSION_DENIED).
  kErrorEtcdBase = 1100,
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_CONFIG_STORE_EXCEPTION_H_
