// The Let's Encrypt tool protocol: the module runs
// "/usr/zeph/sbin/zeph-letsencrypt" as a child and reads one JSON object
// from its standard output.
//
// Thread-safety: no state; each call runs its own child process.
#ifndef ZEPH_MODULE_METHODS_LETSENCRYPT_H_
#define ZEPH_MODULE_METHODS_LETSENCRYPT_H_

#include <json/json.h>

#include "zeph/export.h"

// Runs the tool with up to seven arguments (the list ends at the first
// null) and answers its JSON object. The answer always holds "error" (0 for
// success) and, when "error" is not 0, "msg". A tool that cannot start,
// prints no JSON or gives no "error" answers error 1. The tool's exit
// status is not consulted. A non-zero error is logged.
ZEPH_EXPORT Json::Value RunLetsEncrypt(const char* arg1, const char* arg2 = nullptr,
                                       const char* arg3 = nullptr,
                                       const char* arg4 = nullptr,
                                       const char* arg5 = nullptr,
                                       const char* arg6 = nullptr,
                                       const char* arg7 = nullptr);

// The API error code of a tool error number: 100-106 and 108-110 give
// 5520-5526 and 5528-5530, 200 and 205 give 5527, anything else 5501.
ZEPH_EXPORT int LetsEncryptErrorToApiError(int tool_error);

#endif  // ZEPH_MODULE_METHODS_LETSENCRYPT_H_
