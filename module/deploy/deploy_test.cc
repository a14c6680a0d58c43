#include "module/deploy/deploy.h"

#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "module/archive/archive_testing.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::DirEntries;
using ZEPH::test::Exists;
using ZEPH::test::JsonArray;
using ZEPH::test::MakeArchiveCert;
using ZEPH::test::MakeDirs;
using ZEPH::test::ReadFile;
using ZEPH::test::ReadInfo;
using ZEPH::test::ServiceObject;
using ZEPH::test::WriteFile;
using ZEPH::test::WriteInfo;
using Names = std::vector<std::string>;

// Everything about a directory that a deployment could change.
std::string Snapshot(const std::string& dir) {
  struct stat st;
  if (stat(dir.c_str(), &st) != 0) return "absent";
  std::string out = std::to_string(st.st_ino) + "\n";
  for (const std::string& name : DirEntries(dir)) {
    stat((dir + "/" + name).c_str(), &st);
    out += name + " " + std::to_string(st.st_mode) + " " +
           std::to_string(st.st_ino) + " " + ReadFile(dir + "/" + name) + "\n";
  }
  return out;
}

class DeployTest : public ::testing::Test {
 protected:
  void SetUp() override {
    MakeArchiveCert("AAAAAA");  // the three required files
    ZEPH::test::CertSetOptions full;
    full.chain = full.ca = true;
    MakeArchiveCert("BBBBBB", full);  // all five
    Json::Value info(Json::objectValue);
    info["AAAAAA"] = ZEPH::test::InfoEntry();
    info["BBBBBB"] = ZEPH::test::InfoEntry();
    WriteInfo(info);
  }
  std::string Archive(const std::string& id) const {
    return root_.Path("/usr/zeph/etc/certificate/_archive/" + id);
  }
  std::string Dir(const std::string& sub, const std::string& svc,
                  bool pkg = false) const {
    return root_.Path(std::string("/usr/") + (pkg ? "local" : "zeph") +
                      "/etc/certificate/" + sub + "/" + svc);
  }
  // A hook that appends "<tag> <argument count> <first argument>" to hooks.log.
  void InstallHook(const std::string& path, const std::string& tag,
                   mode_t mode = 0755) {
    MakeDirs(root_.Path(path.substr(0, path.rfind('/'))));
    WriteFile(root_.Path(path),
              "#!/bin/sh\nprintf '%s %s %s\\n' " + tag + " \"$#\" \"$1\" >> " +
                  root_.Path("/hooks.log") + "\n",
              mode);
  }
  std::string Hooks() const { return ReadFile(root_.Path("/hooks.log")); }
  Json::Value BoundTo(const std::string& id) const {
    return ReadInfo()[id]["services"];
  }
  bool Logged(const std::string& message) const {
    return ZEPH::test::HasUtilsLine(root_.Log(), message);
  }
  // `dir` holds exactly certificate `id`'s copies of the `files`.
  void ExpectDeployed(const std::string& dir, const std::string& id,
                      const Names& files) {
    EXPECT_EQ(DirEntries(dir), files) << dir;
    for (const std::string& name : files) {
      EXPECT_EQ(ReadFile(dir + "/" + name), ReadFile(Archive(id) + "/" + name))
          << name;
    }
  }
  void SetBound(const std::string& id, const Json::Value& services) {
    Json::Value info = ReadInfo();
    info[id]["services"] = services;
    WriteInfo(info);
  }

  ZEPH::test::TempRoot root_;
  const Json::Value svc_ = ServiceObject("sub", "svc");
  const Names three_ = {"cert.pem", "fullchain.pem", "privkey.pem"};
  const Names five_ = {"cert.pem", "chain.pem", "fullchain.pem", "privkey.pem",
                       "zeph-ca-cert.pem"};
};

