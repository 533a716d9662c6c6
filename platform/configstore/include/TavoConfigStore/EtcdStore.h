#ifndef TAVOCONFIGSTORE_ETCD_STORE_H_
#define TAVOCONFIGSTORE_ETCD_STORE_H_

#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/Export.h"

namespace TavoConfigStore {

// Where and how to reach an etcd cluster (v3 API) that holds a store.
struct EtcdStoreOptions {
  // "host:port" of one or more members; the client fails over between them.
  std::vector<std::string> endpoints;
  // Every key of the store lies under "/<prefix>/", so several stores can
  // share one cluster. Not empty.
  std::string prefix;
  // TLS, with the cluster's CA and, where the cluster asks for one, a client
  // certificate and key (PEM files).
  bool tls = false;
  std::string caFile;
  std::string certFile;
  std::string keyFile;
  // etcd's user/password authentication, when "user" is not empty.
  std::string user;
  std::string password;
  // Each request to the cluster fails after this long (connecting included).
  int timeoutMs = 5000;
  // Listings of whole collections kept in memory, at most this many MiB of
  // them, so that reading a collection again costs one small request while
  // nobody has changed it (0: none kept, every read fetches the objects). The
  // stores of one process that name the same members, prefix, user and size
  // share them. A collection larger than this is read afresh each time.
  int cacheMiB = 64;
};

// True for "etcd://..." and "etcds://..." (see KindOfLocator for the rest).
CONFIGSTORE_EXPORT bool IsEtcdLocator(const std::string& locator);

// Reads a locator
//   etcd[s]://[USER[:PASSWORD]@]HOST:PORT[,HOST:PORT...]/PREFIX
//              [?cacert=FILE&cert=FILE&key=FILE&timeout=MS&cache=MIB]
// "etcds" turns TLS on. An IPv6 HOST goes in brackets. In a user name,
// password, prefix or file name %XX stands for a byte; an '@' after the
// endpoints is refused, as it is most likely a password's with a bare '/'.
// What the locator leaves out is taken, literally, from etcdctl's
// environment variables: ETCDCTL_CACERT, ETCDCTL_CERT, ETCDCTL_KEY,
// ETCDCTL_USER ("user" or "user:password") and ETCDCTL_PASSWORD. Throws
// ConfigStoreException(kErrorBadLocator) naming what is wrong; the message
// never repeats a password.
CONFIGSTORE_EXPORT EtcdStoreOptions ParseEtcdLocator(const std::string& locator);

// A store kept in an etcd cluster. Connecting is lazy: the first operation
// that needs the cluster reports it unreachable.
CONFIGSTORE_EXPORT std::shared_ptr<ConfigStore> NewEtcdStore(const EtcdStoreOptions& options);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_ETCD_STORE_H_
