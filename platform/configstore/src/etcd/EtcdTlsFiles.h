// The CA, certificate and key files of a TLS connection to etcd, checked for
// what can be told without a member: a fault in them then shows at once,
// with the file named, instead of as a handshake that fails on every member.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_TLS_FILES_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_TLS_FILES_H_

#include <string>

#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {

// The files' PEM text, as gRPC takes it. Empty where no file was given.
struct TlsMaterial {
  std::string ca;
  std::string cert;
  std::string key;
};

// Reads the files the options name and checks that each is readable and
// PEM of its kind (certificates in the CA and certificate files, a private
// key in the key file), that every certificate is within its validity, and
// that the key is the certificate's. Throws ConfigStoreException with
// kErrorTlsFile or kErrorTlsExpired, naming the file and the fault.
TlsMaterial LoadTlsMaterial(const EtcdStoreOptions& options);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_TLS_FILES_H_
