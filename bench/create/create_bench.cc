// Benchmark of "CRT create" with its default 4096-bit keys, through the
// method table, against the bare openssl command sequence of the same set
// (bench/mkcert/openssl_set.sh with 4096-bit keys).
//
//   create_bench [RUNS]      (default 7)
//
// Both run alternately in a private root. The create does everything a
// request does: a fresh archive directory, the CA and server sets, the
// full chain, the catalogue entry. RSA key generation at 4096 bits takes
// seconds and varies widely from key to key, so medians need several runs.
#include <stdio.h>
#include <stdlib.h>

#include <string>
#include <vector>

#include "bench/common/bench_util.h"
#include "zeph/qlibc_exec.h"

#ifndef ZEPH_BENCH_SCRIPT
#error "ZEPH_BENCH_SCRIPT names openssl_set.sh"
#endif

namespace {

using ZEPH::bench::Now;

bool Create() {
  const ZEPH::APIResponse r = ZEPH::bench::Call(
      "ZEPH.Core.Certificate.CRT", "create", ZEPH::bench::CreateParams("arvelon"));
  return r.outcome() == ZEPH::APIResponse::Outcome::kSuccess;
}

bool ScriptSet(const std::string& dir, const std::string& work) {
  return QLIBCExec("/bin/mkdir", "-p", dir.c_str(), work.c_str(), nullptr) == 0 &&
         QLIBCExec("/bin/sh", ZEPH_BENCH_SCRIPT, dir.c_str(), work.c_str(), "4096") == 0;
}

}  // namespace

int main(int argc, char** argv) {
  const int runs = argc > 1 ? atoi(argv[1]) : 7;
  if (runs < 1) {
    fprintf(stderr, "usage: create_bench [RUNS]\n");
    return 2;
  }
  ZEPH::bench::BenchRoot root("create_bench");
  std::vector<double> create_times, script_times;
  bool ok = true;
  {
    ZEPH::bench::QuietStderr quiet;
    for (int i = 0; i < runs && ok; ++i) {
      double t0 = Now();
      ok = Create();
      double t1 = Now();
      ok = ok && ScriptSet(root.dir() + "/script/" + std::to_string(i),
                           root.dir() + "/script-work");
      double t2 = Now();
      create_times.push_back(t1 - t0);
      script_times.push_back(t2 - t1);
    }
  }
  if (!ok) {
    fprintf(stderr, "create_bench: a set could not be made\n");
    return 1;
  }
  const double create_ms = ZEPH::bench::Median(create_times) * 1000;
  const double script_ms = ZEPH::bench::Median(script_times) * 1000;
  printf("CRT create, default 4096-bit keys, median of %d runs\n", runs);
  printf("  module (CRT create)            %8.0f ms\n", create_ms);
  printf("  bare openssl sequence (sh)     %8.0f ms\n", script_ms);
  printf("  ratio                          %8.2f\n", create_ms / script_ms);
  ZEPH::bench::Result("create 4096", "CRT create, median", create_ms, "ms");
  ZEPH::bench::Result("create 4096", "bare openssl sequence, median", script_ms, "ms");
  ZEPH::bench::Result("create 4096", "ratio", create_ms / script_ms, "x");
  return 0;
}
