// CRT set, Service set and the property writer.
#include <gtest/gtest.h>

#include "module/archive/info.h"
#include "module/methods/methods_test_support.h"
#include "module/methods/properties.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::ReadFile;

const char kService[] = "ZEPH.Core.Certificate.Service";

Json::Value Setting(const Json::Value& service, const std::string& id,
                    const std::string& old_id) {
  Json::Value s;
  s["service"] = service;
  s["id"] = id;
  s["old_id"] = old_id;
  return s;
}

TEST(CrtSet, DescriptionDefaultAndRecordCreation) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("a.example");
  Json::Value info = root.Info();
  info.removeMember(id);
  ASSERT_TRUE(ZEPH::JsonToFile(info, root.Archive("/INFO"), true));

  ZEPH::test::CallResult r = root.Call("ZEPH.Core.Certificate.CRT", "set",
                                       "{\"id\": \"" + id + "\", \"desc\": \"caf\xC3\xA9 'q'\", \"as_default\": true}");
  ASSERT_TRUE(r.ok());
  EXPECT_TRUE(r.data().isNull());
  Json::Value record;
  record["desc"] = "caf\xC3\xA9 'q'";
  record["services"] = Json::Value(Json::arrayValue);
  record["user_deletable"] = true;
  EXPECT_EQ(root.Info()[id], record);
  EXPECT_EQ(ReadFile(root.Archive("/DEFAULT")), id + "\n");
  EXPECT_EQ(root.Events().back()["message_id"].asUInt(), 0x12B00001u);

  // The four-argument form changes deletability and keeps the services.
  Json::Value bound = root.Info();
  bound[id]["services"].append(root.WebService());
  ASSERT_TRUE(ZEPH::JsonToFile(bound, root.Archive("/INFO"), true));
  ASSERT_TRUE(SetCrtProperty(id, "system", false, false));
  EXPECT_FALSE(root.Info()[id]["user_deletable"].asBool());
  EXPECT_EQ(root.Info()[id]["services"].size(), 1u);
  EXPECT_EQ(root.Info()[id]["desc"].asString(), "system");
}

TEST(CrtSet, FailuresAnswer5501AndStillLogTheDefaultAttempt) {
  ApplianceRoot root;
  ZEPH::test::CallResult r = root.Call("ZEPH.Core.Certificate.CRT", "set",
                                       "{\"id\": \"..\", \"desc\": \"\", \"as_default\": true}");
  EXPECT_EQ(r.code(), 5501);
  ASSERT_EQ(root.Events().size(), 1u);
  EXPECT_EQ(root.Events()[0]["message_id"].asUInt(), 0x12B00002u);
  EXPECT_EQ(root.Events()[0]["level"].asInt(), 3);
  EXPECT_FALSE(ZEPH::test::Exists(root.Archive("/DEFAULT")));

  const std::string id = root.CreateCertificate("b.example");
  ZEPH::test::WriteFile(root.Archive("/INFO"), "{broken");
  r = root.Call("ZEPH.Core.Certificate.CRT", "set",
                "{\"id\": \"" + id + "\", \"desc\": \"d\"}");
  EXPECT_EQ(r.code(), 5501);
  EXPECT_EQ(ReadFile(root.Archive("/INFO")), "{broken");
  EXPECT_TRUE(root.LogContains("Broken [" + root.Archive("/INFO") + "]"));
}

// A delete drops the record, revokes and only then removes the directory.
// A property change arriving in between must not catalogue it again.
TEST(CrtSet, ACertificateWhoseRecordWasDroppedIsNotCataloguedAgain) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("gone.example");
  ASSERT_TRUE(DropCertInfo(id));
  ASSERT_TRUE(ZEPH::test::Exists(root.Archive("/" + id + "/cert.pem")));
  ZEPH::test::CallResult r = root.Call("ZEPH.Core.Certificate.CRT", "set",
                                       "{\"id\": \"" + id + "\", \"desc\": \"back\"}");
  EXPECT_EQ(r.code(), 5501);
  EXPECT_FALSE(root.Info().isMember(id));
}

TEST(ServiceSet, ReportsExactlyTheBadSettingsAndAsksForARestart) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("web.example");
  const Json::Value web = root.WebService();
  Json::Value no_old_id = Setting(web, id, "");
  no_old_id.removeMember("old_id");
  Json::Value params;
  params["settings"].append(5);
  params["settings"].append(no_old_id);
  params["settings"].append(Setting(web, id, ""));

  ZEPH::test::CallResult r = root.Call(kService, "set", params);
  ASSERT_TRUE(r.ok());
  Json::Value failed(Json::arrayValue);
  failed.append(5);
  failed.append(no_old_id);
  EXPECT_EQ(r.data()["err_settings"], failed);
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(r.response.httpd_restart());
  EXPECT_TRUE(root.LogContains("Failed to ValidSettingObj[0]"));
  EXPECT_TRUE(root.LogContains("Failed to ValidSettingObj[1]"));
  ASSERT_EQ(root.Info()[id]["services"].size(), 1u);
  EXPECT_EQ(ReadFile(root.Path("/usr/zeph/etc/certificate/system/default/cert.pem")),
            ReadFile(root.Archive("/" + id + "/cert.pem")));
  const Json::Value last = root.Events().back();
  EXPECT_EQ(last["message_id"].asUInt(), 0x12B00007u);
  EXPECT_EQ(last["text1"].asString(), "web.example");
  EXPECT_EQ(last["text2"].asString(), web["display_name"].asString());
}

TEST(ServiceSet, AFailedBindingIsReportedWithoutARestart) {
  ApplianceRoot root;
  Json::Value params;
  params["settings"].append(Setting(root.WebService(), "nosuch", ""));
  ZEPH::test::CallResult r = root.Call(kService, "set", params);
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(r.data()["err_settings"].size(), 1u);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_FALSE(r.response.httpd_restart());
  EXPECT_EQ(root.Events().back()["message_id"].asUInt(), 0x12B00008u);
  EXPECT_EQ(root.Events().back()["level"].asInt(), 3);

  // A non-web service moves between certificates without a restart.
  const std::string a = root.CreateCertificate("a.example");
  const std::string b = root.CreateCertificate("b.example");
  Json::Value ftp = root.WebService();
  ftp["subscriber"] = "ftp";
  ftp["service"] = "ftpd";
  ftp["display_name"] = "FTP";
  Json::Value move;
  move["settings"].append(Setting(ftp, a, ""));
  ASSERT_TRUE(root.Call(kService, "set", move).ok());
  move["settings"][0] = Setting(ftp, b, a);
  r = root.Call(kService, "set", move);
  ASSERT_TRUE(r.ok());
  EXPECT_FALSE(r.data().isMember("err_settings"));
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_EQ(root.Info()[a]["services"].size(), 0u);
  EXPECT_EQ(root.Info()[b]["services"].size(), 1u);
}

}  // namespace