TEST_F(DeployTest, DeploysTheFilesWithModesOwnerAndOptionalFiles) {
  WriteFile(Archive("AAAAAA") + "/renew.json", "{}");  // not part of the set
  const Json::Value web = ServiceObject("system", "default");
  const Json::Value pkg = ServiceObject("pkg", "web", true);
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({web}), "", CRT_ACTION_SET));
  ASSERT_TRUE(DeployCrt("BBBBBB", JsonArray({pkg}), "", CRT_ACTION_SET));

  const std::string dir = Dir("system", "default");
  ExpectDeployed(dir, "AAAAAA", three_);
  for (const std::string& name : three_) {
    struct stat st;
    ASSERT_EQ(stat((dir + "/" + name).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0400u) << name;
    EXPECT_EQ(st.st_uid, geteuid());
    EXPECT_EQ(st.st_gid, getegid());
  }
  EXPECT_EQ(ZEPH::test::ModeOf(dir), 0755u);
  EXPECT_EQ(DirEntries(root_.Path("/usr/zeph/etc/certificate/system")),
            Names{"default"});
  ExpectDeployed(Dir("pkg", "web", true), "BBBBBB", five_);
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({web}));
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({pkg}));
  // Under a private root there is no relay daemon to reload.
  EXPECT_TRUE(Logged("Reload zephrelayd failed."));

  // A smaller set replaces a bigger one whole.
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({pkg}), "BBBBBB", CRT_ACTION_SET));
  ExpectDeployed(Dir("pkg", "web", true), "AAAAAA", three_);

  if (geteuid() == 0) {  // only root can give files away
    ASSERT_TRUE(DeployCrt("AAAAAA",
                          JsonArray({ServiceObject("o", "s", false, "nobody")}),
                          "", CRT_ACTION_SET));
    struct stat st;
    ASSERT_EQ(stat((Dir("o", "s") + "/privkey.pem").c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, ZEPH::test::UnprivilegedUid());
    EXPECT_EQ(st.st_gid, ZEPH::test::UnprivilegedGid());
  }
}

TEST_F(DeployTest, InfoBookkeepingMovesEachServiceOnce) {
  const Json::Value other = ServiceObject("sub", "other");
  SetBound("AAAAAA", JsonArray({svc_, other}));
  ASSERT_TRUE(DeployCrt("BBBBBB", JsonArray({svc_}), "AAAAAA", CRT_ACTION_SET));
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({other}));
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({svc_}));
  ExpectDeployed(Dir("sub", "svc"), "BBBBBB", five_);

  // Bound again to the same certificate: one copy, at the end.
  Json::Value renamed = svc_;
  renamed["display_name"] = "new name";
  SetBound("BBBBBB", JsonArray({svc_, other}));
  SetBound("AAAAAA", Json::Value(Json::arrayValue));
  ASSERT_TRUE(
      DeployCrt("BBBBBB", JsonArray({renamed}), "BBBBBB", CRT_ACTION_FALLBACK));
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({other, renamed}));

  // Without an old id only the target changes.
  const Json::Value fresh = ServiceObject("sub", "fresh");
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({fresh}), "", CRT_ACTION_RESET));
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({fresh}));
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({other, renamed}));

  // An old id that is stale (another request moved the service since, or
  // none was given): the entry that holds the service now loses it, so it
  // is never bound twice.
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({other}), "", CRT_ACTION_SET));
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({fresh, other}));
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({renamed}));
  ASSERT_TRUE(DeployCrt("BBBBBB", JsonArray({fresh}), "BBBBBB", CRT_ACTION_SET));
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({other}));
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({renamed, fresh}));
}

TEST_F(DeployTest, MissingInfoRecordsFailAfterTheFilesWereDeployed) {
  MakeArchiveCert("CCCCCC");  // a valid certificate that INFO does not list
  const std::string before = ReadFile(ZEPH::test::InfoPath());
  EXPECT_FALSE(
      DeployCrt("AAAAAA", JsonArray({svc_}), "ZZZZZZ", CRT_ACTION_SET));
  EXPECT_FALSE(DeployCrt("CCCCCC", JsonArray({svc_}), "", CRT_ACTION_SET));
  for (const char* id : {"ZZZZZZ", "CCCCCC"}) {
    EXPECT_TRUE(
        Logged("Broken [" + ZEPH::test::InfoPath() + "][" + id + "].[0x"));
  }
  EXPECT_TRUE(Logged("Failed to update cert info for [" +
                     ZEPH::JsonCompact(svc_) + "] from ZZZZZZ to AAAAAA"));
  EXPECT_EQ(ReadFile(ZEPH::test::InfoPath()), before);
  ExpectDeployed(Dir("sub", "svc"), "CCCCCC", three_);

  // CRT_ACTION_UPDATE does not even open INFO: no record is needed.
  InstallHook("/usr/zeph/share/certificate.d/sub", "hook");
  ASSERT_TRUE(
      DeployCrt("CCCCCC", JsonArray({svc_}), "ZZZZZZ", CRT_ACTION_UPDATE));
  EXPECT_EQ(ReadFile(ZEPH::test::InfoPath()), before);
  EXPECT_EQ(Hooks(), "hook 1 svc\n");
}

