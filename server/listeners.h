// The two listening sockets of the server.
//
//   - The public one, ADDR:PORT, made here and handed to nginx at its start
//     (nginx takes up listening sockets it is given in its environment), so
//     that the port, also a free one picked for port 0, stays the same over
//     restarts of nginx and nothing else can take it meanwhile.
//   - zeph-webapid's own, a Unix socket in the run directory's private
//     "api" directory, which only nginx's workers can reach: mode 0660 and
//     the workers' group when started as root, 0600 otherwise.
//
// Thread-safety: plain functions; ApiHttpServer as httplib::Server.
#ifndef ZEPH_SERVER_LISTENERS_H_
#define ZEPH_SERVER_LISTENERS_H_

#include <httplib.h>
#include <sys/types.h>

#include <string>

#include "server/run_dir.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {

struct PublicListener {
  UniqueFd fd;       // listening, non-blocking, close-on-exec
  std::string host;  // the numeric address bound ("127.0.0.1", "::1")
  int port = 0;      // the port bound (the one picked for port 0)
};

// Binds and listens on `address` (a numeric address or a host name; its
// first address is taken) and `port` (0: any free port). False with a
// one-line reason in `error`.
bool ListenPublic(const std::string& address, int port,
                  PublicListener* listener, std::string* error);

// "host:port", with brackets around an IPv6 host, as nginx's "listen"
// and URLs write it.
std::string HostPort(const std::string& host, int port);

// Binds and listens on the Unix socket `path`, made for `user` as above.
// An old socket at `path` is replaced. False with a reason in `error`.
bool ListenPrivate(const std::string& path, const WorkerUser& user,
                   UniqueFd* fd, std::string* error);

// An HTTP server on a listening socket made elsewhere (httplib binds TCP
// sockets only).
class ApiHttpServer : public httplib::Server {
 public:
  // Takes the listening socket; Stop or the destructor closes it.
  void Adopt(UniqueFd fd) { svr_sock_ = fd.release(); }
};

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_LISTENERS_H_
