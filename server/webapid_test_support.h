// A real zeph-webapid on a private root and curl to talk to it; in tls_test_support.cc (for
// tests that link OpenSSL's TLS library) certificate sets, fingerprints and an HTTPS client.
#ifndef ZEPH_SERVER_WEBAPID_TEST_SUPPORT_H_
#define ZEPH_SERVER_WEBAPID_TEST_SUPPORT_H_

#include <openssl/x509.h>
#include <sys/types.h>

#include <string>
#include <vector>

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

 private:
  std::string root_, log_path_;
  pid_t pid_ = -1;
  int status_ = -1, port_ = -1;
};

struct CurlReply {
  int status = 0;  // 0 when curl got no answer
  std::string headers, body;
  std::string error;  // curl's standard error
};

// One request with the curl tool to https://127.0.0.1:<port><path>, `args` before the URL,
// with `token` (when not empty) as the Bearer token. The body is kept in `scratch_dir`.
CurlReply Curl(int port, const std::string& path, const std::vector<std::string>& args,
               const std::string& token, const std::string& scratch_dir);

// Writes into `dir` an authority and a leaf for `common_name` signed by it: "cert.pem",
// "privkey.pem", "chain.pem" (the authority), "fullchain.pem" (both). False if openssl failed.
bool MakeCertSet(const std::string& dir, const std::string& common_name);

// SHA-256 fingerprint ("AB:CD:...") of the PEM file's first certificate; empty when unreadable.
std::string PemFingerprint(const std::string& path);

// "AB:CD:...", as `openssl x509 -fingerprint -sha256` prints it; empty for nullptr.
std::string CertFingerprint(X509* cert);

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_SERVER_WEBAPID_TEST_SUPPORT_H_
