#include "pebble_test_support.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include "test_support.h"
#include "zeph/json_file.h"
#include "zeph/root.h"

extern char** environ;

namespace ZEPH {
namespace test {
namespace {

constexpr char kPebble[] = "/usr/bin/pebble";
constexpr char kChallengeServer[] = "/usr/bin/pebble-challtestsrv";
constexpr char kLego[] = "/usr/bin/lego";
constexpr char kOpenssl[] = "/usr/bin/openssl";

void Sleep(long ms) {
  const struct timespec t = {ms / 1000, (ms % 1000) * 1000000};
  nanosleep(&t, nullptr);
}

bool Accepts(int port) {
  UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return fd && connect(fd.get(), reinterpret_cast<struct sockaddr*>(&addr),
                       sizeof(addr)) == 0;
}

bool RunOpenssl(const std::vector<std::string>& args, std::string* error) {
  std::vector<std::string> argv{kOpenssl};
  argv.insert(argv.end(), args.begin(), args.end());
  const CommandResult r = Run(argv);
  if (r.status == 0) return true;
  *error = "openssl " + args[0] + " failed: " + r.err;
  return false;
}

// Starts `argv` with `env` added to the test's environment, standard input
// from /dev/null, output and error appended to `log`. The pid, or -1.
pid_t SpawnLogged(std::vector<std::string> args, const std::vector<std::string>& extra_env,
                  const std::string& log) {
  std::vector<std::string> env;
  for (char** e = environ; *e != nullptr; ++e) env.push_back(*e);
  env.insert(env.end(), extra_env.begin(), extra_env.end());
  std::vector<char*> argv, envp;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  for (std::string& e : env) envp.push_back(&e[0]);
  envp.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 1, log.c_str(),
                                   O_WRONLY | O_CREAT | O_APPEND, 0644);
  posix_spawn_file_actions_adddup2(&actions, 1, 2);
  posix_spawn_file_actions_addclosefrom_np(&actions, 3);
  pid_t pid = -1;
  const int rc = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  return rc == 0 ? pid : -1;
}

// Waits until `port` accepts connections or the child `pid` has ended.
bool WaitAccepting(int port, pid_t* pid, const std::string& log, std::string* error) {
  // Readiness, not speed: pebble generates its keys first.
  for (int i = 0; i < 600; ++i) {
    if (Accepts(port)) return true;
    int status;
    if (waitpid(*pid, &status, WNOHANG) == *pid) {
      *pid = -1;
      *error = "exited: " + ReadFile(log);
      return false;
    }
    Sleep(50);
  }
  *error = "does not accept connections: " + ReadFile(log);
  return false;
}

void StopChild(pid_t* pid) {
  if (*pid < 0) return;
  kill(*pid, SIGTERM);
  int status;
  for (int i = 0; i < 100; ++i) {
    if (waitpid(*pid, &status, WNOHANG) == *pid) {
      *pid = -1;
      return;
    }
    Sleep(50);
  }
  kill(*pid, SIGKILL);
  waitpid(*pid, &status, 0);
  *pid = -1;
}

}  // namespace

bool ChallengeServerInstalled() { return access(kChallengeServer, X_OK) == 0; }

ChallengeServer::ChallengeServer(const std::string& dir)
    : dir_(dir), hook_(dir + "/dns-hook.sh") {}

ChallengeServer::~ChallengeServer() { Stop(); }

bool ChallengeServer::Start(std::string* error) {
  dns_port_ = FreePort();
  management_port_ = FreePort();
  const std::string api = "http://127.0.0.1:" + std::to_string(management_port_);
  const std::string curl = "exec /usr/bin/curl -sf --noproxy '*' -X POST -d ";
  WriteFile(hook_,
            "#!/bin/sh\n"
            "# lego's exec DNS provider: present|cleanup FQDN VALUE\n"
            "case \"$1\" in\n"
            "present) " + curl + R"("{\"host\":\"$2\",\"value\":\"$3\"}" )" + api +
                "/set-txt ;;\n"
            "cleanup) " + curl + R"("{\"host\":\"$2\"}" )" + api + "/clear-txt ;;\n"
            "esac\n",
            0755);
  const std::string log = dir_ + "/challtestsrv.log";
  pid_ = SpawnLogged({kChallengeServer, "-dns01", DnsAddress(), "-management",
                      "127.0.0.1:" + std::to_string(management_port_), "-http01", "",
                      "-https01", "", "-tlsalpn01", "", "-defaultIPv6", ""},
                     {}, log);
  if (pid_ < 0) {
    *error = "cannot start pebble-challtestsrv";
    return false;
  }
  if (WaitAccepting(management_port_, &pid_, log, error)) return true;
  *error = "pebble-challtestsrv " + *error;
  Stop();
  return false;
}

void ChallengeServer::Stop() { StopChild(&pid_); }

std::string ChallengeServer::DnsAddress() const {
  return "127.0.0.1:" + std::to_string(dns_port_);
}

Json::Value ChallengeServer::ToolSettings() const {
  Json::Value s(Json::objectValue);
  s["challenge"] = "dns";
  s["dns_provider"] = "exec";
  s["dns_resolvers"].append(DnsAddress());
  // The test server is no authoritative name server of the test's names.
  s["dns_disable_cp"] = true;
  s["environment"]["EXEC_PATH"] = hook_;
  s["environment"]["EXEC_POLLING_INTERVAL"] = "1";
  s["environment"]["EXEC_PROPAGATION_TIMEOUT"] = "30";
  s["environment"]["EXEC_SEQUENCE_INTERVAL"] = "1";
  return s;
}

bool LegoInstalled() { return access(kLego, X_OK) == 0; }
bool PebbleInstalled() { return access(kPebble, X_OK) == 0; }

int FreePort() {
  UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(addr);
  if (!fd || bind(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), len) != 0 ||
      getsockname(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), &len) != 0) {
    ADD_FAILURE() << "no free port";
    return 0;
  }
  return ntohs(addr.sin_port);
}

