#include "zeph/qlibc_error.h"

#include <errno.h>
#include <string.h>

namespace {

struct LastError {
  int code = QLIBC_ERR_NONE;
  const char* file = "";
  int line = 0;
};

thread_local LastError t_last_error;

const char* BaseName(const char* path) {
  const char* slash = strrchr(path, '/');
  return slash != nullptr ? slash + 1 : path;
}

}  // namespace

extern "C" {

int QLIBCErrGet() { return t_last_error.code; }
const char* QLIBCErrorGetFile() { return t_last_error.file; }
int QLIBCErrorGetLine() { return t_last_error.line; }

void QLIBCErrSet(int code, const char* file, int line) {
  t_last_error.code = code;
  t_last_error.file = file != nullptr ? BaseName(file) : "";
  t_last_error.line = line;
}

void QLIBCErrClear() { t_last_error = LastError(); }

}  // extern "C"

int QLIBCErrFromErrno(int err) {
  switch (err) {
    case 0:
      return QLIBC_ERR_NONE;
    case EINVAL:
    case ENAMETOOLONG:
      return QLIBC_ERR_INVALID_ARGUMENT;
    case ENOENT:
    case ENOTDIR:
      return QLIBC_ERR_NOT_FOUND;
    case ENOMEM:
      return QLIBC_ERR_NO_MEMORY;
    case EACCES:
    case EPERM:
    case EROFS:
      return QLIBC_ERR_PERMISSION;
    case EEXIST:
      return QLIBC_ERR_EXISTS;
    case EWOULDBLOCK:
    case ETIMEDOUT:
      return QLIBC_ERR_TIMEOUT;
    default:
      return QLIBC_ERR_IO;
  }
}
