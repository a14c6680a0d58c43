// Expiry and renewal of certificates.
//
// Thread-safety: safe from any thread and process; no locks are taken.
#ifndef ZEPH_MODULE_ARCHIVE_EXPIRY_H_
#define ZEPH_MODULE_ARCHIVE_EXPIRY_H_

#include <string>

#include "zeph/export.h"

// True when the first certificate in the PEM file `path` expires (notAfter)
// before now + `days` days. False when it is valid at least that long
// (debug line "<path> will not expired at <limit>"), when the comparison
// fails, and when the file cannot be opened ("Failed to open <path> (...)")
// or read ("Failed to read <path> (...)"). Used by other components
// of the appliance, linked or looked up with dlsym (c_names.h); nothing in
// this module calls it.
ZEPH_EXPORT bool isPemExpire(const std::string& path, int days);

// True when archived certificate `id` can be renewed automatically: its
// directory holds "renew.json" (whatever its content). `id` is not
// validated; callers pass ids read from INFO.
ZEPH_EXPORT bool CertificateRenewable(const std::string& id);

#endif  // ZEPH_MODULE_ARCHIVE_EXPIRY_H_
