#include "server/log_line.h"

#include <errno.h>
#include <unistd.h>

namespace ZEPH {
namespace webapid {
namespace {

void WriteLine(const std::string& line) {
  ssize_t n;
  do {
    n = write(STDERR_FILENO, line.data(), line.size());
  } while (n < 0 && errno == EINTR);
}

}  // namespace

void LogLine(const std::string& message) {
  WriteLine("zeph-webapid: " + message + "\n");
}

void AccessLine(const std::string& line) {
  WriteLine("access: " + line + "\n");
}

}  // namespace webapid
}  // namespace ZEPH
