#include "module/deploy/deploy.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "module/archive/archive_testing.h"
#include "module/archive/info.h"
#include "module/deploy/service.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::JsonCompact;
using ZEPH::test::DirEntries;
using ZEPH::test::Exists;
using ZEPH::test::InfoEntry;
using ZEPH::test::InfoPath;
using ZEPH::test::JsonArray;
using ZEPH::test::MakeArchiveCert;
using ZEPH::test::MakeDirs;
using ZEPH::test::ReadFile;
using ZEPH::test::ReadInfo;
using ZEPH::test::ServiceObject;
using ZEPH::test::WriteFile;
using ZEPH::test::WriteInfo;
using Names = std::vector<std::string>;

const char kArchive[] = "/usr/zeph/etc/certificate/_archive/";

class DeployTest : public ::testing::Test {
 protected:
  void SetUp() override {
    MakeArchiveCert("AAAAAA");
    MakeArchiveCert("BBBBBB", true);
    Json::Value info(Json::objectValue);
    for (const char* id : {"AAAAAA", "BBBBBB"}) info[id] = InfoEntry();
    WriteInfo(info);
  }
  std::string Archive(const std::string& id) const { return root_.Path(kArchive) + id; }
  std::string Dir(const std::string& sub, const std::string& svc, bool pkg = false) const {
    return root_.Path((pkg ? "/usr/local" : "/usr/zeph") + std::string("/etc/certificate/") + sub) +
           "/" + svc;
  }
  void InstallHook(const std::string& path, const std::string& tag, mode_t mode = 0755) {
    MakeDirs(root_.Path(path.substr(0, path.rfind('/'))));
    WriteFile(root_.Path(path), "#!/bin/sh\nprintf '%s %s %s\\n' " + tag + " \"$#\" \"$1\" >> " +
                                    root_.Path("/hooks.log") + "\n", mode);
  }
  std::string Hooks() const { return ReadFile(root_.Path("/hooks.log")); }
  Json::Value BoundTo(const std::string& id) const { return ReadInfo()[id]["services"]; }
  void ExpectDeployed(const std::string& dir, const std::string& id, const Names& files,
                      uid_t uid = geteuid(), gid_t gid = getegid()) {
    EXPECT_EQ(DirEntries(dir), files) << dir;
    for (const std::string& name : files) {
      struct stat st;
      ASSERT_EQ(stat((dir + "/" + name).c_str(), &st), 0) << name;
      EXPECT_EQ(ReadFile(dir + "/" + name), ReadFile(Archive(id) + "/" + name)) << name;
      EXPECT_TRUE((st.st_mode & 07777) == 0400u && st.st_uid == uid && st.st_gid == gid) << name;
    }
  }
  void SetBound(const std::string& id, const Json::Value& services) {
    Json::Value info = ReadInfo();
    info[id]["services"] = services;
    WriteInfo(info);
  }
  ZEPH::test::TempRoot root_;
  const Json::Value svc_ = ServiceObject("sub", "svc"), web_ = ServiceObject("system", "default");
  const Json::Value other_ = ServiceObject("sub", "other"), fresh_ = ServiceObject("sub", "fresh");
  const Names three_ = {"cert.pem", "fullchain.pem", "privkey.pem"};
  const Names five_ = {"cert.pem", "chain.pem", "fullchain.pem", "privkey.pem", "zeph-ca-cert.pem"};
};

