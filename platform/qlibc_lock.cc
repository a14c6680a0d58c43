#include "zeph/qlibc_lock.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/file.h>
#include <time.h>
#include <unistd.h>

#include "zeph/qlibc_error.h"
#include "zeph/unique_fd.h"

namespace {

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

void SleepMillis(long ms) {
  timespec ts{ms / 1000, (ms % 1000) * 1000000L};
  while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
  }
}

}  // namespace

extern "C" {

int QLIBCFileLockTimeByFile(const char* path, int mode, int seconds, int* fd) {
  if (path == nullptr || *path == '\0' || fd == nullptr || seconds < 0 ||
      (mode != QLIBC_LOCK_SHARED && mode != QLIBC_LOCK_EXCLUSIVE)) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return 0;
  }
  ZEPH::UniqueFd lock(open(path, O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  if (!lock) lock.reset(open(path, O_RDONLY | O_CLOEXEC));
  if (!lock) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return 0;
  }
  const int op = (mode == QLIBC_LOCK_EXCLUSIVE ? LOCK_EX : LOCK_SH) | LOCK_NB;
  const double deadline = Now() + seconds;
  // flock has no time-out of its own, and a SIGALRM-based wait would touch
  // process-wide signal state; poll instead, backing off from 1 ms to 50 ms
  // so that a short hold costs little and a long one costs no CPU.
  long backoff_ms = 1;
  for (;;) {
    if (flock(lock.get(), op) == 0) {
      *fd = lock.release();
      return 1;
    }
    if (errno != EWOULDBLOCK && errno != EINTR) {
      QLIBC_SET_ERROR(QLIBC_ERR_LOCK);
      return 0;
    }
    double left = deadline - Now();
    if (left <= 0) {
      QLIBC_SET_ERROR(QLIBC_ERR_TIMEOUT);
      return 0;
    }
    long wait_ms = backoff_ms;
    if (wait_ms > static_cast<long>(left * 1000) + 1) {
      wait_ms = static_cast<long>(left * 1000) + 1;
    }
    SleepMillis(wait_ms);
    if (backoff_ms < 50) backoff_ms *= 2;
  }
}

int QLIBCFileUnlockByFile(int fd) {
  if (fd < 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return 0;
  }
  int unlocked = flock(fd, LOCK_UN);
  int err = errno;
  int closed = close(fd);
  if (unlocked != 0 || closed != 0) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(unlocked != 0 ? err : errno));
    return 0;
  }
  return 1;
}

}  // extern "C"
