// TLS helpers for the server's tests: certificate sets made with the
// openssl tool, fingerprints, and a small HTTP/1.1 client over TLS.
#ifndef ZEPH_SERVER_TLS_TEST_SUPPORT_H_
#define ZEPH_SERVER_TLS_TEST_SUPPORT_H_

#include <openssl/ssl.h>

#include <memory>
#include <string>

#include "zeph/unique_fd.h"

namespace ZEPH {
namespace test {

// Writes into `dir` (made if missing) a small authority and a leaf for
// `common_name` signed by it: "cert.pem", "privkey.pem", "chain.pem" (the
// authority) and "fullchain.pem" (leaf, then authority). False when openssl
// failed.
bool MakeCertSet(const std::string& dir, const std::string& common_name);

// SHA-256 fingerprint of the first certificate in the PEM file, "AB:CD:..."
// as `openssl x509 -fingerprint` prints it; empty when unreadable.
std::string PemFingerprint(const std::string& path);

struct HttpReply {
  int status = 0;  // 0: no reply (the connection failed or closed)
  std::string headers;
  std::string body;
};

// One TLS connection to 127.0.0.1:port that accepts any server certificate
// (the tests compare fingerprints themselves). `max_version` (e.g.
// TLS1_1_VERSION) limits the protocol, `ciphers` (OpenSSL's names) the TLS
// 1.2 suites; either also lets the client offer what its default security
// level forbids. 0 and "": no limit.
class TlsConnection {
 public:
  explicit TlsConnection(int port, int max_version = 0, const std::string& ciphers = "");

  bool ok() const { return ssl_ != nullptr; }  // the handshake completed
  // Fingerprint of the certificate the server presented.
  std::string LeafFingerprint() const;
  bool Send(const std::string& raw);
  // Reads one HTTP answer (headers and a Content-Length body).
  HttpReply Receive();
  HttpReply Exchange(const std::string& raw) { return Send(raw) ? Receive() : HttpReply(); }
  // Whether the server closed the connection (reads end of stream).
  bool ClosedByPeer();

 private:
  struct SslCtxFree {
    void operator()(SSL_CTX* ctx) const { SSL_CTX_free(ctx); }
  };
  struct SslFree {
    void operator()(SSL* ssl) const { SSL_free(ssl); }
  };
  std::unique_ptr<SSL_CTX, SslCtxFree> ctx_;
  UniqueFd fd_;
  std::unique_ptr<SSL, SslFree> ssl_;
  std::string pending_;
};

// A plain TCP connection to 127.0.0.1:port (for bytes that are not TLS).
UniqueFd ConnectTcp(int port);

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_SERVER_TLS_TEST_SUPPORT_H_
