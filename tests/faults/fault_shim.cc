// A preloaded library that makes one chosen C library call fail once, at
// its Nth occurrence in the process, so that tests can see what the
// module does when a rename, write, open, stream open, process start or
// chown fails.
//
// Driven by the environment of the process it is preloaded into:
//   ZEPH_FAULT_CALL    rename | write | open | fopen | posix_spawn | chown
//                      (open counts open and open64; fopen counts the
//                      streams of fopen and fopen64, through which the
//                      C and C++ libraries and OpenSSL read and write
//                      files)
//   ZEPH_FAULT_AT      N, the occurrence that fails (1 = the first)
//   ZEPH_FAULT_MATCH   optional: only calls on a path containing this text
//                      count (for write, the path of the descriptor;
//                      for posix_spawn, the program; for rename, either
//                      name)
//   ZEPH_FAULT_ERRNO   optional: the error number (default EIO; ENOSPC
//                      for write)
//   ZEPH_FAULT_REPORT  optional: a file that gets one line naming the call
//                      and path when the fault fires
// The settings are read once at load time and removed from the
// environment together with LD_PRELOAD, so the programs the process
// starts run without the shim.
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <spawn.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <atomic>
#include <initializer_list>

namespace {

enum Call { kNone, kRename, kWrite, kOpen, kSpawn, kChown, kFopen };

struct Settings {
  Call call = kNone;
  long at = 0;
  char match[PATH_MAX] = "";
  char report[PATH_MAX] = "";
  int error = 0;
};

Settings g_settings;
std::atomic<long> g_seen{0};

void Load() __attribute__((constructor));
void Load() {
  const char* call = getenv("ZEPH_FAULT_CALL");
  const char* at = getenv("ZEPH_FAULT_AT");
  if (call == nullptr || at == nullptr) return;
  if (strcmp(call, "rename") == 0) g_settings.call = kRename;
  if (strcmp(call, "write") == 0) g_settings.call = kWrite;
  if (strcmp(call, "open") == 0) g_settings.call = kOpen;
  if (strcmp(call, "fopen") == 0) g_settings.call = kFopen;
  if (strcmp(call, "posix_spawn") == 0) g_settings.call = kSpawn;
  if (strcmp(call, "chown") == 0) g_settings.call = kChown;
  g_settings.at = atol(at);
  if (const char* m = getenv("ZEPH_FAULT_MATCH")) {
    snprintf(g_settings.match, sizeof(g_settings.match), "%s", m);
  }
  if (const char* r = getenv("ZEPH_FAULT_REPORT")) {
    snprintf(g_settings.report, sizeof(g_settings.report), "%s", r);
  }
  const char* e = getenv("ZEPH_FAULT_ERRNO");
  g_settings.error = e != nullptr ? atoi(e) : (g_settings.call == kWrite ? ENOSPC : EIO);
  for (const char* name : {"LD_PRELOAD", "ZEPH_FAULT_CALL", "ZEPH_FAULT_AT",
                           "ZEPH_FAULT_MATCH", "ZEPH_FAULT_ERRNO", "ZEPH_FAULT_REPORT"}) {
    unsetenv(name);
  }
}

template <typename F>
F Next(const char* name) {
  return reinterpret_cast<F>(dlsym(RTLD_NEXT, name));
}

bool Matches(const char* path) {
  return g_settings.match[0] == '\0' || (path != nullptr && strstr(path, g_settings.match));
}

// Whether this call (of kind `call`, on `path`) is the one to fail.
bool Fail(Call call, const char* path, const char* other = nullptr) {
  if (g_settings.call != call || !(Matches(path) || Matches(other))) return false;
  if (g_seen.fetch_add(1) + 1 != g_settings.at) return false;
  if (g_settings.report[0] != '\0') {
    int fd = Next<int (*)(const char*, int, ...)>("open")(
        g_settings.report, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (fd >= 0) {
      char line[2 * PATH_MAX + 32];
      int n = snprintf(line, sizeof(line), "%d %s\n", static_cast<int>(call),
                       path != nullptr ? path : "");
      if (n > 0) {
        ssize_t ignored = Next<ssize_t (*)(int, const void*, size_t)>("write")(
            fd, line, static_cast<size_t>(n) < sizeof(line) ? n : sizeof(line) - 1);
        (void)ignored;
      }
      close(fd);
    }
  }
  return true;
}

}  // namespace

extern "C" {

__attribute__((visibility("default"))) int rename(const char* from, const char* to) {
  if (Fail(kRename, from, to)) {
    errno = g_settings.error;
    return -1;
  }
  return Next<int (*)(const char*, const char*)>("rename")(from, to);
}

__attribute__((visibility("default"))) ssize_t write(int fd, const void* buf, size_t n) {
  if (g_settings.call == kWrite) {
    char link[64];
    char path[PATH_MAX] = "";
    snprintf(link, sizeof(link), "/proc/self/fd/%d", fd);
    ssize_t len = readlink(link, path, sizeof(path) - 1);
    if (len > 0) path[len] = '\0';
    if (Fail(kWrite, path)) {
      errno = g_settings.error;
      return -1;
    }
  }
  return Next<ssize_t (*)(int, const void*, size_t)>("write")(fd, buf, n);
}

static int OpenWith(const char* name, const char* path, int flags, va_list args) {
  mode_t mode = 0;
  if ((flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE) {
    mode = static_cast<mode_t>(va_arg(args, int));
  }
  if (Fail(kOpen, path)) {
    errno = g_settings.error;
    return -1;
  }
  return Next<int (*)(const char*, int, ...)>(name)(path, flags, mode);
}

__attribute__((visibility("default"))) int open(const char* path, int flags, ...) {
  va_list args;
  va_start(args, flags);
  int fd = OpenWith("open", path, flags, args);
  va_end(args);
  return fd;
}

__attribute__((visibility("default"))) int open64(const char* path, int flags, ...) {
  va_list args;
  va_start(args, flags);
  int fd = OpenWith("open64", path, flags, args);
  va_end(args);
  return fd;
}

static FILE* FopenWith(const char* name, const char* path, const char* mode) {
  if (Fail(kFopen, path)) {
    errno = g_settings.error;
    return nullptr;
  }
  return Next<FILE* (*)(const char*, const char*)>(name)(path, mode);
}

__attribute__((visibility("default"))) FILE* fopen(const char* path, const char* mode) {
  return FopenWith("fopen", path, mode);
}

__attribute__((visibility("default"))) FILE* fopen64(const char* path, const char* mode) {
  return FopenWith("fopen64", path, mode);
}

__attribute__((visibility("default"))) int posix_spawn(
    pid_t* pid, const char* path, const posix_spawn_file_actions_t* actions,
    const posix_spawnattr_t* attr, char* const argv[], char* const envp[]) {
  if (Fail(kSpawn, path)) return g_settings.error;
  return Next<int (*)(pid_t*, const char*, const posix_spawn_file_actions_t*,
                      const posix_spawnattr_t*, char* const[], char* const[])>(
      "posix_spawn")(pid, path, actions, attr, argv, envp);
}

__attribute__((visibility("default"))) int chown(const char* path, uid_t uid, gid_t gid) {
  if (Fail(kChown, path)) {
    errno = g_settings.error;
    return -1;
  }
  return Next<int (*)(const char*, uid_t, gid_t)>("chown")(path, uid, gid);
}

}  // extern "C"