TEST_F(DeployTest, SyncRedeploysTheBoundCertificateWithoutHook) {
  InstallHook("/usr/zeph/share/certificate.d/sub", "hook");
  const Json::Value other = ServiceObject("sub", "other");
  SetBound("BBBBBB", JsonArray({svc_, other}));
  // Asked for AAAAAA; the service is bound to BBBBBB.
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({svc_}), "", CRT_ACTION_SYNC));
  ExpectDeployed(Dir("sub", "svc"), "BBBBBB", five_);
  EXPECT_EQ(BoundTo("BBBBBB"), JsonArray({other, svc_}));
  EXPECT_EQ(BoundTo("AAAAAA"), Json::Value(Json::arrayValue));
  // A service bound to nothing gets the certificate asked for.
  const Json::Value fresh = ServiceObject("sub", "fresh");
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({fresh}), "", CRT_ACTION_SYNC));
  ExpectDeployed(Dir("sub", "fresh"), "AAAAAA", three_);
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({fresh}));
  EXPECT_EQ(Hooks(), "");
}

TEST_F(DeployTest, HooksGetTheServiceNameShareFirst) {
  InstallHook("/usr/zeph/share/certificate.d/sys", "share");
  InstallHook("/usr/libexec/certificate.d/sys", "libexec");
  InstallHook("/usr/libexec/certificate.d/sys2", "libexec2");
  InstallHook("/usr/local/libexec/certificate.d/pkg", "pkg-libexec");
  InstallHook("/usr/local/share/certificate.d/pkg", "pkg-share");
  InstallHook("/usr/zeph/share/certificate.d/pkg", "wrong");  // system side
  WriteFile(root_.Path("/usr/zeph/share/certificate.d/fails"),
            "#!/bin/sh\nexit 3\n", 0755);
  ASSERT_TRUE(DeployCrt(
      "AAAAAA",
      JsonArray({ServiceObject("sys", "first service"),
                 ServiceObject("sys2", "second"),
                 ServiceObject("pkg", "third", true),
                 ServiceObject("nohook", "fourth"),
                 ServiceObject("fails", "fifth")}),  // its own business
      "", CRT_ACTION_SET));
  EXPECT_EQ(Hooks(),
            "share 1 first service\nlibexec2 1 second\npkg-share 1 third\n");

  // A hook that cannot be run fails its element after the binding.
  InstallHook("/usr/zeph/share/certificate.d/sub", "hook", 0644);
  EXPECT_FALSE(DeployCrt("AAAAAA", JsonArray({svc_}), "", CRT_ACTION_SET));
  EXPECT_TRUE(Logged("Failed to [" +
                     root_.Path("/usr/zeph/share/certificate.d/sub") +
                     "][svc].[0x"));
  EXPECT_TRUE(Logged("Failed to reload [" + ZEPH::JsonCompact(svc_) + "]"));
  ExpectDeployed(Dir("sub", "svc"), "AAAAAA", three_);
  EXPECT_EQ(BoundTo("AAAAAA")[5], svc_);
}

TEST_F(DeployTest, AFailedCopyLeavesTheServiceDirectoryAsItWas) {
  ASSERT_TRUE(DeployCrt("AAAAAA", JsonArray({svc_}), "", CRT_ACTION_SET));
  const std::string dir = Dir("sub", "svc");
  const std::string before = Snapshot(dir);
  // BBBBBB's "chain.pem" is a directory: cp refuses it half-way through.
  unlink((Archive("BBBBBB") + "/chain.pem").c_str());
  MakeDirs(Archive("BBBBBB") + "/chain.pem");
  EXPECT_FALSE(
      DeployCrt("BBBBBB", JsonArray({svc_}), "AAAAAA", CRT_ACTION_SET));
  EXPECT_TRUE(Logged("Failed to copy cert files from " + Archive("BBBBBB") +
                     " to " + dir + ".temp"));
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({svc_}));
  // The bound certificate lost its full chain: a sync fails the same way.
  unlink((Archive("AAAAAA") + "/fullchain.pem").c_str());
  EXPECT_FALSE(DeployCrt("BBBBBB", JsonArray({svc_}), "", CRT_ACTION_SYNC));
  EXPECT_TRUE(Logged("Failed to copy cert files from " + Archive("AAAAAA") +
                     " to " + dir + ".temp"));
  EXPECT_EQ(Snapshot(dir), before);
  EXPECT_FALSE(Exists(dir + ".temp"));

  // An owner that is no user fails before any lock or copy.
  const Json::Value lost =
      ServiceObject("sub", "lost", false, "no-such-user-zz");
  EXPECT_FALSE(DeployCrt("BBBBBB", JsonArray({lost}), "", CRT_ACTION_SET));
  EXPECT_TRUE(Logged("Failed to ZEPHUserGetUGID [no-such-user-zz].[0x"));
  EXPECT_TRUE(Logged("Failed to set cert [BBBBBB] for [" +
                     ZEPH::JsonCompact(lost) + "]"));
  EXPECT_FALSE(Exists(root_.Path("/tmp/certificate_sub_lost.lock")));
  EXPECT_EQ(DirEntries(root_.Path("/usr/zeph/etc/certificate/sub")), Names{"svc"});
}

