// base64url (RFC 4648, section 5), the encoding of JOSE and of the HMAC
// keys that ACME CAs hand out for external account binding.
//
// Thread-safety: pure functions.
#ifndef ZEPH_ACME_BASE64URL_H_
#define ZEPH_ACME_BASE64URL_H_

#include <string>

namespace ZEPH {
namespace acme {

// `bytes` in base64url without padding.
std::string Base64UrlEncode(const std::string& bytes);

// The bytes of base64url `text` into `out`; "=" padding at the end is
// accepted. False for any other character or a length no encoding has.
bool Base64UrlDecode(const std::string& text, std::string* out);

}  // namespace acme
}  // namespace ZEPH

#endif  // ZEPH_ACME_BASE64URL_H_
