// The directory operations a renewal and a working directory rely on.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "test_support.h"
#include "tools/zeph_letsencrypt/files.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

using test::Exists;
using test::ReadFile;
using test::TempRoot;
using test::WriteFile;

TEST(ExchangeDirs, SwapsWholeDirectoriesOrLeavesBothAlone) {
  TempRoot root;
  const std::string target = root.Path("/set");
  const std::string staging = root.Path("/.set.renew");
  ASSERT_TRUE(MakeDir(target, 0700));
  ASSERT_TRUE(MakeDir(staging, 0700));
  WriteFile(target + "/cert.pem", "old", 0400);
  WriteFile(target + "/only-old", "x", 0400);
  WriteFile(staging + "/cert.pem", "new", 0400);

  ASSERT_TRUE(ExchangeDirs(staging, target));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "new");
  EXPECT_FALSE(Exists(target + "/only-old"));
  EXPECT_EQ(ReadFile(staging + "/cert.pem"), "old");

  // Nothing to put in place: the set stays.
  ASSERT_TRUE(RemoveTree(staging));
  EXPECT_FALSE(ExchangeDirs(staging, target));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "new");
}

TEST(RemoveTree, RemovesLinksWithoutFollowingThem) {
  TempRoot root;
  const std::string shared = root.Path("/accounts");
  const std::string work = root.Path("/work");
  ASSERT_TRUE(MakeDir(shared, 0700));
  WriteFile(shared + "/account.json", "{}", 0600);
  ASSERT_TRUE(MakeDir(work, 0700));
  ASSERT_TRUE(MakeDir(work + "/certificates", 0700));
  WriteFile(work + "/certificates/a.key", "k", 0400);
  ASSERT_EQ(symlink(shared.c_str(), (work + "/accounts").c_str()), 0);

  EXPECT_TRUE(RemoveTree(work));
  EXPECT_FALSE(Exists(work));
  EXPECT_EQ(ReadFile(shared + "/account.json"), "{}");
  EXPECT_TRUE(RemoveTree(work));  // nothing there is fine

  // MakeDir does not take a file for a directory.
  WriteFile(root.Path("/file"), "", 0600);
  EXPECT_FALSE(MakeDir(root.Path("/file"), 0700));
  EXPECT_TRUE(MakeDir(shared, 0700));
}

TEST(WriteWhole, ReplacesTheFileWithTheGivenMode) {
  TempRoot root;
  const std::string path = root.Path("/renew.json");
  WriteFile(path, "old content", 0400);
  ASSERT_TRUE(WriteWhole(path, "new", 0600));
  EXPECT_EQ(ReadFile(path), "new");
  EXPECT_EQ(test::ModeOf(path), 0600u);
  EXPECT_FALSE(WriteWhole(root.Path("/missing/dir/file"), "x", 0600));
}

}  // namespace
}  // namespace letsencrypt
}  // namespace ZEPH
