#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <thread>

#include "test_support.h"
#include "zeph/qlibc_error.h"
#include "zeph/qlibc_lock.h"

namespace {

using ZEPH::test::TempRoot;

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

// A child process that holds a lock in `mode` until killed. Returns once
// the lock is held.
class LockHolder {
 public:
  LockHolder(const std::string& path, int mode) {
    int ready[2];
    if (pipe(ready) != 0) return;
    pid_ = fork();
    if (pid_ == 0) {
      int fd = -1;
      char ok = QLIBCFileLockTimeByFile(path.c_str(), mode, 5, &fd) ? '1' : '0';
      ssize_t ignored = write(ready[1], &ok, 1);
      (void)ignored;
      pause();
      _exit(0);
    }
    close(ready[1]);
    char ok = '0';
    held_ = read(ready[0], &ok, 1) == 1 && ok == '1';
    close(ready[0]);
  }
  ~LockHolder() { Release(); }
  void Release() {
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
      pid_ = -1;
    }
  }
  bool held() const { return held_; }

 private:
  pid_t pid_ = -1;
  bool held_ = false;
};

TEST(FileLock, ExclusiveAndSharedAcrossProcesses) {
  TempRoot root;
  const std::string path = root.Path("/tmp/test.lock");

  {
    LockHolder writer(path, QLIBC_LOCK_EXCLUSIVE);
    ASSERT_TRUE(writer.held());
    // Neither a reader nor a writer gets in while a writer holds it, and
    // each waits about as long as it was told to before giving up.
    for (int mode : {QLIBC_LOCK_SHARED, QLIBC_LOCK_EXCLUSIVE}) {
      int fd = -7;
      QLIBCErrClear();
      double start = Now();
      EXPECT_EQ(QLIBCFileLockTimeByFile(path.c_str(), mode, 1, &fd), 0);
      EXPECT_GE(Now() - start, 0.9);
      EXPECT_EQ(fd, -7);
      EXPECT_EQ(QLIBCErrGet(), QLIBC_ERR_TIMEOUT);
    }
  }

  {
    LockHolder reader(path, QLIBC_LOCK_SHARED);
    ASSERT_TRUE(reader.held());
    int fd = -1;
    // Readers share...
    ASSERT_NE(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_SHARED, 1, &fd), 0);
    EXPECT_GE(fd, 0);
    EXPECT_NE(QLIBCFileUnlockByFile(fd), 0);
    // ...a writer waits for them.
    EXPECT_EQ(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 0, &fd), 0);
  }
}

TEST(FileLock, WaiterGetsTheLockWhenTheHolderDies) {
  TempRoot root;
  const std::string path = root.Path("/tmp/test.lock");
  LockHolder writer(path, QLIBC_LOCK_EXCLUSIVE);
  ASSERT_TRUE(writer.held());
  // The holder is killed while we wait: its lock goes with it.
  std::thread killer([&] {
    usleep(300 * 1000);
    writer.Release();
  });
  int fd = -1;
  EXPECT_NE(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 10, &fd), 0);
  killer.join();
  EXPECT_NE(QLIBCFileUnlockByFile(fd), 0);
}

TEST(FileLock, ThreadsOfOneProcessExcludeEachOther) {
  TempRoot root;
  const std::string path = root.Path("/tmp/test.lock");
  int first = -1, second = -1;
  ASSERT_NE(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 0, &first), 0);
  EXPECT_EQ(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 0, &second), 0);
  EXPECT_NE(QLIBCFileUnlockByFile(first), 0);
  ASSERT_NE(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 0, &second), 0);
  EXPECT_NE(QLIBCFileUnlockByFile(second), 0);
}

TEST(FileLock, RejectsBadArguments) {
  TempRoot root;
  int fd = -1;
  EXPECT_EQ(QLIBCFileLockTimeByFile(nullptr, 1, 1, &fd), 0);
  EXPECT_EQ(QLIBCFileLockTimeByFile(root.Path("/tmp/x.lock").c_str(), 2, 1, &fd), 0);
  EXPECT_EQ(QLIBCFileLockTimeByFile(root.Path("/tmp/x.lock").c_str(), 1, 1, nullptr), 0);
  // The lock file's directory is not made on the caller's behalf.
  EXPECT_EQ(QLIBCFileLockTimeByFile(root.Path("/missing/x.lock").c_str(), 1, 0, &fd), 0);
  EXPECT_EQ(QLIBCErrGet(), QLIBC_ERR_NOT_FOUND);
  EXPECT_EQ(QLIBCFileUnlockByFile(-1), 0);
}

}  // namespace
