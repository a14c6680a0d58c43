// Running programs.
//
// Every routine runs the program directly with execv (no shell, so no
// argument is ever interpreted), and the child inherits no descriptor of the
// caller beyond standard input, output and error. argv[0] of the child is
// always `path`.
//
// Results of the waiting forms:
//   0      the program ran and exited with status 0;
//   > 0    it exited with that status, or was killed by signal N (128 + N);
//   < 0    it could not be started (the last error says why).
//
// Thread-safety: all routines are safe from any thread; children are
// started with posix_spawn, which is safe in multi-threaded processes.
#ifndef ZEPH_QLIBC_EXEC_H_
#define ZEPH_QLIBC_EXEC_H_

#include <stdio.h>

#include "zeph/export.h"

// Option bits of QLIBCExecl.
enum {
  QLIBC_EXEC_WAIT = 0x001,          // wait for the child and return its status
  QLIBC_EXEC_CLOSE_FDS = 0x002,     // close every descriptor above 2 (always done)
  QLIBC_EXEC_NULL_STDIN = 0x008,    // standard input from /dev/null
  QLIBC_EXEC_NULL_STDOUT = 0x010,   // standard output to /dev/null
  QLIBC_EXEC_NULL_STDERR = 0x020,   // standard error to /dev/null
  QLIBC_EXEC_RESET_SIGNALS = 0x080, // empty signal mask, default dispositions
  QLIBC_EXEC_NEW_SESSION = 0x100,   // the child leads a session of its own
};

extern "C" {

// Runs `path` with the arguments a1..a4 up to the first null one and waits.
// Standard output and error are those of the caller.
ZEPH_EXPORT int QLIBCExec(const char* path, const char* a1, const char* a2,
                          const char* a3, const char* a4);

// Runs `path` with the null-terminated argument list that follows `arg`
// (arg is argv[1]; a null `arg` means no arguments). `options` is a set of
// QLIBC_EXEC_* bits; without QLIBC_EXEC_WAIT the call returns 0 once the
// child has started and the child is left to be reaped by the caller's
// SIGCHLD handling.
ZEPH_EXPORT int QLIBCExecl(const char* path, int options, const char* arg, ...)
    __attribute__((sentinel));

// Runs `path` with the vector `argv` (argv[0] first, null-terminated).
// `flag` 1 waits for the child as described above; 0 starts it only.
ZEPH_EXPORT int QLIBCExecv(const char* path, char* const argv[], int flag);

// Starts `path` with the null-terminated argument list that follows `arg`
// and returns a stream on its standard output. Only mode "r" is supported.
// Null when the program cannot be started. The stream is close-on-exec.
ZEPH_EXPORT FILE* QLIBCPopen(const char* path, const char* mode,
                             const char* arg, ...) __attribute__((sentinel));

// Closes a stream of QLIBCPopen and reaps its child. 0 when the child
// exited with status 0; -1 otherwise, and for a null stream.
ZEPH_EXPORT int QLIBCPclose(FILE* stream);

}  // extern "C"

#endif  // ZEPH_QLIBC_EXEC_H_
