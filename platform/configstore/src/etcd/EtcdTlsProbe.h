// Why a connection to a member failed, as far as TLS can tell. gRPC says
// little: a refused client certificate reads as a failed read, plain text
// against TLS as a closed socket, and an expired certificate like one of
// another CA. A handshake of the client's own, with the same files, asks
// OpenSSL for the reason.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_TLS_PROBE_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_TLS_PROBE_H_

#include <chrono>
#include <cstdint>
#include <string>

#include "EtcdTlsFiles.h"
#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {

struct TlsFinding {
  std::int32_t code = 0;  // a kErrorTls... code; 0 when nothing was found
  std::string text;       // what is wrong, about the member: "its certificate expired on ..."
};

// Connects to "endpoint" (HOST:PORT) as the client would, with TLS when the
// options ask for it, and tells what is wrong; gives up after "limit".
TlsFinding ProbeTls(const std::string& endpoint, const EtcdStoreOptions& options,
                    const TlsMaterial& material, std::chrono::milliseconds limit);

// Whether "endpoint" (HOST:PORT) accepts a TCP connection within "limit".
bool AcceptsConnections(const std::string& endpoint, std::chrono::milliseconds limit);

// HOST of "HOST:PORT" or "[HOST]:PORT".
std::string HostOf(const std::string& endpoint);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_TLS_PROBE_H_
