// Certificate properties in the INFO catalogue: description, deletability
// and the default certificate.
//
// Thread-safety: each call takes the INFO lock exclusively (10-second
// time-out) around its read-modify-write of INFO and the DEFAULT write.
#ifndef ZEPH_MODULE_METHODS_PROPERTIES_H_
#define ZEPH_MODULE_METHODS_PROPERTIES_H_

#include <string>

#include "zeph/export.h"

// Sets the description of certificate `id` (which must be a valid archive
// certificate). A certificate without a record gets a new one with no
// services and "user_deletable" true; a missing INFO file is created. When
// `as_default` is true the certificate becomes the default (DEFAULT file,
// written while the lock is held) and the set-default action is logged,
// with its outcome, even when the id is invalid. True on success.
ZEPH_EXPORT bool SetCrtProperty(const std::string& id, const std::string& desc,
                                bool as_default);

// As above, and sets "user_deletable" to `user_deletable` in every case.
ZEPH_EXPORT bool SetCrtProperty(const std::string& id, const std::string& desc,
                                bool as_default, bool user_deletable);

#endif  // ZEPH_MODULE_METHODS_PROPERTIES_H_
