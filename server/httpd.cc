#include "server/httpd.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <utility>
#include <vector>

#include "server/log_line.h"
#include "server/tls_probe.h"
#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;

// The descriptor nginx finds the public socket on ("NGINX=3;").
constexpr int kListenFd = 3;
constexpr milliseconds kWatchInterval(250);
constexpr seconds kStartTimeout(10);
constexpr seconds kStopTimeout(3);
constexpr seconds kHandoverTimeout(5);

std::string DescribeStatus(const siginfo_t& info) {
  if (info.si_code == CLD_EXITED) {
    return "exit status " + std::to_string(info.si_status);
  }
  return std::string("signal ") + strsignal(info.si_status);
}

// Whether `pid` has ended; it is left to be reaped (a zombie keeps its pid
// and process group id from being used again until then).
bool Ended(pid_t pid, siginfo_t* info) {
  *info = {};
  return waitid(P_PID, static_cast<id_t>(pid), info,
                WEXITED | WNOHANG | WNOWAIT) == 0 &&
         info->si_pid == pid;
}

// Kills whatever is left of the process group `pid` leads, then reaps
// `pid`.
void KillGroupAndReap(pid_t pid) {
  kill(-pid, SIGKILL);
  while (waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
  }
}

pid_t ReadPidFile(const std::string& path) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  std::string text;
  if (!fd || !ReadAll(fd.get(), text)) return -1;
  return static_cast<pid_t>(atol(text.c_str()));
}

}  // namespace

Httpd::Httpd(HttpdSettings settings, ServedCertificate* certificate)
    : settings_(std::move(settings)), certificate_(certificate) {}

Httpd::~Httpd() { Stop(); }

pid_t Httpd::Spawn(std::string* error) const {
  // Everything the child needs is made before fork: between fork and exec
  // only async-signal-safe calls are allowed.
  std::vector<std::string> args = {settings_.nginx, "-p",
                                   settings_.prefix + "/", "-c",
                                   settings_.conf,  "-e", "stderr"};
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  std::string inherit = "NGINX=" + std::to_string(kListenFd) + ";";
  char* envp[] = {&inherit[0], nullptr};
  const pid_t parent = getpid();
  const int listen_fd = settings_.listen_fd;

  const pid_t pid = fork();
  if (pid < 0) {
    *error = std::string("cannot start nginx: ") + strerror(errno);
    return -1;
  }
  if (pid == 0) {
    setpgid(0, 0);
    // The signal comes when the thread that forked ends: the supervisor,
    // which lives as long as the server.
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (getppid() != parent) _exit(127);
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    struct sigaction dfl = {};
    dfl.sa_handler = SIG_DFL;
    sigaction(SIGPIPE, &dfl, nullptr);
    const int null_fd = open("/dev/null", O_RDONLY);
    if (null_fd < 0 || dup2(null_fd, 0) < 0) _exit(127);
    if (listen_fd == kListenFd) {
      if (fcntl(kListenFd, F_SETFD, 0) < 0) _exit(127);
    } else if (dup2(listen_fd, kListenFd) < 0) {
      _exit(127);
    }
    syscall(SYS_close_range, kListenFd + 1, ~0U, 0);
    execve(argv[0], argv.data(), envp);
    _exit(127);
  }
  return pid;
}

bool Httpd::AwaitStart(pid_t pid, std::string* error) {
  // The master writes its pid file once its configuration is loaded; the
  // socket already listens, so clients wait in its backlog meanwhile.
  const auto deadline = steady_clock::now() + kStartTimeout;
  while (steady_clock::now() < deadline) {
    siginfo_t info;
    if (Ended(pid, &info)) {
      *error = "nginx ended at its start (" + DescribeStatus(info) +
               "); its messages are above";
      return false;
    }
    if (ReadPidFile(settings_.pid_file) == pid) return true;
    if (StopRequested(milliseconds(20))) break;
  }
  *error = "nginx did not start within " +
           std::to_string(kStartTimeout.count()) + " s";
  return false;
}

