#include "module/mkcert/key_type.h"

#include <openssl/ec.h>
#include <openssl/err.h>
#include <openssl/pem.h>

#include "module/common/ssl_ptr.h"

namespace ZEPH {
namespace cert {
namespace {

// Never asks for a pass phrase (OpenSSL's default would prompt on the
// terminal): an encrypted key simply cannot be read here.
int NoPassphrase(char* /*buf*/, int /*size*/, int /*rwflag*/, void* /*u*/) {
  return 0;
}

// The curve of an EC key, NID_undef for any other key.
int CurveOf(const EVP_PKEY* key) {
  if (key == nullptr || EVP_PKEY_base_id(key) != EVP_PKEY_EC) return NID_undef;
  const EC_KEY* ec = EVP_PKEY_get0_EC_KEY(key);
  const EC_GROUP* group = ec != nullptr ? EC_KEY_get0_group(ec) : nullptr;
  return group != nullptr ? EC_GROUP_get_curve_name(group) : NID_undef;
}

}  // namespace

bool ParseKeyType(const std::string& text, KeyType* out) {
  for (KeyType type : {KeyType::kRsa, KeyType::kEc256, KeyType::kEc384}) {
    if (text == KeyTypeName(type)) {
      *out = type;
      return true;
    }
  }
  return false;
}

const char* KeyTypeName(KeyType type) {
  switch (type) {
    case KeyType::kEc256: return "ec256";
    case KeyType::kEc384: return "ec384";
    case KeyType::kRsa: break;
  }
  return "rsa";
}

bool KeyTypeOf(const EVP_PKEY* key, KeyType* out) {
  if (key == nullptr) return false;
  if (EVP_PKEY_base_id(key) == EVP_PKEY_RSA) {
    *out = KeyType::kRsa;
    return true;
  }
  switch (CurveOf(key)) {
    case NID_X9_62_prime256v1:
      *out = KeyType::kEc256;
      return true;
    case NID_secp384r1:
      *out = KeyType::kEc384;
      return true;
    default:
      return false;
  }
}

const char* SigningDigestOption(const std::string& key_path) {
  ssl::BioPtr bio(BIO_new_file(key_path.c_str(), "r"));
  ssl::EvpPkeyPtr key(
      bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, NoPassphrase, nullptr)
          : nullptr);
  // A key that cannot be read here is left for openssl to report.
  ERR_clear_error();
  return CurveOf(key.get()) == NID_secp384r1 ? "-sha384" : "-sha256";
}

}  // namespace cert
}  // namespace ZEPH
