#include "server/http_download.h"

#include <ctype.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include <httplib.h>

namespace ZEPH {
namespace webapid {
namespace {

constexpr size_t kChunk = 64 << 10;

bool IsTokenChar(unsigned char c) {
  return isalnum(c) || (c != 0 && strchr("!#$%&'*+-.^_`|~", c) != nullptr);
}

}  // namespace

bool IsSafeHeader(const std::string& name, const std::string& value) {
  if (name.empty()) return false;
  for (unsigned char c : name) {
    if (!IsTokenChar(c)) return false;
  }
  for (unsigned char c : value) {
    if ((c < 0x20 && c != '\t') || c == 0x7f) return false;
  }
  return true;
}

bool HttpDownload::Deliver(const HeaderList& headers, const std::string& path) {
  if (file_) return false;
  auto fd =
      std::make_shared<UniqueFd>(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  struct stat st;
  if (!*fd || fstat(fd->get(), &st) != 0 || !S_ISREG(st.st_mode)) return false;
  headers_ = headers;
  size_ = st.st_size;
  file_ = std::move(fd);
  return true;
}

void HttpDownload::Respond(httplib::Response* res) const {
  std::string content_type = "application/octet-stream";
  for (const auto& h : headers_) {
    const std::string& name = h.first;
    if (!IsSafeHeader(name, h.second) ||
        strcasecmp(name.c_str(), "Content-Length") == 0 ||
        strcasecmp(name.c_str(), "Transfer-Encoding") == 0 ||
        strcasecmp(name.c_str(), "Connection") == 0) {
      continue;
    }
    if (strcasecmp(name.c_str(), "Content-Type") == 0) {
      content_type = h.second;
      continue;
    }
    res->set_header(name, h.second);
  }
  res->status = 200;
  std::shared_ptr<UniqueFd> file = file_;
  res->set_content_provider(
      static_cast<size_t>(size_), content_type,
      [file](size_t offset, size_t length, httplib::DataSink& sink) {
        char buf[kChunk];
        const size_t want = length < sizeof(buf) ? length : sizeof(buf);
        ssize_t n;
        do {
          n = pread(file->get(), buf, want, static_cast<off_t>(offset));
        } while (n < 0 && errno == EINTR);
        // A file that shrank under us cannot fill the promised length:
        // fail, and the connection is closed.
        if (n <= 0) return false;
        return sink.write(buf, static_cast<size_t>(n));
      });
}

}  // namespace webapid
}  // namespace ZEPH
