#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "test_support.h"
#include "zeph/qlibc_file.h"
#include "zeph/unique_fd.h"

namespace {

using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;

TEST(FileTests, ExistAndDirectory) {
  TempRoot root;
  const std::string file = root.Path("/f");
  WriteFile(file, "x");
  ASSERT_EQ(symlink("/nonexistent", root.Path("/dangling").c_str()), 0);
  ASSERT_EQ(symlink(root.dir().c_str(), root.Path("/dirlink").c_str()), 0);

  EXPECT_TRUE(QLIBCFileExist(file.c_str()));
  EXPECT_TRUE(QLIBCFileExist(root.dir().c_str()));
  EXPECT_FALSE(QLIBCFileExist(root.Path("/missing").c_str()));
  EXPECT_FALSE(QLIBCFileExist(root.Path("/dangling").c_str()));
  EXPECT_FALSE(QLIBCFileExist(nullptr));

  EXPECT_TRUE(QLIBCFileCheckDir(root.dir().c_str()));
  EXPECT_TRUE(QLIBCFileCheckDir(root.Path("/dirlink").c_str()));
  EXPECT_FALSE(QLIBCFileCheckDir(file.c_str()));
  EXPECT_FALSE(QLIBCFileCheckDir(root.Path("/missing").c_str()));
}

TEST(BomStrip, RemovesOnlyALeadingMarkInPlace) {
  TempRoot root;
  const std::string path = root.Path("/pem");
  WriteFile(path, "\xEF\xBB\xBF-----BEGIN X-----\n\xEF\xBB\xBF", 0640);
  struct stat before;
  ASSERT_EQ(stat(path.c_str(), &before), 0);

  EXPECT_EQ(QLIBCFileUTF8BomStrip(path.c_str()), 0);
  EXPECT_EQ(ReadFile(path), "-----BEGIN X-----\n\xEF\xBB\xBF");
  struct stat after;
  ASSERT_EQ(stat(path.c_str(), &after), 0);
  EXPECT_EQ(before.st_ino, after.st_ino);
  EXPECT_EQ(after.st_mode & 0777, 0640u);

  // No mark, a short file, an empty file: untouched and successful.
  for (const std::string content : {"-----BEGIN X-----\n", "\xEF\xBB", ""}) {
    WriteFile(path, content);
    EXPECT_EQ(QLIBCFileUTF8BomStrip(path.c_str()), 0);
    EXPECT_EQ(ReadFile(path), content);
  }
  // Only the mark: an empty file remains.
  WriteFile(path, "\xEF\xBB\xBF");
  EXPECT_EQ(QLIBCFileUTF8BomStrip(path.c_str()), 0);
  EXPECT_EQ(ReadFile(path), "");

  EXPECT_EQ(QLIBCFileUTF8BomStrip(root.Path("/missing").c_str()), -1);
  EXPECT_EQ(QLIBCFileUTF8BomStrip(nullptr), -1);
}

TEST(Fgets, ReadsOneLineWithinTheBuffer) {
  TempRoot root;
  const std::string path = root.Path("/DEFAULT");
  WriteFile(path, "Ab3xYz\nsecond\n");
  ZEPH::UniqueFile f(fopen(path.c_str(), "re"));
  ASSERT_TRUE(f);
  char buf[16];
  ASSERT_NE(QLIBCFgets(buf, sizeof(buf), f.get()), nullptr);
  EXPECT_STREQ(buf, "Ab3xYz\n");
  ASSERT_NE(QLIBCFgets(buf, 4, f.get()), nullptr);
  EXPECT_STREQ(buf, "sec");  // at most size - 1 characters
  ASSERT_NE(QLIBCFgets(buf, sizeof(buf), f.get()), nullptr);
  EXPECT_STREQ(buf, "ond\n");
  EXPECT_EQ(QLIBCFgets(buf, sizeof(buf), f.get()), nullptr);
  EXPECT_EQ(QLIBCFgets(buf, 1, f.get()), nullptr);
  EXPECT_EQ(QLIBCFgets(nullptr, 16, f.get()), nullptr);
}

}  // namespace
