#include "zeph/log.h"

#include <errno.h>
#include <fcntl.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>

#include "zeph/qlibc_error.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace log {
namespace {

std::string Format(const char* format, va_list args) {
  va_list copy;
  va_copy(copy, args);
  char small[512];
  int n = vsnprintf(small, sizeof(small), format, copy);
  va_end(copy);
  if (n < 0) return std::string();
  if (static_cast<size_t>(n) < sizeof(small)) return std::string(small, n);
  std::string big(static_cast<size_t>(n) + 1, '\0');
  vsnprintf(&big[0], big.size(), format, args);
  big.resize(static_cast<size_t>(n));
  return big;
}

// Sends one finished line to syslog and, when asked for, to ZEPH_LOG_FILE.
void Emit(int priority, const std::string& text) {
  syslog(LOG_USER | priority, "%s", text.c_str());
  const char* file = getenv("ZEPH_LOG_FILE");
  if (file == nullptr || *file == '\0') return;
  UniqueFd fd(open(file, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
  if (!fd) return;
  std::string line = text + "\n";
  // O_APPEND with a single write keeps lines of concurrent writers whole.
  ssize_t ignored = write(fd.get(), line.data(), line.size());
  (void)ignored;
}

std::string Prefix(const char* source, int line) {
  char buf[128];
  snprintf(buf, sizeof(buf), "%s:%d ", source, line);
  return buf;
}

}  // namespace

void Write(int priority, const char* source, int line, const char* format,
           ...) {
  int saved_errno = errno;
  va_list args;
  va_start(args, format);
  errno = saved_errno;  // for %m
  std::string text = Prefix(source, line) + Format(format, args);
  va_end(args);
  Emit(priority, text);
  errno = saved_errno;
}

void WriteWithLibError(int priority, const char* source, int line,
                       const char* format, ...) {
  int saved_errno = errno;
  va_list args;
  va_start(args, format);
  errno = saved_errno;
  std::string text = Prefix(source, line) + Format(format, args);
  va_end(args);
  char suffix[160];
  snprintf(suffix, sizeof(suffix), "[0x%04X %s:%d]", QLIBCErrGet(),
           QLIBCErrorGetFile(), QLIBCErrorGetLine());
  Emit(priority, text + suffix);
  errno = saved_errno;
}

}  // namespace log
}  // namespace ZEPH
