// Benchmark of making one certificate set (genCASet + genCertSet) against
// the bare openssl command sequence of the same set run by a shell script
// (openssl_set.sh).
//
//   mkcert_bench [RUNS] [BITS]      (defaults: 15 runs, 1024-bit keys)
//
// Both run in a private root made for the benchmark, alternately, after
// one warm-up run each; each run makes a set in a fresh directory. The
// report gives both medians and their ratio; the module is meant to cost
// at most 1.25 times the bare sequence.
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "bench/common/bench_util.h"
#include "module/common/paths.h"
#include "module/mkcert/cert_set.h"
#include "zeph/qlibc_exec.h"
#include "zeph/root.h"

#ifndef ZEPH_BENCH_SCRIPT
#error "ZEPH_BENCH_SCRIPT names openssl_set.sh"
#endif

namespace {

using ZEPH::bench::Median;
using ZEPH::bench::Now;

constexpr double kTarget = 1.25;

_tag_CSR_ARGUMENT DefaultSubject(const char* common_name) {
  _tag_CSR_ARGUMENT s;
  s.country = "TW";
  s.city = "Taipel";
  s.organization = "Arvelon Inc.";
  s.common_name = common_name;
  return s;
}

bool MakeDir(const std::string& dir) {
  return QLIBCExec("/bin/mkdir", "-p", dir.c_str(), nullptr, nullptr) == 0;
}

// The module's set; openssl's "signature ok" lines go to /dev/null, as the
// script's do.
bool ModuleSet(const std::string& dir, int bits) {
  _tag_CSR_ARGUMENT ca = DefaultSubject("Arvelon Inc. CA");
  _tag_CSR_ARGUMENT server = DefaultSubject("arvelon");
  return genCASet(&ca, bits, dir) == 0 &&
         genCertSet(&server, bits, "arvelon", dir) == 0;
}

bool ScriptSet(const std::string& dir, const std::string& work, int bits) {
  const std::string bits_text = std::to_string(bits);
  return QLIBCExec("/bin/sh", ZEPH_BENCH_SCRIPT, dir.c_str(), work.c_str(),
                   bits_text.c_str()) == 0;
}

}  // namespace

int main(int argc, char** argv) {
  const int runs = argc > 1 ? atoi(argv[1]) : 15;
  const int bits = argc > 2 ? atoi(argv[2]) : 1024;
  if (runs < 1 || bits < 512) {
    fprintf(stderr, "usage: mkcert_bench [RUNS] [BITS]\n");
    return 2;
  }

  ZEPH::bench::BenchRoot root("mkcert_bench");
  const std::string archive = ZEPH::RootPath(ZEPH::cert::kArchiveDir);
  const std::string work = root.dir() + "/script-work";
  MakeDir(work);

  std::vector<double> module_times, script_times;
  bool ok = true;
  {
  ZEPH::bench::QuietStderr quiet;  // openssl's chatter
  for (int i = -1; i < runs && ok; ++i) {  // run -1 warms up
    const std::string tag = std::to_string(i + 1);
    const std::string mdir = archive + "/module" + tag;
    const std::string sdir = archive + "/script" + tag;
    ok = MakeDir(mdir) && MakeDir(sdir);
    double t0 = Now();
    ok = ok && ModuleSet(mdir, bits);
    double t1 = Now();
    ok = ok && ScriptSet(sdir, work, bits);
    double t2 = Now();
    if (i >= 0) {
      module_times.push_back(t1 - t0);
      script_times.push_back(t2 - t1);
    }
  }
  }
  if (!ok) {
    fprintf(stderr, "mkcert_bench: a set could not be made\n");
    return 1;
  }

  const double module_ms = Median(module_times) * 1000;
  const double script_ms = Median(script_times) * 1000;
  const double ratio = module_ms / script_ms;
  printf("certificate set, %d-bit keys, median of %d runs\n", bits, runs);
  printf("  module (genCASet + genCertSet)  %8.1f ms\n", module_ms);
  printf("  bare openssl sequence (sh)      %8.1f ms\n", script_ms);
  printf("  ratio                           %8.2f   (target <= %.2f: %s)\n",
         ratio, kTarget, ratio <= kTarget ? "met" : "missed");
  const std::string name = "mkcert set " + std::to_string(bits);
  ZEPH::bench::Result(name, "module, median", module_ms, "ms");
  ZEPH::bench::Result(name, "bare openssl sequence, median", script_ms, "ms");
  ZEPH::bench::Result(name, "ratio (target <= 1.25)", ratio, "x");
  return 0;
}
