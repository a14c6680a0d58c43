#include "host/upload_dir.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

#include "zeph/fd_io.h"

namespace ZEPH {

const char* const kUploadParts[5] = {"key", "cert", "inter_cert", "csr",
                                     "pkcs12"};

namespace {

struct DirCloser {
  void operator()(DIR* d) const { closedir(d); }
};

// Removes every entry of the directory open at `dir_fd` (and, one level
// down, what a method left in a directory of its own).
void RemoveEntries(int dir_fd) {
  UniqueFd list_fd(fcntl(dir_fd, F_DUPFD_CLOEXEC, 0));
  std::unique_ptr<DIR, DirCloser> dir(list_fd ? fdopendir(list_fd.get())
                                              : nullptr);
  if (!dir) return;
  list_fd.release();  // owned by the DIR now
  while (struct dirent* e = readdir(dir.get())) {
    const std::string entry = e->d_name;
    if (entry == "." || entry == "..") continue;
    if (unlinkat(dir_fd, entry.c_str(), 0) != 0 && errno == EISDIR) {
      UniqueFd sub(openat(dir_fd, entry.c_str(),
                          O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
      if (sub) RemoveEntries(sub.get());
      unlinkat(dir_fd, entry.c_str(), AT_REMOVEDIR);
    }
  }
}

// Copies the regular file `source` into `dir` as `name`. True with the
// copy's path in `copy`; false when `source` cannot be read (`unreadable`
// set) or the copy cannot be written (`error` set).
bool CopyFile(const std::string& source, const std::string& name,
              UploadDir& dir, std::string* copy, bool* unreadable,
              std::string* error) {
  UniqueFd in(open(source.c_str(), O_RDONLY | O_CLOEXEC));
  struct stat st;
  std::string content;
  if (!in || fstat(in.get(), &st) != 0 || !S_ISREG(st.st_mode) ||
      !ReadAll(in.get(), content)) {
    *unreadable = true;
    return false;
  }
  UniqueFd out = dir.Create(name, copy, error);
  if (!out) return false;
  if (!WriteAll(out.get(), content) || close(out.release()) != 0) {
    *error = "cannot copy " + source + " to " + *copy + ": " + strerror(errno);
    return false;
  }
  return true;
}

}  // namespace

UploadDir::UploadDir(std::string parent, std::string prefix)
    : parent_(std::move(parent)), prefix_(std::move(prefix)) {}

UploadDir::~UploadDir() { Remove(); }

bool UploadDir::Make(std::string* error) {
  if (!path_.empty()) return true;
  std::string templ = parent_ + "/" + prefix_ + ".XXXXXX";
  if (mkdtemp(&templ[0]) == nullptr) {  // mode 0700
    *error = "cannot make a private directory in " + parent_ + ": " +
             strerror(errno);
    return false;
  }
  path_ = templ;
  return true;
}

UniqueFd UploadDir::Create(const std::string& name, std::string* path,
                           std::string* error) {
  if (!Make(error)) return UniqueFd();
  *path = path_ + "/" + name;
  UniqueFd fd(open(path->c_str(),
                   O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!fd) *error = "cannot create " + *path + ": " + strerror(errno);
  return fd;
}

void UploadDir::Remove() {
  if (path_.empty()) return;
  UniqueFd dir_fd(
      open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
  if (dir_fd) RemoveEntries(dir_fd.get());
  rmdir(path_.c_str());
  path_.clear();
}

bool CopyUploadParams(Json::Value& params, UploadDir& dir, std::string* error) {
  for (const char* part : kUploadParts) {
    const std::string name = std::string(part) + "_tmp";
    // Looked up without operator[], which would add the parameter.
    const Json::Value value = params.get(name, Json::Value());
    if (!value.isString() || value.asString().empty()) continue;
    std::string copy;
    bool unreadable = false;
    if (CopyFile(value.asString(), part, dir, &copy, &unreadable, error)) {
      params[name] = copy;
    } else if (!unreadable) {
      return false;
    }
  }
  return true;
}

}  // namespace ZEPH
