// Reporting OpenSSL failures.
//
// Thread-safety: safe from any thread (the OpenSSL error queue is per
// thread).
#ifndef ZEPH_MODULE_ARCHIVE_SSL_ERRORS_H_
#define ZEPH_MODULE_ARCHIVE_SSL_ERRORS_H_

#include <string>

#include "zeph/export.h"

// Logs "<message> [<error queue>]" after an OpenSSL failure, and leaves the
// calling thread's error queue empty. The queue is cleared *before* it is
// printed, so the bracket is always empty: the line carries the caller's
// message only, and no stale error can leak into the next operation. Logs
// "Fatal Error. new bio failed." instead when no memory BIO can be made.
ZEPH_EXPORT void log_ssl_errors(const std::string& message);

#endif  // ZEPH_MODULE_ARCHIVE_SSL_ERRORS_H_
