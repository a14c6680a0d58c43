// Benchmark of "Service set" deploying one certificate to 100 registered
// services at once: the time per service, and how many processes the
// module starts per service.
//
//   service_bench [RUNS]      (default 6)
//
// A private root gets two certificates and 100 services registered in
// SERVICES next to the web administration's. Each run moves all 100 from
// one certificate to the other in one call (the first run binds them and
// is not counted). Processes are counted in a PID namespace of the
// benchmark's own, where every process started takes the next number;
// without the privilege to make one the count is left out.
#include <errno.h>
#include <sched.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "bench/common/bench_util.h"
#include "host/provision.h"
#include "zeph/json_file.h"
#include "zeph/root.h"

namespace {

constexpr int kServices = 100;

Json::Value BenchServices(const std::string& owner) {
  Json::Value services(Json::arrayValue);
  for (int i = 0; i < kServices; ++i) {
    char name[16];
    snprintf(name, sizeof(name), "svc%03d", i);
    Json::Value s;
    s["display_name"] = std::string("Bench ") + name;
    s["subscriber"] = "bench";
    s["service"] = name;
    s["isPkg"] = false;
    s["owner"] = owner;
    services.append(s);
  }
  return services;
}

std::string CreateCertificate(const char* name) {
  const ZEPH::APIResponse r = ZEPH::bench::Call(
      "ZEPH.Core.Certificate.CRT", "create", ZEPH::bench::CreateParams(name, 2048));
  if (r.outcome() != ZEPH::APIResponse::Outcome::kSuccess) {
    fprintf(stderr, "service_bench: cannot create a certificate\n");
    exit(1);
  }
  return r.data()["id"].asString();
}

// Processes started so far in this PID namespace; -1 outside one of our own.
long LastPid(bool own_namespace) {
  if (!own_namespace) return -1;
  FILE* f = fopen("/proc/sys/kernel/ns_last_pid", "re");
  long pid = -1;
  if (f != nullptr) {
    if (fscanf(f, "%ld", &pid) != 1) pid = -1;
    fclose(f);
  }
  return pid;
}

// Moves every bench service to `id` in one call; false when any failed.
bool MoveAll(const Json::Value& services, const std::string& id,
             const std::string& old_id) {
  Json::Value params;
  params["settings"] = Json::Value(Json::arrayValue);
  for (const Json::Value& s : services) {
    Json::Value setting;
    setting["service"] = s;
    setting["id"] = id;
    setting["old_id"] = old_id;
    params["settings"].append(setting);
  }
  const ZEPH::APIResponse r =
      ZEPH::bench::Call("ZEPH.Core.Certificate.Service", "set", params);
  return r.outcome() == ZEPH::APIResponse::Outcome::kSuccess &&
         !r.data().isMember("err_settings");
}

int Run(int runs, bool own_namespace) {
  ZEPH::bench::BenchRoot root("service_bench");
  const Json::Value services = BenchServices(ZEPH::CurrentUserName());
  Json::Value registered;
  ZEPH::JsonParse("[" + ZEPH::WebServiceJson(ZEPH::CurrentUserName()) + "]", registered);
  for (const Json::Value& s : services) registered.append(s);
  ZEPH::JsonToFile(registered,
                   ZEPH::RootPath("/usr/zeph/etc/certificate/_archive/SERVICES"), true);

  std::vector<double> seconds;
  std::vector<double> processes;
  {
    ZEPH::bench::QuietStderr quiet;
    const std::string ids[2] = {CreateCertificate("one"), CreateCertificate("two")};
    std::string old_id;
    for (int i = 0; i <= runs; ++i) {  // run 0 binds them first
      const std::string& id = ids[i % 2];
      const long pid0 = LastPid(own_namespace);
      const double t0 = ZEPH::bench::Now();
      const bool ok = MoveAll(services, id, old_id);
      const double t1 = ZEPH::bench::Now();
      const long pid1 = LastPid(own_namespace);
      if (!ok) {
        fprintf(stderr, "service_bench: a setting failed\n");
        return 1;
      }
      old_id = id;
      if (i == 0) continue;
      seconds.push_back(t1 - t0);
      if (pid0 >= 0 && pid1 >= 0) processes.push_back(static_cast<double>(pid1 - pid0));
    }
  }
  const double per_service_ms = ZEPH::bench::Median(seconds) * 1000 / kServices;
  printf("Service set, one certificate to %d services in one call, median of %d runs\n",
         kServices, runs);
  printf("  whole call                    %8.1f ms\n", per_service_ms * kServices);
  printf("  per service                   %8.2f ms\n", per_service_ms);
  ZEPH::bench::Result("service set x100", "time per service, median", per_service_ms, "ms");
  if (!processes.empty()) {
    const double per_service = ZEPH::bench::Median(processes) / kServices;
    printf("  processes started per service %8.2f\n", per_service);
    ZEPH::bench::Result("service set x100", "processes started per service",
                        per_service, "processes");
  } else {
    printf("  processes started per service: not counted (no PID namespace: %s)\n",
           own_namespace ? "unreadable counter" : "not permitted");
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  const int runs = argc > 1 ? atoi(argv[1]) : 6;
  if (runs < 1) {
    fprintf(stderr, "usage: service_bench [RUNS]\n");
    return 2;
  }
  // The benchmark runs as the first process of a PID namespace of its own
  // when it may make one, so that process numbers count what it starts.
  fflush(stdout);
  if (unshare(CLONE_NEWPID) != 0) return Run(runs, false);
  const pid_t child = fork();
  if (child < 0) {
    perror("fork");
    return 1;
  }
  if (child == 0) {
    const int rc = Run(runs, true);
    fflush(stdout);
    _exit(rc);
  }
  int status = 0;
  while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : 1;
}
