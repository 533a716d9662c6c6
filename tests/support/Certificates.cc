#include "Certificates.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <cstdio>
#include <memory>
#include <stdexcept>
#include <utility>

namespace karst_test {
namespace {

using Key = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;
using Certificate = std::unique_ptr<X509, decltype(&X509_free)>;

void Check(bool ok, const char* what) {
  if (!ok) throw std::runtime_error(std::string("making a test certificate: ") + what);
}

template <typename Read>
auto ReadPem(const std::string& path, Read read) {
  FILE* file = std::fopen(path.c_str(), "r");
  Check(file != nullptr, "cannot open the issuer's files");
  auto* object = read(file, nullptr, nullptr, nullptr);
  std::fclose(file);
  Check(object != nullptr, "cannot read the issuer's files");
  return object;
}

// Signs a new key's certificate with "issuerKey" (the new key itself when
// null) and writes both files.
CertificateFiles Make(const std::string& dir, const std::string& name, Validity validity,
                      X509* issuer, EVP_PKEY* issuerKey, const std::string& subjectAltName) {
  Key key(EVP_EC_gen("P-256"), EVP_PKEY_free);
  Certificate certificate(X509_new(), X509_free);
  Check(key && certificate, "no memory");
  static long serial = 1;
  X509_set_version(certificate.get(), 2);
  ASN1_INTEGER_set(X509_get_serialNumber(certificate.get()), serial++);
  X509_gmtime_adj(X509_getm_notBefore(certificate.get()), 86400L * validity.fromDays);
  X509_gmtime_adj(X509_getm_notAfter(certificate.get()), 86400L * validity.toDays);
  X509_NAME* subject = X509_get_subject_name(certificate.get());
  const std::string commonName = "karst-test-" + name;
  X509_NAME_add_entry_by_txt(subject, "CN", MBSTRING_ASC,
                             reinterpret_cast<const unsigned char*>(commonName.c_str()), -1, -1, 0);
  X509_set_issuer_name(certificate.get(), issuer ? X509_get_subject_name(issuer) : subject);
  X509_set_pubkey(certificate.get(), key.get());
  X509V3_CTX context;
  X509V3_set_ctx(&context, issuer ? issuer : certificate.get(), certificate.get(), nullptr, nullptr,
                 0);
  for (const auto& [nid, value] :
       {std::pair{NID_basic_constraints, issuer ? "critical,CA:FALSE" : "critical,CA:TRUE"},
        {NID_subject_alt_name, subjectAltName.c_str()}}) {
    if (*value == '\0') continue;
    X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, nid, value);
    Check(extension != nullptr, "an extension");
    X509_add_ext(certificate.get(), extension, -1);
    X509_EXTENSION_free(extension);
  }
  Check(X509_sign(certificate.get(), issuerKey ? issuerKey : key.get(), EVP_sha256()) > 0, "sign");

  const CertificateFiles files{dir + "/" + name + ".pem", dir + "/" + name + ".key"};
  FILE* out = std::fopen(files.cert.c_str(), "w");
  Check(out != nullptr && PEM_write_X509(out, certificate.get()) == 1, "write the certificate");
  std::fclose(out);
  out = std::fopen(files.key.c_str(), "w");
  Check(out != nullptr &&
            PEM_write_PrivateKey(out, key.get(), nullptr, nullptr, 0, nullptr, nullptr) == 1,
        "write the key");
  std::fclose(out);
  return files;
}

}  // namespace

CertificateFiles MakeCa(const std::string& dir, const std::string& name, Validity validity) {
  return Make(dir, name, validity, nullptr, nullptr, "");
}

CertificateFiles MakeSigned(const std::string& dir, const std::string& name,
                            const CertificateFiles& ca, Validity validity,
                            const std::string& subjectAltName) {
  Certificate issuer(ReadPem(ca.cert, PEM_read_X509), X509_free);
  Key issuerKey(ReadPem(ca.key, PEM_read_PrivateKey), EVP_PKEY_free);
  return Make(dir, name, validity, issuer.get(), issuerKey.get(), subjectAltName);
}

}  // namespace karst_test
