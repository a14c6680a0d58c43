// The account records that the module lists.
//
// Every ACME account the tool has used successfully has a directory
// "<root>/usr/zeph/etc/letsencrypt/account/<name>/" (mode 0700) with an
// "info.json" (mode 0600):
//
//   {"contact": "<e-mail>", "directory_url": "<ACME directory>"}
//
// <name> is stable for one e-mail at one ACME directory (an account belongs
// to its server): "acct-" and the first 16 hexadecimal digits of the SHA-256
// of the directory URL, a newline and the e-mail. The keys themselves stay
// in lego's data directory.
//
// Thread-safety: no shared state; concurrent runs are serialised by the
// tool's lock.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_ACCOUNTS_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_ACCOUNTS_H_

#include <string>

namespace ZEPH {
namespace letsencrypt {

std::string AccountName(const std::string& directory_url, const std::string& email);

// Writes the record of `email` at `directory_url` below `account_root`
// (unless an identical one is there). False with the reason in `error`.
bool RecordAccount(const std::string& account_root, const std::string& directory_url,
                   const std::string& email, std::string* error);

// The e-mail of the one account recorded for `directory_url`; empty when
// there is none or more than one.
std::string OnlyAccountFor(const std::string& account_root,
                           const std::string& directory_url);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_ACCOUNTS_H_
