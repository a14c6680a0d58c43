// A lock file held for one scope.
//
// ScopedFileLock wraps the platform's QLIBCFileLockTimeByFile and
// QLIBCFileUnlockByFile so that a lock taken by a routine is released on
// every way out of it. The routines that take locks each word their own log
// lines, so this class logs nothing: Lock and Unlock report through their
// results and the platform's last error, and the caller logs.
//
//   ZEPH::cert::ScopedFileLock lock;
//   if (!lock.Lock(path, QLIBC_LOCK_EXCLUSIVE, 30)) { log; return false; }
//   ... work; early returns release the lock silently ...
//   if (!lock.Unlock()) log("Failed to unlock %s", ...);
//
// Thread-safety: one object belongs to one thread. The lock itself is a
// flock(2) lock on an open file description, so two objects exclude each
// other whether they live in one process or in two.
#ifndef ZEPH_MODULE_ARCHIVE_FILE_LOCK_H_
#define ZEPH_MODULE_ARCHIVE_FILE_LOCK_H_

#include <string>

#include "zeph/export.h"

namespace ZEPH {
namespace cert {

class ZEPH_EXPORT ScopedFileLock {
 public:
  ScopedFileLock() = default;
  // Releases a lock that is still held; a failure there goes unreported.
  ~ScopedFileLock();
  ScopedFileLock(const ScopedFileLock&) = delete;
  ScopedFileLock& operator=(const ScopedFileLock&) = delete;

  // Takes the lock file `path` in `mode` (QLIBC_LOCK_SHARED or
  // QLIBC_LOCK_EXCLUSIVE), waiting at most `seconds`. True when held. False
  // on a time-out or an unusable lock file, with the platform's last error
  // set and nothing held.
  // REQUIRES: no lock is held by this object.
  bool Lock(const std::string& path, int mode, int seconds);

  // Releases the lock now. True when the release succeeded, and when no lock
  // was held (there is nothing to report then). Either way the object holds
  // nothing afterwards.
  bool Unlock();

  bool held() const { return fd_ >= 0; }

 private:
  int fd_ = -1;
};

}  // namespace cert
}  // namespace ZEPH

#endif  // ZEPH_MODULE_ARCHIVE_FILE_LOCK_H_
