// CRT recreate and delete, and the store reset; under failing storage and
// at once with other calls they are the fault sweep's and the soak's.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>

#include "module/archive/archive_testing.h"
#include "module/methods/methods_test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::Exists;
using ZEPH::test::ReadFile;

const char kCrt[] = "ZEPH.Core.Certificate.CRT";
const char kWebCert[] = "/usr/zeph/etc/certificate/system/default/cert.pem";

// A root with the certificate tool, a default certificate and the web
// service bound to it: what a provisioned appliance starts with.
class StoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    const std::string tool = root_.Path("/usr/zeph/bin/mkcert");
    if (!Exists(tool)) {
      ASSERT_EQ(ZEPH::test::Run({"/bin/cp", ZEPH::test::BinDir() + "/mkcert", tool}).status, 0);
    }
    ZEPH::test::CallResult r = root_.Call("ZEPH.Core.Certificate", "reset");
    ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
    default_id_ = Default();
    ASSERT_EQ(default_id_.size(), 6u);
  }

  void Bind(const Json::Value& service, const std::string& id,
            const std::string& old_id) {
    Json::Value params;
    params["settings"][0]["service"] = service;
    params["settings"][0]["id"] = id;
    params["settings"][0]["old_id"] = old_id;
    ZEPH::test::CallResult r = root_.Call("ZEPH.Core.Certificate.Service", "set", params);
    ASSERT_TRUE(r.ok());
    ASSERT_FALSE(r.data().isMember("err_settings"));
  }

  std::string Default() {
    std::string id = ReadFile(root_.Archive("/DEFAULT"));
    if (!id.empty()) id.pop_back();
    return id;
  }

  ApplianceRoot root_;
  std::string default_id_;
};

TEST_F(StoreTest, ResetMakesADefaultCertificateForEveryService) {
  // A reset's default serving every service is checked after a reset of
  // a broken catalogue below; its subject through the mkcert tool.
  // A second reset replaces the default and removes what users may delete,
  // keeping what they may not.
  const std::string mine = root_.CreateCertificate("mine.example");
  const std::string kept = root_.CreateCertificate("kept.example");
  Json::Value info = root_.Info();
  info[kept]["user_deletable"] = false;
  ASSERT_TRUE(ZEPH::JsonToFile(info, root_.Archive("/INFO"), true));
  ZEPH::test::CallResult r = root_.Call("ZEPH.Core.Certificate", "reset");
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(r.response.httpd_restart());
  EXPECT_EQ(r.data()["err_ids"], Json::Value(Json::arrayValue));
  const std::string new_default = Default();
  EXPECT_NE(new_default, default_id_);
  EXPECT_FALSE(Exists(root_.Archive("/" + mine)));
  EXPECT_FALSE(Exists(root_.Archive("/" + default_id_)));
  EXPECT_TRUE(Exists(root_.Archive("/" + kept)));
  std::vector<std::string> expected = {new_default, kept};
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(root_.Info().getMemberNames(), expected);
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00011u);
}

TEST_F(StoreTest, ResetSetsABrokenCatalogueAsideAndNeedsTheRegistry) {
  ZEPH::test::WriteFile(root_.Archive("/INFO"), "{ broken");
  ZEPH::test::CallResult r = root_.Call("ZEPH.Core.Certificate", "reset");
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(ReadFile(root_.Archive("/INFO.broken")), "{ broken");
  const std::string id = Default();
  EXPECT_EQ(root_.Info()[id]["services"].size(), 1u);
  EXPECT_EQ(ReadFile(root_.Path(kWebCert)), ReadFile(root_.Archive("/" + id + "/cert.pem")));
  EXPECT_TRUE(root_.LogContains("Failed to read cert info, it may missed or broken"));

  unlink(root_.Archive("/SERVICES").c_str());
  const std::vector<std::string> before = ZEPH::test::DirEntries(root_.Archive());
  r = root_.Call("ZEPH.Core.Certificate", "reset");
  EXPECT_EQ(r.code(), 5501);
  EXPECT_EQ(r.data(), Json::Value(Json::objectValue));
  EXPECT_EQ(ZEPH::test::DirEntries(root_.Archive()), before);
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00012u);
}

// A damaged catalogue or DEFAULT naming a directory outside the archive
// (or the archive itself) must not make the store act on it: reset drops the entry without removing
// the directory, and a DEFAULT of "../.." is no default at all.
TEST_F(StoreTest, NamesThatLeaveTheArchiveAreNeverActedOn) {
  const std::string victim = root_.Path("/usr/v");
  ZEPH::test::MakeDirs(victim);
  ZEPH::test::WriteFile(victim + "/keep", "precious");
  Json::Value info = root_.Info();
  info["../../../../v"] = ZEPH::test::InfoEntry();
  // A NUL byte would make the entry's directory the archive itself.
  info[std::string("\0abc", 4)] = ZEPH::test::InfoEntry();
  ASSERT_TRUE(ZEPH::JsonToFile(info, root_.Archive("/INFO"), true));

  ZEPH::test::CallResult r = root_.Call("ZEPH.Core.Certificate", "reset");
  ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
  EXPECT_EQ(ReadFile(victim + "/keep"), "precious");
  EXPECT_FALSE(root_.Info().isMember("../../../../v"));
  EXPECT_FALSE(root_.Info().isMember(std::string("\0abc", 4)));
  EXPECT_TRUE(Exists(root_.Archive("/DEFAULT")));
  EXPECT_TRUE(root_.LogContains("../../../../v is not a valid cert id"));

  // Deleting a certificate moves its services to the default; with a
  // DEFAULT that leaves the archive there is none, and nothing is copied
  // from the directory it names.
  ZEPH::test::MakeCertSet(victim, "victim");
  const std::string mine = root_.CreateCertificate("mine.example");
  Bind(root_.WebService(), mine, "");
  ZEPH::test::WriteFile(root_.Archive("/DEFAULT"), "../../../../v\n");
  r = root_.Call(kCrt, "delete", "{\"ids\": [\"" + mine + "\"]}");
  EXPECT_NE(ReadFile(root_.Path(kWebCert)), ReadFile(victim + "/cert.pem"));
  EXPECT_TRUE(root_.LogContains("Invalid default cert id [../../../../v]"))
      << root_.Log();
}

