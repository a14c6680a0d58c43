// zeph-webapid: the web API server of the certificate module, with nginx
// as its httpd in front.
//
//   zeph-webapid [--root DIR] [--listen ADDR:PORT] [--module PATH] [--web DIR]
//
// Start-up, in order: take the root (ZEPH_ROOT), load the module, start the
// root as `zephcert init` does (provisioning, and on the first start the
// module's "reset", which makes the default certificate), make or read the
// access token, prepare the run directory (sweeping what a killed run left),
// check the web administration service's certificate, listen on ADDR:PORT
// and on the private socket, write nginx's configuration and start nginx,
// then serve until SIGTERM or SIGINT, which stop nginx and the server. Any
// failure before serving ends the process with status 1 and one line on
// standard error; bad arguments with status 2.
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <malloc.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <iostream>
#include <string>
#include <thread>
#include <vector>

#include "host/initialize.h"
#include "host/module_loader.h"
#include "server/event_log.h"
#include "server/httpd.h"
#include "server/listeners.h"
#include "server/log_line.h"
#include "server/nginx_config.h"
#include "server/options.h"
#include "server/run_dir.h"
#include "server/served_certificate.h"
#include "server/token.h"
#include "server/web_api_server.h"
#include "zeph/fd_io.h"
#include "zeph/root.h"
#include "zeph/system.h"
#include "zeph/unique_fd.h"

namespace {

using ZEPH::webapid::LogLine;

constexpr int kExitFailed = 1;
constexpr int kExitUsage = 2;

// The web administration service's certificate directory.
constexpr char kWebCertDir[] = "/usr/zeph/etc/certificate/system/default";
constexpr char kArchiveInfo[] = "/usr/zeph/etc/certificate/_archive/INFO";
constexpr char kServicesFile[] = "/usr/zeph/etc/certificate/_archive/SERVICES";

int Fail(const std::string& message) {
  LogLine(message);
  return kExitFailed;
}

bool Exists(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0;
}

// Makes --root usable: created when missing, resolved to an absolute path
// and exported as ZEPH_ROOT for the module and the tools it runs.
bool SetUpRoot(const std::string& root, std::string* error) {
  if (ZEPHFSMkdirP(root.c_str(), nullptr, 1, 0, 0, 0755) != 0) {
    *error = "cannot create root " + root + ": " + strerror(errno);
    return false;
  }
  char resolved[PATH_MAX];
  if (realpath(root.c_str(), resolved) == nullptr) {
    *error = "root " + root + " is not usable: " + strerror(errno);
    return false;
  }
  setenv("ZEPH_ROOT", resolved, 1);
  return true;
}

// Writes nginx's configuration into the run directory.
bool WriteNginxConfig(const std::string& path,
                      const ZEPH::webapid::NginxSettings& settings,
                      std::string* error) {
  for (const std::string* p :
       {&settings.run_dir, &settings.web_dir, &settings.api_socket}) {
    *error = ZEPH::webapid::CheckNginxPath(*p);
    if (!error->empty()) return false;
  }
  ZEPH::UniqueFd fd(open(path.c_str(),
                         O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW,
                         0600));
  if (!fd || !ZEPH::WriteAll(fd.get(), ZEPH::webapid::NginxConfigText(settings)) ||
      close(fd.release()) != 0) {
    *error = "cannot write " + path + ": " + strerror(errno);
    return false;
  }
  return true;
}

// nginx's workers must reach the page's files and the run directory; a
// directory on the way that they may not enter is named at start, not
// found later as requests that fail.
bool CheckWorkerReach(const ZEPH::webapid::WorkerUser& user,
                      const std::string& web_dir, const std::string& run_dir,
                      std::string* error) {
  for (const std::string& path : {web_dir, run_dir + "/api"}) {
    const std::string blocked = ZEPH::webapid::BlockedFor(user, path);
    if (blocked.empty()) continue;
    *error = "nginx's workers (user " +
             (user.name.empty() ? std::to_string(user.uid) : user.name) +
             ") cannot reach " + path + ": " + blocked +
             " is missing or closed to them";
    return false;
  }
  return true;
}

// The administration page: installed beside the executable's tree, else
// the source tree's web/ (a build tree).
std::string WebDir() {
  const std::string installed = ZEPH::ExecutableDir() + "/../share/zeph/web";
  if (Exists(installed)) return installed;
#ifdef ZEPH_WEBAPID_SOURCE_WEB_DIR
  return ZEPH_WEBAPID_SOURCE_WEB_DIR;
#else
  return "";
#endif
}

}  // namespace

