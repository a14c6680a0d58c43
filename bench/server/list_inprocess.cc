// The "list" method called in the process, without HTTP or TLS: the cost
// the server adds is the difference to the same call over HTTPS (run.sh).
//
//   webapid_bench_list --root DIR [--calls N] [--threads T] [--module PATH]
//
// Prints calls per second and the p50/p99 latency of one call.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "host/module_loader.h"
#include "zeph/api.h"

namespace {

using Clock = std::chrono::steady_clock;

int Usage() {
  fprintf(stderr,
          "usage: webapid_bench_list --root DIR [--calls N] [--threads T] "
          "[--module PATH]\n");
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  std::string root, module_path;
  long calls = 2000;
  long threads = 1;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (i + 1 >= argc) return Usage();
    if (arg == "--root") {
      root = argv[++i];
    } else if (arg == "--calls") {
      calls = atol(argv[++i]);
    } else if (arg == "--threads") {
      threads = atol(argv[++i]);
    } else if (arg == "--module") {
      module_path = argv[++i];
    } else {
      return Usage();
    }
  }
  if (root.empty() || calls < 1 || threads < 1) return Usage();
  setenv("ZEPH_ROOT", root.c_str(), 1);

  std::string error;
  auto module = ZEPH::LoadedModule::Open(
      module_path.empty() ? ZEPH::DefaultCertificateModulePath() : module_path,
      &error);
  if (!module) {
    fprintf(stderr, "%s\n", error.c_str());
    return 1;
  }
  const ZEPH_API_TABLE* list =
      module->Find("ZEPH.Core.Certificate.CRT", 1, "list");
  if (list == nullptr) return 1;

  // One warm-up call, which also checks that the list works at all.
  {
    ZEPH::APIRequest request;
    ZEPH::APIResponse response;
    list->handler(&request, &response);
    if (response.outcome() != ZEPH::APIResponse::Outcome::kSuccess) {
      fprintf(stderr, "list answered error %d\n", response.error_code());
      return 1;
    }
    printf("certificates: %u\n", response.data()["certificates"].size());
  }

  std::vector<std::vector<double>> latencies(static_cast<size_t>(threads));
  const long per_thread = calls / threads;
  const Clock::time_point start = Clock::now();
  std::vector<std::thread> workers;
  for (long t = 0; t < threads; ++t) {
    workers.emplace_back([&, t] {
      std::vector<double>& mine = latencies[static_cast<size_t>(t)];
      for (long i = 0; i < per_thread; ++i) {
        ZEPH::APIRequest request;
        ZEPH::APIResponse response;
        const Clock::time_point before = Clock::now();
        list->handler(&request, &response);
        mine.push_back(std::chrono::duration<double, std::milli>(
                           Clock::now() - before)
                           .count());
      }
    });
  }
  for (std::thread& w : workers) w.join();
  const double seconds =
      std::chrono::duration<double>(Clock::now() - start).count();

  std::vector<double> all;
  for (const auto& l : latencies) all.insert(all.end(), l.begin(), l.end());
  std::sort(all.begin(), all.end());
  auto at = [&all](double q) {
    return all[std::min(all.size() - 1,
                        static_cast<size_t>(q * static_cast<double>(all.size())))];
  };
  printf("in-process list, %ld threads: %.1f calls/s, p50 %.2f ms, p99 %.2f ms\n",
         threads, static_cast<double>(all.size()) / seconds, at(0.50), at(0.99));
  return 0;
}
