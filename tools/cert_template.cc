#include "tools/cert_template.h"

#include <arpa/inet.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include "module/common/ssl_ptr.h"
#include "module/mkcert/cert_set.h"
#include "zeph/qlibc_file.h"

namespace ZEPH {
namespace mkcert {
namespace {

constexpr int kDefaultBits = 2048;

_tag_CSR_ARGUMENT DefaultSubject(const char* common_name) {
  _tag_CSR_ARGUMENT s;
  s.country = "TW";
  s.city = "Taipel";
  s.organization = "Arvelon Inc.";
  s.common_name = common_name;
  return s;
}

ssl::X509Ptr ReadCert(const std::string& path) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  if (!bio) return nullptr;
  return ssl::X509Ptr(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
}

// The first value of attribute `nid` in UTF-8, empty when there is none.
std::string FirstValue(X509_NAME* name, int nid) {
  const int i = X509_NAME_get_index_by_NID(name, nid, -1);
  if (i < 0) return "";
  unsigned char* utf8 = nullptr;
  const int n = ASN1_STRING_to_UTF8(
      &utf8, X509_NAME_ENTRY_get_data(X509_NAME_get_entry(name, i)));
  if (n < 0) return "";
  ssl::OpensslBytes owned(utf8);
  return std::string(reinterpret_cast<const char*>(utf8),
                     static_cast<size_t>(n));
}

bool IsEmpty(const _tag_CSR_ARGUMENT& s) {
  return s.country.empty() && s.state.empty() && s.city.empty() &&
         s.organization.empty() && s.department.empty() &&
         s.common_name.empty() && s.email.empty();
}

bool HasControlChar(const std::string& s) {
  for (unsigned char c : s) {
    if (c < 0x20 || c == 0x7f) return true;
  }
  return false;
}

bool SubjectOf(X509* cert, _tag_CSR_ARGUMENT* out) {
  X509_NAME* name = X509_get_subject_name(cert);
  out->country = FirstValue(name, NID_countryName);
  out->state = FirstValue(name, NID_stateOrProvinceName);
  out->city = FirstValue(name, NID_localityName);
  out->organization = FirstValue(name, NID_organizationName);
  out->department = FirstValue(name, NID_organizationalUnitName);
  out->common_name = FirstValue(name, NID_commonName);
  out->email = FirstValue(name, NID_pkcs9_emailAddress);
  for (const std::string* v :
       {&out->country, &out->state, &out->city, &out->organization,
        &out->department, &out->common_name, &out->email}) {
    if (HasControlChar(*v)) return false;
  }
  return true;
}

// The key type and length of the certificate's key; the default RSA key
// for a key the appliance does not make.
void KeyOf(X509* cert, cert::KeyType* type, int* bits) {
  EVP_PKEY* key = X509_get0_pubkey(cert);
  *bits = kDefaultBits;
  if (!cert::KeyTypeOf(key, type)) *type = cert::KeyType::kRsa;
  if (key != nullptr && EVP_PKEY_base_id(key) == EVP_PKEY_RSA) {
    *bits = EVP_PKEY_bits(key);
  }
}

bool IsPlainDnsName(const std::string& name) {
  if (name.empty()) return false;
  for (unsigned char c : name) {
    const bool alnum = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                       (c >= '0' && c <= '9');
    if (!alnum && c != '.' && c != '-' && c != '_' && c != '*') {
      return false;
    }
  }
  return true;
}

std::string IpText(const ASN1_OCTET_STRING* ip) {
  char text[INET6_ADDRSTRLEN] = "";
  const int len = ASN1_STRING_length(ip);
  const int family = len == 4 ? AF_INET : len == 16 ? AF_INET6 : -1;
  if (family < 0 || inet_ntop(family, ASN1_STRING_get0_data(ip), text,
                              sizeof(text)) == nullptr) {
    return "";
  }
  return text;
}

std::string AliasesOf(X509* cert) {
  ssl::GeneralNamesPtr names(static_cast<GENERAL_NAMES*>(
      X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr)));
  std::string aliases;
  const int n = names ? sk_GENERAL_NAME_num(names.get()) : 0;
  for (int i = 0; i < n; ++i) {
    const GENERAL_NAME* gn = sk_GENERAL_NAME_value(names.get(), i);
    std::string alias;
    if (gn->type == GEN_DNS) {
      const ASN1_IA5STRING* dns = gn->d.dNSName;
      alias.assign(reinterpret_cast<const char*>(ASN1_STRING_get0_data(dns)),
                   static_cast<size_t>(ASN1_STRING_length(dns)));
      if (!IsPlainDnsName(alias)) alias.clear();
    } else if (gn->type == GEN_IPADD) {
      alias = IpText(gn->d.iPAddress);
    }
    if (alias.empty()) continue;
    if (!aliases.empty()) aliases += ';';
    aliases += alias;
  }
  return aliases;
}

}  // namespace

CertTemplate DefaultTemplate() {
  CertTemplate t;
  t.authority = DefaultSubject("Arvelon Inc. CA");
  t.server = DefaultSubject("arvelon");
  t.server_bits = kDefaultBits;
  t.authority_bits = kDefaultBits;
  t.aliases = "arvelon";
  return t;
}

bool TemplateFromDir(const std::string& dir, CertTemplate* out,
                     std::string* error) {
  CertTemplate t = DefaultTemplate();
  const std::string cert_path = dir + "/" + cert::kSetCert;
  ssl::X509Ptr cert = ReadCert(cert_path);
  if (!cert) {
    ERR_clear_error();
    *error = "cannot read certificate " + cert_path;
    return false;
  }
  if (!SubjectOf(cert.get(), &t.server)) {
    *error = "subject of " + cert_path + " holds a control character";
    return false;
  }
  if (IsEmpty(t.server)) {
    *error = "subject of " + cert_path + " has no attribute that can be kept";
    return false;
  }
  KeyOf(cert.get(), &t.server_type, &t.server_bits);
  t.aliases = AliasesOf(cert.get());
  t.authority_type = t.server_type;
  t.authority_bits = t.server_bits;

  const std::string ca_path = dir + "/" + cert::kSetCaCert;
  if (QLIBCFileExist(ca_path.c_str())) {
    ssl::X509Ptr ca = ReadCert(ca_path);
    if (!ca) {
      ERR_clear_error();
      *error = "cannot read certificate " + ca_path;
      return false;
    }
    if (!SubjectOf(ca.get(), &t.authority)) {
      *error = "subject of " + ca_path + " holds a control character";
      return false;
    }
    KeyOf(ca.get(), &t.authority_type, &t.authority_bits);
  }
  *out = t;
  return true;
}

}  // namespace mkcert
}  // namespace ZEPH