int main(int argc, char** argv) {
  ZEPH::webapid::Options options;
  std::string error;
  if (!ZEPH::webapid::ParseOptions(
          std::vector<std::string>(argv + 1, argv + argc), &options, &error)) {
    std::cerr << "zeph-webapid: " << error << "\n" << ZEPH::webapid::kUsage;
    return kExitUsage;
  }
  if (options.help) {
    std::cout << ZEPH::webapid::kUsage;
    return 0;
  }

  // Signals are taken by one thread with sigwait; every thread made from
  // here on inherits the mask. A peer that goes away mid-answer must not
  // kill the process.
  sigset_t stop_signals;
  sigemptyset(&stop_signals);
  sigaddset(&stop_signals, SIGTERM);
  sigaddset(&stop_signals, SIGINT);
  pthread_sigmask(SIG_BLOCK, &stop_signals, nullptr);
  signal(SIGPIPE, SIG_IGN);
  // glibc gives busy threads arenas of their own, up to eight per core,
  // and keeps their memory after a burst of requests; a few shared arenas
  // keep the resident size of an idle server small.
  mallopt(M_ARENA_MAX, 2);

  if (options.has_root && !SetUpRoot(options.root, &error)) return Fail(error);

  const std::string module_path = options.module.empty()
                                      ? ZEPH::DefaultCertificateModulePath()
                                      : options.module;
  std::unique_ptr<ZEPH::LoadedModule> module =
      ZEPH::LoadedModule::Open(module_path, &error);
  if (!module) return Fail(error);

  // The first start on a root is what `zephcert init` does: provision it
  // and, while it has no catalogue, reset the store so that a default
  // certificate exists and is deployed to the web administration service.
  // A root that has a catalogue is never reset here.
  if (!Exists(ZEPH::RootPath(kArchiveInfo))) {
    LogLine(
        "first start: provisioning the root and making the default "
        "certificate");
  }
  if (!ZEPH::InitializeRoot(*module, &error)) return Fail(error);

  std::string token;
  const std::string token_path = ZEPH::RootPath(ZEPH::webapid::kTokenFile);
  if (!ZEPH::webapid::LoadOrCreateToken(token_path, &token, &error)) {
    return Fail(error);
  }

  // The run directory, swept of what a killed run left (uploads among it).
  ZEPH::webapid::WorkerUser worker;
  if (!ZEPH::webapid::FindWorkerUser(&worker, &error)) return Fail(error);
  ZEPH::webapid::RunDir run(ZEPH::RootPath(ZEPH::webapid::kRunDir));
  const std::string upload_parent = ZEPH::RootPath("/tmp");
  if (!run.Prepare(worker, upload_parent, &error)) return Fail(error);
  const std::string web_dir = options.web_dir.empty() ? WebDir() : options.web_dir;
  if (!CheckWorkerReach(worker, web_dir, run.dir(), &error)) return Fail(error);

  ZEPH::webapid::ServedCertificate certificate(ZEPH::RootPath(kWebCertDir),
                                               run.Path("tls"), LogLine);
  if (!certificate.Load(&error)) {
    // Never serve without TLS: without a certificate there is no server.
    return Fail(error +
                "; bind a certificate to the web administration service "
                "(system/default) and start again");
  }
  LogLine("certificate in use: SHA256 " + certificate.Fingerprint() +
          ", valid until " + certificate.NotAfter());

  ZEPH::webapid::PublicListener listener;
  if (!ZEPH::webapid::ListenPublic(options.address, options.port, &listener,
                                   &error)) {
    return Fail(error);
  }
  ZEPH::UniqueFd api_socket;
  if (!ZEPH::webapid::ListenPrivate(run.api_socket(), worker, &api_socket,
                                    &error)) {
    return Fail(error);
  }
  ZEPH::webapid::NginxSettings nginx;
  nginx.listen = ZEPH::webapid::HostPort(listener.host, listener.port);
  nginx.run_dir = run.dir();
  nginx.web_dir = web_dir;
  nginx.api_socket = run.api_socket();
  nginx.chain_path = certificate.chain_path();
  nginx.key_path = certificate.key_path();
  nginx.worker_user = worker.name;
  if (!WriteNginxConfig(run.Path("nginx.conf"), nginx, &error)) {
    return Fail(error);
  }

  ZEPH::webapid::HttpdSettings httpd_settings;
  httpd_settings.prefix = run.dir();
  httpd_settings.conf = run.Path("nginx.conf");
  httpd_settings.pid_file = run.Path("nginx.pid");
  httpd_settings.listen_fd = listener.fd.get();
  httpd_settings.host = listener.host;
  httpd_settings.port = listener.port;
  ZEPH::webapid::Httpd httpd(httpd_settings, &certificate);

  ZEPH::webapid::ServerSettings settings;
  settings.upload_parent = upload_parent;
  settings.services_file = ZEPH::RootPath(kServicesFile);
  settings.events_file = ZEPH::RootPath(ZEPH::webapid::kEventsFile);
  ZEPH::webapid::WebApiServer server(module.get(), &httpd, token, settings);
  server.Listen(std::move(api_socket));
  if (!httpd.Start(&error)) return Fail(error);

  const std::string host = options.address.find(':') != std::string::npos
                               ? "[" + options.address + "]"
                               : options.address;
  LogLine("listening on https://" + host + ":" + std::to_string(listener.port) +
          " (pid " + std::to_string(getpid()) + ", token in " + token_path +
          ")");

  std::atomic<bool> served{false};
  std::thread stopper([&] {
    int sig = 0;
    sigwait(&stop_signals, &sig);
    if (served) return;  // woken by main after the server ended by itself
    LogLine(std::string("stopping on ") +
            (sig == SIGINT ? "SIGINT" : "SIGTERM"));
    // nginx first: nothing new reaches the server, and bodies still being
    // received are dropped. Stop may come before the server started to
    // listen; repeat until the listening loop has ended.
    httpd.Stop();
    while (!served) {
      server.Stop();
      usleep(20 * 1000);
    }
  });
  const bool ok = server.Serve();
  served = true;
  httpd.Stop();
  pthread_kill(stopper.native_handle(), SIGTERM);
  stopper.join();
  if (!ok) return Fail("the server stopped unexpectedly");
  LogLine("stopped");
  return 0;
}
