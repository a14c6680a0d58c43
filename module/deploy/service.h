// Service objects and the look-ups of which certificate serves which
// service.
//
// A service object describes one consumer of a certificate:
//   "display_name"       string, required, non-empty
//   "display_name_i18n"  string, optional, non-empty when present
//   "subscriber"         string, required, non-empty (owning component)
//   "service"            string, required, non-empty (consumer inside it)
//   "isPkg"              boolean, required (add-on package: under
//                        /usr/local; system service: under /usr/zeph)
//   "owner"              string, required, non-empty (user owning the
//                        deployed files)
// Other members are carried along and never examined. Two objects denote
// the same service exactly when "subscriber" and "service" are equal. The
// web administration interface is {"subscriber": "system",
// "service": "default"}.
//
// The binding lives in INFO (module/archive/info.h): a service stands in the
// "services" array of at most one certificate.
//
// Thread-safety: all functions are safe from any thread and process.
#ifndef ZEPH_MODULE_DEPLOY_SERVICE_H_
#define ZEPH_MODULE_DEPLOY_SERVICE_H_

#include <json/json.h>

#include <string>

#include "zeph/export.h"

// True when `service` is an object satisfying the schema above. The keys
// are checked in the order of the table; the first failing one decides. A
// missing required key logs "Lack of necesary key. [<key>]"; a wrong JSON
// type or an empty string fails without a log line. A value that is not an
// object lacks every key. Last, "subscriber" and "service" must each be one
// path component (no "/" or NUL byte, not "." or ".."): else "Invalid
// service name".
ZEPH_EXPORT bool CheckServiceFormat(const Json::Value& service);

// True when the array `services` holds the web administration interface.
// Malformed elements are skipped with "service object is error.". False for
// an empty array and for anything that is not an array.
ZEPH_EXPORT bool ServicesContainORN(const Json::Value& services);

// Finds the certificate that `service` is bound to, under the INFO lock
// taken shared (ZEPH::cert::kInfoLockServiceLookup). True when INFO could be
// read, whether or not the service is bound; `id` is set only when it is
// (the first match in sorted id order, then array order), so callers pass
// it empty. False when `service` is malformed ("Invalid input format
// [<json>]"), the lock cannot be had ("Failed to lock [<lock>]"), or INFO is
// absent, broken or not an object ("Broken [<INFO>]."). The lock is
// released before returning.
ZEPH_EXPORT bool GetServiceCertID(const Json::Value& service, std::string& id);

// Copies the "services" array of certificate `id` into `services`, reading
// INFO without the lock. False when `id` is not a valid certificate (see
// IsCrtIdValid), or INFO is absent or broken, or `id`'s entry is not an
// object with a "services" array ("Broken [<INFO>]."); `services` is then
// unchanged.
ZEPH_EXPORT bool GetServiceList(const std::string& id, Json::Value& services);

namespace ZEPH {
namespace cert {

// Whether the "subscriber" and "service" of `service` are each one path
// component: not empty, not "." or "..", no "/" and no NUL byte. Logs
// "Invalid service name [<name>]" for the first that is not. Deployments
// check it before making any path of a service, also for service objects
// read back from INFO.
ZEPH_EXPORT bool ServiceNamesAreSafe(const Json::Value& service);

// Whether `a` and `b` (any JSON values) are objects denoting the same
// service: string "subscriber" and "service" members equal byte for byte.
ZEPH_EXPORT bool SameService(const Json::Value& a, const Json::Value& b);

}  // namespace cert
}  // namespace ZEPH

#endif  // ZEPH_MODULE_DEPLOY_SERVICE_H_
