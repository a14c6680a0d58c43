// A real pebble ACME server on 127.0.0.1 for one test, and helpers to run
// zeph-letsencrypt against it.
//
// pebble runs with no artificial sleeps and no rejected nonces, on free
// ports, with a TLS certificate made for the test by openssl from a
// throw-away authority (ca_file()). By default validation is switched off
// (PEBBLE_VA_ALWAYS_VALID) and its DNS server address is one where nothing
// listens, so that nothing leaves 127.0.0.1; with a ChallengeServer it
// validates DNS-01 for real against that server. It is stopped by Stop()
// or at the latest by the destructor.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_PEBBLE_TEST_SUPPORT_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_PEBBLE_TEST_SUPPORT_H_

#include <json/json.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "zeph/unique_fd.h"

namespace ZEPH {
namespace test {

// True when /usr/bin/lego (and, with `pebble`, /usr/bin/pebble) can run.
bool LegoInstalled();
bool PebbleInstalled();

// A TCP port on 127.0.0.1 that nobody listened on a moment ago.
int FreePort();

// The key id and HMAC key of the external account binding a Pebble made
// with PebbleOptions::require_eab demands.
constexpr char kEabKid[] = "kid-zeph";
constexpr char kEabHmacKey[] =
    "zWNDZM6eQGHWpSRTPal5eIUYFTu7EajVIoguysqZ9wG44nMEtx3MUAsUDkMTQ12W";

struct PebbleOptions {
  // "127.0.0.1:port" of the DNS server to validate challenges with (a
  // ChallengeServer's); empty: every challenge counts as valid.
  std::string dns_server;
  // New accounts need external account binding (kEabKid, kEabHmacKey).
  bool require_eab = false;
};

// True when /usr/bin/pebble-challtestsrv (pebble's challenge test server)
// can run.
bool ChallengeServerInstalled();

// pebble-challtestsrv on 127.0.0.1: a DNS server answering the TXT records
// of DNS-01 challenges (and 127.0.0.1 for every A query), set and cleared
// through its management interface. hook() is a script for lego's "exec"
// DNS provider that does so ("present"/"cleanup" FQDN VALUE, with curl).
class ChallengeServer {
 public:
  // `dir` (existing) receives the hook and the server's log.
  explicit ChallengeServer(const std::string& dir);
  ~ChallengeServer();
  ChallengeServer(const ChallengeServer&) = delete;
  ChallengeServer& operator=(const ChallengeServer&) = delete;

  bool Start(std::string* error);
  void Stop();

  std::string DnsAddress() const;
  const std::string& hook() const { return hook_; }
  // Settings of the tool (acme/settings.h update form) that solve DNS-01
  // through this server: the "exec" provider with the hook, this server as
  // the resolver, lego's waits shortened.
  Json::Value ToolSettings() const;

 private:
  std::string dir_;
  std::string hook_;
  int dns_port_ = 0;
  int management_port_ = 0;
  pid_t pid_ = -1;
};

class Pebble {
 public:
  // `dir` (existing) receives pebble's configuration, certificate and log.
  explicit Pebble(const std::string& dir, PebbleOptions options = {});
  ~Pebble();
  Pebble(const Pebble&) = delete;
  Pebble& operator=(const Pebble&) = delete;

  // Starts pebble (again, on the same ports and certificate after a Stop:
  // a new server that knows no account) and waits until it accepts
  // connections. False, with the reason in `error`, when it does not.
  bool Start(std::string* error);
  void Stop();

  std::string DirectoryUrl() const;
  const std::string& ca_file() const { return ca_file_; }
  const std::string& log_file() const { return log_file_; }

 private:
  bool MakeCertificate(std::string* error);

  std::string dir_;
  PebbleOptions options_;
  std::string ca_file_;
  std::string log_file_;
  int port_ = 0;
  pid_t pid_ = -1;
};

// Writes the tool's configuration file of the current root (ZEPH_ROOT):
// `config` as given.
void WriteToolConfig(const Json::Value& config);

// The tool's configuration for `pebble`: its directory, its TLS authority,
// an HTTP-01 solver on a free port of 127.0.0.1 and a 60 s bound.
Json::Value PebbleToolConfig(const Pebble& pebble);

// One run of the built zeph-letsencrypt.
struct ToolAnswer {
  int status = -1;      // exit status
  std::string out;      // its whole standard output
  std::string err;
  Json::Value answer;   // the one JSON object of `out` (null if none)
  int error() const { return answer["error"].asInt(); }
  std::string msg() const { return answer["msg"].asString(); }
};

// Runs `program` (default: the built tool) with `args` and checks with
// gtest assertions that its standard output is exactly one line holding
// one JSON object with an integer "error" and, unless it is 0, a string
// "msg".
ToolAnswer RunTool(const std::vector<std::string>& args,
                   const std::string& program = "");

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_PEBBLE_TEST_SUPPORT_H_
