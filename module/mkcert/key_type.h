// The kinds of key the appliance makes for its certificates and requests.
//
// RSA is what the appliance has always made; its length is chosen by the
// caller. The two elliptic-curve kinds have a fixed size: P-256 and P-384.
// Whatever signs (a request with its own key, a certificate with its
// authority's key) signs with the digest that matches the signing key:
// SHA-384 for a P-384 key, SHA-256 for every other key. So an RSA or
// P-256 key keeps the "-sha256" of the appliance's command lines, and a
// P-384 key signs ecdsa-with-SHA384.
//
// Thread-safety: no state; safe from any thread.
#ifndef ZEPH_MODULE_MKCERT_KEY_TYPE_H_
#define ZEPH_MODULE_MKCERT_KEY_TYPE_H_

#include <openssl/evp.h>

#include <string>

#include "zeph/export.h"

namespace ZEPH {
namespace cert {

enum class KeyType {
  kRsa,    // "rsa", of the length the caller asks for
  kEc256,  // "ec256", NIST P-256 (prime256v1)
  kEc384,  // "ec384", NIST P-384 (secp384r1)
};

// The key type named `text` ("rsa", "ec256", "ec384") into `out`. False,
// leaving `out` alone, for any other text.
ZEPH_EXPORT bool ParseKeyType(const std::string& text, KeyType* out);

// The name ParseKeyType takes for `type`.
ZEPH_EXPORT const char* KeyTypeName(KeyType type);

// The kind of `key`: kEc256 and kEc384 for EC keys on those curves, kRsa
// for RSA keys. False for every other key (other curves, DSA, EdDSA) and
// for null.
ZEPH_EXPORT bool KeyTypeOf(const EVP_PKEY* key, KeyType* out);

// The openssl digest option for signing with the private key in the PEM
// file `key_path`: "-sha384" for a P-384 key, "-sha256" for any other key
// and for a file that cannot be read (openssl then reports the key itself).
ZEPH_EXPORT const char* SigningDigestOption(const std::string& key_path);

}  // namespace cert
}  // namespace ZEPH

#endif  // ZEPH_MODULE_MKCERT_KEY_TYPE_H_
