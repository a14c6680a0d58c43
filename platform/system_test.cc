#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include "test_support.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_support.h"
#include "zeph/root.h"
#include "zeph/system.h"

namespace {

using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;

TEST(RootPrefix, PrefixesAbsolutePathsOnly) {
  TempRoot root;
  EXPECT_EQ(ZEPH::RootPath("/usr/zeph/etc"), root.dir() + "/usr/zeph/etc");
  EXPECT_EQ(ZEPH::RootPath("relative"), "relative");
  setenv("ZEPH_ROOT", (root.dir() + "//").c_str(), 1);
  EXPECT_EQ(ZEPH::RootPath("/tmp/x.lock"), root.dir() + "/tmp/x.lock");
  for (const char* real : {"", "/"}) {
    setenv("ZEPH_ROOT", real, 1);
    EXPECT_EQ(ZEPH::RootPath("/tmp/x.lock"), "/tmp/x.lock");
    EXPECT_EQ(ZEPH::RootDir(), "");
  }
  unsetenv("ZEPH_ROOT");
  EXPECT_EQ(ZEPH::RootPath("/usr/zeph"), "/usr/zeph");
}

TEST(MkdirP, MakesParentsWithExactModes) {
  TempRoot root;
  umask(022);
  const std::string deep = root.Path("/a/b/c");
  ASSERT_EQ(ZEPHFSMkdirP(deep.c_str(), nullptr, 1, 0, 0, 0700), 0);
  EXPECT_EQ(ModeOf(deep), 0700u);
  EXPECT_EQ(ModeOf(root.Path("/a")), 0755u);

  // The umask does not take bits from the asked-for mode.
  umask(077);
  const std::string wide = root.Path("/wide");
  ASSERT_EQ(ZEPHFSMkdirP(wide.c_str(), nullptr, 1, 0, 0, 0755), 0);
  EXPECT_EQ(ModeOf(wide), 0755u);
  umask(022);

  // parents_mode gives the made parents the same mode.
  ASSERT_EQ(ZEPHFSMkdirP(root.Path("/p/q").c_str(), nullptr, 1, 1, 0, 0711), 0);
  EXPECT_EQ(ModeOf(root.Path("/p")), 0711u);

  // An existing directory is success and keeps its mode.
  ASSERT_EQ(ZEPHFSMkdirP(deep.c_str(), nullptr, 1, 0, 0, 0755), 0);
  EXPECT_EQ(ModeOf(deep), 0700u);
}

TEST(MkdirP, FailsOnFilesMissingParentsAndBadArguments) {
  TempRoot root;
  WriteFile(root.Path("/file"), "x");
  EXPECT_EQ(ZEPHFSMkdirP(root.Path("/file").c_str(), nullptr, 1, 0, 0, 0755), -1);
  EXPECT_EQ(ZEPHFSMkdirP(root.Path("/file/sub").c_str(), nullptr, 1, 0, 0, 0755), -1);
  EXPECT_EQ(ZEPHFSMkdirP(root.Path("/no/parents").c_str(), nullptr, 0, 0, 0, 0755), -1);
  EXPECT_FALSE(ZEPH::test::Exists(root.Path("/no")));
  EXPECT_EQ(ZEPHFSMkdirP("", nullptr, 1, 0, 0, 0755), -1);
  EXPECT_EQ(ZEPHFSMkdirP(root.Path("/r").c_str(), nullptr, 1, 0, 7, 0755), -1);
  EXPECT_EQ(ZEPHFSMkdirP(root.Path("/o").c_str(), "no-such-user-zeph", 1, 0, 0, 0755), -1);
}

TEST(UserIds, ResolvesKnownUsersOnly) {
  uid_t uid = 99;
  gid_t gid = 99;
  ASSERT_EQ(ZEPHUserGetUGID("root", &uid, &gid), 0);
  EXPECT_EQ(uid, 0u);
  EXPECT_EQ(gid, 0u);
  EXPECT_EQ(ZEPHUserGetUGID("no-such-user-zeph", &uid, &gid), -1);
  EXPECT_EQ(ZEPHUserGetUGID("", &uid, &gid), -1);
  EXPECT_EQ(ZEPHUserGetUGID(nullptr, &uid, &gid), -1);
}

TEST(EventLog, AppendsWholeLinesFromManyThreads) {
  TempRoot root;
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([t] {
      for (int i = 0; i < 50; ++i) {
        std::string text(200, static_cast<char>('a' + t));
        ASSERT_EQ(ZEPHLogSet1(1, t, 0x12B00003u, text.c_str(), "id",
                              nullptr, "x"),
                  0);
      }
    });
  }
  for (auto& th : threads) th.join();

  std::string log = ReadFile(root.Path("/var/log/zeph/events.jsonl"));
  size_t lines = 0, start = 0;
  for (size_t nl; (nl = log.find('\n', start)) != std::string::npos; start = nl + 1) {
    Json::Value event;
    ASSERT_TRUE(ZEPH::JsonParse(log.substr(start, nl - start), event));
    EXPECT_EQ(event["message_id"].asUInt(), 0x12B00003u);
    EXPECT_EQ(event["type"].asInt(), 1);
    EXPECT_EQ(event["text1"].asString().size(), 200u);
    EXPECT_EQ(event["text3"].asString(), "");
    EXPECT_TRUE(event["time"].isIntegral());
    ++lines;
  }
  EXPECT_EQ(lines, 400u);
}

TEST(SystemdReload, NeverTouchesTheHostUnderAPrivateRoot) {
  TempRoot root;
  EXPECT_FALSE(ZEPHSystemdReload("zephrelayd"));
}

TEST(SupportGet, ReadsFeatureSwitches) {
  TempRoot root;
  EXPECT_EQ(QLIBCSupportGet("support_self_sign_cert"), 0);  // no file
  ZEPH::test::MakeDirs(root.Path("/usr/zeph/etc"));
  WriteFile(root.Path("/usr/zeph/etc/features.conf"),
            "# features\n"
            "support_self_sign_cert = yes\n"
            "other=no\n"
            "flip=yes\nflip=no\n"
            "support_self_sign_cert_extra=yes\n");
  EXPECT_EQ(QLIBCSupportGet("support_self_sign_cert"), 1);
  EXPECT_EQ(QLIBCSupportGet("other"), 0);
  EXPECT_EQ(QLIBCSupportGet("flip"), 0);
  EXPECT_EQ(QLIBCSupportGet("missing"), 0);
  EXPECT_EQ(QLIBCSupportGet(""), 0);
  EXPECT_EQ(QLIBCSupportGet(nullptr), 0);
}

}  // namespace
