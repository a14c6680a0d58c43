// Benchmark of "CRT create" through the method table, against the bare
// openssl command sequence of the same set (bench/mkcert/openssl_set.sh).
//
//   create_bench [RUNS] [KEYS]   (defaults: 7 runs, "rsa")
//
// KEYS "rsa" is the method's default, 4096-bit RSA keys; "ec256" asks for
// P-256 keys for both the authority and the server ("key_type" and
// "ca_key_type"). Both run alternately in a private root. The create does
// everything a request does: a fresh archive directory, the CA and server
// sets, the full chain, the catalogue entry. RSA key generation at 4096
// bits takes seconds and varies widely from key to key, so medians need
// several runs; with EC keys the starts of the openssl processes dominate.
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

bool Create(bool ec) {
  Json::Value params = ZEPH::bench::CreateParams("arvelon");
  if (ec) {
    params["key_type"] = "ec256";
    params["ca_key_type"] = "ec256";
  }
  const ZEPH::APIResponse r =
      ZEPH::bench::Call("ZEPH.Core.Certificate.CRT", "create", params);
  return r.outcome() == ZEPH::APIResponse::Outcome::kSuccess;
}

bool ScriptSet(const std::string& dir, const std::string& work, bool ec) {
  return QLIBCExec("/bin/mkdir", "-p", dir.c_str(), work.c_str(), nullptr) == 0 &&
         QLIBCExec("/bin/sh", ZEPH_BENCH_SCRIPT, dir.c_str(), work.c_str(),
                   ec ? "ec256" : "4096") == 0;
}

}  // namespace

int main(int argc, char** argv) {
  const int runs = argc > 1 ? atoi(argv[1]) : 7;
  const std::string keys = argc > 2 ? argv[2] : "rsa";
  if (runs < 1 || (keys != "rsa" && keys != "ec256")) {
    fprintf(stderr, "usage: create_bench [RUNS] [rsa|ec256]\n");
    return 2;
  }
  const bool ec = keys == "ec256";
  ZEPH::bench::BenchRoot root("create_bench");
  std::vector<double> create_times, script_times;
  bool ok = true;
  {
    ZEPH::bench::QuietStderr quiet;
    for (int i = 0; i < runs && ok; ++i) {
      double t0 = Now();
      ok = Create(ec);
      double t1 = Now();
      ok = ok && ScriptSet(root.dir() + "/script/" + std::to_string(i),
                           root.dir() + "/script-work", ec);
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
  const char* name = ec ? "create ec256" : "create 4096";
  printf("CRT create, %s, median of %d runs\n",
         ec ? "P-256 keys (key_type, ca_key_type ec256)" : "default 4096-bit keys", runs);
  printf("  module (CRT create)            %8.0f ms\n", create_ms);
  printf("  bare openssl sequence (sh)     %8.0f ms\n", script_ms);
  printf("  ratio                          %8.2f\n", create_ms / script_ms);
  ZEPH::bench::Result(name, "CRT create, median", create_ms, "ms");
  ZEPH::bench::Result(name, "bare openssl sequence, median", script_ms, "ms");
  ZEPH::bench::Result(name, "ratio", create_ms / script_ms, "x");
  return 0;
}
