#include "server/listeners.h"

#include <arpa/inet.h>
#include <errno.h>
#include <netdb.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <memory>

namespace ZEPH {
namespace webapid {
namespace {

constexpr int kBacklog = 511;  // nginx's own default

struct AddrInfoFree {
  void operator()(addrinfo* ai) const { freeaddrinfo(ai); }
};

std::string NumericHost(const sockaddr* sa, socklen_t len) {
  char host[NI_MAXHOST];
  if (getnameinfo(sa, len, host, sizeof(host), nullptr, 0, NI_NUMERICHOST) !=
      0) {
    return "";
  }
  return host;
}

int PortOf(const sockaddr_storage& ss) {
  return ss.ss_family == AF_INET6
             ? ntohs(reinterpret_cast<const sockaddr_in6&>(ss).sin6_port)
             : ntohs(reinterpret_cast<const sockaddr_in&>(ss).sin_port);
}

}  // namespace

std::string HostPort(const std::string& host, int port) {
  const std::string h =
      host.find(':') != std::string::npos ? "[" + host + "]" : host;
  return h + ":" + std::to_string(port);
}

bool ListenPublic(const std::string& address, int port,
                  PublicListener* listener, std::string* error) {
  const std::string where = HostPort(address, port);
  addrinfo hints = {};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  hints.ai_flags = AI_PASSIVE;
  addrinfo* found = nullptr;
  const int rc = getaddrinfo(address.c_str(), std::to_string(port).c_str(),
                             &hints, &found);
  std::unique_ptr<addrinfo, AddrInfoFree> list(found);
  if (rc != 0 || !list) {
    *error = "cannot listen on " + where + ": " + gai_strerror(rc);
    return false;
  }
  const addrinfo* ai = list.get();
  // Non-blocking, as nginx makes the sockets it opens itself but takes
  // handed-over ones as they are: several workers (old and new ones during
  // a reload) are woken for one connection, and a blocking accept would
  // hold the ones that lose the race until the next connection comes.
  UniqueFd fd(socket(ai->ai_family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  const int one = 1;
  if (!fd ||
      setsockopt(fd.get(), SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one)) != 0 ||
      (ai->ai_family == AF_INET6 &&
       setsockopt(fd.get(), IPPROTO_IPV6, IPV6_V6ONLY, &one, sizeof(one)) !=
           0) ||
      bind(fd.get(), ai->ai_addr, ai->ai_addrlen) != 0 ||
      listen(fd.get(), kBacklog) != 0) {
    *error = "cannot listen on " + where + ": " + strerror(errno);
    return false;
  }
  sockaddr_storage bound = {};
  socklen_t len = sizeof(bound);
  if (getsockname(fd.get(), reinterpret_cast<sockaddr*>(&bound), &len) != 0) {
    *error = "cannot listen on " + where + ": " + strerror(errno);
    return false;
  }
  listener->host = NumericHost(reinterpret_cast<sockaddr*>(&bound), len);
  listener->port = PortOf(bound);
  listener->fd = std::move(fd);
  return true;
}

bool ListenPrivate(const std::string& path, const WorkerUser& user,
                   UniqueFd* out, std::string* error) {
  sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof(addr.sun_path)) {
    *error = "the socket path " + path + " is too long";
    return false;
  }
  memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  unlink(path.c_str());
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const bool separate = !user.name.empty();
  if (!fd ||
      bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 ||
      chmod(path.c_str(), separate ? 0660 : 0600) != 0 ||
      (separate && chown(path.c_str(), 0, user.gid) != 0) ||
      listen(fd.get(), kBacklog) != 0) {
    *error = "cannot listen on " + path + ": " + strerror(errno);
    return false;
  }
  *out = std::move(fd);
  return true;
}

}  // namespace webapid
}  // namespace ZEPH
