#include "tools/zeph_letsencrypt/lego_process.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include "tools/zeph_letsencrypt/files.h"
#include "zeph/qlibc_exec.h"
#include "zeph/spawn.h"
#include "zeph/unique_fd.h"

extern char** environ;

namespace ZEPH {
namespace letsencrypt {
namespace {

double Now() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

void Pause() {
  const struct timespec step = {0, 20 * 1000 * 1000};
  nanosleep(&step, nullptr);
}

// Polls for the child's end until `deadline`; true when it ended.
bool WaitUntil(pid_t pid, double deadline, int* wait_status) {
  for (;;) {
    const pid_t r = waitpid(pid, wait_status, WNOHANG);
    if (r == pid) return true;
    if (r < 0 && errno != EINTR) return true;  // nothing left to wait for
    if (Now() >= deadline) return false;
    Pause();
  }
}

std::vector<std::string> ChildEnvironment(
    const std::map<std::string, std::string>& extra) {
  std::vector<std::string> env;
  for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
    const std::string entry = *e;
    const std::string name = entry.substr(0, entry.find('='));
    if (name.compare(0, 5, "LEGO_") == 0 || extra.count(name) != 0) continue;
    env.push_back(entry);
  }
  for (const auto& kv : extra) env.push_back(kv.first + "=" + kv.second);
  return env;
}

std::vector<char*> Pointers(std::vector<std::string>& strings) {
  std::vector<char*> out;
  for (std::string& s : strings) out.push_back(&s[0]);
  out.push_back(nullptr);
  return out;
}

}  // namespace

LegoRun RunLego(const std::string& program, const std::vector<std::string>& args,
                const std::map<std::string, std::string>& environment,
                const std::string& log_path, int timeout_s) {
  LegoRun run;
  UniqueFd log(open(log_path.c_str(),
                    O_WRONLY | O_CREAT | O_TRUNC | O_APPEND | O_CLOEXEC, 0600));
  if (!log) {
    run.start_errno = errno;
    return run;
  }
  std::vector<std::string> argv_strings{program};
  argv_strings.insert(argv_strings.end(), args.begin(), args.end());
  std::vector<std::string> env_strings = ChildEnvironment(environment);
  std::vector<char*> argv = Pointers(argv_strings);
  std::vector<char*> envp = Pointers(env_strings);

  // Its own process group, so that a time-out stops lego and anything it
  // started; default signal handling; stdin from /dev/null; stdout and
  // stderr into the log; nothing else inherited.
  ChildOptions child;
  child.options = QLIBC_EXEC_NULL_STDIN | QLIBC_EXEC_RESET_SIGNALS;
  child.stdout_fd = log.get();
  child.stderr_fd = log.get();
  child.new_process_group = true;
  child.envp = envp.data();
  const pid_t pid = Spawn(program.c_str(), argv.data(), child);
  const int rc = pid < 0 ? errno : 0;
  log.reset();
  if (rc != 0) {
    run.start_errno = rc;
    return run;
  }
  int wait_status = 0;
  if (WaitUntil(pid, Now() + timeout_s, &wait_status)) {
    run.end = WIFSIGNALED(wait_status) ? LegoRun::End::kSignaled
                                       : LegoRun::End::kExited;
    run.status = WIFSIGNALED(wait_status) ? WTERMSIG(wait_status)
                                          : WEXITSTATUS(wait_status);
  } else {
    run.end = LegoRun::End::kTimedOut;
    kill(-pid, SIGTERM);
    if (!WaitUntil(pid, Now() + 2, &wait_status)) {
      kill(-pid, SIGKILL);
      while (waitpid(pid, &wait_status, 0) < 0 && errno == EINTR) {
      }
    }
  }
  ReadWhole(log_path, &run.output);
  return run;
}

}  // namespace letsencrypt
}  // namespace ZEPH
