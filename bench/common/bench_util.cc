#include "bench/common/bench_util.h"

#include <fcntl.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

#include "host/provision.h"
#include "module/frame/table.h"
#include "zeph/qlibc_exec.h"

namespace ZEPH {
namespace bench {

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

double Median(std::vector<double> v) {
  if (v.empty()) return 0;
  std::sort(v.begin(), v.end());
  const size_t n = v.size();
  return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
}

BenchRoot::BenchRoot(const char* name) {
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/" + name + ".XXXXXX";
  if (mkdtemp(&templ[0]) == nullptr) {
    perror("mkdtemp");
    exit(1);
  }
  char resolved[PATH_MAX];
  dir_ = realpath(templ.c_str(), resolved) ? resolved : templ;
  setenv("ZEPH_ROOT", dir_.c_str(), 1);
  setenv("ZEPH_LOG_FILE", (dir_ + "/module.log").c_str(), 1);
  std::string error;
  if (!ProvisionRoot(&error)) {
    fprintf(stderr, "%s: %s\n", name, error.c_str());
    exit(1);
  }
}

BenchRoot::~BenchRoot() {
  QLIBCExec("/bin/rm", "-rf", dir_.c_str(), nullptr, nullptr);
}

APIResponse Call(const std::string& api, const std::string& method,
                 const Json::Value& params) {
  for (const ZEPH_API_TABLE* row = GetAPITable(); row->api; ++row) {
    if (api == row->api && method == row->method) {
      APIRequest request(params);
      APIResponse response;
      row->handler(&request, &response);
      return response;
    }
  }
  fprintf(stderr, "no method %s %s\n", api.c_str(), method.c_str());
  exit(1);
}

Json::Value CreateParams(const std::string& common_name, int bits) {
  Json::Value p(Json::objectValue);
  for (const char* prefix : {"ca_", ""}) {
    const std::string x = prefix;
    p[x + "country"] = "TW";
    p[x + "state"] = "";
    p[x + "city"] = "Taipel";
    p[x + "organization"] = "Arvelon Inc.";
    p[x + "department"] = "";
    p[x + "email"] = "";
  }
  p["ca_common_name"] = common_name + " CA";
  p["common_name"] = common_name;
  p["desc"] = "benchmark";
  if (bits > 0) {
    p["key_length"] = bits;
    p["ca_key_length"] = bits;
  }
  return p;
}

QuietStderr::QuietStderr() : saved_(fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 3)) {
  fflush(stderr);
  UniqueFd null(open("/dev/null", O_WRONLY | O_CLOEXEC));
  dup2(null.get(), STDERR_FILENO);
}

QuietStderr::~QuietStderr() {
  fflush(stderr);
  if (saved_.valid()) dup2(saved_.get(), STDERR_FILENO);
}

void Result(const std::string& bench, const std::string& what, double value,
            const char* unit) {
  printf("result: %s | %s | %.2f | %s\n", bench.c_str(), what.c_str(), value, unit);
}

}  // namespace bench
}  // namespace ZEPH
