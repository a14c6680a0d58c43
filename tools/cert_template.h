// What a recreated certificate keeps of the certificate it replaces.
//
// Thread-safety: no state; safe from any thread.
#ifndef ZEPH_TOOLS_CERT_TEMPLATE_H_
#define ZEPH_TOOLS_CERT_TEMPLATE_H_

#include <string>

#include "module/mkcert/csr_argument.h"
#include "module/mkcert/key_type.h"

namespace ZEPH {
namespace mkcert {

// The inputs of one certificate set: the two subjects, the two key types
// and lengths (a length counts for RSA only) and the alias string
// (";"-separated subject alternative names).
struct CertTemplate {
  _tag_CSR_ARGUMENT server;
  _tag_CSR_ARGUMENT authority;
  cert::KeyType server_type = cert::KeyType::kRsa;
  cert::KeyType authority_type = cert::KeyType::kRsa;
  int server_bits = 0;
  int authority_bits = 0;
  std::string aliases;
};

// The appliance's default set: the same subjects, key lengths and alias as
// genDefaultCrt.
CertTemplate DefaultTemplate();

// Reads the template of the certificate set in `dir`:
//   - the server subject, key type and length and alternative names from
//     "cert.pem";
//   - the authority subject and key type and length from "zeph-ca-cert.pem"
//     when that file exists, else the default authority subject and the
//     server's key type and length.
// Of each subject the first countryName, stateOrProvinceName, localityName,
// organizationName, organizationalUnitName, commonName and emailAddress are
// kept; other attributes are dropped. Alternative names keep their order:
// DNS names as they are, IPv4 and IPv6 addresses in text form; other kinds,
// and DNS names with characters outside letters, digits and ".-_*", are
// dropped, since the configuration files have no way to quote them. RSA
// keys keep their length, P-256 and P-384 keys their curve; any other key
// (another curve, EdDSA, DSA) gives an RSA key of the default length (2048).
// False, with a one-line reason in `error`, when a certificate cannot be
// read, its subject keeps no attribute at all (no request can be made from
// it), or a kept subject value holds a control character (which would break
// the request configuration's line structure).
bool TemplateFromDir(const std::string& dir, CertTemplate* out,
                     std::string* error);

}  // namespace mkcert
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_CERT_TEMPLATE_H_
