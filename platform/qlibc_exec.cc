#include "zeph/qlibc_exec.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <stdarg.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <memory>
#include <new>
#include <vector>

#include "zeph/qlibc_error.h"
#include "zeph/spawn.h"
#include "zeph/unique_fd.h"

extern char** environ;

namespace {

// posix_spawn attributes and file actions with automatic destruction.
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

  bool Configure(const ZEPH::ChildOptions& child) {
    if (!ok_) return false;
    short flags = POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF;
    if (child.options & QLIBC_EXEC_NEW_SESSION) flags |= POSIX_SPAWN_SETSID;
    if (child.new_process_group) flags |= POSIX_SPAWN_SETPGROUP;
    sigset_t empty, defaults;
    sigemptyset(&empty);
    sigemptyset(&defaults);
    sigaddset(&defaults, SIGPIPE);  // a server ignores it; its children must not
    if (child.options & QLIBC_EXEC_RESET_SIGNALS) {
      for (int s = 1; s < NSIG; ++s) {
        if (s != SIGKILL && s != SIGSTOP) sigaddset(&defaults, s);
      }
    }
    if (posix_spawnattr_setflags(&attr_, flags) != 0 ||
        posix_spawnattr_setpgroup(&attr_, 0) != 0 ||
        posix_spawnattr_setsigmask(&attr_, &empty) != 0 ||
        posix_spawnattr_setsigdefault(&attr_, &defaults) != 0) {
      return false;
    }
    const int o = child.options;
    return (!(o & QLIBC_EXEC_NULL_STDIN) || Redirect(0, O_RDONLY)) &&
           (!(o & QLIBC_EXEC_NULL_STDOUT) || Redirect(1, O_WRONLY)) &&
           (!(o & QLIBC_EXEC_NULL_STDERR) || Redirect(2, O_WRONLY)) &&
           (child.stdin_fd < 0 || Dup(child.stdin_fd, 0)) &&
           (child.stdout_fd < 0 || Dup(child.stdout_fd, 1)) &&
           (child.stderr_fd < 0 || Dup(child.stderr_fd, 2)) &&
           posix_spawn_file_actions_addclosefrom_np(&actions_, 3) == 0;
  }

  posix_spawnattr_t* attr() { return &attr_; }
  posix_spawn_file_actions_t* actions() { return &actions_; }

 private:
  bool Redirect(int target, int flags) {
    return posix_spawn_file_actions_addopen(&actions_, target, "/dev/null",
                                            flags, 0) == 0;
  }
  bool Dup(int fd, int target) {
    return posix_spawn_file_actions_adddup2(&actions_, fd, target) == 0;
  }

  posix_spawnattr_t attr_;
  posix_spawn_file_actions_t actions_;
  bool ok_ = false;
};

// Exit status as the library reports it: the exit code, 128 + signal, or -1.
int WaitFor(pid_t pid) {
  int status = 0;
  for (;;) {
    pid_t r = waitpid(pid, &status, 0);
    if (r == pid) break;
    if (r < 0 && errno == EINTR) continue;
    QLIBC_SET_ERROR(QLIBC_ERR_EXEC);
    return -1;
  }
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}

int Run(const char* path, const std::vector<const char*>& args, int options) {
  if (path == nullptr || *path == '\0') {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return -1;
  }
  std::vector<char*> argv;
  argv.reserve(args.size() + 2);
  argv.push_back(const_cast<char*>(path));
  for (const char* a : args) argv.push_back(const_cast<char*>(a));
  argv.push_back(nullptr);

  ZEPH::ChildOptions child;
  child.options = options;
  pid_t pid = ZEPH::Spawn(path, argv.data(), child);
  if (pid < 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_EXEC);
    return -1;
  }
  if (!(options & QLIBC_EXEC_WAIT)) return 0;
  return WaitFor(pid);
}

