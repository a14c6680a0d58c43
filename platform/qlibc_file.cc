#include "zeph/qlibc_file.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "zeph/fd_io.h"
#include "zeph/qlibc_error.h"
#include "zeph/unique_fd.h"


extern "C" {

int QLIBCFileExist(const char* path) {
  struct stat st;
  if (path == nullptr || stat(path, &st) != 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_NOT_FOUND);
    return 0;
  }
  return 1;
}

int QLIBCFileCheckDir(const char* path) {
  struct stat st;
  if (path == nullptr || stat(path, &st) != 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_NOT_FOUND);
    return 0;
  }
  if (!S_ISDIR(st.st_mode)) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return 0;
  }
  return 1;
}

int QLIBCFileUTF8BomStrip(const char* path) {
  static const char kBom[] = "\xEF\xBB\xBF";
  if (path == nullptr) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return -1;
  }
  // Most files have no mark: they are only read, so that read-only files
  // (mode 0400 as the archive keeps them, a read-only mount, somebody
  // else's upload) pass unchanged and keep their times.
  ZEPH::UniqueFd in(open(path, O_RDONLY | O_CLOEXEC));
  if (!in) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return -1;
  }
  std::string content;
  if (!ZEPH::ReadAll(in.get(), content)) {
    QLIBC_SET_ERROR(QLIBC_ERR_IO);
    return -1;
  }
  if (content.compare(0, 3, kBom) != 0) return 0;

  ZEPH::UniqueFd out(open(path, O_WRONLY | O_CLOEXEC));
  if (!out) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return -1;
  }
  const size_t rest = content.size() - 3;
  if (!ZEPH::WriteAllAt(out.get(), content.data() + 3, rest, 0) ||
      ftruncate(out.get(), static_cast<off_t>(rest)) != 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_IO);
    return -1;
  }
  return 0;
}

char* QLIBCFgets(char* buf, int size, FILE* f) {
  if (buf == nullptr || f == nullptr || size < 2) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return nullptr;
  }
  return fgets(buf, size, f);
}

}  // extern "C"
