// Running the lego ACME client with a time limit.
//
// lego runs directly (posix_spawn, no shell) in a process group of its own,
// with standard input from /dev/null and its standard output and error
// both going to a log file, never to the tool's standard output (which
// carries the tool's one JSON answer). It inherits no other descriptor. Its
// environment is the tool's, with lego's own LEGO_* variables removed and
// `environment` added.
//
// Thread-safety: reentrant; the tool calls it from its one thread.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_LEGO_PROCESS_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_LEGO_PROCESS_H_

#include <map>
#include <string>
#include <vector>

namespace ZEPH {
namespace letsencrypt {

struct LegoRun {
  enum class End {
    kNotStarted,  // start_errno says why (ENOENT: lego not installed)
    kExited,      // status is the exit status
    kSignaled,    // status is the signal
    kTimedOut,    // stopped after the time limit
  };
  End end = End::kNotStarted;
  int status = 0;
  int start_errno = 0;
  std::string output;  // what lego wrote (the log file's content)

  bool succeeded() const { return end == End::kExited && status == 0; }
};

// Runs `program` with `args` (argv[1]...), writing its output to
// `log_path` (created mode 0600, or truncated). After `timeout_s` seconds
// the process group gets SIGTERM, and SIGKILL two seconds later if it is
// still there; either way the child is reaped before the call returns.
LegoRun RunLego(const std::string& program, const std::vector<std::string>& args,
                const std::map<std::string, std::string>& environment,
                const std::string& log_path, int timeout_s);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_LEGO_PROCESS_H_
