// Starting a child process without a shell, for callers that manage the
// child themselves (wait with a time-out, signal its process group). The
// QLIBC* routines of qlibc_exec.h are built on it.
//
// The child always starts with an empty signal mask, default handling of
// SIGPIPE (of every signal with QLIBC_EXEC_RESET_SIGNALS), and no descriptor
// above 2 of the caller.
//
// Thread-safety: safe from any thread (posix_spawn).
#ifndef ZEPH_SPAWN_H_
#define ZEPH_SPAWN_H_

#include <sys/types.h>

#include "zeph/export.h"

namespace ZEPH {

struct ChildOptions {
  // QLIBC_EXEC_* bits for the child's set-up (QLIBC_EXEC_WAIT is ignored).
  int options = 0;
  // When 0 or more, made the child's standard input / output / error
  // (stdin_fd takes the place of QLIBC_EXEC_NULL_STDIN).
  int stdin_fd = -1;
  int stdout_fd = -1;
  int stderr_fd = -1;
  // The child leads a process group of its own, so that the caller can
  // signal it and everything it started at once.
  bool new_process_group = false;
  // The child's environment; null for the caller's.
  char* const* envp = nullptr;
};

// Starts `path` with `argv` (argv[0] first, null-terminated). Returns the
// child's pid, or -1 with errno set when it could not be started. The
// caller must reap the child.
ZEPH_EXPORT pid_t Spawn(const char* path, char* const argv[],
                        const ChildOptions& child);

}  // namespace ZEPH

#endif  // ZEPH_SPAWN_H_