TEST_F(DeployTest, DeploysWithModesAndOwnerMovesEachServiceOnceAndSyncs) {
  WriteFile(Archive("AAAAAA") + "/renew.json", "{}");  // not part of the set
  const Json::Value pkg = ServiceObject("pkg", "web", true);
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({web_}), "", CRT_ACTION_SET));
  ASSERT_TRUE(DeployCrt("BBBBBB", JsonArray({pkg}), "", CRT_ACTION_SET));
  const std::string dir = Dir("system", "default");
  ExpectDeployed(dir, "AAAAAA", three_);
  EXPECT_EQ(ZEPH::test::ModeOf(dir), 0755u);
  ExpectDeployed(Dir("pkg", "web", true), "BBBBBB", five_);
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({web_}));
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({pkg}));
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({pkg}), "BBBBBB", CRT_ACTION_SET));  // a smaller set
  ExpectDeployed(Dir("pkg", "web", true), "AAAAAA", three_);
  if (geteuid() == 0) {  // only root can give files away
    const Json::Value given = ServiceObject("o", "s", false, "nobody");
    ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({given}), "", CRT_ACTION_SET));
    ExpectDeployed(Dir("o", "s"), "AAAAAA", three_, ZEPH::test::UnprivilegedUid(),
                   ZEPH::test::UnprivilegedGid());
  }
  Json::Value renamed = svc_;
  renamed["display_name"] = "new name";
  SetBound("AAAAAA", JsonArray({svc_, other_}));
  SetBound("BBBBBB", Json::Value(Json::arrayValue));
  const struct { const char* id; Json::Value service; const char* old_id; CRT_ACTION action;
                 Json::Value a, b; } rows[] = {
      {"BBBBBB", svc_, "AAAAAA", CRT_ACTION_SET, JsonArray({other_}), JsonArray({svc_})},
      {"BBBBBB", fresh_, "", CRT_ACTION_RESET, JsonArray({other_}), JsonArray({svc_, fresh_})},
      {"BBBBBB", renamed, "BBBBBB", CRT_ACTION_FALLBACK, JsonArray({other_}),
       JsonArray({fresh_, renamed})},
      {"AAAAAA", fresh_, "", CRT_ACTION_SET, JsonArray({other_, fresh_}), JsonArray({renamed})},
      {"BBBBBB", other_, "BBBBBB", CRT_ACTION_SET, JsonArray({fresh_}),
       JsonArray({renamed, other_})}};
  for (const auto& row : rows) {
    ASSERT_TRUE(DeployCrt(row.id, JsonArray({row.service}), row.old_id, row.action));
    EXPECT_EQ(BoundTo("AAAAAA"), row.a) << row.id << " " << row.action;
    EXPECT_EQ(BoundTo("BBBBBB"), row.b) << row.id << " " << row.action;
  }
  ExpectDeployed(Dir("sub", "svc"), "BBBBBB", five_);
  InstallHook("/usr/zeph/share/certificate.d/sub", "hook");
  SetBound("BBBBBB", JsonArray({svc_, other_}));
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({svc_}), "", CRT_ACTION_SYNC));  // bound to BBBBBB
  ExpectDeployed(Dir("sub", "svc"), "BBBBBB", five_);
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({other_, svc_}));
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({fresh_}), "", CRT_ACTION_SYNC));  // bound to none
  ExpectDeployed(Dir("sub", "fresh"), "AAAAAA", three_);
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({fresh_}));
  MakeArchiveCert("a.b");
  const Json::Value odd = ServiceObject("sub", "odd");
  SetBound("a.b", JsonArray({odd}));
  const Json::Value info = ReadInfo();
  EXPECT_FALSE(DeployCrt("AAAAAA", JsonArray({odd}), "", CRT_ACTION_SYNC));
  ExpectDeployed(Dir("sub", "odd"), "a.b", three_);
  EXPECT_EQ(ReadInfo(), info);
  MakeArchiveCert("CCCCCC");  // a valid certificate that INFO does not list
  const std::string before = ReadFile(InfoPath());
  EXPECT_FALSE(DeployCrt("AAAAAA", JsonArray({svc_}), "ZZZZZZ", CRT_ACTION_SET));
  EXPECT_FALSE(DeployCrt("CCCCCC", JsonArray({svc_}), "", CRT_ACTION_SET));
  ExpectDeployed(Dir("sub", "svc"), "CCCCCC", three_);
  ASSERT_TRUE(DeployCrt("CCCCCC", JsonArray({svc_}), "ZZZZZZ", CRT_ACTION_UPDATE));
  EXPECT_EQ(ReadFile(InfoPath()), before);
  EXPECT_EQ(Hooks(), "hook 1 svc\n");
}

