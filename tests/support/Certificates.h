// Certificates made for a test, as PEM files: a CA of its own and
// certificates it signs, valid for the days the test asks for.

#ifndef KARST_TESTS_SUPPORT_CERTIFICATES_H_
#define KARST_TESTS_SUPPORT_CERTIFICATES_H_

#include <string>

namespace karst_test {

struct CertificateFiles {
  std::string cert;
  std::string key;
};

// Valid from "fromDays" to "toDays" days from now (negative: in the past).
struct Validity {
  int fromDays = -1;
  int toDays = 30;
};

// A self-signed CA, "<dir>/<name>.pem" and "<dir>/<name>.key".
CertificateFiles MakeCa(const std::string& dir, const std::string& name, Validity validity = {});
// A certificate that "ca" signs, in the same two files; a server's names its
// address in "subjectAltName" ("IP:127.0.0.1").
CertificateFiles MakeSigned(const std::string& dir, const std::string& name,
                            const CertificateFiles& ca, Validity validity = {},
                            const std::string& subjectAltName = "");

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_CERTIFICATES_H_
