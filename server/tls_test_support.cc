#include "webapid_test_support.h"

#include <openssl/crypto.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <stdio.h>

#include <memory>

#include "test_support.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace test {

std::string CertFingerprint(X509* cert) {
  unsigned char md[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  if (cert == nullptr || X509_digest(cert, EVP_sha256(), md, &len) != 1) return "";
  char* hex = OPENSSL_buf2hexstr(md, len);
  const std::string out = hex == nullptr ? "" : hex;
  OPENSSL_free(hex);
  return out;
}

bool MakeCertSet(const std::string& dir, const std::string& common_name) {
  const std::string ec = " -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes ";
  const std::string cn = " -subj '/CN=" + common_name;
  const std::string script =
      "set -e; mkdir -p '" + dir + "'; cd '" + dir + "'; o=/usr/bin/openssl; "
      "$o req -x509" + ec + "-keyout ca.key -out chain.pem" + cn + " CA' -days 30 2>/dev/null; "
      "$o req" + ec + "-keyout privkey.pem -out leaf.csr" + cn + "' 2>/dev/null; "
      "$o x509 -req -in leaf.csr -CA chain.pem -CAkey ca.key -set_serial 7 -out cert.pem -days 30 "
      "2>/dev/null; cat cert.pem chain.pem > fullchain.pem; rm -f leaf.csr ca.key";
  return Run({"/bin/sh", "-c", script}).status == 0;
}

std::string PemFingerprint(const std::string& path) {
  UniqueFile f(fopen(path.c_str(), "re"));
  if (!f) return "";
  std::unique_ptr<X509, void (*)(X509*)> cert(PEM_read_X509(f.get(), nullptr, nullptr, nullptr),
                                             X509_free);
  return CertFingerprint(cert.get());
}

}  // namespace test
}  // namespace ZEPH
