// Registering an ACME account with external account binding (RFC 8555,
// section 7.3.4) without handing the HMAC key to lego.
//
// lego registers an account with binding only when it is given the key id
// and the HMAC key on its command line ("--eab --kid K --hmac H"), where
// every user of the machine can read them in /proc. So the tool registers
// such accounts itself: it makes the account key, signs the newAccount
// request (ES256) with the binding (HS256 over the account key, with the
// HMAC key) and stores the account where lego keeps its accounts:
//
//   <lego dir>/accounts/<server host>/<email>/account.json      (0600)
//   <lego dir>/accounts/<server host>/<email>/keys/<email>.key  (0600)
//
// (<server host> is the directory URL's host with ":" made "_", as lego
// names it). lego then finds a registered account and, run with "--eab"
// alone, uses it without registering again.
//
// Thread-safety: one call at a time per lego directory; the tool's lock
// (commands.h) is held around it.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_EAB_ACCOUNT_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_EAB_ACCOUNT_H_

#include <string>

#include "tools/zeph_letsencrypt/config.h"
#include "tools/zeph_letsencrypt/outcome.h"

namespace ZEPH {
namespace letsencrypt {

// Where lego keeps the account of `email` at `directory_url` below the
// lego directory `lego_dir`.
std::string LegoAccountDir(const std::string& lego_dir,
                           const std::string& directory_url,
                           const std::string& email);

// Makes sure `email` has an account at `directory_url` in `lego_dir`: one
// that lego or this tool registered earlier is kept; otherwise a new one is
// registered with the binding of `config` (its "eab_kid" and
// "eab_hmac_key", agreeing to the server's terms) and stored for lego.
// The server's TLS is trusted as lego trusts it ("ca_bundle", else the
// system's roots); every request is bounded by "timeout_s".
// Errors: 100 the server cannot be reached or gives no usable directory;
// 101 it refuses the account (a wrong key id or HMAC key among others);
// 105 the account cannot be stored; 107 an answer not understood.
// REQUIRES: config.eab_kid and config.eab_hmac_key are set.
Outcome EnsureEabAccount(const Config& config, const std::string& directory_url,
                         const std::string& email, const std::string& lego_dir);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_EAB_ACCOUNT_H_