TEST_F(DeployTest, BadInputIsRefused) {
  const Json::Value list = JsonArray({svc_});
  struct Case {
    std::string id;
    Json::Value services;
    int action;
    const char* line;
  } cases[] = {
      {"", list, 1, "Invalid params (cert_id/services)"},
      {"..", list, 1, "Invalid params (cert_id/services)"},
      {"AAAAAA/..", list, 1, "Invalid params (cert_id/services)"},
      {"MISSNG", list, 1, "Invalid params (cert_id/services)"},
      {"AAAAAA", svc_, 1, "Invalid params (cert_id/services)"},
      {"AAAAAA", Json::Value(), 1, "Invalid params (cert_id/services)"},
      {"AAAAAA", list, 5, "Wrong rgCRTActionInfo."},
      {"AAAAAA", list, -1, "Wrong rgCRTActionInfo."},
  };
  for (const Case& c : cases) {
    root_.ClearLog();
    EXPECT_FALSE(
        DeployCrt(c.id, c.services, "", static_cast<CRT_ACTION>(c.action)));
    EXPECT_TRUE(Logged(c.line)) << c.id << " " << c.action;
    EXPECT_EQ(c.action == 1, !Logged("Invalid params (action)"));
    EXPECT_FALSE(root_.LogContains("zephrelayd"));  // refused before the reload
  }
  EXPECT_FALSE(Exists(Dir("sub", "svc")));
  EXPECT_TRUE(
      DeployCrt("AAAAAA", Json::Value(Json::arrayValue), "", CRT_ACTION_SET));
  EXPECT_TRUE(Logged("Reload zephrelayd failed."));

  // Bad elements fail alone; the good ones around them are deployed.
  Json::Value wrong_type = ServiceObject("sub", "a");
  wrong_type["isPkg"] = "false";
  Json::Value empty_name = ServiceObject("sub", "b");
  empty_name["service"] = "";
  // A name that climbs out of the service directories is refused, and a
  // ".." subscriber would otherwise replace "<root>/usr/zeph/etc/<service>".
  const Json::Value climbing = ServiceObject("../../../../escape", "svc");
  const Json::Value parent = ServiceObject("..", "certificate");
  EXPECT_FALSE(
      DeployCrt("AAAAAA",
                JsonArray({wrong_type, ServiceObject("sub", "good"), empty_name,
                           "text", climbing, parent, ServiceObject("sub", "good2")}),
                "", CRT_ACTION_SET));
  EXPECT_TRUE(Logged("service object is error."));
  EXPECT_TRUE(Logged("Invalid service name [../../../../escape]"));
  EXPECT_TRUE(Exists(root_.Path("/usr/zeph/etc/certificate/_archive/AAAAAA")));
  EXPECT_EQ(BoundTo("AAAAAA"), JsonArray({ServiceObject("sub", "good"),
                                          ServiceObject("sub", "good2")}));
  EXPECT_EQ(DirEntries(root_.Path("/usr/zeph/etc/certificate/sub")),
            (Names{"good", "good2"}));
  EXPECT_FALSE(Exists(root_.Path("/escape")));

  // A broken INFO stops every element before its copy.
  for (const char* text : {"{\"AAAAAA\": {", ""}) {
    WriteFile(ZEPH::test::InfoPath(), text);
    if (*text == '\0') unlink(ZEPH::test::InfoPath().c_str());
    EXPECT_FALSE(DeployCrt("AAAAAA", list, "", CRT_ACTION_SET));
    EXPECT_TRUE(
        Logged("Failed to check service exist for " + ZEPH::JsonCompact(svc_)));
    EXPECT_EQ(ReadFile(ZEPH::test::InfoPath()), text);
  }
  EXPECT_FALSE(Exists(Dir("sub", "svc")));
}

