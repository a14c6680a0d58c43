#include "server/tls_probe.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <sys/socket.h>
#include <sys/time.h>

#include <memory>

#include "module/common/ssl_ptr.h"
#include "server/served_certificate.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {
namespace {

using SslCtxPtr = std::unique_ptr<SSL_CTX, ssl::Deleter<SSL_CTX, SSL_CTX_free>>;
using SslPtr = std::unique_ptr<SSL, ssl::Deleter<SSL, SSL_free>>;

UniqueFd Connect(const std::string& host, int port, int timeout_ms) {
  sockaddr_storage ss = {};
  socklen_t len = 0;
  auto* v4 = reinterpret_cast<sockaddr_in*>(&ss);
  auto* v6 = reinterpret_cast<sockaddr_in6*>(&ss);
  if (inet_pton(AF_INET, host.c_str(), &v4->sin_addr) == 1) {
    v4->sin_family = AF_INET;
    v4->sin_port = htons(static_cast<uint16_t>(port));
    if (v4->sin_addr.s_addr == htonl(INADDR_ANY)) {
      v4->sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    }
    len = sizeof(*v4);
  } else if (inet_pton(AF_INET6, host.c_str(), &v6->sin6_addr) == 1) {
    v6->sin6_family = AF_INET6;
    v6->sin6_port = htons(static_cast<uint16_t>(port));
    if (IN6_IS_ADDR_UNSPECIFIED(&v6->sin6_addr)) v6->sin6_addr = in6addr_loopback;
    len = sizeof(*v6);
  } else {
    return UniqueFd();
  }
  UniqueFd fd(socket(ss.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0));
  timeval tv = {timeout_ms / 1000, (timeout_ms % 1000) * 1000};
  if (!fd ||
      setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv)) != 0 ||
      setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) != 0 ||
      connect(fd.get(), reinterpret_cast<sockaddr*>(&ss), len) != 0) {
    return UniqueFd();
  }
  return fd;
}

}  // namespace

std::string PresentedFingerprint(const std::string& host, int port,
                                 int timeout_ms) {
  UniqueFd fd = Connect(host, port, timeout_ms);
  SslCtxPtr ctx(SSL_CTX_new(TLS_client_method()));
  if (!fd || !ctx) return "";
  SSL_CTX_set_verify(ctx.get(), SSL_VERIFY_NONE, nullptr);
  SslPtr ssl(SSL_new(ctx.get()));
  if (!ssl || SSL_set_fd(ssl.get(), fd.get()) != 1 ||
      SSL_connect(ssl.get()) != 1) {
    ERR_clear_error();
    return "";
  }
  ssl::X509Ptr leaf(SSL_get1_peer_certificate(ssl.get()));
  SSL_shutdown(ssl.get());
  ERR_clear_error();
  return CertificateFingerprint(leaf.get());
}

}  // namespace webapid
}  // namespace ZEPH