TEST_F(DeployTest, HooksGetTheServiceNameShareFirst) {
  const std::pair<const char*, const char*> hooks[] = {
      {"/usr/zeph/share/certificate.d/sys", "share"}, {"/usr/libexec/certificate.d/sys", "libexec"},
      {"/usr/libexec/certificate.d/sys2", "libexec2"},
      {"/usr/local/share/certificate.d/pkg", "pkg-share"},
      {"/usr/local/libexec/certificate.d/pkg", "pkg-libexec"},
      {"/usr/zeph/share/certificate.d/pkg", "wrong"}};
  for (const auto& hook : hooks) InstallHook(hook.first, hook.second);
  WriteFile(root_.Path("/usr/zeph/share/certificate.d/fails"), "#!/bin/sh\nexit 3\n", 0755);
  const Json::Value services =
      JsonArray({ServiceObject("sys", "first service"), ServiceObject("sys2", "second"),
                 ServiceObject("pkg", "third", true), ServiceObject("nohook", "fourth"),
                 ServiceObject("fails", "fifth")});
  ASSERT_TRUE(DeployCrt("AAAAAA", services, "", CRT_ACTION_SET));
  EXPECT_EQ(Hooks(), "share 1 first service\nlibexec2 1 second\npkg-share 1 third\n");
  // A hook that cannot be run fails its element after the binding.
  InstallHook("/usr/zeph/share/certificate.d/sub", "hook", 0644);
  EXPECT_FALSE(DeployCrt("AAAAAA", JsonArray({svc_}), "", CRT_ACTION_SET));
  EXPECT_TRUE(root_.LogContains("Failed to [" + root_.Path("/usr/zeph/share/certificate.d/sub") +
                                "][svc].[0x"));
  ExpectDeployed(Dir("sub", "svc"), "AAAAAA", three_);
  EXPECT_EQ(BoundTo("AAAAAA")[5], svc_);
}

TEST_F(DeployTest, BadServicesAndInputAreRefused) {
  Json::Value extra = ServiceObject("pkg", "svc", true), dotted = web_;
  extra["display_name_i18n"] = "common:web";
  extra["anything"] = Json::Value(Json::arrayValue);  // carried along
  dotted["service"] = "web.v2..x";  // dots inside a name are fine
  for (const Json::Value& good : {web_, extra, dotted}) EXPECT_TRUE(CheckServiceFormat(good));
  // `line`: "" for no log line, null when not checked.
  const struct { const char* key; Json::Value value; const char* line; } rows[] = {
      {"isPkg", "true", ""}, {"isPkg", 1, ""}, {"display_name", "", ""}, {"display_name", 7, ""},
      {"display_name_i18n", "", ""}, {"display_name_i18n", false, ""}, {"subscriber", "", ""},
      {"service", Json::Value(), ""}, {"owner", "", ""}, {"service", std::string("\0", 1), nullptr},
      {"service", std::string("x\0/..", 5), nullptr},
      {"subscriber", "..", "Invalid service name [..]"}, {"service", ".", "name [.]"},
      {"subscriber", "a/b", "Invalid service name [a/b]"},
      {"service", "../../etc", "Invalid service name [../../etc]"}};
  for (const auto& row : rows) {
    Json::Value service = web_;
    service[row.key] = row.value;
    // Without "owner": an earlier rule decides before a later one.
    if (row.line && !*row.line && std::string(row.key) != "owner") service.removeMember("owner");
    root_.ClearLog();
    EXPECT_FALSE(CheckServiceFormat(service)) << row.key << JsonCompact(row.value);
    if (row.line == nullptr) continue;
    EXPECT_EQ(root_.Log().empty(), !*row.line) << row.key << root_.Log();
    EXPECT_TRUE(!*row.line || root_.LogContains(row.line)) << row.line;
  }
  for (const char* key : {"display_name", "subscriber", "service", "isPkg", "owner"}) {
    Json::Value service = web_;
    service.removeMember(key);
    root_.ClearLog();
    EXPECT_FALSE(CheckServiceFormat(service));
    EXPECT_TRUE(root_.LogContains(std::string("Lack of necesary key. [") + key + "]")) << key;
  }
  root_.ClearLog();  // a value that is no object lacks every key, the first one logged
  EXPECT_FALSE(CheckServiceFormat(JsonArray({web_})));
  EXPECT_TRUE(root_.LogContains("Lack of necesary key. [display_name]"));
  Json::Value malformed = web_;
  malformed.removeMember("owner");
  EXPECT_FALSE(ServicesContainORN(JsonArray({malformed, ServiceObject("system", "x")})));
  EXPECT_TRUE(ServicesContainORN(JsonArray({malformed, web_})));
  EXPECT_FALSE(ServicesContainORN(Json::Value(Json::arrayValue)));
  EXPECT_FALSE(ServicesContainORN(web_));  // not an array
  const Json::Value list = JsonArray({svc_});
  const struct { std::string id; Json::Value services; int action; } inputs[] = {
      {"..", list, 1}, {"MISSNG", list, 1}, {"AAAAAA", svc_, 1}, {"AAAAAA", Json::Value(), 1},
      {"AAAAAA", list, 5}, {"AAAAAA", list, -1}};
  for (const auto& row : inputs) {
    root_.ClearLog();
    EXPECT_FALSE(DeployCrt(row.id, row.services, "", static_cast<CRT_ACTION>(row.action)));
    EXPECT_TRUE(root_.LogContains(row.action == 1 ? "Invalid params (cert_id/services)"
                                                  : "Wrong rgCRTActionInfo.")) << row.id;
    EXPECT_FALSE(root_.LogContains("zephrelayd"));  // refused before the reload
  }
  EXPECT_FALSE(Exists(Dir("sub", "svc")));
  EXPECT_TRUE(DeployCrt("AAAAAA", Json::Value(Json::arrayValue), "", CRT_ACTION_SET));
  EXPECT_TRUE(root_.LogContains("Reload zephrelayd failed."));
  Json::Value wrong_type = ServiceObject("sub", "a"), empty_name = ServiceObject("sub", "b");
  wrong_type["isPkg"] = "false";
  empty_name["service"] = "";
  const Json::Value mixed =
      JsonArray({wrong_type, ServiceObject("sub", "good"), empty_name, "text",
                 ServiceObject("../../../../escape", "svc"), ServiceObject("..", "certificate"),
                 ServiceObject("sub", "good2")});
  EXPECT_FALSE(DeployCrt("AAAAAA", mixed, "", CRT_ACTION_SET));
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({ServiceObject("sub", "good"), mixed[6]}));
  EXPECT_EQ(DirEntries(root_.Path("/usr/zeph/etc/certificate/sub")), (Names{"good", "good2"}));
  EXPECT_FALSE(Exists(root_.Path("/escape")));
  for (const char* text : {"{\"AAAAAA\": {", ""}) {
    ZEPH::test::WriteInfoText(text);
    EXPECT_FALSE(DeployCrt("AAAAAA", list, "", CRT_ACTION_SET));
    EXPECT_TRUE(root_.LogContains("Failed to check service exist for " + JsonCompact(svc_)));
    EXPECT_EQ(ReadFile(InfoPath()), text);
  }
  EXPECT_FALSE(Exists(Dir("sub", "svc")));
}

