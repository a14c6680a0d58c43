// Fingerprints of the certificates that services should be using.
//
// Thread-safety: safe from any thread and process. INFO is read without the
// INFO lock: it is always replaced whole by rename, so the read sees one
// complete version.
#ifndef ZEPH_MODULE_ARCHIVE_CHECKSUM_H_
#define ZEPH_MODULE_ARCHIVE_CHECKSUM_H_

#include <json/json.h>

#include "zeph/export.h"

// Appends to `list` (an empty array or a null value) one object
//   {"service": ..., "subscriber": ..., "checksum": <64 lowercase hex digits>}
// per service bound in INFO, certificates in sorted id order and services in
// array order. The checksum is the SHA-256 of the DER form of the first
// certificate in the archive's "<archive>/<id>/cert.pem" (not of a service's
// deployed copy), so every service of one certificate gets the same value.
// True when every bound service got its element. False, after logging, at
// the first failure; the elements already appended stay:
//   - INFO unreadable, unparsable or not an object ("Open <INFO> failed. ...");
//   - an entry without a "services" array ("Incorrect format for <INFO>");
//   - "cert.pem" does not resolve ("Realpath ... failed. ..."), or resolves
//     elsewhere, through a symbolic link ("Invalid path for <path>,
//     <resolved>.");
//   - the file cannot be opened or read as PEM, or hashing fails (OpenSSL
//     failures go through log_ssl_errors).
// Writes no file. Used by other components of the appliance,
// linked or looked up with dlsym (c_names.h); nothing in this module calls
// it.
ZEPH_EXPORT bool GenCrtChecksum(Json::Value& list);

#endif  // ZEPH_MODULE_ARCHIVE_CHECKSUM_H_
