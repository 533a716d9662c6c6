// Owning pointers and small helpers for the OpenSSL objects the etcd
// client's TLS checks use.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_OPEN_SSL_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_OPEN_SSL_H_

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>

#include <ctime>
#include <memory>
#include <string>

namespace TavoConfigStore {
namespace openssl {

template <typename T, void (*Free)(T*)>
struct Deleter {
  void operator()(T* p) const { Free(p); }
};

inline void FreeBio(BIO* bio) { BIO_free(bio); }

using BioPtr = std::unique_ptr<BIO, Deleter<BIO, FreeBio>>;
using X509Ptr = std::unique_ptr<X509, Deleter<X509, X509_free>>;
using KeyPtr = std::unique_ptr<EVP_PKEY, Deleter<EVP_PKEY, EVP_PKEY_free>>;
using SslCtxPtr = std::unique_ptr<SSL_CTX, Deleter<SSL_CTX, SSL_CTX_free>>;
using SslPtr = std::unique_ptr<SSL, Deleter<SSL, SSL_free>>;

// "2026-11-25 23:00:00 UTC".
inline std::string Date(const ASN1_TIME* time) {
  std::tm tm{};
  char text[32];
  if (ASN1_TIME_to_tm(time, &tm) != 1 ||
      std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S UTC", &tm) == 0) {
    return "an unreadable date";
  }
  return text;
}

}  // namespace openssl
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_OPEN_SSL_H_