TEST_F(DeployTest, DefaultFileUpdatesAndLookupsUnderASharedLock) {
  const std::string def = Archive("DEFAULT");
  EXPECT_EQ(GetDefCrtId(), "");  // no file
  MakeDirs(Archive("ABCDEFGHIJKLMNO"));
  const std::pair<const char*, const char*> rows[] = {
      {"BBBBBB\n", "BBBBBB"}, {"BBBBBB", "BBBBBB"}, {"", ""}, {"GONE12\n", ""},
      {"ABCDEFGHIJKLMNOPQRS\n", "ABCDEFGHIJKLMNO"}};  // 15 characters are read
  for (const auto& row : rows) {
    WriteFile(def, row.first);
    EXPECT_EQ(GetDefCrtId(), row.second) << row.first;
  }
  Json::Value services = JsonArray({svc_});
  SetBound("AAAAAA", services);
  EXPECT_FALSE(DeployDefCrt(services, CRT_ACTION_FALLBACK, "AAAAAA"));
  EXPECT_FALSE(Exists(Dir("sub", "svc")));
  WriteFile(def, "BBBBBB\n");
  ASSERT_TRUE(DeployDefCrt(services, CRT_ACTION_FALLBACK, "AAAAAA"));
  EXPECT_EQ(BoundTo("AAAAAA"), Json::Value(Json::arrayValue));
  EXPECT_EQ(BoundTo("BBBBBB"), services);
  ExpectDeployed(Dir("sub", "svc"), "BBBBBB", five_);
  InstallHook("/usr/zeph/share/certificate.d/system", "system");
  InstallHook("/usr/zeph/share/certificate.d/sub", "sub");
  const Json::Value lost = ServiceObject("sub", "lost", false, "no-such-user-zz");
  SetBound("AAAAAA", JsonArray({web_, lost, svc_}));
  const std::string before = ReadFile(InfoPath());
  ASSERT_TRUE(ZEPH::test::MakeCertSet(Archive("AAAAAA"), "renewed"));
  bool restart = false;
  EXPECT_TRUE(!UpdateCertToService("AAAAAA", restart) && restart);  // "lost" fails alone
  ExpectDeployed(Dir("system", "default"), "AAAAAA", three_);
  ExpectDeployed(Dir("sub", "svc"), "AAAAAA", three_);
  EXPECT_FALSE(Exists(root_.Path("/tmp/certificate_sub_lost.lock")) || Exists(Dir("sub", "lost")));
  EXPECT_EQ(Hooks(), "system 1 default\nsub 1 svc\n");  // none for "lost"
  EXPECT_EQ(ReadFile(InfoPath()), before);
  const std::string victim = root_.Path("/usr/zeph/etc/victim");
  MakeDirs(victim);
  WriteFile(victim + "/keep", "precious");
  SetBound("AAAAAA", JsonArray({ServiceObject("..", "victim"), svc_}));
  EXPECT_FALSE(UpdateCertToService("AAAAAA", restart));
  EXPECT_TRUE(ReadFile(victim + "/keep") == "precious" && !Exists(victim + "/cert.pem"));
  SetBound("AAAAAA", JsonArray({svc_}));
  EXPECT_TRUE(UpdateCertToService("AAAAAA", restart) && !restart);
  restart = true;
  EXPECT_TRUE(!UpdateCertToService("MISSNG", restart) && restart);  // left alone
  root_.ClearLog();
  Json::Value info(Json::objectValue);
  info["AAAAAA"] = InfoEntry(JsonArray({ServiceObject("a", "one")}));
  info["BBBBBB"] = InfoEntry(JsonArray({web_, ServiceObject("a", "one")}));
  info["CCCCCC"] = "not an entry";
  WriteInfo(info);
  int holder = -1;
  const std::string lock = ZEPH::cert::InfoLockPath();
  ASSERT_TRUE(QLIBCFileLockTimeByFile(lock.c_str(), QLIBC_LOCK_SHARED, 0, &holder));
  const std::pair<Json::Value, const char*> lookups[] = {
      {web_, "BBBBBB"}, {ServiceObject("a", "one", true, "other"), "AAAAAA"},
      {ServiceObject("a", "two"), ""}};
  for (const auto& row : lookups) {
    std::string id;
    EXPECT_TRUE(GetServiceCertID(row.first, id) && id == row.second) << row.second;
  }
  QLIBCFileUnlockByFile(holder);
  Json::Value found;
  ASSERT_TRUE(GetServiceList("BBBBBB", found));
  EXPECT_EQ(found, info["BBBBBB"]["services"]);
  EXPECT_FALSE(GetServiceList("..", found) || GetServiceList("CCCCCC", found));
  EXPECT_EQ(root_.Log(), "");  // invalid ids are refused before INFO is read
  info["BBBBBB"].removeMember("services");
  WriteInfo(info);
  MakeArchiveCert("CCCCCC");
  for (const char* cert : {"BBBBBB", "CCCCCC"}) EXPECT_FALSE(GetServiceList(cert, found)) << cert;
  EXPECT_EQ(found, JsonArray({web_, ServiceObject("a", "one")}));  // unchanged
  std::string id;
  Json::Value malformed = web_;
  malformed["isPkg"] = "no";
  EXPECT_FALSE(GetServiceCertID(malformed, id));
  ZEPH::test::WriteInfoText("{");
  root_.ClearLog();
  EXPECT_FALSE(GetServiceCertID(web_, id));
  EXPECT_TRUE(root_.LogContains("Broken [" + InfoPath() + "].[0x"));
  ASSERT_EQ(ZEPH::test::Run({"/bin/rm", "-r", root_.Path("/tmp")}).status, 0);
  EXPECT_FALSE(GetServiceCertID(web_, id));
  EXPECT_TRUE(root_.LogContains("Failed to lock [" + lock + "]"));
}

}  // namespace
