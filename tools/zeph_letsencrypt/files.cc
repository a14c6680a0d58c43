#include "tools/zeph_letsencrypt/files.h"

#include <errno.h>
#include <fcntl.h>
#include <ftw.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

int RemoveEntry(const char* path, const struct stat*, int type, struct FTW*) {
  const int rc = type == FTW_DP ? rmdir(path) : unlink(path);
  return rc == 0 || errno == ENOENT ? 0 : -1;
}

}  // namespace

bool ReadWhole(const std::string& path, std::string* out) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return false;
  out->clear();
  char buf[16384];
  for (;;) {
    const ssize_t n = read(fd.get(), buf, sizeof(buf));
    if (n == 0) return true;
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    out->append(buf, static_cast<size_t>(n));
  }
}

bool WriteWhole(const std::string& path, const std::string& content,
                mode_t mode) {
  std::string temp = path + ".XXXXXX";
  UniqueFd fd(mkostemp(&temp[0], O_CLOEXEC));
  if (!fd) return false;
  const bool written = fchmod(fd.get(), mode) == 0 &&
                       ZEPH::WriteAll(fd.get(), content) && fsync(fd.get()) == 0;
  int saved = errno;
  fd.reset();
  if (written && rename(temp.c_str(), path.c_str()) == 0) return true;
  if (written) saved = errno;
  unlink(temp.c_str());
  errno = saved;
  return false;
}

bool MakeDir(const std::string& path, mode_t mode) {
  if (mkdir(path.c_str(), mode) == 0) return chmod(path.c_str(), mode) == 0;
  if (errno != EEXIST) return false;
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return false;
  if (S_ISDIR(st.st_mode)) return true;
  errno = ENOTDIR;
  return false;
}

bool RemoveTree(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return errno == ENOENT;
  if (!S_ISDIR(st.st_mode)) return unlink(path.c_str()) == 0;
  // The set's files are mode 0400 in a 0700 directory: the owner can remove
  // them without changing any mode. FTW_PHYS: a link is removed, not
  // followed (a working directory links lego's shared account store).
  return nftw(path.c_str(), RemoveEntry, 16, FTW_DEPTH | FTW_PHYS) == 0;
}

bool ExchangeDirs(const std::string& staging, const std::string& target) {
  if (renameat2(AT_FDCWD, staging.c_str(), AT_FDCWD, target.c_str(),
                RENAME_EXCHANGE) == 0) {
    return true;
  }
  if (errno != EINVAL && errno != ENOSYS && errno != ENOTSUP) return false;
  const std::string aside = staging + ".previous";
  if (rename(target.c_str(), aside.c_str()) != 0) return false;
  if (rename(staging.c_str(), target.c_str()) != 0) {
    const int saved = errno;
    rename(aside.c_str(), target.c_str());
    errno = saved;
    return false;
  }
  // The new set is in place; the old one only waits for its removal.
  if (rename(aside.c_str(), staging.c_str()) != 0) RemoveTree(aside);
  return true;
}

}  // namespace letsencrypt
}  // namespace ZEPH
