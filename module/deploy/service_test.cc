#include "module/deploy/service.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "module/archive/archive_testing.h"
#include "module/archive/info.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::HasUtilsLine;
using ZEPH::test::InfoEntry;
using ZEPH::test::JsonArray;
using ZEPH::test::ServiceObject;

class ServiceTest : public ::testing::Test {
 protected:
  bool Logged(const std::string& message) const {
    return HasUtilsLine(root_.Log(), message);
  }
  ZEPH::test::TempRoot root_;
  const Json::Value web_ = ServiceObject("system", "default");
};

TEST_F(ServiceTest, FormatIsCheckedRowByRow) {
  Json::Value extra = ServiceObject("pkg", "svc", true);
  extra["display_name_i18n"] = "common:web";
  extra["anything"] = Json::Value(Json::arrayValue);  // carried along
  EXPECT_TRUE(CheckServiceFormat(web_));
  EXPECT_TRUE(CheckServiceFormat(extra));
  EXPECT_EQ(root_.Log(), "");

  // Wrong types and empty strings fail without a log line; an earlier row
  // decides before a later one (here: the missing "owner").
  const std::pair<const char*, Json::Value> silent[] = {
      {"isPkg", "true"},
      {"isPkg", 1},
      {"display_name", ""},
      {"display_name", 7},
      {"display_name_i18n", ""},
      {"display_name_i18n", false},
      {"subscriber", ""},
      {"service", Json::Value()},
      {"owner", ""}};
  for (const auto& [key, value] : silent) {
    Json::Value service = web_;
    service[key] = value;
    service.removeMember(std::string(key) == "owner" ? "none" : "owner");
    EXPECT_FALSE(CheckServiceFormat(service))
        << key << ZEPH::JsonCompact(value);
  }
  EXPECT_EQ(root_.Log(), "");

  for (const char* key :
       {"display_name", "subscriber", "service", "isPkg", "owner"}) {
    Json::Value service = web_;
    service.removeMember(key);
    EXPECT_FALSE(CheckServiceFormat(service));
    EXPECT_TRUE(Logged(std::string("Lack of necesary key. [") + key + "]"));
  }
  // The first row decides; values that are not objects lack every key.
  root_.ClearLog();
  for (const Json::Value& value :
       {Json::Value(Json::objectValue), Json::Value(), Json::Value("system"),
        JsonArray({web_})}) {
    EXPECT_FALSE(CheckServiceFormat(value));
  }
  EXPECT_TRUE(Logged("Lack of necesary key. [display_name]"));
  EXPECT_FALSE(root_.LogContains("[subscriber]"));

  // Names that would lead a deployment out of its directory.
  for (const char* key : {"subscriber", "service"}) {
    for (const char* name : {"..", ".", "a/b", "../../etc"}) {
      Json::Value service = web_;
      service[key] = name;
      EXPECT_FALSE(CheckServiceFormat(service)) << key << " " << name;
      EXPECT_TRUE(Logged(std::string("Invalid service name [") + name + "]"));
    }
  }
  for (const std::string& name : {std::string("\0", 1), std::string("x\0/..", 5)}) {
    Json::Value service = web_;
    service["service"] = name;
    EXPECT_FALSE(CheckServiceFormat(service));
  }
  Json::Value dotted = web_;
  dotted["service"] = "web.v2..x";  // dots inside a name are fine
  EXPECT_TRUE(CheckServiceFormat(dotted));
}

TEST_F(ServiceTest, FindsTheWebAdministrationInterface) {
  Json::Value malformed = web_;
  malformed.removeMember("owner");
  EXPECT_FALSE(
      ServicesContainORN(JsonArray({malformed, ServiceObject("system", "x")})));
  EXPECT_TRUE(Logged("service object is error."));
  EXPECT_TRUE(ServicesContainORN(JsonArray({malformed, web_})));
  EXPECT_FALSE(ServicesContainORN(Json::Value(Json::arrayValue)));
  EXPECT_FALSE(ServicesContainORN(web_));  // not an array
}

