#include "webapid_test_support.h"

#include <arpa/inet.h>
#include <ctype.h>
#include <netinet/in.h>
#include <openssl/crypto.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/time.h>

#include "test_support.h"

namespace ZEPH {
namespace test {
namespace {

using X509Ptr = std::unique_ptr<X509, void (*)(X509*)>;

// "AB:CD:...", as `openssl x509 -fingerprint -sha256` prints it.
std::string CertFingerprint(X509* cert) {
  unsigned char md[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  if (cert == nullptr || X509_digest(cert, EVP_sha256(), md, &len) != 1) return "";
  char* hex = OPENSSL_buf2hexstr(md, len);
  const std::string out = hex == nullptr ? "" : hex;
  OPENSSL_free(hex);
  return out;
}

}  // namespace

bool MakeCertSet(const std::string& dir, const std::string& common_name) {
  const std::string ec = " -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes ";
  const std::string cn = " -subj '/CN=" + common_name;
  const std::string script =
      "set -e; mkdir -p '" + dir + "'; cd '" + dir + "'; o=/usr/bin/openssl; "
      "$o req -x509" + ec + "-keyout ca.key -out chain.pem" + cn + " CA' -days 30 2>/dev/null; "
      "$o req" + ec + "-keyout privkey.pem -out leaf.csr" + cn + "' 2>/dev/null; "
      "$o x509 -req -in leaf.csr -CA chain.pem -CAkey ca.key -set_serial 7 -out cert.pem -days 30 "
      "2>/dev/null; cat cert.pem chain.pem > fullchain.pem; rm -f leaf.csr ca.key";
  return Run({"/bin/sh", "-c", script}).status == 0;
}

std::string PemFingerprint(const std::string& path) {
  UniqueFile f(fopen(path.c_str(), "re"));
  if (!f) return "";
  X509Ptr cert(PEM_read_X509(f.get(), nullptr, nullptr, nullptr), X509_free);
  return CertFingerprint(cert.get());
}

UniqueFd ConnectTcp(int port) {
  UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) return fd;
  // A bound on every read, so that a broken server fails the test instead
  // of hanging it.
  struct timeval tv = {30, 0};
  setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
  setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv));
  struct sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (connect(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0) fd.reset();
  return fd;
}

TlsConnection::TlsConnection(int port, int max_version, const std::string& ciphers)
    : ctx_(SSL_CTX_new(TLS_client_method()), SSL_CTX_free),
      fd_(ConnectTcp(port)),
      ssl_(nullptr, SSL_free) {
  if (!ctx_ || !fd_) return;
  SSL_CTX_set_verify(ctx_.get(), SSL_VERIFY_NONE, nullptr);
  if (max_version != 0 || !ciphers.empty()) {
    SSL_CTX_set_security_level(ctx_.get(), 0);
    SSL_CTX_set_min_proto_version(ctx_.get(), 0);
  }
  if (max_version != 0) SSL_CTX_set_max_proto_version(ctx_.get(), max_version);
  if (!ciphers.empty() && SSL_CTX_set_cipher_list(ctx_.get(), ciphers.c_str()) != 1) return;
  std::unique_ptr<SSL, decltype(&SSL_free)> ssl(SSL_new(ctx_.get()), SSL_free);
  if (!ssl || SSL_set_fd(ssl.get(), fd_.get()) != 1 ||
      SSL_set_tlsext_host_name(ssl.get(), "localhost") != 1 || SSL_connect(ssl.get()) != 1) {
    return;
  }
  ssl_ = std::move(ssl);
}

std::string TlsConnection::LeafFingerprint() const {
  if (!ssl_) return "";
  X509Ptr cert(SSL_get1_peer_certificate(ssl_.get()), X509_free);
  return CertFingerprint(cert.get());
}

bool TlsConnection::Send(const std::string& raw) {
  if (!ssl_) return false;
  for (size_t done = 0; done < raw.size();) {
    const int n = SSL_write(ssl_.get(), raw.data() + done, static_cast<int>(raw.size() - done));
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

HttpReply TlsConnection::Receive() {
  HttpReply reply;
  if (!ssl_) return reply;
  auto fill = [this]() {
    char buf[16384];
    const int n = SSL_read(ssl_.get(), buf, sizeof(buf));
    if (n > 0) pending_.append(buf, static_cast<size_t>(n));
    return n > 0;
  };
  size_t end;
  while ((end = pending_.find("\r\n\r\n")) == std::string::npos) {
    if (!fill()) return reply;
  }
  reply.headers = pending_.substr(0, end + 2);
  pending_.erase(0, end + 4);
  if (reply.headers.compare(0, 9, "HTTP/1.1 ") == 0) reply.status = atoi(reply.headers.c_str() + 9);
  std::string lower = reply.headers;
  for (char& c : lower) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  const size_t at = lower.find("\r\ncontent-length:");
  const size_t length = at == std::string::npos ? 0 : strtoul(lower.c_str() + at + 17, nullptr, 10);
  while (pending_.size() < length && fill()) continue;
  reply.body = pending_.substr(0, length);
  pending_.erase(0, reply.body.size());
  return reply;
}

bool TlsConnection::ClosedByPeer() {
  if (!ssl_) return true;
  char c;
  if (SSL_read(ssl_.get(), &c, 1) <= 0) return true;
  pending_.push_back(c);
  return false;
}

}  // namespace test
}  // namespace ZEPH
