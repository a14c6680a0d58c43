// The platform utility library's last-error triple.
//
// Every QLIBC* and ZEPH* routine that fails records an error code and the
// library file and line where it failed. The record is per thread: a failure
// in one thread never shows in another. A successful call does not clear it.
#ifndef ZEPH_QLIBC_ERROR_H_
#define ZEPH_QLIBC_ERROR_H_

#include "zeph/export.h"

// Error codes of the utility library.
enum {
  QLIBC_ERR_NONE = 0x0000,
  QLIBC_ERR_INVALID_ARGUMENT = 0x0001,
  QLIBC_ERR_NOT_FOUND = 0x0002,
  QLIBC_ERR_IO = 0x0003,
  QLIBC_ERR_NO_MEMORY = 0x0004,
  QLIBC_ERR_EXEC = 0x0005,
  QLIBC_ERR_TIMEOUT = 0x0006,
  QLIBC_ERR_LOCK = 0x0007,
  QLIBC_ERR_PERMISSION = 0x0008,
  QLIBC_ERR_EXISTS = 0x0009,
  QLIBC_ERR_UNSUPPORTED = 0x000A,
};

extern "C" {

// The calling thread's last error code (QLIBC_ERR_NONE when none yet).
ZEPH_EXPORT int QLIBCErrGet();
// Base name of the library file that recorded it ("" when none yet).
ZEPH_EXPORT const char* QLIBCErrorGetFile();
// Line in that file (0 when none yet).
ZEPH_EXPORT int QLIBCErrorGetLine();

// Records an error for the calling thread. `file` must be a string literal
// or otherwise outlive the thread. Used by the library itself.
ZEPH_EXPORT void QLIBCErrSet(int code, const char* file, int line);
// Forgets the calling thread's error.
ZEPH_EXPORT void QLIBCErrClear();

}  // extern "C"

// Maps an errno value onto the library's codes.
ZEPH_EXPORT int QLIBCErrFromErrno(int err);

#define QLIBC_SET_ERROR(code) QLIBCErrSet((code), __FILE__, __LINE__)

#endif  // ZEPH_QLIBC_ERROR_H_
