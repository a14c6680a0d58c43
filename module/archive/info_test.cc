#include "module/archive/info.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <random>
#include <string>

#include "module/archive/archive_testing.h"
#include "module/archive/file_lock.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::HasUtilsLine;
using ZEPH::test::InfoEntry;
using ZEPH::test::ReadFile;
using ZEPH::test::ReadInfo;
using ZEPH::test::ServiceObject;
using ZEPH::test::WriteInfo;

class InfoTest : public ::testing::Test {
 protected:
  void SetUp() override { WriteInfo(Json::objectValue); }
  std::string Info() const { return ZEPH::test::InfoPath(); }
  std::string Temp() const { return Info() + ".temp"; }
  ZEPH::test::TempRoot root_;
};

TEST_F(InfoTest, WriteGoesThroughTheTempFileAndFailuresKeepTheOldFile) {
  ZEPH::test::WriteFile(Temp(), "{\"half\": ");  // left by a crashed writer
  Json::Value info(Json::objectValue);
  info["Ab3xYz"] = InfoEntry(ZEPH::test::JsonArray({ServiceObject("s", "v")}));
  info["Ab3xYz"]["extra"] = "kept";
  ASSERT_TRUE(WriteCertInfo(info));
  EXPECT_EQ(ReadInfo(), info);
  EXPECT_FALSE(ZEPH::test::Exists(Temp()));

  const std::string before = ReadFile(Info());
  ZEPH::test::MakeDirs(Temp());  // the temp file cannot be written
  EXPECT_FALSE(WriteCertInfo(Json::objectValue));
  EXPECT_TRUE(
      HasUtilsLine(root_.Log(), "Failed to write [{}] to [" + Temp() + "]."));
  EXPECT_EQ(ReadFile(Info()), before);

  rmdir(Temp().c_str());
  ASSERT_EQ(unlink(Info().c_str()), 0);
  ZEPH::test::MakeDirs(Info() + "/inside");  // the rename cannot replace it
  EXPECT_FALSE(WriteCertInfo(info));
  EXPECT_TRUE(
      HasUtilsLine(root_.Log(), "Failed to move " + Temp() + " to " + Info()));
}

TEST_F(InfoTest, DropRemovesUnusedEntriesOnly) {
  Json::Value info(Json::objectValue);
  info["unused"] = InfoEntry();
  info["other"] = InfoEntry();
  info["other"]["custom"] = 42;
  WriteInfo(info);
  ASSERT_TRUE(DropCertInfo("unused"));
  info.removeMember("unused");
  EXPECT_EQ(ReadInfo(), info);

  // An unknown id succeeds without a rewrite (which would change the inode).
  struct stat before, after;
  stat(Info().c_str(), &before);
  EXPECT_TRUE(DropCertInfo("absent"));
  stat(Info().c_str(), &after);
  EXPECT_EQ(before.st_ino, after.st_ino);
  EXPECT_EQ(root_.Log(), "");
}

TEST_F(InfoTest, DropRefusesUsedOrMalformedEntriesAndBrokenCatalogues) {
  Json::Value no_services = InfoEntry();
  no_services.removeMember("services");
  Json::Value not_array = InfoEntry();
  not_array["services"] = "none";
  for (const Json::Value& entry :
       {InfoEntry(ZEPH::test::JsonArray({ServiceObject("system", "default")})),
        no_services, not_array, Json::Value("text")}) {
    Json::Value info(Json::objectValue);
    info["Ab3xYz"] = entry;
    WriteInfo(info);
    const std::string before = ReadFile(Info());
    root_.ClearLog();
    EXPECT_FALSE(DropCertInfo("Ab3xYz")) << ZEPH::JsonCompact(entry);
    EXPECT_TRUE(HasUtilsLine(root_.Log(), "Wrong info: [Ab3xYz]"));
    EXPECT_EQ(ReadFile(Info()), before);
  }
  for (const char* text : {"{\"Ab3xYz\": {", "[]", ""}) {
    ZEPH::test::WriteFile(Info(), text);
    if (*text == '\0') unlink(Info().c_str());
    root_.ClearLog();
    EXPECT_FALSE(DropCertInfo("Ab3xYz")) << text;
    EXPECT_TRUE(HasUtilsLine(root_.Log(), "Broken [" + Info() + "].[0x"));
    EXPECT_EQ(ReadFile(Info()), text);  // an absent INFO is not created
  }
  // Without the root's /tmp the lock file cannot even be created.
  unlink(ZEPH::cert::InfoLockPath().c_str());
  ASSERT_EQ(rmdir(root_.Path("/tmp").c_str()), 0);
  EXPECT_FALSE(DropCertInfo("Ab3xYz"));
  EXPECT_TRUE(HasUtilsLine(
      root_.Log(),
      "Lock list file [" + ZEPH::cert::InfoLockPath() + "] failed"));
}

// A catalogue big enough that writing it takes a while.
Json::Value BigInfo(const std::string& desc) {
  Json::Value info(Json::objectValue);
  for (int i = 0; i < 3000; ++i) {
    info["id" + std::to_string(i)] = InfoEntry(ZEPH::test::JsonArray(
        {ServiceObject("sub" + std::to_string(i), desc)}));
  }
  return info;
}

TEST_F(InfoTest, KilledWriterLeavesTheOldOrTheNewCatalogue) {
  const Json::Value first = BigInfo("first");
  const Json::Value second = BigInfo("second");
  ASSERT_TRUE(WriteCertInfo(first));
  const unsigned seed = std::random_device()();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937 random(seed);
  std::uniform_int_distribution<long> delay_ns(0, 40000000);

  for (int round = 0; round < 60; ++round) {
    const pid_t writer = fork();
    ASSERT_GE(writer, 0);
    if (writer == 0) {
      for (int i = 0;; ++i) {  // rewrite INFO as every writer does, for ever
        ZEPH::cert::ScopedFileLock lock;
        if (!lock.Lock(ZEPH::cert::InfoLockPath(), QLIBC_LOCK_EXCLUSIVE, 10) ||
            !WriteCertInfo(i % 2 == 0 ? second : first)) {
          _exit(1);
        }
      }
    }
    const timespec pause{0, delay_ns(random)};
    nanosleep(&pause, nullptr);
    kill(writer, SIGKILL);
    int status = 0;
    ASSERT_EQ(waitpid(writer, &status, 0), writer);
    ASSERT_TRUE(WIFSIGNALED(status)) << "the writer failed by itself";
    const Json::Value now = ReadInfo();
    ASSERT_TRUE(now == first || now == second) << "round " << round;
    // The dead writer's lock died with it.
    ZEPH::cert::ScopedFileLock lock;
    EXPECT_TRUE(lock.Lock(ZEPH::cert::InfoLockPath(), QLIBC_LOCK_EXCLUSIVE, 0));
  }
}

}  // namespace
