// nginx, the appliance's httpd, run and supervised by zeph-webapid.
//
// Start runs the machine's nginx with the configuration written for it
// (nginx_config.h) and hands it the public listening socket as descriptor
// 3 (nginx's "NGINX" environment variable), so that a restarted nginx goes
// on with the same socket. The nginx master leads a process group of its
// own and is told to end when zeph-webapid ends (parent-death signal), so
// that neither outlives the other.
//
// Supervision (a thread of its own):
//   - an nginx that ends is started again (after a second when it ran for
//     less than ten), and workers it left behind are killed first;
//   - every quarter of a second the web administration service's
//     certificate files are looked at; a new pair that passes the checks
//     (served_certificate.h) replaces nginx's copy and nginx is reloaded.
//
// A reload (SIGHUP) is graceful: new connections get the new certificate,
// connections in flight finish with their old worker. Handover returns
// once new TLS connections are presented the new certificate, or after
// five seconds, saying so in the log.
//
// Stop ends nginx at once (SIGTERM: connections are closed, bodies being
// received dropped) and kills what is left of its process group after
// three seconds.
//
// Thread-safety: all members may be called from any thread.
#ifndef ZEPH_SERVER_HTTPD_H_
#define ZEPH_SERVER_HTTPD_H_

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>

#include "server/served_certificate.h"
#include "server/web_api_server.h"

namespace ZEPH {
namespace webapid {

struct HttpdSettings {
  std::string nginx = "/usr/sbin/nginx";
  std::string prefix;    // nginx's prefix directory (the run directory)
  std::string conf;      // its configuration file
  std::string pid_file;  // the pid file the configuration names
  int listen_fd = -1;    // the public listening socket; stays the caller's
  std::string host;      // its numeric address and port, for the checks
  int port = 0;
};

class Httpd : public HttpdControl {
 public:
  // `certificate` must outlive the Httpd.
  Httpd(HttpdSettings settings, ServedCertificate* certificate);
  ~Httpd() override;
  Httpd(const Httpd&) = delete;
  Httpd& operator=(const Httpd&) = delete;

  // Starts nginx and its supervision; returns once nginx runs. False with
  // a one-line reason in `error` when it did not start (its own messages
  // are on standard error before).
  bool Start(std::string* error);
  // Ends nginx and its supervision (see above). Safe to call twice.
  void Stop();

  // Takes up a changed certificate now, before the caller answers.
  void RestartRequested() override;
  std::string Fingerprint() const override;
  std::string NotAfter() const override;

 private:
  enum class State { kStarting, kRunning, kFailed };

  void Supervise();
  pid_t Spawn(std::string* error) const;
  bool AwaitStart(pid_t pid, std::string* error);
  // Waits up to `wait` for the stop request; true when it came.
  bool StopRequested(std::chrono::milliseconds wait);
  void Handover(bool force);

  const HttpdSettings settings_;
  ServedCertificate* const certificate_;
  std::thread supervisor_;
  std::mutex handover_mu_;  // one certificate hand-over at a time
  mutable std::mutex mu_;
  std::condition_variable cv_;
  State state_ = State::kStarting;  // guarded by mu_
  std::string start_error_;         // guarded by mu_
  pid_t pid_ = -1;                  // guarded by mu_: the nginx master
  bool stopping_ = false;           // guarded by mu_
};

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_HTTPD_H_