std::vector<const char*> CollectArgs(const char* first, va_list args) {
  std::vector<const char*> out;
  for (const char* a = first; a != nullptr; a = va_arg(args, const char*)) {
    out.push_back(a);
  }
  return out;
}

// State behind a stream of QLIBCPopen.
struct PipeChild {
  int fd;
  pid_t pid;
};

ssize_t PipeRead(void* cookie, char* buf, size_t size) {
  auto* child = static_cast<PipeChild*>(cookie);
  for (;;) {
    ssize_t n = read(child->fd, buf, size);
    if (n >= 0 || errno != EINTR) return n;
  }
}

int PipeClose(void* cookie) {
  std::unique_ptr<PipeChild> child(static_cast<PipeChild*>(cookie));
  close(child->fd);
  return WaitFor(child->pid) == 0 ? 0 : -1;
}

}  // namespace

namespace ZEPH {

pid_t Spawn(const char* path, char* const argv[], const ChildOptions& child) {
  SpawnSetup setup;
  if (!setup.Configure(child)) {
    errno = ENOMEM;
    return -1;
  }
  pid_t pid = -1;
  const int rc = posix_spawn(&pid, path, setup.actions(), setup.attr(), argv,
                             child.envp != nullptr ? child.envp : environ);
  if (rc != 0) {
    errno = rc;
    return -1;
  }
  return pid;
}

}  // namespace ZEPH

extern "C" {

int QLIBCExec(const char* path, const char* a1, const char* a2, const char* a3,
              const char* a4) {
  std::vector<const char*> args;
  for (const char* a : {a1, a2, a3, a4}) {
    if (a == nullptr) break;
    args.push_back(a);
  }
  return Run(path, args, QLIBC_EXEC_WAIT);
}

int QLIBCExecl(const char* path, int options, const char* arg, ...) {
  va_list ap;
  va_start(ap, arg);
  std::vector<const char*> args = CollectArgs(arg, ap);
  va_end(ap);
  return Run(path, args, options);
}

int QLIBCExecv(const char* path, char* const argv[], int flag) {
  std::vector<const char*> args;
  if (argv != nullptr && argv[0] != nullptr) {
    for (char* const* a = argv + 1; *a != nullptr; ++a) args.push_back(*a);
  }
  return Run(path, args, flag == 1 ? QLIBC_EXEC_WAIT : 0);
}

FILE* QLIBCPopen(const char* path, const char* mode, const char* arg, ...) {
  if (path == nullptr || mode == nullptr || strcmp(mode, "r") != 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return nullptr;
  }
  va_list ap;
  va_start(ap, arg);
  std::vector<const char*> args = CollectArgs(arg, ap);
  va_end(ap);

  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return nullptr;
  }
  ZEPH::UniqueFd read_end(fds[0]);
  ZEPH::UniqueFd write_end(fds[1]);

  std::vector<char*> argv;
  argv.push_back(const_cast<char*>(path));
  for (const char* a : args) argv.push_back(const_cast<char*>(a));
  argv.push_back(nullptr);

  ZEPH::ChildOptions to_pipe;
  to_pipe.stdout_fd = write_end.get();
  pid_t pid = ZEPH::Spawn(path, argv.data(), to_pipe);
  if (pid < 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_EXEC);
    return nullptr;
  }
  write_end.reset();

  auto* child = new (std::nothrow) PipeChild{read_end.get(), pid};
  cookie_io_functions_t io = {PipeRead, nullptr, nullptr, PipeClose};
  FILE* stream = child != nullptr ? fopencookie(child, "r", io) : nullptr;
  if (stream == nullptr) {
    delete child;
    read_end.reset();
    WaitFor(pid);
    QLIBC_SET_ERROR(QLIBC_ERR_NO_MEMORY);
    return nullptr;
  }
  read_end.release();
  return stream;
}

int QLIBCPclose(FILE* stream) {
  if (stream == nullptr) return -1;
  return fclose(stream) == 0 ? 0 : -1;
}

}  // extern "C"
