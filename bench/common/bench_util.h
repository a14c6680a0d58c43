// What the benchmarks share: a clock, medians, a private appliance root,
// calls through the method table, and a quiet standard error.
//
// Every benchmark prints its figures for a reader and, for bench/run, one
// line per figure of the form
//   result: <benchmark> | <what> | <value> | <unit>
// which bench/run gathers into bench/REPORT.md.
#ifndef ZEPH_BENCH_COMMON_BENCH_UTIL_H_
#define ZEPH_BENCH_COMMON_BENCH_UTIL_H_

#include <json/json.h>

#include <string>
#include <vector>

#include "zeph/api.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace bench {

// Seconds on the monotonic clock.
double Now();
// The median of `v` (the mean of the middle two for an even count); 0 for
// none.
double Median(std::vector<double> v);

// A fresh directory below $TMPDIR (or /tmp), provisioned as an appliance
// root and named in ZEPH_ROOT for the object's lifetime, then removed.
// Exits the process with a message when it cannot be made.
class BenchRoot {
 public:
  explicit BenchRoot(const char* name);
  ~BenchRoot();
  BenchRoot(const BenchRoot&) = delete;
  BenchRoot& operator=(const BenchRoot&) = delete;

  const std::string& dir() const { return dir_; }

 private:
  std::string dir_;
};

// Calls (api, method) of the module's method table. Exits the process when
// the row does not exist.
APIResponse Call(const std::string& api, const std::string& method,
                 const Json::Value& params);

// The parameters of "CRT create" for a server named `common_name`, with
// the default key lengths unless `bits` is given (> 0).
Json::Value CreateParams(const std::string& common_name, int bits = 0);

// Sends standard error to /dev/null until destroyed: openssl's chatter
// stays off the report.
class QuietStderr {
 public:
  QuietStderr();
  ~QuietStderr();
  QuietStderr(const QuietStderr&) = delete;
  QuietStderr& operator=(const QuietStderr&) = delete;

 private:
  UniqueFd saved_;
};

// Prints one "result:" line.
void Result(const std::string& bench, const std::string& what, double value,
            const char* unit);

}  // namespace bench
}  // namespace ZEPH

#endif  // ZEPH_BENCH_COMMON_BENCH_UTIL_H_
