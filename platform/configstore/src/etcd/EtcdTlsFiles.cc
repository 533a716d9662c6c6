#include "EtcdTlsFiles.h"

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <fstream>
#include <memory>
#include <sstream>
#include <vector>

#include "EtcdOpenSsl.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace {

[[noreturn]] void Refuse(const std::string& what, std::int32_t code = kErrorTlsFile) {
  throw ConfigStoreException("etcd TLS: " + what, code);
}

std::string ReadWhole(const std::string& path, const char* what) {
  std::ifstream in(path, std::ios::binary);
  if (!in)
    Refuse("cannot read the " + std::string(what) + " " + path + ": " + std::strerror(errno));
  std::ostringstream text;
  text << in.rdbuf();
  if (!in && !in.eof()) {
    Refuse("cannot read the " + std::string(what) + " " + path + ": " + std::strerror(errno));
  }
  return text.str();
}

bool Has(const std::string& text, const char* part) { return text.find(part) != std::string::npos; }

// Why a file holds none of what was asked for: the most likely mix-up first.
std::string NotOfItsKind(const std::string& text, const char* wanted) {
  if (!Has(text, "-----BEGIN "))
    return std::string("is not PEM (no -----BEGIN ") + wanted + "----- block)";
  if (Has(text, "PRIVATE KEY-----") && std::strcmp(wanted, "CERTIFICATE") == 0) {
    return "holds a private key, not a certificate";
  }
  if (Has(text, "BEGIN CERTIFICATE-----") && std::strcmp(wanted, "CERTIFICATE") != 0) {
    return "holds a certificate, not a private key";
  }
  if (Has(text, "ENCRYPTED")) return "holds an encrypted key; the client needs it unencrypted";
  return std::string("holds no readable ") +
         (std::strcmp(wanted, "CERTIFICATE") == 0 ? "certificate" : "private key");
}

std::vector<openssl::X509Ptr> Certificates(const std::string& text) {
  std::vector<openssl::X509Ptr> certificates;
  openssl::BioPtr bio(BIO_new_mem_buf(text.data(), static_cast<int>(text.size())));
  while (X509* certificate = PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)) {
    certificates.emplace_back(certificate);
  }
  ERR_clear_error();  // the end of the file reads as an error
  return certificates;
}

// "" when "certificate" is valid now, else why not.
std::string OutOfDate(X509* certificate) {
  if (X509_cmp_current_time(X509_get0_notAfter(certificate)) < 0) {
    return "expired on " + openssl::Date(X509_get0_notAfter(certificate));
  }
  if (X509_cmp_current_time(X509_get0_notBefore(certificate)) > 0) {
    return "is not valid before " + openssl::Date(X509_get0_notBefore(certificate));
  }
  return std::string();
}

std::vector<openssl::X509Ptr> LoadCertificates(const std::string& path, const char* what,
                                               std::string* text) {
  *text = ReadWhole(path, what);
  std::vector<openssl::X509Ptr> certificates = Certificates(*text);
  if (certificates.empty())
    Refuse("the " + std::string(what) + " " + path + " " + NotOfItsKind(*text, "CERTIFICATE"));
  return certificates;
}

// A key file is never decrypted: a password would have to come from a prompt.
int NoPassword(char*, int, int, void*) { return 0; }

}  // namespace

TlsMaterial LoadTlsMaterial(const EtcdStoreOptions& options) {
  TlsMaterial material;
  if (!options.caFile.empty()) {
    const auto cas = LoadCertificates(options.caFile, "CA file", &material.ca);
    // A bundle may hold old certificates beside current ones; only a file
    // whose every certificate is out of date cannot verify anything.
    std::string outOfDate;
    for (const auto& ca : cas) {
      outOfDate = OutOfDate(ca.get());
      if (outOfDate.empty()) break;
    }
    if (!outOfDate.empty()) {
      Refuse("the CA certificate in " + options.caFile + " " + outOfDate, kErrorTlsExpired);
    }
  }
  if (options.certFile.empty() && options.keyFile.empty()) return material;
  if (options.certFile.empty() || options.keyFile.empty()) {
    Refuse("a client certificate needs its key, and a key its certificate");
  }
  const auto chain = LoadCertificates(options.certFile, "client certificate file", &material.cert);
  const std::string outOfDate = OutOfDate(chain.front().get());
  if (!outOfDate.empty()) {
    Refuse("the client certificate in " + options.certFile + " " + outOfDate, kErrorTlsExpired);
  }
  material.key = ReadWhole(options.keyFile, "client key file");
  openssl::BioPtr bio(BIO_new_mem_buf(material.key.data(), static_cast<int>(material.key.size())));
  openssl::KeyPtr key(PEM_read_bio_PrivateKey(bio.get(), nullptr, NoPassword, nullptr));
  ERR_clear_error();
  if (!key)
    Refuse("the client key file " + options.keyFile + " " +
           NotOfItsKind(material.key, "PRIVATE KEY"));
  if (X509_check_private_key(chain.front().get(), key.get()) != 1) {
    ERR_clear_error();
    Refuse("the key in " + options.keyFile + " is not the one of the client certificate in " +
           options.certFile);
  }
  return material;
}

}  // namespace TavoConfigStore
