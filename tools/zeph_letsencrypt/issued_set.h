// A certificate set as lego obtains it and as the archive keeps it.
//
// In the archive, a directory of this tool holds exactly:
//   cert.pem       the certificate (leaf)                     mode 0400
//   chain.pem      the intermediate certificates              mode 0400
//   fullchain.pem  cert.pem followed by chain.pem             mode 0400
//   privkey.pem    the private key                            mode 0400
//   renew.json     how to renew and revoke it (see commands.h) mode 0600
//
// Thread-safety: no shared state.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_ISSUED_SET_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_ISSUED_SET_H_

#include <json/json.h>

#include <string>

#include "tools/zeph_letsencrypt/outcome.h"

namespace ZEPH {
namespace letsencrypt {

constexpr char kRenewFile[] = "renew.json";

struct IssuedSet {
  std::string cert;   // one PEM certificate
  std::string chain;  // one or more PEM certificates
  std::string key;    // PEM private key
  std::string serial;     // of the leaf, upper-case hexadecimal
  std::string not_after;  // of the leaf, "YYYY-MM-DDTHH:MM:SSZ"
};

// Reads the certificate that one lego run wrote into `certificates_dir`
// (its "<name>.crt", "<name>.issuer.crt" and "<name>.key"; the directory
// holds the output of that run only) and checks it with OpenSSL: the leaf
// and every chain certificate parse, the key parses and belongs to the
// leaf, and the chain is not empty. Error 205 with the reason otherwise.
Outcome ReadLegoCertificate(const std::string& certificates_dir, IssuedSet* set);

// Writes the five files of `set` and `renew` into the existing directory
// `dir`, each whole (see WriteWhole), renew.json last. On failure removes
// the files it wrote and answers 105.
Outcome WriteSet(const std::string& dir, const IssuedSet& set,
                 const Json::Value& renew);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_ISSUED_SET_H_