TEST_F(ServiceTest, LooksUpBindingsInInfo) {
  ZEPH::test::MakeArchiveCert("AAAAAA");
  ZEPH::test::MakeArchiveCert("BBBBBB");
  Json::Value info(Json::objectValue);
  info["AAAAAA"] = InfoEntry(JsonArray({ServiceObject("a", "one")}));
  // The same service twice (a damaged catalogue): the first id wins.
  info["BBBBBB"] = InfoEntry(JsonArray({web_, ServiceObject("a", "one")}));
  info["CCCCCC"] = "not an entry";
  ZEPH::test::WriteInfo(info);

  std::string id;
  ASSERT_TRUE(GetServiceCertID(web_, id));
  EXPECT_EQ(id, "BBBBBB");
  id.clear();
  ASSERT_TRUE(GetServiceCertID(ServiceObject("a", "one", true, "other"), id));
  EXPECT_EQ(id, "AAAAAA");  // identity: subscriber and service only
  id.clear();
  ASSERT_TRUE(GetServiceCertID(ServiceObject("a", "two"), id));
  EXPECT_EQ(id, "");  // bound to nothing

  Json::Value services;
  ASSERT_TRUE(GetServiceList("BBBBBB", services));
  EXPECT_EQ(services, info["BBBBBB"]["services"]);
  EXPECT_EQ(root_.Log(), "");
  // Invalid ids are refused before INFO is read.
  EXPECT_FALSE(GetServiceList("..", services));
  EXPECT_FALSE(GetServiceList("CCCCCC", services));
  EXPECT_EQ(root_.Log(), "");
  // Valid certificates without a usable entry.
  info["BBBBBB"].removeMember("services");
  ZEPH::test::WriteInfo(info);
  ZEPH::test::MakeArchiveCert("CCCCCC");
  for (const char* cert : {"BBBBBB", "CCCCCC"}) {
    root_.ClearLog();
    EXPECT_FALSE(GetServiceList(cert, services));
    EXPECT_TRUE(Logged("Broken [" + ZEPH::test::InfoPath() + "].[0x"));
  }
  EXPECT_EQ(services,
            JsonArray({web_, ServiceObject("a", "one")}));  // unchanged
}

TEST_F(ServiceTest, LookupTakesTheLockShared) {
  ZEPH::test::WriteInfo(Json::objectValue);
  // Another reader holds the lock shared: a shared lookup goes ahead, where
  // an exclusive one would wait 30 s and fail.
  int ready[2];
  ASSERT_EQ(pipe(ready), 0);
  const pid_t holder = fork();
  if (holder == 0) {
    int fd = -1;
    char ok = QLIBCFileLockTimeByFile(ZEPH::cert::InfoLockPath().c_str(),
                                      QLIBC_LOCK_SHARED, 5, &fd)
                  ? '1'
                  : '0';
    if (write(ready[1], &ok, 1) == 1) pause();
    _exit(0);
  }
  char ok = '0';
  ASSERT_EQ(read(ready[0], &ok, 1), 1);
  ASSERT_EQ(ok, '1');
  std::string id;
  EXPECT_TRUE(GetServiceCertID(web_, id));
  kill(holder, SIGKILL);
  waitpid(holder, nullptr, 0);
  close(ready[0]);
  close(ready[1]);
}

TEST_F(ServiceTest, LookupFailures) {
  ZEPH::test::WriteInfo(Json::objectValue);
  std::string id;
  Json::Value malformed = web_;
  malformed["isPkg"] = "no";
  EXPECT_FALSE(GetServiceCertID(malformed, id));
  EXPECT_TRUE(
      Logged("Invalid input format [" + ZEPH::JsonCompact(malformed) + "]"));

  for (const char* text : {"", "{", "[]", "null"}) {
    ZEPH::test::WriteFile(ZEPH::test::InfoPath(), text);
    if (*text == '\0') unlink(ZEPH::test::InfoPath().c_str());
    root_.ClearLog();
    EXPECT_FALSE(GetServiceCertID(web_, id)) << text;
    EXPECT_TRUE(Logged("Broken [" + ZEPH::test::InfoPath() + "].[0x"));
  }
  // Without the root's /tmp the lock file cannot even be created.
  ZEPH::test::WriteInfo(Json::objectValue);
  unlink(ZEPH::cert::InfoLockPath().c_str());
  ASSERT_EQ(rmdir(root_.Path("/tmp").c_str()), 0);
  EXPECT_FALSE(GetServiceCertID(web_, id));
  EXPECT_TRUE(Logged("Failed to lock [" + ZEPH::cert::InfoLockPath() + "]"));
  EXPECT_EQ(id, "");
}

}  // namespace
