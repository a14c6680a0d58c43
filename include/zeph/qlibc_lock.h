// Lock files with a time-out.
//
// A lock is a flock(2) lock on a lock file, which is created (mode 0600)
// when missing; its directory must exist. Locks are per open file
// description, so two threads of one process exclude each other like two
// processes do. The lock dies with its descriptor: a crashed holder never
// leaves a lock behind.
//
// Thread-safety: safe from any thread.
#ifndef ZEPH_QLIBC_LOCK_H_
#define ZEPH_QLIBC_LOCK_H_

#include "zeph/export.h"

enum {
  QLIBC_LOCK_SHARED = 0,     // readers: any number at once
  QLIBC_LOCK_EXCLUSIVE = 1,  // writers: one, and no reader
};

extern "C" {

// Takes a lock on `path` in `mode` (QLIBC_LOCK_*), waiting at most `seconds`
// (0: one try). On success stores the descriptor that holds the lock in
// `*fd` and returns nonzero. On failure (time-out, unopenable file, bad
// argument) returns 0, leaves `*fd` unchanged and records the last error
// (QLIBC_ERR_TIMEOUT for a time-out).
ZEPH_EXPORT int QLIBCFileLockTimeByFile(const char* path, int mode, int seconds,
                                        int* fd);

// Releases the lock held by `fd` and closes it. Nonzero on success; 0 for a
// descriptor that is not open.
ZEPH_EXPORT int QLIBCFileUnlockByFile(int fd);

}  // extern "C"

#endif  // ZEPH_QLIBC_LOCK_H_