TEST_F(DeployTest, DefaultCertificateComesFromTheDefaultFile) {
  const std::string def = Archive("DEFAULT");
  EXPECT_EQ(GetDefCrtId(), "");  // no file: no log line
  EXPECT_EQ(root_.Log(), "");
  for (const char* text : {"BBBBBB\n", "BBBBBB"}) {
    WriteFile(def, text);
    EXPECT_EQ(GetDefCrtId(), "BBBBBB");
  }
  WriteFile(def, "");
  EXPECT_EQ(GetDefCrtId(), "");
  WriteFile(def, "ABCDEFGHIJKLMNOPQRS\n");  // only 15 characters are read
  MakeDirs(Archive("ABCDEFGHIJKLMNO"));
  EXPECT_EQ(GetDefCrtId(), "ABCDEFGHIJKLMNO");

  WriteFile(def, "GONE12\n");
  EXPECT_EQ(GetDefCrtId(), "");
  EXPECT_TRUE(Logged("[" + Archive("GONE12") + "] doesn't exist.[0x"));
  Json::Value services = JsonArray({svc_});
  SetBound("AAAAAA", services);
  EXPECT_FALSE(DeployDefCrt(services, CRT_ACTION_FALLBACK, "AAAAAA"));
  EXPECT_FALSE(Exists(Dir("sub", "svc")));

  WriteFile(def, "BBBBBB\n");
  ASSERT_TRUE(DeployDefCrt(services, CRT_ACTION_FALLBACK, "AAAAAA"));
  EXPECT_EQ(BoundTo("AAAAAA"), Json::Value(Json::arrayValue));
  EXPECT_EQ(BoundTo("BBBBBB"), services);
  ExpectDeployed(Dir("sub", "svc"), "BBBBBB", five_);
}

TEST_F(DeployTest, UpdatePushesAChangedCertificateToItsServices) {
  InstallHook("/usr/zeph/share/certificate.d/system", "system");
  InstallHook("/usr/zeph/share/certificate.d/sub", "sub");
  const Json::Value web = ServiceObject("system", "default");
  const Json::Value lost =
      ServiceObject("sub", "lost", false, "no-such-user-zz");
  SetBound("AAAAAA", JsonArray({web, lost, svc_}));
  const std::string before = ReadFile(ZEPH::test::InfoPath());
  ASSERT_TRUE(ZEPH::test::MakeCertSet(Archive("AAAAAA"), "renewed"));

  bool restart = false;
  EXPECT_FALSE(UpdateCertToService("AAAAAA", restart));  // "lost" fails alone
  EXPECT_TRUE(restart);
  ExpectDeployed(Dir("system", "default"), "AAAAAA", three_);
  ExpectDeployed(Dir("sub", "svc"), "AAAAAA", three_);
  EXPECT_TRUE(Logged("Failed to set cert [AAAAAA] for [" +
                     ZEPH::JsonCompact(lost) + "]"));
  EXPECT_EQ(Hooks(), "system 1 default\nsub 1 svc\n");  // none for "lost"
  EXPECT_TRUE(Logged("Failed to reload zephrelayd"));
  EXPECT_EQ(ReadFile(ZEPH::test::InfoPath()), before);

  // A service name from a damaged catalogue never leads the copy out of
  // the service directories.
  const std::string victim = root_.Path("/usr/zeph/etc/victim");
  ZEPH::test::MakeDirs(victim);
  ZEPH::test::WriteFile(victim + "/keep", "precious");
  SetBound("AAAAAA", JsonArray({ServiceObject("..", "victim"), svc_}));
  EXPECT_FALSE(UpdateCertToService("AAAAAA", restart));
  EXPECT_EQ(ReadFile(victim + "/keep"), "precious");
  EXPECT_FALSE(ZEPH::test::Exists(victim + "/cert.pem"));
  EXPECT_TRUE(Logged("Invalid service name [..]"));
  ExpectDeployed(Dir("sub", "svc"), "AAAAAA", three_);

  SetBound("AAAAAA", JsonArray({svc_}));
  EXPECT_TRUE(UpdateCertToService("AAAAAA", restart));
  EXPECT_FALSE(restart);
  root_.ClearLog();
  restart = true;
  EXPECT_FALSE(UpdateCertToService("MISSNG", restart));
  EXPECT_TRUE(restart);  // left alone
  EXPECT_TRUE(Logged("Failed to get service list of MISSNG"));
}

}  // namespace
