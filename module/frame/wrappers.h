// The handlers of the method table.
//
// Each wrapper validates the request's parameters against its rule list and
// then hands request and response to its worker; when validation fails it
// answers the error code of its method (5503; import: 5511, 5510, 5512)
// with a JSON null and the worker is not called. A wrapper never writes a
// success itself, keeps no state and never lets an exception escape: one
// that a worker throws becomes error 5501 (unless the worker had already
// answered).
#ifndef ZEPH_MODULE_FRAME_WRAPPERS_H_
#define ZEPH_MODULE_FRAME_WRAPPERS_H_

#include "zeph/api.h"
#include "zeph/export.h"

extern "C" {

ZEPH_EXPORT void doCertificateReset_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateExport_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateImport_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateCreateCSR_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateRenew_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateSign_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateCreateCRT_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateRecreateCRT_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateSetCRT_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateDeleteCRT_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateListCRT_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateCreateLE_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateRenewLE_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateListLEAccount_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);
ZEPH_EXPORT void doCertificateSetService_v1(ZEPH::APIRequest*, ZEPH::APIResponse*);

}  // extern "C"

#endif  // ZEPH_MODULE_FRAME_WRAPPERS_H_
