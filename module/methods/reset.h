// The store reset.
#ifndef ZEPH_MODULE_METHODS_RESET_H_
#define ZEPH_MODULE_METHODS_RESET_H_

#include <json/json.h>

#include "zeph/export.h"

// Given the parsed INFO catalogue, moves the services of every certificate
// that users may delete to the default certificate, drops its entry,
// revokes it with the Let's Encrypt tool and removes its directory.
// Certificates marked "user_deletable": false are left alone. Returns the
// ids whose services or entry could not be moved or dropped; a directory
// that cannot be removed is only logged.
ZEPH_EXPORT Json::Value softReset(const Json::Value& info);

#endif  // ZEPH_MODULE_METHODS_RESET_H_
