#include "module/mkcert/mkcert_test_util.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <openssl/pem.h>

#include "module/common/paths.h"
#include "module/mkcert/cert_set.h"

namespace ZEPH {
namespace test {

GenRoot::GenRoot(const std::string& address) {
  for (const char* d : {cert::kArchiveDir, cert::kSslCfgDir, cert::kGenDir,
                        "/usr/zeph/etc/ssl/ssl.csr", "/proc/sys/kernel"}) {
    MakeDirs(Path(d));
  }
  WriteFile(Path(cert::kMacAddressFile), address, 0444);
}

std::string GenRoot::NewSetDir(const std::string& name) const {
  const std::string dir = Path(cert::kArchiveDir) + "/" + name;
  MakeDirs(dir);
  return dir;
}

ssl::X509Ptr LoadCert(const std::string& path) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  ssl::X509Ptr cert(bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr);
  ERR_clear_error();
  return cert;
}

std::vector<std::string> AltNames(X509* cert) {
  std::vector<std::string> out;
  ssl::GeneralNamesPtr names(static_cast<GENERAL_NAMES*>(
      X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr)));
  for (int i = 0; names && i < sk_GENERAL_NAME_num(names.get()); ++i) {
    const GENERAL_NAME* gn = sk_GENERAL_NAME_value(names.get(), i);
    if (gn->type == GEN_DNS) {
      const ASN1_STRING* dns = gn->d.dNSName;
      out.push_back("DNS:" + std::string(reinterpret_cast<const char*>(ASN1_STRING_get0_data(dns)),
                                         ASN1_STRING_length(dns)));
    } else if (gn->type == GEN_IPADD) {
      char text[INET6_ADDRSTRLEN] = "?";
      inet_ntop(ASN1_STRING_length(gn->d.iPAddress) == 4 ? AF_INET : AF_INET6,
                ASN1_STRING_get0_data(gn->d.iPAddress), text, sizeof(text));
      out.push_back(std::string("IP:") + text);
    } else {
      out.push_back("other:" + std::to_string(gn->type));
    }
  }
  return out;
}

int CertKeyBits(X509* cert) { return EVP_PKEY_bits(X509_get0_pubkey(cert)); }

void MakeSet(const std::string& dir, _tag_CSR_ARGUMENT ca, _tag_CSR_ARGUMENT server,
             const std::string& aliases) {
  ASSERT_EQ(genCASet(&ca, 1024, dir), 0);
  ASSERT_EQ(genCertSet(&server, 1024, aliases, dir), 0);
}

_tag_CSR_ARGUMENT Subject(const std::string& country, const std::string& state,
                          const std::string& city, const std::string& organization,
                          const std::string& department, const std::string& common_name,
                          const std::string& email) {
  return _tag_CSR_ARGUMENT{country, state, city, organization, department, common_name, email};
}

}  // namespace test
}  // namespace ZEPH