TEST_F(StoreTest, RecreateGivesNewKeysAndRedeploys) {
  const std::string before = ReadFile(root_.Archive("/" + default_id_ + "/privkey.pem"));
  const std::string subject =
      root_.Call(kCrt, "list").data()["certificates"][0]["subject"].toStyledString();
  ZEPH::test::CallResult r = root_.Call(kCrt, "recreate", "{\"id\": \"" + default_id_ + "\"}");
  ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
  EXPECT_EQ(r.data().getMemberNames(), std::vector<std::string>{"restart_httpd"});
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_NE(ReadFile(root_.Archive("/" + default_id_ + "/privkey.pem")), before);
  EXPECT_EQ(ReadFile(root_.Path(kWebCert)),
            ReadFile(root_.Archive("/" + default_id_ + "/cert.pem")));
  EXPECT_EQ(root_.Call(kCrt, "list").data()["certificates"][0]["subject"].toStyledString(),
            subject);
  EXPECT_FALSE(Exists(root_.Archive("/" + default_id_ + ".temp")));
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00009u);

  r = root_.Call(kCrt, "recreate", "{\"id\": \"nosuch\"}");
  EXPECT_EQ(r.code(), 5503);
  // An id that leads out of the archive removes nothing out there.
  ZEPH::test::MakeDirs(root_.Path("/usr/zeph/etc/certificate/outside.temp"));
  r = root_.Call(kCrt, "recreate", "{\"id\": \"../outside\"}");
  EXPECT_EQ(r.code(), 5503);
  EXPECT_TRUE(Exists(root_.Path("/usr/zeph/etc/certificate/outside.temp")));
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00010u);

  // A tool that fails leaves the certificate as it was.
  ZEPH::test::WriteFile(root_.Path("/usr/zeph/bin/mkcert"), "#!/bin/sh\nexit 1\n", 0755);
  const std::string key = ReadFile(root_.Archive("/" + default_id_ + "/privkey.pem"));
  EXPECT_EQ(root_.Call(kCrt, "recreate", "{\"id\": \"" + default_id_ + "\"}").code(), 5501);
  EXPECT_EQ(ReadFile(root_.Archive("/" + default_id_ + "/privkey.pem")), key);
  EXPECT_FALSE(Exists(root_.Archive("/" + default_id_ + ".temp")));
}

TEST_F(StoreTest, DeleteMovesServicesToTheDefaultAndSkipsTheDefault) {
  const std::string web_cert = root_.CreateCertificate("web.example");
  Bind(root_.WebService(), web_cert, default_id_);
  ASSERT_EQ(ReadFile(root_.Path(kWebCert)),
            ReadFile(root_.Archive("/" + web_cert + "/cert.pem")));
  const std::string other = root_.CreateCertificate("other.example");

  ZEPH::test::CallResult r = root_.Call(kCrt, "delete",
      "{\"ids\": [\"" + default_id_ + "\", \"" + web_cert + "\", \"" + other + "\"]}");
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_FALSE(r.data().isMember("err_ids"));
  EXPECT_FALSE(Exists(root_.Archive("/" + web_cert)));
  EXPECT_FALSE(Exists(root_.Archive("/" + other)));
  EXPECT_TRUE(Exists(root_.Archive("/" + default_id_)));
  EXPECT_EQ(ReadFile(root_.Path(kWebCert)),
            ReadFile(root_.Archive("/" + default_id_ + "/cert.pem")));
  EXPECT_EQ(root_.Info().getMemberNames(), std::vector<std::string>{default_id_});
  const Json::Value last = root_.Events().back();
  EXPECT_EQ(last["message_id"].asUInt(), 0x12B00005u);
  EXPECT_EQ(last["text1"].asString(), "other.example");

  r = root_.Call(kCrt, "delete", "{\"ids\": []}");
  ASSERT_TRUE(r.ok());
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
}

TEST_F(StoreTest, DeleteReportsTheIdsItCouldNotRemove) {
  const std::string a = root_.CreateCertificate("a.example");
  ZEPH::test::CallResult r = root_.Call(kCrt, "delete",
      "{\"ids\": [\"" + a + "\", \"nosuch\", \"../x\"]}");
  EXPECT_EQ(r.code(), 5501);
  Json::Value failed(Json::arrayValue);
  failed.append("nosuch");
  failed.append("../x");
  EXPECT_EQ(r.data()["err_ids"], failed);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_FALSE(Exists(root_.Archive("/" + a)));
  // A failed id is passed as the id: with no certificate behind it there is
  // no display name.
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00006u);
  EXPECT_EQ(root_.Events().back()["text1"].asString(), "");

  // Without a default certificate nothing is deleted at all.
  unlink(root_.Archive("/DEFAULT").c_str());
  r = root_.Call(kCrt, "delete", "{\"ids\": []}");
  EXPECT_EQ(r.code(), 5501);
  Json::Value data;
  data["restart_httpd"] = false;
  EXPECT_EQ(r.data(), data);
}

}  // namespace
