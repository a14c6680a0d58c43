// The three commands of zeph-letsencrypt.
//
// All paths are below the root prefix (ZEPH_ROOT). Each command reads the
// configuration first (error 108), takes the tool's lock before lego runs
// and holds it to its end (waiting at most "timeout_s"; error 109 after
// that), runs lego in a
// private working directory below "<root>/usr/zeph/etc/letsencrypt/work"
// that it removes afterwards, and copies lego's output to standard error.
// lego's data directory "<root>/usr/zeph/etc/letsencrypt/lego" (mode 0700)
// keeps the accounts and their keys; the working directory reaches them
// through a link named "accounts", and certificates never stay there.
//
// renew.json, written with each set, holds what renewal and revocation
// need:
//   {"domain": "<domain>", "email": "<account e-mail>",
//    "account": "<account record name>",
//    "directory_url": "<ACME directory the certificate came from>",
//    "domains": ["<domain>", "<second>", ...],        (several names only)
//    "lego_path": "/usr/zeph/etc/letsencrypt/lego",   (below the root)
//    "key_type": "<lego key type>", "serial": "<hex>",
//    "not_after": "<time>", "issued_at": "<time>"}
// A renewal goes to the directory and account recorded there (the account
// belongs to that server), with the key type recorded there, and solves
// the challenge as the current configuration says.
//
// Thread-safety: run from the tool's one thread; separate processes are
// kept apart by the lock file "<root>/usr/zeph/etc/letsencrypt/.lock".
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_COMMANDS_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_COMMANDS_H_

#include <string>
#include <vector>

#include "tools/zeph_letsencrypt/outcome.h"

namespace ZEPH {
namespace letsencrypt {

// A certificate directory name: not empty, not "." or "..", no "/".
bool IsDirectoryName(const std::string& name);

// A domain name lego can ask for: letters, digits and hyphens in labels of
// 1 to 63 characters that neither start nor end with a hyphen, separated
// by dots, optionally "*." in front, 253 characters at most. Upper-case
// letters are accepted (the tool asks for the lower-case name).
bool IsDomainName(const std::string& domain);

// The names of "-d": one or more domain names separated by ",", blanks
// around each ignored in such a list, each IsDomainName, at most 100. They go into
// `domains` in lower case, in the order given, each once; the first is the
// certificate's common name. False with the reason in `why` otherwise.
bool ParseDomains(const std::string& text, std::vector<std::string>* domains,
                  std::string* why);

// new-cert: obtains a certificate for `domain` with the account of `email`
// (registering it, agreeing to the server's terms, when it is new) and
// writes the set into the archive directory `name`, which is made (mode
// 0700) when missing. `domain` may name several domains (ParseDomains):
// one certificate for all of them. A wildcard name ("*.example.org") needs
// the DNS-01 challenge: without a "dns_provider" it is refused with 102
// before anything is sent. With "eab_kid" set, a new account is registered
// with external account binding (eab_account.h). An empty `email` uses
// the one account recorded for the configured directory. Records the account. Success data: "domain",
// "account", "serial", "not_after", and "domains" (all names, the first
// being "domain") for several names.
Outcome NewCert(const std::string& domain, const std::string& email,
                const std::string& name);

// renew: obtains a new certificate as the renew.json of archive directory
// `id` says and replaces the directory's set as a whole: the new set is
// made in a staging directory beside it and exchanged for the old one in
// one rename, so that any failure leaves the old set as it was. Staging
// directories of `id` that a killed run left behind are removed first. A
// certificate with a wildcard name needs DNS-01 again (102 otherwise).
// Success data as for NewCert.
Outcome Renew(const std::string& id);

// revoke: asks the ACME server to revoke the certificate of archive
// directory `id` (reason: cessation of operation), with the account that
// obtained it. Error 106 for a directory without renew.json, that is, a
// certificate this tool did not issue; nothing is sent then. The files
// are left alone. Success data: "domain".
Outcome Revoke(const std::string& id);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_COMMANDS_H_
