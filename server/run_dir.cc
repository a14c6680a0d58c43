#include "server/run_dir.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <ftw.h>
#include <pwd.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>
#include <vector>

#include "zeph/system.h"

namespace ZEPH {
namespace webapid {
namespace {

constexpr char kWorkerUserName[] = "www-data";
constexpr char kUploadPrefix[] = "zeph-webapid-upload.";
// What an earlier run may have left in the run directory.
const char* const kLeftovers[] = {"api",     "tls",   "body",  "proxy",
                                  "fastcgi", "uwsgi", "scgi",  "nginx.pid",
                                  "nginx.conf"};

int RemoveEntry(const char* path, const struct stat* /*st*/, int type,
                struct FTW* /*ftw*/) {
  const int rc = type == FTW_DP ? rmdir(path) : unlink(path);
  return rc == 0 || errno == ENOENT ? 0 : -1;
}

// Whether `user` has the permission `bit` (4 read, 1 search) on `st`.
bool Allows(const WorkerUser& user, const struct stat& st, mode_t bit) {
  if (user.uid == 0) return true;
  if (st.st_uid == user.uid) return (st.st_mode & (bit << 6)) != 0;
  if (st.st_gid == user.gid) return (st.st_mode & (bit << 3)) != 0;
  return (st.st_mode & bit) != 0;
}

}  // namespace

bool RemoveTree(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return errno == ENOENT;
  if (!S_ISDIR(st.st_mode)) return unlink(path.c_str()) == 0;
  return nftw(path.c_str(), RemoveEntry, 16, FTW_DEPTH | FTW_PHYS) == 0;
}

bool FindWorkerUser(WorkerUser* user, std::string* error) {
  if (geteuid() != 0) {
    *user = WorkerUser{"", geteuid(), getegid()};
    return true;
  }
  struct passwd pw;
  struct passwd* found = nullptr;
  std::vector<char> buf(16384);
  if (getpwnam_r(kWorkerUserName, &pw, buf.data(), buf.size(), &found) != 0 ||
      found == nullptr) {
    *error = std::string("nginx's workers run as the user ") +
             kWorkerUserName + ", which does not exist";
    return false;
  }
  *user = WorkerUser{kWorkerUserName, pw.pw_uid, pw.pw_gid};
  return true;
}

std::string BlockedFor(const WorkerUser& user, const std::string& path) {
  std::string prefix;
  size_t start = 0;
  while (start < path.size()) {
    size_t slash = path.find('/', start + 1);
    if (slash == std::string::npos) slash = path.size();
    prefix = path.substr(0, slash);
    start = slash;
    struct stat st;
    if (stat(prefix.c_str(), &st) != 0) return prefix;
    const bool last = slash == path.size();
    if (S_ISDIR(st.st_mode) ? !Allows(user, st, 1)
                            : (last && !Allows(user, st, 4))) {
      return prefix;
    }
  }
  return "";
}

bool RunDir::Prepare(const WorkerUser& user, const std::string& upload_parent,
                     std::string* error) {
  if (ZEPHFSMkdirP(dir_.c_str(), nullptr, 1, 0, 0, 0755) != 0 ||
      chmod(dir_.c_str(), 0755) != 0) {
    *error = "cannot make " + dir_ + ": " + strerror(errno);
    return false;
  }
  lock_.reset(open(Path("lock").c_str(),
                   O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!lock_) {
    *error = "cannot open " + Path("lock") + ": " + strerror(errno);
    return false;
  }
  if (flock(lock_.get(), LOCK_EX | LOCK_NB) != 0) {
    *error = "another zeph-webapid serves this root (it holds " +
             Path("lock") + ")";
    return false;
  }
  for (const char* name : kLeftovers) {
    if (!RemoveTree(Path(name))) {
      *error = "cannot remove " + Path(name) + ": " + strerror(errno);
      return false;
    }
  }
  std::unique_ptr<DIR, int (*)(DIR*)> uploads(opendir(upload_parent.c_str()),
                                              closedir);
  while (uploads) {
    const struct dirent* e = readdir(uploads.get());
    if (e == nullptr) break;
    if (strncmp(e->d_name, kUploadPrefix, strlen(kUploadPrefix)) == 0) {
      RemoveTree(upload_parent + "/" + e->d_name);
    }
  }
  // The socket's directory: only nginx's workers (and root) may enter.
  const std::string api = Path("api");
  const bool separate = !user.name.empty();
  if (mkdir(api.c_str(), 0700) != 0 ||
      (separate && (chown(api.c_str(), 0, user.gid) != 0 ||
                    chmod(api.c_str(), 0750) != 0))) {
    *error = "cannot make " + api + ": " + strerror(errno);
    return false;
  }
  return true;
}

}  // namespace webapid
}  // namespace ZEPH
