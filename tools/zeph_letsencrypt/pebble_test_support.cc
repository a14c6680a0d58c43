#include "pebble_test_support.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include "test_support.h"
#include "zeph/json_file.h"

extern char** environ;

namespace ZEPH {
namespace test {
namespace {

constexpr char kPebble[] = "/usr/bin/pebble";
constexpr char kChallengeServer[] = "/usr/bin/pebble-challtestsrv";

// A TCP socket and the address of `port` on 127.0.0.1.
UniqueFd LoopbackSocket(int port, struct sockaddr_in* addr) {
  *addr = {};
  addr->sin_family = AF_INET;
  addr->sin_port = htons(static_cast<uint16_t>(port));
  addr->sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return UniqueFd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
}

bool Accepts(int port) {
  struct sockaddr_in addr;
  UniqueFd fd = LoopbackSocket(port, &addr);
  return fd && connect(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) == 0;
}

}  // namespace

bool LegoInstalled() { return access("/usr/bin/lego", X_OK) == 0; }
bool PebbleInstalled() { return access(kPebble, X_OK) == 0; }
bool ChallengeServerInstalled() { return access(kChallengeServer, X_OK) == 0; }

UniqueFd ListeningSocket(int* port) {
  struct sockaddr_in addr;
  UniqueFd fd = LoopbackSocket(0, &addr);
  socklen_t len = sizeof(addr);
  auto* any = reinterpret_cast<struct sockaddr*>(&addr);
  if (!fd || bind(fd.get(), any, len) != 0 || listen(fd.get(), 8) != 0 ||
      getsockname(fd.get(), any, &len) != 0) {
    ADD_FAILURE() << "no free port";
    *port = 0;
    return UniqueFd();
  }
  *port = ntohs(addr.sin_port);
  return fd;
}

int FreePort() {
  int port;
  ListeningSocket(&port);
  return port;
}

bool LoggedChild::Spawn(const std::vector<std::string>& args, const std::vector<std::string>& env,
                        const std::string& log, int port, std::string* error) {
  // Through env(1) with `env` added; input from /dev/null, output and errors into `log`.
  std::vector<std::string> strings = {"/usr/bin/env"};
  strings.insert(strings.end(), env.begin(), env.end());
  strings.insert(strings.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& s : strings) argv.push_back(&s[0]);
  argv.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 1, log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
  posix_spawn_file_actions_adddup2(&actions, 1, 2);
  posix_spawn_file_actions_addclosefrom_np(&actions, 3);
  const int rc = posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (rc != 0) {
    pid_ = -1;
    *error = "cannot start " + args[0];
    return false;
  }
  for (int i = 0; i < 600; ++i) {  // readiness, not speed: pebble makes its keys first
    if (Accepts(port)) return true;
    if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
      pid_ = -1;
      *error = args[0] + " exited: " + ReadFile(log);
      return false;
    }
    usleep(50000);
  }
  *error = args[0] + " does not accept connections: " + ReadFile(log);
  Stop();
  return false;
}

void LoggedChild::Stop() {  // the servers keep nothing worth a graceful end
  if (pid_ < 0) return;
  kill(pid_, SIGKILL);
  waitpid(pid_, nullptr, 0);
  pid_ = -1;
}

bool ChallengeServer::Start(std::string* error) {
  dns_port_ = FreePort();
  const int management_port = FreePort();
  const std::string management = "127.0.0.1:" + std::to_string(management_port);
  const std::string post = "exec /usr/bin/curl -sf --noproxy '*' -X POST -d ";
  WriteFile(hook_,
            "#!/bin/sh\n# lego's exec DNS provider: present|cleanup FQDN VALUE\n"
            "case \"$1\" in\n"
            "present) " + post + R"("{\"host\":\"$2\",\"value\":\"$3\"}" http://)" +
                management + "/set-txt ;;\n"
            "cleanup) " + post + R"("{\"host\":\"$2\"}" http://)" + management +
                "/clear-txt ;;\nesac\n",
            0755);
  return Spawn({kChallengeServer, "-dns01", DnsAddress(), "-management", management, "-http01",
                "", "-https01", "", "-tlsalpn01", "", "-defaultIPv6", ""},
               {}, dir_ + "/challtestsrv.log", management_port, error);
}

Json::Value ChallengeServer::ToolSettings() const {
  Json::Value s(Json::objectValue);
  s["challenge"] = "dns";
  s["dns_provider"] = "exec";
  s["dns_resolvers"].append(DnsAddress());
  s["dns_disable_cp"] = true;  // no authoritative name server of the test's names
  s["environment"]["EXEC_PATH"] = hook_;
  s["environment"]["EXEC_POLLING_INTERVAL"] = "1";
  s["environment"]["EXEC_PROPAGATION_TIMEOUT"] = "30";
  s["environment"]["EXEC_SEQUENCE_INTERVAL"] = "1";
  return s;
}

// A throw-away authority and a server certificate for 127.0.0.1 signed by it, which lego is
// told to trust; pebble's configuration on free ports.
bool Pebble::Configure(std::string* error) {
  const std::string ca_key = dir_ + "/pebble-ca.key", csr = dir_ + "/pebble.csr";
  const std::string ext = dir_ + "/pebble.ext", curve = "ec_paramgen_curve:P-256";
  WriteFile(ext, "subjectAltName=IP:127.0.0.1,DNS:localhost\n");
  for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
           {"req", "-x509", "-newkey", "ec", "-pkeyopt", curve, "-nodes", "-keyout", ca_key,
            "-out", ca_file(), "-days", "2", "-subj", "/CN=zeph test ACME TLS CA", "-addext",
            "basicConstraints=critical,CA:TRUE", "-addext",
            "keyUsage=critical,keyCertSign,cRLSign"},
           {"req", "-newkey", "ec", "-pkeyopt", curve, "-nodes", "-keyout", dir_ + "/pebble.key",
            "-out", csr, "-subj", "/CN=localhost"},
           {"x509", "-req", "-in", csr, "-CA", ca_file(), "-CAkey", ca_key, "-CAcreateserial",
            "-out", dir_ + "/pebble.pem", "-days", "2", "-extfile", ext}}) {
    std::vector<std::string> argv = {"/usr/bin/openssl"};
    argv.insert(argv.end(), args.begin(), args.end());
    const CommandResult r = Run(argv);
    if (r.status != 0) {
      *error = "openssl " + args[0] + " failed: " + r.err;
      return false;
    }
  }
  port_ = FreePort();
  Json::Value config;
  Json::Value& p = config["pebble"];
  p["listenAddress"] = "127.0.0.1:" + std::to_string(port_);
  p["managementListenAddress"] = "";
  p["certificate"] = dir_ + "/pebble.pem";
  p["privateKey"] = dir_ + "/pebble.key";
  p["httpPort"] = FreePort();
  p["tlsPort"] = FreePort();
  p["ocspResponderURL"] = "";
  p["externalAccountBindingRequired"] = options_.require_eab;
  if (options_.require_eab) p["externalAccountMACKeys"][kEabKid] = kEabHmacKey;
  WriteFile(dir_ + "/pebble.json", JsonCompact(config));
  return true;
}

bool Pebble::Start(std::string* error) {
  if (port_ == 0 && !Configure(error)) return false;
  const bool validate = !options_.dns_server.empty();
  std::vector<std::string> env = {"PEBBLE_VA_NOSLEEP=1", "PEBBLE_WFE_NONCEREJECT=0"};
  if (!validate) env.push_back("PEBBLE_VA_ALWAYS_VALID=1");
  return Spawn({kPebble, "-config", dir_ + "/pebble.json", "-dnsserver",
                validate ? options_.dns_server : "127.0.0.1:" + std::to_string(FreePort())},
               env, dir_ + "/pebble.log", port_, error);
}

}  // namespace test
}  // namespace ZEPH
