#include "zeph/system.h"

#include <errno.h>
#include <fcntl.h>
#include <pwd.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "zeph/fd_io.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_error.h"
#include "zeph/qlibc_exec.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

bool IsDir(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// Makes one directory; true when it exists as a directory afterwards.
// `created` tells whether this call made it.
bool MakeOne(const std::string& path, mode_t mode, bool& created) {
  created = false;
  if (mkdir(path.c_str(), mode) == 0) {
    created = true;
    // mkdir applies the umask; the caller asked for exactly `mode`.
    return chmod(path.c_str(), mode) == 0;
  }
  if (errno == EEXIST && IsDir(path)) return true;
  if (errno == EEXIST) errno = ENOTDIR;
  return false;
}

}  // namespace

extern "C" {

int ZEPHLogSet1(int type, int level, unsigned int message_id, const char* text1,
                const char* text2, const char* text3, const char* text4) {
  const std::string dir = ZEPH::RootPath("/var/log/zeph");
  if (ZEPHFSMkdirP(dir.c_str(), nullptr, 1, 0, 0, 0755) != 0) return -1;
  Json::Value event(Json::objectValue);
  event["time"] = static_cast<Json::Int64>(time(nullptr));
  event["type"] = type;
  event["level"] = level;
  event["message_id"] = message_id;
  event["text1"] = text1 != nullptr ? text1 : "";
  event["text2"] = text2 != nullptr ? text2 : "";
  event["text3"] = text3 != nullptr ? text3 : "";
  event["text4"] = text4 != nullptr ? text4 : "";
  const std::string line = ZEPH::JsonCompact(event) + "\n";

  const std::string path = dir + "/events.jsonl";
  ZEPH::UniqueFd fd(
      open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
  if (!fd) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return -1;
  }
  // Readers (the log viewer) take a shared lock; writers an exclusive one so
  // that a line is never seen half-written.
  while (flock(fd.get(), LOCK_EX) != 0) {
    if (errno != EINTR) {
      QLIBC_SET_ERROR(QLIBC_ERR_LOCK);
      return -1;
    }
  }
  bool ok = ZEPH::WriteAll(fd.get(), line);
  flock(fd.get(), LOCK_UN);
  if (!ok) {
    QLIBC_SET_ERROR(QLIBC_ERR_IO);
    return -1;
  }
  return 0;
}

int ZEPHUserGetUGID(const char* user, uid_t* uid, gid_t* gid) {
  if (user == nullptr || *user == '\0' || uid == nullptr || gid == nullptr) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return -1;
  }
  long size = sysconf(_SC_GETPW_R_SIZE_MAX);
  std::vector<char> buf(size > 0 ? static_cast<size_t>(size) : 16384);
  struct passwd pw;
  struct passwd* result = nullptr;
  int rc;
  while ((rc = getpwnam_r(user, &pw, buf.data(), buf.size(), &result)) == ERANGE) {
    buf.resize(buf.size() * 2);
  }
  if (rc != 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_IO);
    return -1;
  }
  if (result == nullptr) {
    QLIBC_SET_ERROR(QLIBC_ERR_NOT_FOUND);
    return -1;
  }
  *uid = pw.pw_uid;
  *gid = pw.pw_gid;
  return 0;
}

int ZEPHFSMkdirP(const char* path, const char* owner, int make_parents,
                 int parents_mode, int reserved, mode_t mode) {
  if (path == nullptr || *path == '\0' || reserved != 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return -1;
  }
  uid_t uid = 0;
  gid_t gid = 0;
  if (owner != nullptr && ZEPHUserGetUGID(owner, &uid, &gid) != 0) return -1;

  std::string full(path);
  while (full.size() > 1 && full.back() == '/') full.pop_back();
  std::vector<std::string> to_make;
  if (make_parents) {
    for (size_t pos = full.find('/', 1); pos != std::string::npos;
         pos = full.find('/', pos + 1)) {
      to_make.push_back(full.substr(0, pos));
    }
  }
  to_make.push_back(full);

  for (size_t i = 0; i < to_make.size(); ++i) {
    const bool last = i + 1 == to_make.size();
    const mode_t m = (last || parents_mode) ? mode : 0755;
    bool created = false;
    if (!MakeOne(to_make[i], m, created)) {
      QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
      return -1;
    }
    if (created && owner != nullptr && chown(to_make[i].c_str(), uid, gid) != 0) {
      QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
      return -1;
    }
  }
  return 0;
}

}  // extern "C"

bool ZEPHSystemdReload(const std::string& unit) {
  // Under a private root there is no systemd that belongs to it: reloading
  // the host's unit of the same name would be wrong.
  if (!ZEPH::RootDir().empty() || unit.empty()) {
    QLIBC_SET_ERROR(QLIBC_ERR_UNSUPPORTED);
    return false;
  }
  if (!IsDir("/run/systemd/system")) {
    QLIBC_SET_ERROR(QLIBC_ERR_UNSUPPORTED);
    return false;
  }
  const char* systemctl = access("/usr/bin/systemctl", X_OK) == 0
                              ? "/usr/bin/systemctl"
                              : "/bin/systemctl";
  int rc = QLIBCExecl(systemctl, QLIBC_EXEC_WAIT | QLIBC_EXEC_NULL_STDIN,
                      "reload", unit.c_str(), nullptr);
  return rc == 0;
}