bool Httpd::StopRequested(milliseconds wait) {
  std::unique_lock<std::mutex> lock(mu_);
  return cv_.wait_for(lock, wait, [this] { return stopping_; });
}

bool Httpd::Start(std::string* error) {
  supervisor_ = std::thread([this] { Supervise(); });
  std::unique_lock<std::mutex> lock(mu_);
  cv_.wait(lock, [this] { return state_ != State::kStarting; });
  if (state_ == State::kFailed) {
    *error = start_error_;
    return false;
  }
  return true;
}

void Httpd::Supervise() {
  std::string error;
  pid_t pid = Spawn(&error);
  const bool started = pid > 0 && AwaitStart(pid, &error);
  {
    std::lock_guard<std::mutex> lock(mu_);
    state_ = started ? State::kRunning : State::kFailed;
    start_error_ = error;
    pid_ = started ? pid : -1;
  }
  cv_.notify_all();
  if (!started) {
    if (pid > 0) KillGroupAndReap(pid);
    return;
  }

  auto since = steady_clock::now();
  while (!StopRequested(kWatchInterval)) {
    siginfo_t info;
    if (pid > 0 && !Ended(pid, &info)) {
      Handover(false);
      continue;
    }
    if (pid > 0) {
      LogLine("nginx ended (" + DescribeStatus(info) + "); starting it again");
      KillGroupAndReap(pid);
      pid = -1;
      std::lock_guard<std::mutex> lock(mu_);
      pid_ = -1;
    }
    // One that keeps failing is not started in a tight loop.
    if (steady_clock::now() - since < seconds(10) &&
        StopRequested(seconds(1))) {
      break;
    }
    since = steady_clock::now();
    pid = Spawn(&error);
    if (pid > 0 && !AwaitStart(pid, &error)) {
      KillGroupAndReap(pid);
      pid = -1;
    }
    if (pid < 0) {
      LogLine(error);
      continue;
    }
    std::lock_guard<std::mutex> lock(mu_);
    pid_ = pid;
  }

  if (pid < 0) return;
  kill(pid, SIGTERM);
  const auto deadline = steady_clock::now() + kStopTimeout;
  siginfo_t info;
  while (!Ended(pid, &info) && steady_clock::now() < deadline) {
    usleep(10 * 1000);
  }
  KillGroupAndReap(pid);
  std::lock_guard<std::mutex> lock(mu_);
  pid_ = -1;
}

void Httpd::Stop() {
  {
    std::lock_guard<std::mutex> lock(mu_);
    stopping_ = true;
  }
  cv_.notify_all();
  if (supervisor_.joinable()) supervisor_.join();
}

void Httpd::Handover(bool force) {
  std::lock_guard<std::mutex> handover(handover_mu_);
  if (!certificate_->Refresh(force)) return;
  pid_t pid;
  {
    std::lock_guard<std::mutex> lock(mu_);
    pid = pid_;
  }
  // Without a running nginx, the next one starts with the new copy.
  if (pid <= 0 || kill(pid, SIGHUP) != 0) return;
  // Old workers may accept a connection or two until the new ones are
  // up: the new certificate must be seen twice in a row.
  const std::string wanted = certificate_->Fingerprint();
  const auto deadline = steady_clock::now() + kHandoverTimeout;
  int seen = 0;
  while (seen < 2 && steady_clock::now() < deadline) {
    if (PresentedFingerprint(settings_.host, settings_.port, 1000) == wanted) {
      ++seen;
    } else {
      seen = 0;
      usleep(10 * 1000);
    }
  }
  if (seen < 2) {
    LogLine("nginx was reloaded but does not present the new certificate " +
            wanted + " yet");
  }
}

void Httpd::RestartRequested() { Handover(true); }

std::string Httpd::Fingerprint() const { return certificate_->Fingerprint(); }

std::string Httpd::NotAfter() const { return certificate_->NotAfter(); }

}  // namespace webapid
}  // namespace ZEPH
