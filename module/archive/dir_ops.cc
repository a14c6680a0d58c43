#include "module/archive/dir_ops.h"

#include <errno.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include "module/common/log.h"
#include "module/common/paths.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_file.h"
#include "zeph/system.h"

namespace {

using ZEPH::cert::kCp;
using ZEPH::cert::kRm;

// "/bin/rm" "-rf" path; true when rm exited with status 0.
bool RmRf(const std::string& path) {
  return QLIBCExec(kRm, "-rf", path.c_str(), nullptr, nullptr) == 0;
}

// Restore steps of MoveDir: put the backup back in place of `dst`. Always
// part of a failed move, so the result is false whatever happens here.
// Without a backup there is nothing to put back, and a `dst` that is still
// there is the only copy: it stays.
bool RestoreBackup(const std::string& dst, const std::string& backup) {
  if (!QLIBCFileCheckDir(backup.c_str()) && QLIBCFileCheckDir(dst.c_str())) {
    return false;
  }
  if (!RmRf(dst)) {
    UTILS_LOG("Failed to remove %s [%d]", dst.c_str(), errno);
    return false;
  }
  if (rename(backup.c_str(), dst.c_str()) != 0) {
    UTILS_LOG("Failed to move %s to %s [%d]", backup.c_str(), dst.c_str(),
              errno);
  }
  return false;
}

// False when `target` exists but is not as long as `source` (or `source`
// cannot be looked at, so the copy cannot be checked). A missing target
// counts as whole here: the caller's next step reports it.
bool IsWholeCopy(const std::string& source, const std::string& target) {
  struct stat copy;
  if (stat(target.c_str(), &copy) != 0) return true;
  struct stat original;
  return stat(source.c_str(), &original) == 0 &&
         original.st_size == copy.st_size;
}

}  // namespace

bool RemoveDir(const std::string& path) {
  if (!QLIBCFileCheckDir(path.c_str())) {
    UTILS_LOG("%s is not a valid directory", path.c_str());
    return false;
  }
  if (!RmRf(path)) {
    UTILS_LOG("Failed to remove %s [%d]", path.c_str(), errno);
    return false;
  }
  return true;
}

bool CleanDir(const std::string& path, mode_t mode) {
  if (QLIBCFileCheckDir(path.c_str()) && !RmRf(path)) {
    UTILS_LOG("Failed to remove %s [%d]", path.c_str(), errno);
    return false;
  }
  if (ZEPHFSMkdirP(path.c_str(), nullptr, 1, 0, 0, mode) < 0) {
    UTILS_LOG("Failed to create %s", path.c_str());
    return false;
  }
  return true;
}

bool MoveDir(const std::string& src, const std::string& dst) {
  const std::string backup = dst + ".bak";
  if (!QLIBCFileCheckDir(src.c_str())) {
    UTILS_LOG("%s is not a valid directory", src.c_str());
    return false;
  }
  if (src == dst) {
    UTILS_LOG_DEBUG(
        "skip move directory, due to source equals to destination [%s]",
        dst.c_str());
    return true;
  }
  // A backup that cannot be cleared may be the only good copy left by an
  // earlier failed move: it is put back in place of dst, and the move fails.
  if (!RmRf(backup)) {
    UTILS_LOG("Failed to remove %s [%d]", backup.c_str(), errno);
    return RestoreBackup(dst, backup);
  }
  if (QLIBCFileCheckDir(dst.c_str()) &&
      QLIBCExec(kCp, "-arp", dst.c_str(), backup.c_str(), nullptr) != 0) {
    UTILS_LOG("Failed to copy %s to %s [%d]", dst.c_str(), backup.c_str(),
              errno);
    // A copy cut short (a full disk) is no backup: left behind, the next
    // move that cannot clear it would put it back in place of dst.
    if (!RmRf(backup)) {
      UTILS_LOG("Failed to remove %s [%d]", backup.c_str(), errno);
    }
    return false;
  }
  if (!RmRf(dst)) {
    UTILS_LOG("Failed to remove %s [%d]", dst.c_str(), errno);
    return RestoreBackup(dst, backup);
  }
  if (rename(src.c_str(), dst.c_str()) != 0) {
    UTILS_LOG("Failed to move %s to %s [%d]", src.c_str(), dst.c_str(), errno);
    return RestoreBackup(dst, backup);
  }
  if (!RmRf(backup)) {
    UTILS_LOG("Failed to remove %s [%d]", backup.c_str(), errno);
  }
  return true;
}

bool CopyCertFile(const std::string& src_dir, const std::string& dst_dir,
                  const std::string& name, uid_t uid, gid_t gid) {
  const std::string source = src_dir + "/" + name;
  const std::string target = dst_dir + "/" + name;
  // cp's exit status is not looked at. A copy that cp refused leaves no
  // target, which the chmod below reports; one it cut short (a full disk)
  // leaves a target that is empty or too short, caught by the size check.
  if (QLIBCExec(kCp, "-f", source.c_str(), target.c_str(), nullptr) < 0) {
    UTILS_LOG_LIBERR("Failed to copy [%s].", source.c_str());
    return false;
  }
  if (!IsWholeCopy(source, target)) {
    UTILS_LOG("Failed to copy [%s].", source.c_str());
    // Handed on, a cut-short key or certificate would break the service.
    if (unlink(target.c_str()) != 0 && errno != ENOENT) {
      UTILS_LOG("Failed to remove %s [%d]", target.c_str(), errno);
    }
    return false;
  }
  // Read for the owner only, not even writable by it.
  if (chmod(target.c_str(), 0400) != 0 ||
      chown(target.c_str(), uid, gid) != 0) {
    UTILS_LOG("Failed to chmod chown. [%s]", target.c_str());
    return false;
  }
  return true;
}
