// Helpers of the generation tests: a provisioned test root and reading back
// what openssl made with the OpenSSL library.
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
  // A fresh directory below the archive, for a certificate set.
  std::string NewSetDir(const std::string& name) const;
};

// How many diagnostic lines "mkcert:<line> <message>" the root's log holds
// whose message is exactly `message` or, with `prefix` set, starts with it.
int LogCount(const TempRoot& root, const std::string& message,
             bool prefix = false);
inline bool Logged(const TempRoot& root, const std::string& message) {
  return LogCount(root, message) > 0;
}
// For messages that end with the platform's "[0x%04X %s:%d]".
inline bool LoggedWithLibError(const TempRoot& root,
                               const std::string& message) {
  return LogCount(root, message + "[0x", true) > 0;
}

ssl::X509Ptr LoadCert(const std::string& path);
ssl::X509ReqPtr LoadCsr(const std::string& path);
ssl::EvpPkeyPtr LoadKey(const std::string& path);

// The values of attribute `nid` of `name`, joined with "|" (so a missing
// attribute is "" and a repeated one shows).
std::string Attr(X509_NAME* name, int nid);
// The subject alternative names: "DNS:x", "IP:1.2.3.4", "IP:fe80::1".
std::vector<std::string> AltNames(X509* cert);
// The extension `nid` as openssl prints it, "" when absent.
std::string ExtensionText(X509* cert, int nid);
bool ExtensionCritical(X509* cert, int nid);
// notAfter - notBefore in whole days (rounded down).
int ValidityDays(X509* cert);
// The serial number in uppercase hexadecimal.
std::string SerialHex(X509* cert);
// RSA modulus bits of the key in a certificate or key file.
int CertKeyBits(X509* cert);

// Makes a set with genCASet and genCertSet in `dir` (1024-bit keys).
void MakeSet(const std::string& dir, _tag_CSR_ARGUMENT ca,
             _tag_CSR_ARGUMENT server, const std::string& aliases);

_tag_CSR_ARGUMENT Subject(const std::string& country, const std::string& state,
                          const std::string& city,
                          const std::string& organization,
                          const std::string& department,
                          const std::string& common_name,
                          const std::string& email);

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_MODULE_MKCERT_MKCERT_TEST_UTIL_H_
