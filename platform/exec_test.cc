#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

#include "test_support.h"
#include "zeph/qlibc_error.h"
#include "zeph/qlibc_exec.h"

namespace {

using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;

std::string ReadStream(FILE* f) {
  std::string out;
  char buf[256];
  size_t n;
  while ((n = fread(buf, 1, sizeof(buf), f)) > 0) out.append(buf, n);
  return out;
}

TEST(Exec, ReportsExitStatusAndStartFailure) {
  EXPECT_EQ(QLIBCExec("/bin/true", nullptr, nullptr, nullptr, nullptr), 0);
  EXPECT_EQ(QLIBCExec("/bin/false", nullptr, nullptr, nullptr, nullptr), 1);
  EXPECT_EQ(QLIBCExec("/bin/sh", "-c", "exit 7", nullptr, nullptr), 7);
  EXPECT_EQ(QLIBCExec("/bin/sh", "-c", "kill -TERM $$", nullptr, nullptr),
            128 + 15);

  QLIBCErrClear();
  EXPECT_LT(QLIBCExec("/nonexistent/tool", nullptr, nullptr, nullptr, nullptr), 0);
  EXPECT_EQ(QLIBCErrGet(), QLIBC_ERR_EXEC);
  EXPECT_STREQ(QLIBCErrorGetFile(), "qlibc_exec.cc");
  EXPECT_GT(QLIBCErrorGetLine(), 0);
  EXPECT_LT(QLIBCExecl(nullptr, QLIBC_EXEC_WAIT, "x", nullptr), 0);
}

TEST(Exec, PassesArgumentsWithoutAShell) {
  TempRoot root;
  const std::string out = root.Path("/args");
  // Every argument reaches the program as one word, metacharacters and all.
  const char* tricky = "a b;$(touch pwned)'\"*";
  ASSERT_EQ(QLIBCExec("/bin/sh", "-c", "printf '%s|' \"$@\" > \"$0\"",
                      out.c_str(), tricky),
            0);
  EXPECT_EQ(ReadFile(out), std::string(tricky) + "|");
  EXPECT_FALSE(ZEPH::test::Exists("pwned"));

  // QLIBCExec stops at the first null argument.
  ASSERT_EQ(QLIBCExec("/bin/sh", "-c", "echo $# > \"$0\"", out.c_str(), nullptr), 0);
  EXPECT_EQ(ReadFile(out), "0\n");

  // The list form: everything after the option word is argv[1]...
  ASSERT_EQ(QLIBCExecl("/bin/sh", 0xBB, "-c", "printf '%s,' \"$0\" \"$@\" > x",
                       "one", "two words", nullptr),
            0);
  EXPECT_EQ(ReadFile("x"), "one,two words,");
  unlink("x");

  // ...and the vector form takes argv[0] from the vector's first entry.
  std::string script = "printf '%s' \"$1\" > \"$0\"";
  char* argv[] = {const_cast<char*>("/bin/sh"), const_cast<char*>("-c"),
                  &script[0], const_cast<char*>(out.c_str()),
                  const_cast<char*>("vec"), nullptr};
  ASSERT_EQ(QLIBCExecv(argv[0], argv, 1), 0);
  EXPECT_EQ(ReadFile(out), "vec");
}

// Writes "null" or "other" into $0: what the shell's standard output is.
const char kIsStdoutNull[] =
    "if [ /dev/null -ef /proc/$$/fd/1 ]; then r=null; else r=other; fi;"
    " echo $r > \"$0\"";

TEST(Exec, ListFormOptionWordSetsUpStandardDescriptors) {
  TempRoot root;
  const std::string out = root.Path("/fd1");
  // 0xBB sends the child's standard output to /dev/null; 0x1BB as well.
  for (int options : {0xBB, 0x1BB}) {
    ASSERT_EQ(QLIBCExecl("/bin/sh", options, "-c",
                         kIsStdoutNull, out.c_str(), nullptr),
              0);
    EXPECT_EQ(ReadFile(out), "null\n") << options;
  }
  // Plain waiting keeps the caller's standard output.
  ASSERT_EQ(QLIBCExecl("/bin/sh", QLIBC_EXEC_WAIT, "-c", kIsStdoutNull,
                       out.c_str(), nullptr),
            0);
  EXPECT_EQ(ReadFile(out), "other\n");
}

TEST(Exec, ChildInheritsNoDescriptors) {
  // A descriptor opened without O_CLOEXEC must still not reach the child.
  int leaky = fcntl(0, F_DUPFD, 100);
  ASSERT_GE(leaky, 100);
  FILE* f = QLIBCPopen("/bin/ls", "r", "/proc/self/fd", nullptr);
  ASSERT_NE(f, nullptr);
  std::string listing = ReadStream(f);
  EXPECT_EQ(QLIBCPclose(f), 0);
  close(leaky);
  // 0, 1, 2 and the descriptor ls reads the directory with.
  EXPECT_EQ(listing, "0\n1\n2\n3\n");
}

TEST(Popen, StreamsOutputAndReportsStatus) {
  FILE* f = QLIBCPopen("/bin/echo", "r", "{\"error\": 0}", nullptr);
  ASSERT_NE(f, nullptr);
  EXPECT_EQ(ReadStream(f), "{\"error\": 0}\n");
  EXPECT_EQ(QLIBCPclose(f), 0);

  f = QLIBCPopen("/bin/sh", "r", "-c", "echo partial; exit 3", nullptr);
  ASSERT_NE(f, nullptr);
  EXPECT_EQ(ReadStream(f), "partial\n");
  EXPECT_EQ(QLIBCPclose(f), -1);

  EXPECT_EQ(QLIBCPopen("/nonexistent/tool", "r", "x", nullptr), nullptr);
  EXPECT_EQ(QLIBCPopen("/bin/echo", "w", "x", nullptr), nullptr);
  EXPECT_EQ(QLIBCPclose(nullptr), -1);
}

}  // namespace
