// The ACME settings as the page changes them and the tool reads them, and lego's DNS providers.
#include "acme/settings.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "acme/dns_providers.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace test {
namespace {

constexpr char kHmac[] = "zWNDZM6eQGHWpSRTPal5eIUYFTu7EajVIoguysqZ9wG44nMEtx3MUAsUDkMTQ12W";

class AcmeSettings : public ::testing::Test {
 protected:
  void SetUp() override { MakeDirs(dir_); }
  // Applies `update` (JSON text); returns the refused setting, "" when saved.
  std::string Update(const std::string& update, acme::Settings* saved = nullptr) {
    Json::Value value;
    EXPECT_TRUE(JsonParse(update, value)) << update;
    acme::Settings s;
    acme::SettingsError error;
    if (acme::UpdateSettings(dir_, value, saved ? saved : &s, &error)) return "";
    EXPECT_FALSE(error.message.empty());
    return error.setting.empty() ? "(document)" : error.setting;
  }
  std::string File() const { return ReadFile(dir_ + "/config.json"); }

  TempRoot root_;
  const std::string dir_ = root_.Path("/le");
};

// A refused update names the setting and changes nothing; what one saves the tool reads back.
TEST_F(AcmeSettings, RefusesBadUpdatesAndReadsBackWhatItSaved) {
  ASSERT_EQ(Update(R"({"key_type": "ec256", "timeout_s": 30})"), "");
  const bool lego_installed = access(acme::kLegoProgram, X_OK) == 0;
  const std::string before = File(), hmac = kHmac, lego = lego_installed ? "dns_provider" : "";
  const std::pair<std::string, std::string> kRows[] = {
      {"[]", "(document)"}, {R"({"colour": "blue"})", "colour"},
      {R"({"directory_url": "http://acme.example/dir"})", "directory_url"},
      {R"({"directory_url": 7})", "directory_url"}, {R"({"eab_kid": "kid-1"})", "eab_hmac_key"},
      {R"({"eab_hmac_key": ")" + hmac + "\"}", "eab_kid"},
      {R"({"eab_kid": "kid-1", "eab_hmac_key": "not base64!"})", "eab_hmac_key"},
      {R"({"eab_kid": "kid-1", "eab_hmac_key": "c2hvcnQ"})", "eab_hmac_key"},
      {R"({"eab_kid": "two words", "eab_hmac_key": ")" + hmac + "\"}", "eab_kid"},
      {R"({"http_address": "80"})", "http_address"},
      {R"({"http_webroot": "relative/dir"})", "http_webroot"},
      {R"({"http_webroot": ")" + root_.Path("/missing") + "\"}", "http_webroot"},
      {R"({"challenge": "webroot"})", "http_webroot"}, {R"({"challenge": "tls"})", "challenge"},
      {R"({"challenge": "dns"})", "dns_provider"}, {R"({"dns_provider": "../x"})", "dns_provider"},
      {R"({"dns_provider": "manual"})", "dns_provider"},
      {lego.empty() ? "[]" : R"({"dns_provider": "nosuchprovider"})",
       lego.empty() ? "(document)" : lego},
      {R"({"dns_resolvers": "127.0.0.1:53"})", "dns_resolvers"},
      {R"({"dns_resolvers": [":53"]})", "dns_resolvers"},
      {R"({"dns_disable_cp": "yes"})", "dns_disable_cp"},
      {R"({"environment": {"LEGO_CA_CERTIFICATES": "/x"}})", "environment"},
      {R"({"environment": {"1ST": "x"}})", "environment"},
      {R"({"environment": {"TOKEN": 5}})", "environment"},
      {R"({"key_type": "dsa1024"})", "key_type"}, {R"({"timeout_s": 0})", "timeout_s"},
      {R"({"timeout_s": "60"})", "timeout_s"},
      {R"({"ca_bundle_pem": "not a certificate"})", "ca_bundle_pem"},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.first);
    EXPECT_EQ(Update(row.first), row.second);
    EXPECT_EQ(File(), before);
    EXPECT_FALSE(Exists(dir_ + "/ca_bundle.pem"));
  }
  // What an update saves is what the tool reads back and what the page's view says of it.
  ASSERT_EQ(test::Run({"/usr/bin/openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt",
                 "ec_paramgen_curve:P-256", "-nodes", "-keyout", root_.Path("/ca.key"), "-out",
                 root_.Path("/ca.pem"), "-days", "2", "-subj", "/CN=Private ACME Root"})
                .status, 0);
  const std::string ca_pem = JsonCompact(Json::Value(ReadFile(root_.Path("/ca.pem"))));
  acme::Settings saved, loaded;
  ASSERT_EQ(Update(R"({"directory_url": "https://acme.example/dir", "ca_bundle_pem": )" + ca_pem +
                       R"(, "eab_kid": "kid-1", "eab_hmac_key": ")" + kHmac +
                       R"(", "dns_provider": "exec", "dns_resolvers": ["127.0.0.1:53"], )"
                       R"("dns_disable_cp": true, "environment": )"
                       R"({"EXEC_PATH": "/secret/hook", "TOKEN": "t0p"}})", &saved), "");
  EXPECT_EQ(ReadFile(dir_ + "/ca_bundle.pem"), ReadFile(root_.Path("/ca.pem")));
  acme::SettingsError error;
  ASSERT_TRUE(acme::LoadSettings(dir_, &loaded, &error)) << error.message;
  EXPECT_EQ(acme::SettingsToJson(loaded), acme::SettingsToJson(saved));
  EXPECT_EQ(acme::CaBundlePath(loaded, dir_), dir_ + "/ca_bundle.pem");
  const Json::Value view = acme::PublicView(loaded, dir_);
  EXPECT_EQ(JsonCompact(view["environment_names"]), "[\"EXEC_PATH\",\"TOKEN\"]");
  EXPECT_EQ(view["directory"].asString(), "custom");
  EXPECT_EQ(JsonCompact(view["ca_bundle_subjects"]), "[\"CN=Private ACME Root\"]");
  // A variable removed; another provider starts afresh; back to HTTP-01 and LE's staging.
  ASSERT_EQ(Update(R"({"environment": {"TOKEN": null}})", &saved), "");
  EXPECT_EQ(saved.environment, (std::map<std::string, std::string>{{"EXEC_PATH", "/secret/hook"}}));
  if (lego_installed) {
    ASSERT_EQ(Update(R"({"dns_provider": "cloudflare", "environment": {"CF_DNS_API_TOKEN": "cf"}})",
                     &saved), "");
    EXPECT_EQ(saved.environment.size(), 1u);
    Json::Value help;
    ASSERT_TRUE(acme::DnsProviderHelp("cloudflare", &help));
    EXPECT_EQ(help["name"].asString(), "Cloudflare");
    EXPECT_FALSE(acme::DnsProviderHelp("-h", &help));
  }
  ASSERT_EQ(Update(R"({"challenge": "http", "http_address": "127.0.0.1:8080", "directory_url": ")" +
                   std::string(acme::kLetsEncryptStagingDirectory) +
                   R"(", "ca_bundle_pem": "", "eab_kid": "", "eab_hmac_key": ""})", &saved), "");
  EXPECT_FALSE(Exists(dir_ + "/ca_bundle.pem"));
  const Json::Value back = acme::PublicView(saved, dir_);
  EXPECT_EQ(back["directory"].asString(), "letsencrypt_staging");
  EXPECT_EQ(acme::PublicView(acme::Settings(), dir_)["directory"].asString(), "letsencrypt");
  EXPECT_FALSE(back["ca_bundle_is_set"].asBool());
  EXPECT_FALSE(back["eab_hmac_key_is_set"].asBool());
  EXPECT_EQ(File().find(kHmac), std::string::npos);
  // A bundle gone missing keeps the tool from starting; an update that clears it repairs.
  WriteFile(dir_ + "/config.json", R"({"ca_bundle": "gone.pem"})", 0600);
  EXPECT_FALSE(acme::LoadSettings(dir_, &loaded, &error));
  EXPECT_EQ(error.setting, "ca_bundle");
  EXPECT_EQ(Update(R"({"timeout_s": 60})"), "ca_bundle");
  EXPECT_EQ(Update(R"({"ca_bundle_pem": ""})"), "");
  EXPECT_TRUE(acme::LoadSettings(dir_, &loaded, &error)) << error.message;
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
