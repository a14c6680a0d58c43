// A real zeph-webapid process on a private root, the curl tool to talk to it, and (in
// tls_test_support.cc, for the tests that link OpenSSL's TLS library) certificate sets made
// with the openssl tool, fingerprints and a small HTTP/1.1 client over TLS.
#ifndef ZEPH_SERVER_WEBAPID_TEST_SUPPORT_H_
#define ZEPH_SERVER_WEBAPID_TEST_SUPPORT_H_

#include <openssl/ssl.h>
#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

#include "zeph/unique_fd.h"

namespace ZEPH {
namespace test {

class ServerProcess {
 public:
  // Starts zeph-webapid on `root` on a free port of 127.0.0.1 with `extra` arguments, `wrapper`
  // before the command (setpriv, say), its standard error going to a file beside the root;
  // returns once it listens or has ended.
  explicit ServerProcess(const std::string& root, const std::vector<std::string>& extra = {},
                         const std::vector<std::string>& wrapper = {});
  ~ServerProcess() { Stop(); }
  ServerProcess(const ServerProcess&) = delete;
  ServerProcess& operator=(const ServerProcess&) = delete;
  bool listening() const { return port_ > 0; }
  int port() const { return port_; }
  pid_t pid() const { return pid_; }
  std::string Log() const;    // its standard error so far
  std::string Token() const;  // the access token of the root
  int Stop();                 // SIGTERM if it still runs; the exit status
  int Wait();                 // the exit status, or -1 when killed by a signal
  bool Alive();
  // The server and every process below it (nginx's master and workers), parents before their
  // children; the resident memory of them all in KiB.
  std::vector<pid_t> Tree() const;
  long TreeRssKiB() const;

 private:
  std::string root_;
  std::string log_path_;
  pid_t pid_ = -1;
  int status_ = -1;
  int port_ = -1;
};

long ProcessUid(pid_t pid);   // -1 when it is gone
bool ProcessGone(pid_t pid);  // or a zombie nobody waits for

struct CurlReply {
  int status = 0;  // 0 when curl got no answer
  std::string headers, body;
  std::string error;  // curl's standard error
};

// One request with the curl tool to https://127.0.0.1:<port><path>, `args` before the URL,
// with `token` (when not empty) as the Bearer token. The body is kept in `scratch_dir`.
CurlReply Curl(int port, const std::string& path, const std::vector<std::string>& args,
               const std::string& token, const std::string& scratch_dir);

// Writes into `dir` (made if missing) a small authority and a leaf for `common_name` signed by
// it: "cert.pem", "privkey.pem", "chain.pem" (the authority) and "fullchain.pem" (leaf, then
// authority). False when openssl failed.
bool MakeCertSet(const std::string& dir, const std::string& common_name);

// SHA-256 fingerprint of the first certificate in the PEM file, "AB:CD:..." as
// `openssl x509 -fingerprint` prints it; empty when unreadable.
std::string PemFingerprint(const std::string& path);

struct HttpReply {
  int status = 0;  // 0: no reply (the connection failed or closed)
  std::string headers, body;
};

// One TLS connection to 127.0.0.1:port that accepts any server certificate. `max_version`
// (e.g. TLS1_1_VERSION) limits the protocol, `ciphers` (OpenSSL's names) the TLS 1.2 suites;
// either also lets the client offer what its default security level forbids. 0, "": no limit.
class TlsConnection {
 public:
  explicit TlsConnection(int port, int max_version = 0, const std::string& ciphers = "");
  bool ok() const { return ssl_ != nullptr; }  // the handshake completed
  std::string LeafFingerprint() const;         // of the server's certificate
  bool Send(const std::string& raw);
  HttpReply Receive();  // one answer: headers and a Content-Length body
  HttpReply Exchange(const std::string& raw) { return Send(raw) ? Receive() : HttpReply(); }
  bool ClosedByPeer();

 private:
  std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)> ctx_;
  UniqueFd fd_;
  std::unique_ptr<SSL, decltype(&SSL_free)> ssl_;
  std::string pending_;
};

UniqueFd ConnectTcp(int port);  // plain TCP to 127.0.0.1:port, for bytes that are not TLS

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_SERVER_WEBAPID_TEST_SUPPORT_H_
