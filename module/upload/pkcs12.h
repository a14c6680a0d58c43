// PKCS#12 files of a certificate set, made by the openssl tool: the form in
// which Windows and most devices take a key with its certificates.
//
// The passphrase reaches openssl on its standard input (a pipe written and
// closed before the tool starts), never on its command line, which other
// users of the machine could read in /proc; it is never logged.
//
// Thread-safety: no state; safe from any thread. The caller owns `out_path`
// (the export lock guards the export's one path).
#ifndef ZEPH_MODULE_UPLOAD_PKCS12_H_
#define ZEPH_MODULE_UPLOAD_PKCS12_H_

#include <string>

namespace ZEPH {
namespace cert {

// The longest passphrase accepted: openssl reads at most this much of a
// line for a password.
constexpr size_t kMaxPassphraseBytes = 1023;

// Whether `passphrase` can protect a PKCS#12 file: not empty, at most
// kMaxPassphraseBytes, and no line break or NUL (openssl takes the first
// line of its input).
bool IsUsablePassphrase(const std::string& passphrase);

struct Pkcs12Input {
  std::string key_path;    // the private key (PEM)
  std::string cert_path;   // the certificate (PEM)
  std::string chain_path;  // further certificates (PEM); empty: none
  std::string friendly_name;
};

// Makes `out_path` (replacing any earlier file; mode 0400) with
//   openssl pkcs12 -export -in CERT -inkey KEY [-certfile CHAIN]
//                  -name NAME -passout stdin -out OUT
// that is, OpenSSL 3's defaults: AES-256-CBC with PBKDF2 for the key and
// the certificates, a SHA-256 MAC. `legacy` adds
//   -keypbe PBE-SHA1-3DES -certpbe PBE-SHA1-3DES -macalg sha1
// the form older Windows versions and many devices read; it needs no
// legacy provider. openssl's own output is discarded.
// REQUIRES: IsUsablePassphrase(passphrase).
// 0 on success; -1, with a log line (source "uploadsslca") and no file at
// `out_path`, when the tool could not be run or failed (a key that does
// not fit the certificate, a file that is missing or unreadable).
int MakePkcs12(const Pkcs12Input& input, const std::string& passphrase,
               bool legacy, const std::string& out_path);

}  // namespace cert
}  // namespace ZEPH

#endif  // ZEPH_MODULE_UPLOAD_PKCS12_H_
