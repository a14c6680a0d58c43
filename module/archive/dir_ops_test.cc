#include "module/archive/dir_ops.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "module/archive/archive_testing.h"
#include "test_support.h"

namespace {

using ZEPH::test::Exists;
using ZEPH::test::HasUtilsLine;
using ZEPH::test::MakeDirs;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::WriteFile;

// What a CopyCertFile run in a child process did.
struct LimitedCopy {
  int result = -1;  // 1 true, 0 false, -1 the child did not get to call
  std::string log;  // its log lines
};

// CopyCertFile run in a child process whose files may grow to `limit`
// bytes at most, like a disk with that much room left: cp, started from
// it, inherits the limit and gets a short write (EFBIG; SIGXFSZ is ignored
// so that cp is not killed by it). The child logs into a pipe, which the
// limit does not apply to.
LimitedCopy CopyWithFileSizeLimit(const std::string& src_dir,
                                  const std::string& dst_dir,
                                  const std::string& name, rlim_t limit) {
  LimitedCopy copy;
  int log[2];
  if (pipe(log) != 0) return copy;
  const pid_t pid = fork();
  if (pid == 0) {
    close(log[0]);
    const std::string sink = "/dev/fd/" + std::to_string(log[1]);
    const struct rlimit size = {limit, limit};
    if (setenv("ZEPH_LOG_FILE", sink.c_str(), 1) != 0 ||
        signal(SIGXFSZ, SIG_IGN) == SIG_ERR ||
        setrlimit(RLIMIT_FSIZE, &size) != 0) {
      _exit(2);
    }
    _exit(CopyCertFile(src_dir, dst_dir, name, getuid(), getgid()) ? 1 : 0);
  }
  close(log[1]);
  char buf[4096];
  ssize_t n;
  while (pid > 0 && (n = read(log[0], buf, sizeof(buf))) > 0) {
    copy.log.append(buf, static_cast<size_t>(n));
  }
  close(log[0]);
  int status = 0;
  if (pid > 0 && waitpid(pid, &status, 0) == pid && WIFEXITED(status) &&
      WEXITSTATUS(status) <= 1) {
    copy.result = WEXITSTATUS(status);
  }
  return copy;
}

class DirOpsTest : public ::testing::Test {
 protected:
  std::string P(const std::string& rel) const { return root_.Path("/" + rel); }
  bool Logged(const std::string& message) const {
    return HasUtilsLine(root_.Log(), message);
  }
  ZEPH::test::TempRoot root_;
};

TEST_F(DirOpsTest, RemoveAndCleanDirectories) {
  MakeDirs(P("tree/a/b"));
  WriteFile(P("tree/a/b/key.pem"), "k", 0400);
  chmod(P("tree/a/b").c_str(), 0500);
  ASSERT_TRUE(RemoveDir(P("tree")));
  EXPECT_FALSE(Exists(P("tree")));
  EXPECT_FALSE(RemoveDir(P("tree")));
  EXPECT_TRUE(Logged(P("tree") + " is not a valid directory"));

  MakeDirs(P("work/old"));
  WriteFile(P("work/old/cert.pem"), "c");
  ASSERT_TRUE(CleanDir(P("work"), 0700));
  EXPECT_FALSE(Exists(P("work/old")));
  EXPECT_EQ(ModeOf(P("work")), 0700u);
  ASSERT_TRUE(CleanDir(P("new/parents/staging"), 0755));
  EXPECT_EQ(ModeOf(P("new/parents/staging")), 0755u);

  // A plain file is neither removed nor cleaned.
  WriteFile(P("plain"), "keep me");
  EXPECT_FALSE(RemoveDir(P("plain")));
  EXPECT_FALSE(CleanDir(P("plain"), 0755));
  EXPECT_TRUE(Logged("Failed to create " + P("plain")));
  EXPECT_EQ(ReadFile(P("plain")), "keep me");
}

TEST_F(DirOpsTest, MoveDirReplacesTheTarget) {
  MakeDirs(P("same"));
  EXPECT_TRUE(MoveDir(P("same"), P("same")));
  EXPECT_TRUE(
      Logged("skip move directory, due to source equals to destination [" +
             P("same") + "]"));
  EXPECT_FALSE(
      MoveDir(P("gone"), P("gone")));  // the directory test comes first
  EXPECT_TRUE(Logged(P("gone") + " is not a valid directory"));
  root_.ClearLog();

  MakeDirs(P("src"));
  WriteFile(P("src/cert.pem"), "new");
  ASSERT_TRUE(MoveDir(P("src"), P("dst")));  // no target yet: no backup
  EXPECT_EQ(ReadFile(P("dst/cert.pem")), "new");

  MakeDirs(P("src2"));
  WriteFile(P("src2/cert.pem"), "newer");
  WriteFile(P("dst/old.pem"), "old");
  MakeDirs(P("dst.bak/stale"));  // a stale backup is cleared first
  ASSERT_TRUE(MoveDir(P("src2"), P("dst")));
  EXPECT_EQ(ReadFile(P("dst/cert.pem")), "newer");
  for (const char* gone : {"src", "src2", "dst.bak", "dst/old.pem"}) {
    EXPECT_FALSE(Exists(P(gone))) << gone;
  }
  EXPECT_EQ(root_.Log(), "");
}

TEST_F(DirOpsTest, FailedRenameRestoresTheBackup) {
  MakeDirs(P("outer/target"));
  WriteFile(P("outer/cert.pem"), "staged");
  WriteFile(P("outer/target/cert.pem"), "deployed", 0400);
  const timespec old_times[2] = {{1000000000, 0}, {1000000000, 0}};
  utimensat(AT_FDCWD, P("outer/target/cert.pem").c_str(), old_times, 0);

  // A directory cannot be renamed into itself (EINVAL), whoever asks.
  EXPECT_FALSE(MoveDir(P("outer"), P("outer/target")));
  EXPECT_TRUE(Logged("Failed to move " + P("outer") + " to " +
                     P("outer/target") + " ["));
  // Back from the backup, with mode and times (cp -arp).
  struct stat st;
  ASSERT_EQ(stat(P("outer/target/cert.pem").c_str(), &st), 0);
  EXPECT_EQ(ReadFile(P("outer/target/cert.pem")), "deployed");
  EXPECT_EQ(st.st_mode & 07777, 0400u);
  EXPECT_EQ(st.st_mtim.tv_sec, 1000000000);
  EXPECT_FALSE(Exists(P("outer/target.bak")));
  EXPECT_EQ(ReadFile(P("outer/cert.pem")), "staged");  // src stays

  // The target's parent is missing: rename fails, and so does the restore.
  const std::string dst = P("no/parent/dst");
  EXPECT_FALSE(MoveDir(P("outer"), dst));
  EXPECT_TRUE(Logged("Failed to move " + P("outer") + " to " + dst + " ["));
  EXPECT_TRUE(Logged("Failed to move " + dst + ".bak to " + dst + " ["));
}

// Trees that rm or cp cannot handle, built from unwritable or unreadable
// directories and run through MoveDir in an unprivileged child (see
// RunUnprivileged: root would pass every permission check).
class UnprivilegedMoveTest : public DirOpsTest {
 protected:
  void SetUp() override {
    ASSERT_EQ(chmod(root_.dir().c_str(), 0755), 0);
    WriteFile(root_.dir() + "/test.log", "", 0666);
    MakeDirs(P("work/src"));
    WriteFile(P("work/src/cert.pem"), "staged");
    MakeDirs(P("work/dst"));
    WriteFile(P("work/dst/cert.pem"), "current");
    ZEPH::test::Run({"/bin/chown", "-R",
                     std::to_string(ZEPH::test::UnprivilegedUid()) + ":" +
                         std::to_string(ZEPH::test::UnprivilegedGid()),
                     P("work")});
  }
  // MoveDir's result in the child after `prepare`; -1 if the child failed.
  int Move(void (*prepare)(const std::string& work)) {
    const std::string work = P("work");
    const int status = ZEPH::test::RunUnprivileged([&]() {
      prepare(work);
      return MoveDir(work + "/src", work + "/dst") ? 0 : 1;
    });
    return status == 0 ? 1 : status == 1 ? 0 : -1;
  }
};

TEST_F(UnprivilegedMoveTest, StaleBackupThatCannotBeRemovedReplacesTarget) {
  EXPECT_EQ(Move([](const std::string& work) {
              MakeDirs(work + "/dst.bak");
              WriteFile(work + "/dst.bak/cert.pem", "backup");
              chmod((work + "/dst.bak").c_str(), 0555);
            }),
            0);
  EXPECT_TRUE(Logged("Failed to remove " + P("work/dst.bak") + " ["));
  // Taken for the only good copy, the stale backup is now the target.
  EXPECT_EQ(ReadFile(P("work/dst/cert.pem")), "backup");
  EXPECT_FALSE(Exists(P("work/dst.bak")));
  EXPECT_EQ(ReadFile(P("work/src/cert.pem")), "staged");
}

TEST_F(UnprivilegedMoveTest, TargetThatCannotBeBackedUpIsLeftAlone) {
  EXPECT_EQ(Move([](const std::string& work) {
              WriteFile(work + "/dst/privkey.pem", "key", 0000);
            }),
            0);
  EXPECT_TRUE(Logged("Failed to copy " + P("work/dst") + " to " +
                     P("work/dst.bak") + " ["));
  // The part of the backup that was copied goes too.
  EXPECT_FALSE(Exists(P("work/dst.bak")));
  EXPECT_EQ(ReadFile(P("work/dst/cert.pem")), "current");
  EXPECT_TRUE(Exists(P("work/dst/privkey.pem")));
  EXPECT_EQ(ReadFile(P("work/src/cert.pem")), "staged");
}

TEST_F(UnprivilegedMoveTest, TargetThatCannotBeRemovedLeavesTheBackup) {
  EXPECT_EQ(Move([](const std::string& work) {
              MakeDirs(work + "/dst/locked");
              WriteFile(work + "/dst/locked/chain.pem", "chain");
              chmod((work + "/dst/locked").c_str(), 0555);
            }),
            0);
  // rm fails on the target and again in the restore step: the backup is all
  // that is left of the old contents.
  EXPECT_TRUE(Logged("Failed to remove " + P("work/dst") + " ["));
  EXPECT_EQ(ReadFile(P("work/dst.bak/cert.pem")), "current");
  EXPECT_EQ(ReadFile(P("work/dst.bak/locked/chain.pem")), "chain");
  EXPECT_EQ(ReadFile(P("work/src/cert.pem")), "staged");
}

TEST_F(DirOpsTest, CopyCertFileRestrictsAndHandsOverTheCopy) {
  MakeDirs(P("src"));
  MakeDirs(P("dst"));
  const uid_t uid = ZEPH::test::UnprivilegedUid();
  const gid_t gid = ZEPH::test::UnprivilegedGid();
  for (const char* content : {"certificate", "renewed"}) {  // 2nd: replaces
    WriteFile(P("src/cert.pem"), content, 0644);
    ASSERT_TRUE(CopyCertFile(P("src"), P("dst"), "cert.pem", uid, gid));
    struct stat st;
    ASSERT_EQ(stat(P("dst/cert.pem").c_str(), &st), 0);
    EXPECT_EQ(ReadFile(P("dst/cert.pem")), content);
    EXPECT_EQ(st.st_mode & 07777, 0400u);
    EXPECT_EQ(st.st_uid, uid);
    EXPECT_EQ(st.st_gid, gid);
  }
  // cp fails by itself on a missing file; the missing copy is reported.
  EXPECT_FALSE(CopyCertFile(P("src"), P("dst"), "chain.pem", uid, gid));
  EXPECT_TRUE(Logged("Failed to chmod chown. [" + P("dst/chain.pem") + "]"));
}

// A copy that cp cuts short, as on a full disk, is no copy: nothing stays
// behind in its place and the result is false. A copy that just fits is
// kept.
TEST_F(DirOpsTest, CopyCertFileRemovesACopyCutShort) {
  MakeDirs(P("src"));
  MakeDirs(P("dst"));
  std::string pem = "-----BEGIN CERTIFICATE-----\n";
  while (pem.size() < 10000) pem += std::string(64, 'A') + "\n";
  pem += "-----END CERTIFICATE-----\n";
  WriteFile(P("src/fullchain.pem"), pem, 0400);
  const std::string failed = "Failed to copy [" + P("src/fullchain.pem") + "].";

  for (rlim_t room : {rlim_t{0}, rlim_t{4096}}) {  // empty, cut short
    SCOPED_TRACE("room for " + std::to_string(room) + " bytes");
    const LimitedCopy copy =
        CopyWithFileSizeLimit(P("src"), P("dst"), "fullchain.pem", room);
    EXPECT_EQ(copy.result, 0);
    EXPECT_FALSE(Exists(P("dst/fullchain.pem")))
        << ReadFile(P("dst/fullchain.pem")).size() << " bytes left";
    EXPECT_TRUE(HasUtilsLine(copy.log, failed)) << copy.log;
    // The plain line: no platform error, which says nothing about cp.
    EXPECT_NE(copy.log.find(failed + "\n"), std::string::npos) << copy.log;
    EXPECT_EQ(copy.log.find("Failed to chmod chown."), std::string::npos)
        << copy.log;
  }

  // cp may still complain here (it looks for more past the limit), but the
  // copy is whole and stays.
  const LimitedCopy fits =
      CopyWithFileSizeLimit(P("src"), P("dst"), "fullchain.pem", pem.size());
  EXPECT_EQ(fits.result, 1) << fits.log;
  EXPECT_EQ(ReadFile(P("dst/fullchain.pem")), pem);
  EXPECT_EQ(ModeOf(P("dst/fullchain.pem")), 0400u);
  EXPECT_EQ(fits.log, "");
}

}  // namespace
