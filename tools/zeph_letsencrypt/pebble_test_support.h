// A real pebble ACME server on 127.0.0.1 on free ports, without sleeps or rejected nonces, its
// TLS certificate from a throw-away authority (ca_file()). Without a DNS server every challenge
// is valid and its resolver a port nobody listens on; with a ChallengeServer it checks DNS-01.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_PEBBLE_TEST_SUPPORT_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_PEBBLE_TEST_SUPPORT_H_

#include <json/json.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "zeph/unique_fd.h"

namespace ZEPH {
namespace test {

// Whether /usr/bin/lego, /usr/bin/pebble, /usr/bin/pebble-challtestsrv run.
bool LegoInstalled();
bool PebbleInstalled();
bool ChallengeServerInstalled();

// A socket listening on a free port of 127.0.0.1, which it sets; a port nobody listened on.
UniqueFd ListeningSocket(int* port);
int FreePort();

// The external account binding a Pebble with require_eab demands.
constexpr char kEabKid[] = "kid-zeph";
constexpr char kEabHmacKey[] = "zWNDZM6eQGHWpSRTPal5eIUYFTu7EajVIoguysqZ9wG44nMEtx3MUAsUDkMTQ12W";

// A child process whose output goes to a log, stopped by Stop() or the destructor.
class LoggedChild {
 public:
  LoggedChild() = default;
  ~LoggedChild() { Stop(); }
  LoggedChild(const LoggedChild&) = delete;
  LoggedChild& operator=(const LoggedChild&) = delete;
  void Stop();

 protected:
  // Starts `args` with `env` ("NAME=value") added and waits until `port` accepts
  // connections; false with the reason in `error` when it does not.
  bool Spawn(const std::vector<std::string>& args, const std::vector<std::string>& env,
             const std::string& log, int port, std::string* error);

 private:
  pid_t pid_ = -1;
};

// pebble-challtestsrv answering DNS-01's TXT records, set by hook() (lego's "exec" provider);
// ToolSettings() (an acme/settings.h update) uses both. `dir` receives the hook and the log.
class ChallengeServer : public LoggedChild {
 public:
  explicit ChallengeServer(const std::string& dir) : dir_(dir), hook_(dir + "/dns-hook.sh") {}
  bool Start(std::string* error);
  std::string DnsAddress() const { return "127.0.0.1:" + std::to_string(dns_port_); }
  const std::string& hook() const { return hook_; }
  Json::Value ToolSettings() const;

 private:
  std::string dir_, hook_;
  int dns_port_ = 0;
};

struct PebbleOptions {
  std::string dns_server;    // a ChallengeServer's DnsAddress(), or ""
  bool require_eab = false;  // new accounts need kEabKid and kEabHmacKey
};

// `dir` receives pebble's configuration, certificate and log. Start() after a Stop() starts
// a new server, on the same port and certificate, that knows no account.
class Pebble : public LoggedChild {
 public:
  explicit Pebble(const std::string& dir, PebbleOptions options = {})
      : dir_(dir), options_(std::move(options)) {}
  bool Start(std::string* error);
  std::string DirectoryUrl() const { return "https://127.0.0.1:" + std::to_string(port_) + "/dir"; }
  std::string ca_file() const { return dir_ + "/pebble-ca.pem"; }

 private:
  bool Configure(std::string* error);
  std::string dir_;
  PebbleOptions options_;
  int port_ = 0;
};

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_PEBBLE_TEST_SUPPORT_H_
