// Where a method's download goes in the server: the HTTP answer.
//
// The export worker calls APIDownload::Output with the path of the file to
// send while it runs; Deliver opens the file at once and keeps the
// descriptor, so the answer streams the bytes the worker meant even if a
// later export replaces the file at that path. Respond then makes the HTTP
// answer: status 200, the worker's headers, the file as the body in pieces
// of 64 KiB.
//
// Thread-safety: one HttpDownload belongs to one request on one thread
// (installed with ZEPH::ScopedDownloadSink); the body is read by the
// thread that writes the answer.
#ifndef ZEPH_SERVER_HTTP_DOWNLOAD_H_
#define ZEPH_SERVER_HTTP_DOWNLOAD_H_

#include <sys/types.h>

#include <memory>
#include <string>

#include "zeph/api.h"
#include "zeph/unique_fd.h"

namespace httplib {
struct Response;
}

namespace ZEPH {
namespace webapid {

class HttpDownload : public DownloadSink {
 public:
  // Takes the headers and opens the file. False when the file cannot be
  // opened or a download was already delivered for this request.
  bool Deliver(const HeaderList& headers, const std::string& path) override;

  bool delivered() const { return file_ != nullptr; }

  // Fills `res` with the download. Headers that frame the HTTP answer
  // ("Content-Length", "Transfer-Encoding", "Connection") are the server's
  // and are not taken from the worker, nor any header whose name or value
  // could break the header block.
  // REQUIRES: delivered().
  void Respond(httplib::Response* res) const;

 private:
  HeaderList headers_;
  std::shared_ptr<UniqueFd> file_;
  off_t size_ = 0;
};

// Whether `name: value` can be sent as one HTTP header line.
bool IsSafeHeader(const std::string& name, const std::string& value);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_HTTP_DOWNLOAD_H_
