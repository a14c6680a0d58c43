// Checks of certificates against their keys and their issuers, with the
// OpenSSL library.
//
// Thread-safety: no state is kept; safe from any thread. verifyCrtAndKey
// rewrites its files in place when they start with a byte-order mark, so it
// must not run on a file that another thread or process writes.
#ifndef ZEPH_MODULE_MKCERT_VERIFY_H_
#define ZEPH_MODULE_MKCERT_VERIFY_H_

#include <string>

#include "zeph/export.h"

// Whether the first PEM certificate of `crtPath` belongs to the first PEM
// private key of `keyPath` (no pass phrase is tried). A leading UTF-8
// byte-order mark is first stripped from both files, in place.
// Returns 0 on a match, 1 when they do not match, -1 on any error (a file
// missing or unreadable, no certificate or key in it), with a log line.
ZEPH_EXPORT int verifyCrtAndKey(const std::string& crtPath,
                                const std::string& keyPath);

// Whether the first PEM certificate request of `csrPath` was made with the
// first PEM private key of `keyPath`. Neither file is changed. 0 on a
// match, 1 when they do not match, -1 when either cannot be read, with a
// log line.
ZEPH_EXPORT int verifyCsrAndKey(const std::string& csrPath,
                                const std::string& keyPath);

// Whether the PEM certificates of `crtPath` followed by those of `upperPath`
// form a chain. Only names are compared, signatures are not checked: every
// certificate but one must be the issuer (by subject name) of some other
// certificate of the list. So a single certificate is a chain, and two are
// one when either issued the other.
// Returns 0 for a chain, 1 for none (also when both files hold no
// certificate), -1 when either path is null, empty or missing, or a file
// cannot be opened, with a log line.
ZEPH_EXPORT int verifyCrtChain(const char* crtPath, const char* upperPath);

#endif  // ZEPH_MODULE_MKCERT_VERIFY_H_
