#include "module/mkcert/mkcert_test_util.h"

#include <arpa/inet.h>
#include <dirent.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <openssl/pem.h>

#include <algorithm>

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

int LogCount(const TempRoot& root, const std::string& message, bool prefix) {
  const std::string log = root.Log();
  int n = 0;
  size_t start = 0;
  while (start < log.size()) {
    size_t end = log.find('\n', start);
    if (end == std::string::npos) end = log.size();
    const std::string line = log.substr(start, end - start);
    start = end + 1;
    const std::string source = "mkcert:";
    if (line.compare(0, source.size(), source) != 0) continue;
    size_t i = source.size();
    while (i < line.size() && isdigit(static_cast<unsigned char>(line[i]))) ++i;
    if (i == source.size() || i >= line.size() || line[i] != ' ') continue;
    const std::string text = line.substr(i + 1);
    if (prefix ? text.compare(0, message.size(), message) == 0
               : text == message) {
      ++n;
    }
  }
  return n;
}

ssl::X509Ptr LoadCert(const std::string& path) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  ssl::X509Ptr cert(
      bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr);
  ERR_clear_error();
  return cert;
}

ssl::X509ReqPtr LoadCsr(const std::string& path) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  ssl::X509ReqPtr req(
      bio ? PEM_read_bio_X509_REQ(bio.get(), nullptr, nullptr, nullptr)
          : nullptr);
  ERR_clear_error();
  return req;
}

ssl::EvpPkeyPtr LoadKey(const std::string& path) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  ssl::EvpPkeyPtr key(
      bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr)
          : nullptr);
  ERR_clear_error();
  return key;
}

std::string Attr(X509_NAME* name, int nid) {
  std::string out;
  for (int i = X509_NAME_get_index_by_NID(name, nid, -1); i >= 0;
       i = X509_NAME_get_index_by_NID(name, nid, i)) {
    unsigned char* utf8 = nullptr;
    int n = ASN1_STRING_to_UTF8(
        &utf8, X509_NAME_ENTRY_get_data(X509_NAME_get_entry(name, i)));
    if (n < 0) continue;
    ssl::OpensslBytes owned(utf8);
    if (!out.empty()) out += "|";
    out.append(reinterpret_cast<char*>(utf8), static_cast<size_t>(n));
  }
  return out;
}

std::vector<std::string> AltNames(X509* cert) {
  std::vector<std::string> out;
  ssl::GeneralNamesPtr names(static_cast<GENERAL_NAMES*>(
      X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr)));
  for (int i = 0; names && i < sk_GENERAL_NAME_num(names.get()); ++i) {
    const GENERAL_NAME* gn = sk_GENERAL_NAME_value(names.get(), i);
    if (gn->type == GEN_DNS) {
      out.push_back("DNS:" +
                    std::string(reinterpret_cast<const char*>(
                                    ASN1_STRING_get0_data(gn->d.dNSName)),
                                ASN1_STRING_length(gn->d.dNSName)));
    } else if (gn->type == GEN_IPADD) {
      char text[INET6_ADDRSTRLEN] = "?";
      int len = ASN1_STRING_length(gn->d.iPAddress);
      inet_ntop(len == 4 ? AF_INET : AF_INET6,
                ASN1_STRING_get0_data(gn->d.iPAddress), text, sizeof(text));
      out.push_back(std::string("IP:") + text);
    } else {
      out.push_back("other:" + std::to_string(gn->type));
    }
  }
  return out;
}

std::string ExtensionText(X509* cert, int nid) {
  int i = X509_get_ext_by_NID(cert, nid, -1);
  if (i < 0) return "";
  ssl::BioPtr mem(BIO_new(BIO_s_mem()));
  X509V3_EXT_print(mem.get(), X509_get_ext(cert, i), 0, 0);
  char* data = nullptr;
  long n = BIO_get_mem_data(mem.get(), &data);
  return std::string(data, static_cast<size_t>(n));
}

bool ExtensionCritical(X509* cert, int nid) {
  int i = X509_get_ext_by_NID(cert, nid, -1);
  return i >= 0 && X509_EXTENSION_get_critical(X509_get_ext(cert, i)) == 1;
}

int ValidityDays(X509* cert) {
  int days = 0, seconds = 0;
  if (!ASN1_TIME_diff(&days, &seconds, X509_get0_notBefore(cert),
                      X509_get0_notAfter(cert))) {
    return -1;
  }
  return days;
}

std::string SerialHex(X509* cert) {
  ssl::BignumPtr bn(ASN1_INTEGER_to_BN(X509_get0_serialNumber(cert), nullptr));
  ssl::OpensslChars hex(bn ? BN_bn2hex(bn.get()) : nullptr);
  return hex ? hex.get() : "";
}

int CertKeyBits(X509* cert) { return EVP_PKEY_bits(X509_get0_pubkey(cert)); }

void MakeSet(const std::string& dir, _tag_CSR_ARGUMENT ca,
             _tag_CSR_ARGUMENT server, const std::string& aliases) {
  ASSERT_EQ(genCASet(&ca, 1024, dir), 0);
  ASSERT_EQ(genCertSet(&server, 1024, aliases, dir), 0);
}

_tag_CSR_ARGUMENT Subject(const std::string& country, const std::string& state,
                          const std::string& city,
                          const std::string& organization,
                          const std::string& department,
                          const std::string& common_name,
                          const std::string& email) {
  _tag_CSR_ARGUMENT s;
  s.country = country;
  s.state = state;
  s.city = city;
  s.organization = organization;
  s.department = department;
  s.common_name = common_name;
  s.email = email;
  return s;
}

}  // namespace test
}  // namespace ZEPH
