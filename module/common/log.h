// Log helpers of the certificate module.
//
// Each line names the logical source file it belongs to, whichever C++ file
// the code sits in: "certificate" (the method frame and workers), "utils"
// (archive and deployment), "mkcert" (key and certificate generation) and
// "uploadsslca" (import and export). Use the macro of the subsystem:
//
//   UTILS_LOG("Failed to remove %s [%d]", path.c_str(), errno);
//   UTILS_LOG_LIBERR("Broken [%s].", info.c_str());   // + "[0x%04X %s:%d]"
//   UTILS_LOG_DEBUG("skip move directory ...");       // priority 7
#ifndef ZEPH_MODULE_COMMON_LOG_H_
#define ZEPH_MODULE_COMMON_LOG_H_

#include "zeph/log.h"

#define ZEPH_SOURCE_CERTIFICATE "certificate"
#define ZEPH_SOURCE_UTILS "utils"
#define ZEPH_SOURCE_MKCERT "mkcert"
#define ZEPH_SOURCE_UPLOADSSLCA "uploadsslca"

#define CERT_LOG(...) ZEPH_LOG(LOG_ERR, ZEPH_SOURCE_CERTIFICATE, __VA_ARGS__)
#define CERT_LOG_LIBERR(...) \
  ZEPH_LOG_LIBERR(LOG_ERR, ZEPH_SOURCE_CERTIFICATE, __VA_ARGS__)
#define CERT_LOG_DEBUG(...) \
  ZEPH_LOG(LOG_DEBUG, ZEPH_SOURCE_CERTIFICATE, __VA_ARGS__)

#define UTILS_LOG(...) ZEPH_LOG(LOG_ERR, ZEPH_SOURCE_UTILS, __VA_ARGS__)
#define UTILS_LOG_LIBERR(...) \
  ZEPH_LOG_LIBERR(LOG_ERR, ZEPH_SOURCE_UTILS, __VA_ARGS__)
#define UTILS_LOG_DEBUG(...) ZEPH_LOG(LOG_DEBUG, ZEPH_SOURCE_UTILS, __VA_ARGS__)

#define MKCERT_LOG(...) ZEPH_LOG(LOG_ERR, ZEPH_SOURCE_MKCERT, __VA_ARGS__)
#define MKCERT_LOG_LIBERR(...) \
  ZEPH_LOG_LIBERR(LOG_ERR, ZEPH_SOURCE_MKCERT, __VA_ARGS__)
#define MKCERT_LOG_DEBUG(...) \
  ZEPH_LOG(LOG_DEBUG, ZEPH_SOURCE_MKCERT, __VA_ARGS__)

#define UPLOAD_LOG(...) ZEPH_LOG(LOG_ERR, ZEPH_SOURCE_UPLOADSSLCA, __VA_ARGS__)
#define UPLOAD_LOG_LIBERR(...) \
  ZEPH_LOG_LIBERR(LOG_ERR, ZEPH_SOURCE_UPLOADSSLCA, __VA_ARGS__)
#define UPLOAD_LOG_DEBUG(...) \
  ZEPH_LOG(LOG_DEBUG, ZEPH_SOURCE_UPLOADSSLCA, __VA_ARGS__)

#endif  // ZEPH_MODULE_COMMON_LOG_H_
