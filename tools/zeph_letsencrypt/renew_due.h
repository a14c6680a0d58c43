// renew-due: renews every certificate of this tool that is about to expire,
// through the certificate module, so that the services using a renewed
// certificate get it deployed. A systemd timer runs it daily.
//
// All paths are below the root prefix (ZEPH_ROOT), for the module too.
//
// Thread-safety: run from the tool's one thread. Two renew-due runs keep
// apart through their own lock file; the renewals themselves take the
// tool's ACME lock (commands.h) in the child the module starts, which is
// why renew-due never holds that lock.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_RENEW_DUE_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_RENEW_DUE_H_

#include <string>
#include <vector>

#include "tools/zeph_letsencrypt/outcome.h"

namespace ZEPH {
namespace letsencrypt {

// Held for the whole of a renew-due run (appliance path).
constexpr char kRenewDueLockFile[] = "/usr/zeph/etc/letsencrypt/.renew-due.lock";

// Certificates that expire within this many days are renewed by default.
constexpr int kDefaultRenewDays = 30;
// Largest --days accepted.
constexpr int kMaxRenewDays = 36500;

struct RenewDueOptions {
  int days = kDefaultRenewDays;
  // The certificate module to load; empty: the environment variable
  // ZEPH_CERT_MODULE, else the first of CertificateModuleCandidates() that
  // exists.
  std::string module_path;
};

// Whether a certificate is due for renewal.
enum class Expiry {
  kDue,         // its notAfter lies before now + days
  kNotDue,      // valid at least that long
  kUnreadable,  // no certificate could be read from the file
};

// The expiry test of the module's isPemExpire: the first certificate of the
// PEM file `path` is due when its notAfter is earlier than now + `days`
// days. `not_after`, when given, receives the notAfter as text ("" when
// unreadable).
Expiry CheckExpiry(const std::string& path, int days, std::string* not_after);

// Where the certificate module is looked for when no path is given, in
// order: beside the executable, ../lib/zeph relative to it, and the
// library directory of the installation. A copy of the tool in a root's
// /usr/zeph/sbin usually finds none of them in the root; the last one is
// the installed module, if any.
std::vector<std::string> CertificateModuleCandidates();

// renew-due:
//  1. takes the renew-due lock without waiting (error 112 when another run
//     holds it);
//  2. reads the catalogue INFO without its lock, as other readers of the
//     archive do (error 112 when it is missing or not a JSON object);
//  3. loads the certificate module and finds its method "renew" of
//     "ZEPH.Core.Certificate.LetsEncrypt" (error 112 when it cannot be
//     found, loaded, or has no such method: then nothing is renewed, and
//     step 5 counts every certificate as one that will not renew itself);
//  4. for each certificate id of INFO, in the catalogue's order: an id
//     that is renewable (its directory holds "renew.json") and whose
//     "cert.pem" is due (CheckExpiry) is renewed by calling the module's
//     "renew" with {"id": id}; every other id is skipped (a "cert.pem"
//     that cannot be read is skipped with a warning on standard error);
//  5. writes the day's expiry warnings (expiry_warnings.h): certificates
//     in use that expire within 30 days and will not renew themselves.
// Answer data: "renewed" (ids), "failed" ([{"id", "code"}], "code" the API
// error code the module answered), "skipped" (how many ids were not
// renewed), "warned" (the ids warned about in this run). Success when
// nothing failed; error 111 with the same data when one or more renewals
// failed; error 112 of step 3 with "warned". Progress lines go to
// standard error.
Outcome RenewDue(const RenewDueOptions& options);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_RENEW_DUE_H_
