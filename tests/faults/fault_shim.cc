// A preloaded library that fails the ZEPH_FAULT_AT-th call (1 = the first) of ZEPH_FAULT_CALL
// (rename, write, open(64), fopen(64), posix_spawn or chown) on a path containing
// ZEPH_FAULT_MATCH with EIO (write: ENOSPC), then makes the file ZEPH_FAULT_REPORT. A write's
// path is its descriptor's, posix_spawn's the program, rename's either name. The settings leave
// the environment with LD_PRELOAD, so the programs the process starts run without the shim.
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

const char* g_call = "";
long g_at = 0;
const char* g_match = "";
const char* g_report = "";
std::atomic<long> g_seen{0};

void Load() __attribute__((constructor));
void Load() {
  auto env = [](const char* name) { return getenv(name) != nullptr ? getenv(name) : ""; };
  g_call = strdup(env("ZEPH_FAULT_CALL"));
  g_at = atol(env("ZEPH_FAULT_AT"));
  g_match = strdup(env("ZEPH_FAULT_MATCH"));
  g_report = strdup(env("ZEPH_FAULT_REPORT"));
  for (const char* name : {"LD_PRELOAD", "ZEPH_FAULT_CALL", "ZEPH_FAULT_AT", "ZEPH_FAULT_MATCH",
                           "ZEPH_FAULT_REPORT"}) {
    unsetenv(name);
  }
}

template <typename F>
F Next(const char* name) {
  return reinterpret_cast<F>(dlsym(RTLD_NEXT, name));
}

bool Matches(const char* path) {
  return g_match[0] == '\0' || (path != nullptr && strstr(path, g_match) != nullptr);
}
// Whether this call (of kind `call`, on `path` or `other`) is the one to
// fail; sets errno when it is.
bool Fail(const char* call, const char* path, const char* other = nullptr) {
  if (strcmp(g_call, call) != 0 || !(Matches(path) || Matches(other))) return false;
  if (g_seen.fetch_add(1) + 1 != g_at) return false;
  const int fd = Next<int (*)(const char*, int, ...)>("open")(
      g_report, O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
  if (fd >= 0) close(fd);
  errno = strcmp(call, "write") == 0 ? ENOSPC : EIO;
  return true;
}

int OpenWith(const char* name, const char* path, int flags, va_list args) {
  const mode_t mode = (flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE
                          ? static_cast<mode_t>(va_arg(args, int)) : 0;
  if (Fail("open", path)) return -1;
  return Next<int (*)(const char*, int, ...)>(name)(path, flags, mode);
}

FILE* FopenWith(const char* name, const char* path, const char* mode) {
  if (Fail("fopen", path)) return nullptr;
  return Next<FILE* (*)(const char*, const char*)>(name)(path, mode);
}

}  // namespace

extern "C" {

__attribute__((visibility("default"))) int rename(const char* from, const char* to) {
  if (Fail("rename", from, to)) return -1;
  return Next<int (*)(const char*, const char*)>("rename")(from, to);
}

__attribute__((visibility("default"))) ssize_t write(int fd, const void* buf, size_t n) {
  if (strcmp(g_call, "write") == 0) {
    char link[64], path[PATH_MAX] = "";
    snprintf(link, sizeof(link), "/proc/self/fd/%d", fd);
    const ssize_t len = readlink(link, path, sizeof(path) - 1);
    if (len > 0) path[len] = '\0';
    if (Fail("write", path)) return -1;
  }
  return Next<ssize_t (*)(int, const void*, size_t)>("write")(fd, buf, n);
}

__attribute__((visibility("default"))) int open(const char* path, int flags, ...) {
  va_list args;
  va_start(args, flags);
  const int fd = OpenWith("open", path, flags, args);
  va_end(args);
  return fd;
}

__attribute__((visibility("default"))) int open64(const char* path, int flags, ...) {
  va_list args;
  va_start(args, flags);
  const int fd = OpenWith("open64", path, flags, args);
  va_end(args);
  return fd;
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
  if (Fail("posix_spawn", path)) return EIO;
  return Next<int (*)(pid_t*, const char*, const posix_spawn_file_actions_t*,
                      const posix_spawnattr_t*, char* const[], char* const[])>(
      "posix_spawn")(pid, path, actions, attr, argv, envp);
}

__attribute__((visibility("default"))) int chown(const char* path, uid_t uid, gid_t gid) {
  if (Fail("chown", path)) return -1;
  return Next<int (*)(const char*, uid_t, gid_t)>("chown")(path, uid, gid);
}

}  // extern "C"
