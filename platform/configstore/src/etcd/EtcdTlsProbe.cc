#include "EtcdTlsProbe.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netdb.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>

#include "EtcdOpenSsl.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace {

using Clock = std::chrono::steady_clock;

// An HTTP/2 client's first bytes: the preface and an empty SETTINGS frame.
constexpr char kHttp2Hello[] = "PRI * HTTP/2.0\r\n\r\nSM\r\n\r\n\0\0\0\4\0\0\0\0\0";
constexpr std::size_t kHttp2HelloSize = sizeof kHttp2Hello - 1;

// A member that closes the connection must not end the process with
// SIGPIPE: OpenSSL writes with plain write(). The signal is blocked on this
// thread while the probe runs and taken back if one came.
class NoSigpipe {
 public:
  NoSigpipe() {
    sigemptyset(&pipe_);
    sigaddset(&pipe_, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &pipe_, &old_);
  }
  ~NoSigpipe() {
    const timespec none{0, 0};
    while (sigtimedwait(&pipe_, nullptr, &none) == SIGPIPE) {
    }
    pthread_sigmask(SIG_SETMASK, &old_, nullptr);
  }

 private:
  sigset_t pipe_;
  sigset_t old_;
};

class Socket {
 public:
  ~Socket() {
    if (fd_ >= 0) close(fd_);
  }
  // Connects to the first of the endpoint's addresses that accepts; then
  // every read and write gives up at "deadline".
  bool Connect(const std::string& endpoint, Clock::time_point deadline) {
    addrinfo hints{};
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* found = nullptr;
    const std::string port = endpoint.substr(endpoint.rfind(':') + 1);
    if (getaddrinfo(HostOf(endpoint).c_str(), port.c_str(), &hints, &found) != 0) return false;
    for (addrinfo* a = found; a != nullptr && fd_ < 0; a = a->ai_next) {
      fd_ = socket(a->ai_family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
      if (fd_ < 0) continue;
      pollfd wait{fd_, POLLOUT, 0};
      int error = 0;
      socklen_t size = sizeof error;
      const bool connected =
          (connect(fd_, a->ai_addr, a->ai_addrlen) == 0 ||
           (errno == EINPROGRESS && poll(&wait, 1, MsUntil(deadline)) == 1 &&
            getsockopt(fd_, SOL_SOCKET, SO_ERROR, &error, &size) == 0 && error == 0));
      if (!connected) {
        close(fd_);
        fd_ = -1;
      }
    }
    freeaddrinfo(found);
    if (fd_ < 0) return false;
    fcntl(fd_, F_SETFL, fcntl(fd_, F_GETFL) & ~O_NONBLOCK);
    const int ms = MsUntil(deadline);
    const timeval limit{ms / 1000, static_cast<suseconds_t>(ms % 1000) * 1000};
    setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    setsockopt(fd_, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
    return true;
  }
  int fd() const { return fd_; }

 private:
  static int MsUntil(Clock::time_point deadline) {
    const auto ms =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    return static_cast<int>(std::max<long long>(1, ms));
  }
  int fd_ = -1;
};

// Whether the member answers an HTTP/2 client in plain text.
bool SpeaksPlainHttp2(const std::string& endpoint, Clock::time_point deadline) {
  Socket socket;
  if (!socket.Connect(endpoint, deadline)) return false;
  unsigned char frame[9];
  return send(socket.fd(), kHttp2Hello, kHttp2HelloSize, MSG_NOSIGNAL) ==
             static_cast<ssize_t>(kHttp2HelloSize) &&
         recv(socket.fd(), frame, sizeof frame, MSG_WAITALL) == sizeof frame &&
         frame[3] == 4;  // a SETTINGS frame
}

bool IsIpAddress(const std::string& host) {
  unsigned char address[16];
  return inet_pton(AF_INET, host.c_str(), address) == 1 ||
         inet_pton(AF_INET6, host.c_str(), address) == 1;
}

// The first fault OpenSSL found in the member's certificate chain; the
// handshake goes on past it, so that what comes after can be seen too.
struct ChainFault {
  int error = X509_V_OK;
  int depth = 0;
  std::string subject;
  std::string notBefore;
  std::string notAfter;
};

int RecordFirstFault(int ok, X509_STORE_CTX* store) {
  SSL* ssl =
      static_cast<SSL*>(X509_STORE_CTX_get_ex_data(store, SSL_get_ex_data_X509_STORE_CTX_idx()));
  auto* fault = static_cast<ChainFault*>(SSL_get_app_data(ssl));
  if (!ok && fault->error == X509_V_OK) {
    fault->error = X509_STORE_CTX_get_error(store);
    fault->depth = X509_STORE_CTX_get_error_depth(store);
    if (X509* certificate = X509_STORE_CTX_get_current_cert(store)) {
      char subject[256];
      X509_NAME_oneline(X509_get_subject_name(certificate), subject, sizeof subject);
      fault->subject = subject;
      fault->notBefore = openssl::Date(X509_get0_notBefore(certificate));
      fault->notAfter = openssl::Date(X509_get0_notAfter(certificate));
    }
  }
  return 1;
}

TlsFinding FromChainFault(const ChainFault& fault, const std::string& host,
                          const EtcdStoreOptions& options) {
  const std::string whose =
      fault.depth == 0 ? "its certificate" : "the certificate " + fault.subject + " in its chain";
  switch (fault.error) {
    case X509_V_ERR_CERT_HAS_EXPIRED:
      return {kErrorTlsExpired, whose + " expired on " + fault.notAfter};
    case X509_V_ERR_CERT_NOT_YET_VALID:
      return {kErrorTlsExpired, whose + " is not valid before " + fault.notBefore};
    case X509_V_ERR_HOSTNAME_MISMATCH:
    case X509_V_ERR_IP_ADDRESS_MISMATCH:
      return {kErrorTlsName, "its certificate does not name " + host};
    default:
      return {kErrorTlsUntrusted,
              "its certificate is not signed by " +
                  (options.caFile.empty() ? std::string("a CA this host trusts (no cacert given)")
                                          : "the CA in " + options.caFile) +
                  " (" + X509_verify_cert_error_string(fault.error) + ")"};
  }
}

// The alerts by which a member turns down the client's certificate.
bool RefusesCertificate(unsigned long error) {
  switch (ERR_GET_REASON(error)) {
    case SSL_R_SSLV3_ALERT_BAD_CERTIFICATE:
    case SSL_R_SSLV3_ALERT_UNSUPPORTED_CERTIFICATE:
    case SSL_R_SSLV3_ALERT_CERTIFICATE_REVOKED:
    case SSL_R_SSLV3_ALERT_CERTIFICATE_EXPIRED:
    case SSL_R_SSLV3_ALERT_CERTIFICATE_UNKNOWN:
    case SSL_R_TLSV1_ALERT_UNKNOWN_CA:
    case SSL_R_TLSV1_ALERT_ACCESS_DENIED:
    case SSL_R_TLSV13_ALERT_CERTIFICATE_REQUIRED:
      return true;
    default:
      return false;
  }
}

TlsFinding CertificateRefused(unsigned long error, const EtcdStoreOptions& options) {
  if (options.certFile.empty()) {
    return {kErrorTlsClientCertificate,
            "it asks for a client certificate and none was given (cert= and key=)"};
  }
  const char* reason = ERR_reason_error_string(error);
  return {kErrorTlsClientCertificate, "it refused the client certificate in " + options.certFile +
                                          " (" + (reason ? reason : "refused") + ")"};
}

openssl::SslCtxPtr ClientContext(const TlsMaterial& material) {
  openssl::SslCtxPtr context(SSL_CTX_new(TLS_client_method()));
  if (!context) return context;
  X509_STORE* store = SSL_CTX_get_cert_store(context.get());
  if (material.ca.empty()) {
    SSL_CTX_set_default_verify_paths(context.get());
  } else {
    openssl::BioPtr bio(BIO_new_mem_buf(material.ca.data(), static_cast<int>(material.ca.size())));
    while (X509* ca = PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)) {
      X509_STORE_add_cert(store, ca);
      X509_free(ca);
    }
  }
  if (!material.cert.empty()) {
    openssl::BioPtr cert(
        BIO_new_mem_buf(material.cert.data(), static_cast<int>(material.cert.size())));
    openssl::X509Ptr leaf(PEM_read_bio_X509(cert.get(), nullptr, nullptr, nullptr));
    if (leaf) SSL_CTX_use_certificate(context.get(), leaf.get());
    while (X509* link = PEM_read_bio_X509(cert.get(), nullptr, nullptr, nullptr)) {
      SSL_CTX_add0_chain_cert(context.get(), link);
    }
    openssl::BioPtr key(
        BIO_new_mem_buf(material.key.data(), static_cast<int>(material.key.size())));
    openssl::KeyPtr pkey(PEM_read_bio_PrivateKey(key.get(), nullptr, nullptr, nullptr));
    if (pkey) SSL_CTX_use_PrivateKey(context.get(), pkey.get());
  }
  static const unsigned char kAlpn[] = "\x02h2";
  SSL_CTX_set_alpn_protos(context.get(), kAlpn, sizeof kAlpn - 1);
  ERR_clear_error();
  return context;
}

TlsFinding ProbeWithTls(const std::string& endpoint, const EtcdStoreOptions& options,
                        const TlsMaterial& material, Clock::time_point deadline) {
  Socket socket;
  const openssl::SslCtxPtr context = ClientContext(material);
  if (!context || !socket.Connect(endpoint, deadline)) return {};
  openssl::SslPtr ssl(SSL_new(context.get()));
  ChainFault fault;
  SSL_set_app_data(ssl.get(), &fault);
  SSL_set_verify(ssl.get(), SSL_VERIFY_PEER, RecordFirstFault);
  const std::string host = HostOf(endpoint);
  X509_VERIFY_PARAM* names = SSL_get0_param(ssl.get());
  if (IsIpAddress(host)) {
    X509_VERIFY_PARAM_set1_ip_asc(names, host.c_str());
  } else {
    X509_VERIFY_PARAM_set1_host(names, host.c_str(), 0);
    SSL_set_tlsext_host_name(ssl.get(), host.c_str());
  }
  SSL_set_fd(ssl.get(), socket.fd());
  if (SSL_connect(ssl.get()) != 1) {
    const unsigned long error = ERR_peek_error();
    const bool serverSpokeTls = SSL_get0_peer_certificate(ssl.get()) != nullptr;
    ERR_clear_error();
    if (RefusesCertificate(error)) return CertificateRefused(error, options);
    if (!serverSpokeTls && fault.error == X509_V_OK && SpeaksPlainHttp2(endpoint, deadline)) {
      return {kErrorTlsProtocol, "it speaks plain text, not TLS: use etcd://"};
    }
    return {};
  }
  if (fault.error != X509_V_OK) return FromChainFault(fault, host, options);
  // With TLS 1.3 a member checks the client's certificate after the client
  // has finished its handshake, and sends its verdict unasked. Nothing is
  // written meanwhile: a write that meets the closed connection makes the
  // kernel drop the alert before it is read.
  unsigned char frame[9];
  if (SSL_read(ssl.get(), frame, sizeof frame) > 0) return {};
  const unsigned long error = ERR_peek_error();
  ERR_clear_error();
  return RefusesCertificate(error) ? CertificateRefused(error, options) : TlsFinding();
}

TlsFinding ProbeWithoutTls(const std::string& endpoint, Clock::time_point deadline) {
  Socket socket;
  const openssl::SslCtxPtr context = ClientContext(TlsMaterial());
  if (!context || !socket.Connect(endpoint, deadline)) return {};
  openssl::SslPtr ssl(SSL_new(context.get()));
  SSL_set_verify(ssl.get(), SSL_VERIFY_NONE, nullptr);
  SSL_set_fd(ssl.get(), socket.fd());
  const bool handshook = SSL_connect(ssl.get()) == 1;
  const bool serverSpokeTls = handshook || SSL_get0_peer_certificate(ssl.get()) != nullptr ||
                              RefusesCertificate(ERR_peek_error());
  ERR_clear_error();
  if (!serverSpokeTls) return {};
  return {kErrorTlsProtocol, "it speaks TLS, not plain text: use etcds:// (and cacert=)"};
}

}  // namespace

std::string HostOf(const std::string& endpoint) {
  std::string host = endpoint.substr(0, endpoint.rfind(':'));
  if (host.size() > 1 && host.front() == '[') host = host.substr(1, host.size() - 2);
  return host;
}

bool AcceptsConnections(const std::string& endpoint, std::chrono::milliseconds limit) {
  Socket socket;
  return socket.Connect(endpoint, Clock::now() + limit);
}

TlsFinding ProbeTls(const std::string& endpoint, const EtcdStoreOptions& options,
                    const TlsMaterial& material, std::chrono::milliseconds limit) {
  const Clock::time_point deadline = Clock::now() + limit;
  const NoSigpipe noSigpipe;
  return options.tls ? ProbeWithTls(endpoint, options, material, deadline)
                     : ProbeWithoutTls(endpoint, deadline);
}

}  // namespace TavoConfigStore
