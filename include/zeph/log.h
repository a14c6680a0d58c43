// Diagnostics.
//
// Every diagnostic line of the product has the form
//   "<source>:<line> <message>"
// where <source> is the logical source file the line belongs to (for the
// certificate module: "certificate", "mkcert", "uploadsslca" or "utils") and
// <line> the line of code that wrote it. Lines that report a failure of the
// platform utility library end with "[0x%04X %s:%d]": the library's last error
// code, file and line for the calling thread (see qlibc_error.h).
//
// Lines go to syslog (facility LOG_USER) at the given priority. When the
// environment variable ZEPH_LOG_FILE is set, each line is also appended to
// that file (one write per line, so concurrent writers never interleave
// inside a line).
//
// The format is printf's, glibc's "%m" included; errno is preserved for it.
//
// Thread-safety: safe from any thread.
#ifndef ZEPH_LOG_H_
#define ZEPH_LOG_H_

#include <syslog.h>

#include "zeph/export.h"

namespace ZEPH {
namespace log {

// Writes "<source>:<line> " followed by the formatted message.
ZEPH_EXPORT void Write(int priority, const char* source, int line,
                       const char* format, ...)
    __attribute__((format(printf, 4, 5)));

// As Write, with "[0x%04X %s:%d]" of the calling thread's last platform
// error appended directly after the message.
ZEPH_EXPORT void WriteWithLibError(int priority, const char* source, int line,
                                   const char* format, ...)
    __attribute__((format(printf, 4, 5)));

}  // namespace log
}  // namespace ZEPH

// Convenience forms; `source` is one of the logical source names.
#define ZEPH_LOG(priority, source, ...) \
  ::ZEPH::log::Write((priority), (source), __LINE__, __VA_ARGS__)
#define ZEPH_LOG_LIBERR(priority, source, ...) \
  ::ZEPH::log::WriteWithLibError((priority), (source), __LINE__, __VA_ARGS__)

#endif  // ZEPH_LOG_H_
