#include "tools/zeph_letsencrypt/lego_process.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include "tools/zeph_letsencrypt/files.h"
#include "zeph/unique_fd.h"

extern char** environ;

namespace ZEPH {
namespace letsencrypt {
namespace {

class SpawnSetup {
 public:
  SpawnSetup() {
    ok_ = posix_spawnattr_init(&attr_) == 0;
    ok_ = posix_spawn_file_actions_init(&actions_) == 0 && ok_;
  }
  ~SpawnSetup() {
    posix_spawnattr_destroy(&attr_);
    posix_spawn_file_actions_destroy(&actions_);
  }
  SpawnSetup(const SpawnSetup&) = delete;
  SpawnSetup& operator=(const SpawnSetup&) = delete;

  // Own process group (so that a time-out stops lego and anything it
  // started), default signal handling, stdin from /dev/null, stdout and
  // stderr into `log_fd`, nothing else inherited.
  bool Prepare(int log_fd) {
    sigset_t empty, defaults;
    sigemptyset(&empty);
    sigemptyset(&defaults);
    for (int s = 1; s < NSIG; ++s) {
      if (s != SIGKILL && s != SIGSTOP) sigaddset(&defaults, s);
    }
    return ok_ &&
           posix_spawnattr_setflags(&attr_, POSIX_SPAWN_SETPGROUP |
                                                POSIX_SPAWN_SETSIGMASK |
                                                POSIX_SPAWN_SETSIGDEF) == 0 &&
           posix_spawnattr_setpgroup(&attr_, 0) == 0 &&
           posix_spawnattr_setsigmask(&attr_, &empty) == 0 &&
           posix_spawnattr_setsigdefault(&attr_, &defaults) == 0 &&
           posix_spawn_file_actions_addopen(&actions_, STDIN_FILENO, "/dev/null",
                                            O_RDONLY, 0) == 0 &&
           posix_spawn_file_actions_adddup2(&actions_, log_fd, STDOUT_FILENO) == 0 &&
           posix_spawn_file_actions_adddup2(&actions_, log_fd, STDERR_FILENO) == 0 &&
           posix_spawn_file_actions_addclosefrom_np(&actions_, 3) == 0;
  }

  posix_spawnattr_t* attr() { return &attr_; }
  posix_spawn_file_actions_t* actions() { return &actions_; }

 private:
  bool ok_ = false;
  posix_spawnattr_t attr_;
  posix_spawn_file_actions_t actions_;
};

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
  SpawnSetup setup;
  if (!log || !setup.Prepare(log.get())) {
    run.start_errno = errno;
    return run;
  }
  std::vector<std::string> argv_strings{program};
  argv_strings.insert(argv_strings.end(), args.begin(), args.end());
  std::vector<std::string> env_strings = ChildEnvironment(environment);
  std::vector<char*> argv = Pointers(argv_strings);
  std::vector<char*> envp = Pointers(env_strings);

  pid_t pid = -1;
  const int rc = posix_spawn(&pid, program.c_str(), setup.actions(),
                             setup.attr(), argv.data(), envp.data());
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