Pebble::Pebble(const std::string& dir, PebbleOptions options)
    : dir_(dir),
      options_(std::move(options)),
      ca_file_(dir + "/pebble-ca.pem"),
      log_file_(dir + "/pebble.log") {}

Pebble::~Pebble() { Stop(); }

bool Pebble::MakeCertificate(std::string* error) {
  // A throw-away authority and a server certificate for 127.0.0.1, which
  // lego is told to trust through the tool's "ca_bundle".
  const std::string ca_key = dir_ + "/pebble-ca.key";
  const std::string key = dir_ + "/pebble.key";
  const std::string csr = dir_ + "/pebble.csr";
  const std::string ext = dir_ + "/pebble.ext";
  WriteFile(ext, "subjectAltName=IP:127.0.0.1,DNS:localhost\n");
  return RunOpenssl({"req", "-x509", "-newkey", "ec", "-pkeyopt",
                     "ec_paramgen_curve:P-256", "-nodes", "-keyout", ca_key,
                     "-out", ca_file_, "-days", "2", "-subj", "/CN=zeph test ACME TLS CA",
                     "-addext", "basicConstraints=critical,CA:TRUE",
                     "-addext", "keyUsage=critical,keyCertSign,cRLSign"},
                    error) &&
         RunOpenssl({"req", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256",
                     "-nodes", "-keyout", key, "-out", csr, "-subj", "/CN=localhost"},
                    error) &&
         RunOpenssl({"x509", "-req", "-in", csr, "-CA", ca_file_, "-CAkey", ca_key,
                     "-CAcreateserial", "-out", dir_ + "/pebble.pem", "-days", "2",
                     "-extfile", ext},
                    error);
}

bool Pebble::Start(std::string* error) {
  if (port_ == 0) {
    if (!MakeCertificate(error)) return false;
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
  }
  const std::string config = dir_ + "/pebble.json";
  const std::string dns = options_.dns_server.empty()
                              ? "127.0.0.1:" + std::to_string(FreePort())
                              : options_.dns_server;
  std::vector<std::string> env = {"PEBBLE_VA_NOSLEEP=1", "PEBBLE_WFE_NONCEREJECT=0"};
  if (options_.dns_server.empty()) env.push_back("PEBBLE_VA_ALWAYS_VALID=1");
  pid_ = SpawnLogged({kPebble, "-config", config, "-dnsserver", dns}, env, log_file_);
  if (pid_ < 0) {
    *error = "cannot start pebble";
    return false;
  }
  if (WaitAccepting(port_, &pid_, log_file_, error)) return true;
  *error = "pebble " + *error;
  Stop();
  return false;
}

void Pebble::Stop() { StopChild(&pid_); }

std::string Pebble::DirectoryUrl() const {
  return "https://127.0.0.1:" + std::to_string(port_) + "/dir";
}

void WriteToolConfig(const Json::Value& config) {
  const std::string path = RootPath("/usr/zeph/etc/letsencrypt/config.json");
  MakeDirs(RootPath("/usr/zeph/etc/letsencrypt"));
  WriteFile(path, config.isString() ? config.asString() : JsonCompact(config), 0600);
}

Json::Value PebbleToolConfig(const Pebble& pebble) {
  Json::Value config;
  config["directory_url"] = pebble.DirectoryUrl();
  config["ca_bundle"] = pebble.ca_file();
  config["http_address"] = "127.0.0.1:" + std::to_string(FreePort());
  config["timeout_s"] = 60;
  return config;
}

ToolAnswer RunTool(const std::vector<std::string>& args, const std::string& program) {
  std::vector<std::string> argv{program.empty() ? BinDir() + "/zeph-letsencrypt"
                                                : program};
  argv.insert(argv.end(), args.begin(), args.end());
  const CommandResult r = Run(argv);
  ToolAnswer a;
  a.status = r.status;
  a.out = r.out;
  a.err = r.err;
  // Exactly one line, and it is one JSON object.
  EXPECT_TRUE(!r.out.empty() && r.out.find('\n') == r.out.size() - 1) << r.out;
  EXPECT_TRUE(JsonParse(r.out, a.answer)) << r.out;
  EXPECT_TRUE(a.answer.isObject()) << r.out;
  if (!a.answer.isObject()) a.answer = Json::Value(Json::objectValue);
  EXPECT_TRUE(a.answer["error"].isInt()) << r.out;
  if (!a.answer["error"].isInt()) a.answer["error"] = -1;
  if (a.answer["error"].asInt() != 0) {
    EXPECT_TRUE(a.answer["msg"].isString()) << r.out;
    EXPECT_EQ(a.status, 1) << r.out;
  } else {
    EXPECT_FALSE(a.answer.isMember("msg")) << r.out;
    EXPECT_EQ(a.status, 0) << r.out;
  }
  return a;
}

}  // namespace test
}  // namespace ZEPH
