// The workers behind the API methods of the certificate module.
//
// Each worker reads its parameters from `request` (the wrapper in
// frame/wrappers.h has already checked their types) and ends with exactly one
// outcome on `response`: SetSuccess or SetError. Workers keep no state
// between calls and may run in several threads and processes at once; what
// must be serialised is serialised by the archive's lock files.
#ifndef ZEPH_MODULE_METHODS_WORKERS_H_
#define ZEPH_MODULE_METHODS_WORKERS_H_

#include "zeph/api.h"
#include "zeph/export.h"

// ZEPH.Core.Certificate "reset": back to one fresh default certificate.
ZEPH_EXPORT void handleResetAction(ZEPH::APIRequest* request,
                                   ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CSR "create": a key and a signing request.
ZEPH_EXPORT void handleCSRAction(ZEPH::APIRequest* request,
                                 ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CSR "renew": a request from an existing certificate.
ZEPH_EXPORT void handleRenewAction(ZEPH::APIRequest* request,
                                   ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CSR "sign": sign an uploaded request with a CA.
ZEPH_EXPORT void handleSignCSRAction(ZEPH::APIRequest* request,
                                     ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CRT "create": a self-signed set with its own CA.
ZEPH_EXPORT void handleCRTAction(ZEPH::APIRequest* request,
                                 ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CRT "recreate": fresh keys, same subject.
ZEPH_EXPORT void handleRecreateCRTAction(ZEPH::APIRequest* request,
                                         ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CRT "set": description and default flag.
ZEPH_EXPORT void handleCRTSet(ZEPH::APIRequest* request,
                              ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CRT "delete".
ZEPH_EXPORT void handleCRTDelete(ZEPH::APIRequest* request,
                                 ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.CRT "list".
ZEPH_EXPORT void handleCRTList(ZEPH::APIRequest* request,
                               ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.LetsEncrypt "create". "domain_name" may hold several
// names separated by "," (the first is the common name) and wildcard names
// ("*.example.org", which the tool takes with DNS-01 only); a failure of
// such a request answers the tool's reason as {"msg": ...}, every other
// failure a JSON null.
ZEPH_EXPORT void handleLECreate(ZEPH::APIRequest* request,
                                ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.LetsEncrypt "renew".
ZEPH_EXPORT void handleLERenew(ZEPH::APIRequest* request,
                               ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.LetsEncrypt.Account "list".
ZEPH_EXPORT void handleLEAccountList(ZEPH::APIRequest* request,
                                     ZEPH::APIResponse* response);
// ZEPH.Core.Certificate.Service "set": bind services to certificates.
ZEPH_EXPORT void handleServiceSet(ZEPH::APIRequest* request,
                                  ZEPH::APIResponse* response);

#endif  // ZEPH_MODULE_METHODS_WORKERS_H_
