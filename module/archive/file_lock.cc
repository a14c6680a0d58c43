#include "module/archive/file_lock.h"

#include "zeph/qlibc_lock.h"

namespace ZEPH {
namespace cert {

ScopedFileLock::~ScopedFileLock() { Unlock(); }

bool ScopedFileLock::Lock(const std::string& path, int mode, int seconds) {
  // The descriptor starts at -1 so that a failed attempt leaves nothing to
  // release.
  int fd = -1;
  if (!QLIBCFileLockTimeByFile(path.c_str(), mode, seconds, &fd)) return false;
  fd_ = fd;
  return true;
}

bool ScopedFileLock::Unlock() {
  if (fd_ < 0) return true;
  const int fd = fd_;
  fd_ = -1;
  return QLIBCFileUnlockByFile(fd) != 0;
}

}  // namespace cert
}  // namespace ZEPH
