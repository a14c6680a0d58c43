// CRT set, Service set and the property writer. Both methods under failing
// storage are the fault sweep's.
#include <gtest/gtest.h>

#include "module/archive/info.h"
#include "module/methods/methods_test_support.h"
#include "module/methods/properties.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::ReadFile;

const char kService[] = "ZEPH.Core.Certificate.Service";

Json::Value Settings(const std::vector<Json::Value>& settings) {
  Json::Value p;
  p["settings"] = Json::Value(Json::arrayValue);
  for (const Json::Value& s : settings) p["settings"].append(s);
  return p;
}

Json::Value Setting(const Json::Value& service, const std::string& id,
                    const std::string& old_id) {
  Json::Value s;
  s["service"] = service;
  s["id"] = id;
  s["old_id"] = old_id;
  return s;
}

ZEPH::test::CallResult SetCrt(const ApplianceRoot& root, const std::string& rest) {
  return root.Call("ZEPH.Core.Certificate.CRT", "set", "{" + rest + "}");
}

TEST(CrtSet, DescriptionDefaultAndRecords) {
  ApplianceRoot root;
  // A failure still logs the attempt to set the default.
  EXPECT_EQ(SetCrt(root, "\"id\": \"..\", \"desc\": \"\", \"as_default\": true").code(), 5501);
  ASSERT_EQ(root.Events().size(), 1u);
  EXPECT_EQ(root.Events()[0]["message_id"].asUInt(), 0x12B00002u);
  EXPECT_EQ(root.Events()[0]["level"].asInt(), 3);
  EXPECT_FALSE(ZEPH::test::Exists(root.Archive("/DEFAULT")));

  // A certificate without a record gets one.
  const std::string id = root.CreateCertificate("a.example");
  Json::Value info = root.Info();
  info.removeMember(id);
  ASSERT_TRUE(ZEPH::JsonToFile(info, root.Archive("/INFO"), true));
  ZEPH::test::CallResult r =
      SetCrt(root, "\"id\": \"" + id + "\", \"desc\": \"caf\xC3\xA9 'q'\", \"as_default\": true");
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
  record["desc"] = "system";
  record["services"] = bound[id]["services"];
  record["user_deletable"] = false;
  EXPECT_EQ(root.Info()[id], record);

  // A delete drops the record, revokes and only then removes the
  // directory: a change arriving in between must not catalogue it again.
  const std::string gone = root.CreateCertificate("gone.example");
  ASSERT_TRUE(DropCertInfo(gone));
  EXPECT_EQ(SetCrt(root, "\"id\": \"" + gone + "\", \"desc\": \"back\"").code(), 5501);
  EXPECT_FALSE(root.Info().isMember(gone));

  ZEPH::test::WriteFile(root.Archive("/INFO"), "{broken");
  EXPECT_EQ(SetCrt(root, "\"id\": \"" + id + "\", \"desc\": \"d\"").code(), 5501);
  EXPECT_EQ(ReadFile(root.Archive("/INFO")), "{broken");
  EXPECT_TRUE(root.LogContains("Broken [" + root.Archive("/INFO") + "]"));
}

TEST(ServiceSet, ReportsExactlyTheBadSettingsAndRestartsOnlyForTheWebService) {
  ApplianceRoot root;
  const Json::Value web = root.WebService();
  ZEPH::test::CallResult r = root.Call(kService, "set", Settings({Setting(web, "nosuch", "")}));
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(r.data()["err_settings"].size(), 1u);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_FALSE(r.response.httpd_restart());
  EXPECT_EQ(root.Events().back()["message_id"].asUInt(), 0x12B00008u);
  EXPECT_EQ(root.Events().back()["level"].asInt(), 3);

  const std::string a = root.CreateCertificate("a.example");
  Json::Value no_old_id = Setting(web, a, "");
  no_old_id.removeMember("old_id");
  r = root.Call(kService, "set", Settings({Json::Value(5), no_old_id, Setting(web, a, "")}));
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(r.data()["err_settings"], Settings({Json::Value(5), no_old_id})["settings"]);
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(r.response.httpd_restart());
  EXPECT_TRUE(root.LogContains("Failed to ValidSettingObj[0]"));
  EXPECT_TRUE(root.LogContains("Failed to ValidSettingObj[1]"));
  ASSERT_EQ(root.Info()[a]["services"].size(), 1u);
  EXPECT_EQ(ReadFile(root.Path("/usr/zeph/etc/certificate/system/default/cert.pem")),
            ReadFile(root.Archive("/" + a + "/cert.pem")));
  const Json::Value last = root.Events().back();
  EXPECT_EQ(last["message_id"].asUInt(), 0x12B00007u);
  EXPECT_EQ(last["text1"].asString(), "a.example");
  EXPECT_EQ(last["text2"].asString(), web["display_name"].asString());

  // A non-web service moves between certificates without a restart.
  const std::string b = root.CreateCertificate("b.example");
  Json::Value ftp = web;
  ftp["subscriber"] = "ftp";
  ftp["service"] = "ftpd";
  ftp["display_name"] = "FTP";
  ASSERT_TRUE(root.Call(kService, "set", Settings({Setting(ftp, a, "")})).ok());
  r = root.Call(kService, "set", Settings({Setting(ftp, b, a)}));
  ASSERT_TRUE(r.ok());
  EXPECT_FALSE(r.data().isMember("err_settings"));
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_EQ(root.Info()[a]["services"].size(), 1u);  // the web service only
  EXPECT_EQ(root.Info()[b]["services"].size(), 1u);
  EXPECT_EQ(root.Info()[b]["services"][0]["service"].asString(), "ftpd");
}

}  // namespace
