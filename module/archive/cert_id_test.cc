#include "module/archive/cert_id.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

#include "module/archive/archive_testing.h"
#include "test_support.h"

namespace {

using ZEPH::test::HasUtilsLine;
using ZEPH::test::MakeDirs;
using ZEPH::test::WriteFile;

class CertIdTest : public ::testing::Test {
 protected:
  std::string Archive() const { return ZEPH::cert::ArchiveDir(); }
  std::string System() const {
    return root_.Path("/usr/zeph/etc/certificate/");
  }
  ZEPH::test::TempRoot root_;
};

TEST_F(CertIdTest, GetCrtIdTakesTheFirstComponentBelowTheArchive) {
  MakeDirs(Archive() + "/Ab3xYz/sub");
  WriteFile(Archive() + "/Ab3xYz/cert.pem", "x");
  MakeDirs(root_.Path("/usr/zeph/etc/certificate/_archived/Ab3xYz"));
  EXPECT_EQ(GetCrtId(Archive() + "/Ab3xYz"), "Ab3xYz");
  EXPECT_EQ(GetCrtId(Archive() + "/Ab3xYz/sub"), "Ab3xYz");
  // The character after the prefix is always taken, even a slash.
  EXPECT_EQ(GetCrtId(Archive() + "//Ab3xYz"), "/Ab3xYz");
  for (const std::string& path :
       {Archive() + "/Ab3xYz/cert.pem", Archive() + "/missing", Archive() + "/",
        Archive(), std::string(),
        root_.Path("/usr/zeph/etc/certificate/_archived/Ab3xYz"),
        std::string("/usr/zeph/etc/certificate/_archive/Ab3xYz")}) {
    EXPECT_EQ(GetCrtId(path), "") << path;
  }
}

TEST_F(CertIdTest, ValidIdsNameCompleteDirectories) {
  // Complete directories under names with dots must not help such ids.
  for (const char* name : {"a.b", "..x", "Ab3xYz"}) {
    for (const char* file : {"privkey.pem", "cert.pem", "fullchain.pem"}) {
      MakeDirs(Archive() + "/" + name);
      WriteFile(Archive() + "/" + name + "/" + file, "x");
    }
  }
  for (const char* id :
       {"", ".", "..", "a/b", "a.b", "..x", "/Ab3xYz", "Ab3xYz/", "Missing"}) {
    EXPECT_FALSE(IsCrtIdValid(id)) << id;
  }
  // A NUL byte would cut the path short: "Ab3xYz\0x" would look up Ab3xYz,
  // "\0" the archive itself.
  for (const std::string& id : {std::string("Ab3xYz\0x", 8), std::string("\0", 1)}) {
    EXPECT_FALSE(IsCrtIdValid(id));
    EXPECT_FALSE(IsCrtIdName(id));
  }
  EXPECT_EQ(root_.Log(), "");  // refusals without looking, or no directory
  EXPECT_TRUE(IsCrtIdValid("Ab3xYz"));

  unlink((Archive() + "/Ab3xYz/fullchain.pem").c_str());
  EXPECT_FALSE(IsCrtIdValid("Ab3xYz"));
  EXPECT_TRUE(HasUtilsLine(
      root_.Log(),
      "Lack of necessary files in cert dir [" + Archive() + "/Ab3xYz]"));
}

TEST_F(CertIdTest, MakeCrtDirDrawsFreshIdsInTheArchive) {
  std::string path, id, path2, id2;
  EXPECT_FALSE(ZEPH::cert::MakeCrtDir(path, id));  // no archive yet
  MakeDirs(Archive());
  ASSERT_TRUE(ZEPH::cert::MakeCrtDir(path, id));
  ASSERT_TRUE(ZEPH::cert::MakeCrtDir(path2, id2));
  EXPECT_NE(id, id2);
  ASSERT_EQ(id.size(), 6u);
  for (char c : id) EXPECT_TRUE(isalnum(static_cast<unsigned char>(c)));
  EXPECT_EQ(path, Archive() + "/" + id);
  EXPECT_EQ(ZEPH::test::ModeOf(path), 0700u);
}

TEST_F(CertIdTest, PathsAreConfinedToTheirCertificateRoot) {
  MakeDirs(System() + "a/sub");
  MakeDirs(System() + "b");
  WriteFile(System() + "a/cert.pem", "c");
  MakeDirs(root_.Path("/usr/zeph/etc/etc"));
  MakeDirs(root_.Path("/usr/local/etc/certificate/pkg/svc"));
  WriteFile(root_.Path("/outside"), "s");
  ASSERT_EQ(symlink(root_.Path("/usr").c_str(), (System() + "link").c_str()),
            0);
  ASSERT_EQ(
      symlink(root_.Path("/outside").c_str(), (System() + "a/out").c_str()), 0);
  ASSERT_EQ(symlink("../b", (System() + "a/to_b").c_str()), 0);
  ASSERT_EQ(symlink("cert.pem", (System() + "a/alias.pem").c_str()), 0);

  struct Case {
    bool local;
    const char* base;
    const char* name;
    bool valid;
  } cases[] = {
      {false, "a", "", true},
      {false, "a", "cert.pem", true},
      {false, "a/sub/..", "sub", true},
      {false, "a", "alias.pem", true},
      {false, "a/to_b", "", true},
      {true, "pkg", "svc", true},
      {false, "", "", false},
      {false, "", "a", false},
      {false, "x/../../etc", "", false},  // resolves, outside the root
      {false, "a", "../b", false},        // leaves the resolved base
      {false, "a", "..", false},
      {false, "a", ".", false},
      {false, ".", "", false},
      {false, "a/..", "", false},  // the root
      {false, "missing", "", false},
      {false, "a", "missing", false},
      {false, "pkg", "svc", false},
      {true, "a", "", false},
      {true, "../../../zeph/etc/certificate/a", "", false},
      {false, "link", "", false},
      {false, "link/zeph", "", false},
      {false, "a", "out", false},
      {false, "a", "to_b", false},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(IsCrtPathValid(c.local, c.base, c.name), c.valid)
        << c.local << " " << c.base << " " << c.name;
  }
}

}  // namespace
