// Helpers of the generation tests: a test root and reading back what openssl made.
#ifndef ZEPH_MODULE_MKCERT_MKCERT_TEST_UTIL_H_
#define ZEPH_MODULE_MKCERT_MKCERT_TEST_UTIL_H_

#include <string>
#include <vector>

#include "module/common/ssl_ptr.h"
#include "module/mkcert/csr_argument.h"
#include "test_support.h"

namespace ZEPH {
namespace test {

// A TempRoot with the directories generation works in and the appliance's
// address file holding `address` (a line, as the kernel writes it).
class GenRoot : public TempRoot {
 public:
  explicit GenRoot(const std::string& address = "00113201abcd");
  std::string NewSetDir(const std::string& name) const;  // a fresh set directory
};

ssl::X509Ptr LoadCert(const std::string& path);
// The subject alternative names: "DNS:x", "IP:1.2.3.4", "IP:fe80::1".
std::vector<std::string> AltNames(X509* cert);
int CertKeyBits(X509* cert);  // RSA modulus bits of the key in a certificate
// Makes a set with genCASet and genCertSet in `dir` (1024-bit keys).
void MakeSet(const std::string& dir, _tag_CSR_ARGUMENT ca, _tag_CSR_ARGUMENT server,
             const std::string& aliases);
_tag_CSR_ARGUMENT Subject(const std::string& country, const std::string& state,
                          const std::string& city, const std::string& organization,
                          const std::string& department, const std::string& common_name,
                          const std::string& email);

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_MODULE_MKCERT_MKCERT_TEST_UTIL_H_
