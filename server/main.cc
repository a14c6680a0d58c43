// zeph-webapid: the HTTPS web API server of the certificate module.
//
//   zeph-webapid [--root DIR] [--listen ADDR:PORT] [--module PATH] [--web DIR]
//
// Start-up, in order: take the root (ZEPH_ROOT), load the module, start the
// root as `zephcert init` does (provisioning, and on the first start the
// module's "reset", which makes the default certificate), make or read the
// access token, load the web administration service's certificate, then
// serve until SIGTERM or SIGINT. Any failure before serving ends the process
// with status 1 and one line on standard error; bad arguments with status 2.
#include <errno.h>
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
#include "server/log_line.h"
#include "server/options.h"
#include "server/tls_identity.h"
#include "server/token.h"
#include "server/web_api_server.h"
#include "zeph/root.h"
#include "zeph/system.h"

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

  ZEPH::webapid::TlsIdentity identity(ZEPH::RootPath(kWebCertDir), LogLine);
  if (!identity.Load(&error)) {
    // Never serve without TLS: without a certificate there is no server.
    return Fail(error +
                "; bind a certificate to the web administration service "
                "(system/default) and start again");
  }
  LogLine("certificate in use: SHA256 " + identity.Fingerprint() +
          ", valid until " + identity.NotAfter());

  ZEPH::webapid::ServerSettings settings;
  settings.address = options.address;
  settings.port = options.port;
  settings.web_dir = options.web_dir.empty() ? WebDir() : options.web_dir;
  settings.upload_parent = ZEPH::RootPath("/tmp");
  settings.services_file = ZEPH::RootPath(kServicesFile);
  settings.events_file = ZEPH::RootPath(ZEPH::webapid::kEventsFile);
  ZEPH::webapid::WebApiServer server(module.get(), &identity, token, settings);
  if (!server.Bind(&error)) return Fail(error);

  const std::string host = options.address.find(':') != std::string::npos
                               ? "[" + options.address + "]"
                               : options.address;
  LogLine("listening on https://" + host + ":" + std::to_string(server.port()) +
          " (pid " + std::to_string(getpid()) + ", token in " + token_path +
          ")");

  std::atomic<bool> served{false};
  std::thread stopper([&] {
    int sig = 0;
    sigwait(&stop_signals, &sig);
    if (served) return;  // woken by main after the server ended by itself
    LogLine(std::string("stopping on ") +
            (sig == SIGINT ? "SIGINT" : "SIGTERM"));
    // Stop may come before the server started to listen; repeat until the
    // listening loop has ended.
    while (!served) {
      server.Stop();
      usleep(20 * 1000);
    }
  });
  const bool ok = server.Serve();
  served = true;
  pthread_kill(stopper.native_handle(), SIGTERM);
  stopper.join();
  if (!ok) return Fail("the server stopped unexpectedly");
  LogLine("stopped");
  return 0;
}
