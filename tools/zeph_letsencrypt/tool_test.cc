// zeph-letsencrypt as the module runs it: a child process in a provisioned
// root, answering one JSON object. The ACME cases run lego against a real
// pebble server on 127.0.0.1; nothing is sent anywhere else.
#include <dirent.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>
#include <sys/socket.h>

#include <algorithm>
#include <map>

#include "acme/settings.h"
#include "module/common/ssl_ptr.h"
#include "module/methods/methods_test_support.h"
#include "pebble_test_support.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_lock.h"

namespace ZEPH {
namespace test {
namespace {

const char kDomain[] = "nas.zeph.test";
const char kEmail[] = "admin@zeph.test";
const std::vector<std::string> kSetFiles = {"cert.pem", "chain.pem", "fullchain.pem",
                                            "privkey.pem", "renew.json"};

std::vector<ssl::X509Ptr> Certs(const std::string& pem) {
  std::vector<ssl::X509Ptr> out;
  ssl::BioPtr bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  while (X509* c = PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)) {
    out.emplace_back(c);
  }
  return out;
}

std::map<std::string, std::string> Snapshot(const std::string& dir) {
  std::map<std::string, std::string> files;
  for (const std::string& name : DirEntries(dir)) files[name] = ReadFile(dir + "/" + name);
  return files;
}

// Entries of the archive that are neither certificates nor catalogue
// files: what a renewal might leave behind.
std::vector<std::string> Leftovers(const ApplianceRoot& root) {
  std::vector<std::string> out;
  for (const std::string& n : DirEntries(root.Archive())) {
    if (n[0] == '.') out.push_back(n);
  }
  return out;
}

// A configuration whose server, should anything reach lego, is a closed
// port of 127.0.0.1.
Json::Value ClosedServerConfig() {
  Json::Value c;
  c["directory_url"] = "https://127.0.0.1:" + std::to_string(FreePort()) + "/dir";
  c["http_address"] = "127.0.0.1:" + std::to_string(FreePort());
  return c;
}

TEST(ZephLetsencryptTool, BadCommandLinesAnswer200AndTouchNothing) {
  ApplianceRoot root;
  WriteToolConfig(ClosedServerConfig());
  const std::vector<std::vector<std::string>> lines = {
      {},
      {"frobnicate"},
      {"new-cert", "-d", kDomain, "-m", kEmail},
      {"new-cert", "-d", kDomain, "-m", kEmail, "-c"},
      {"new-cert", "-d", kDomain, "-d", kDomain, "-m", kEmail, "-c", "Ab12Cd.temp"},
      {"new-cert", "-d", kDomain, "-m", kEmail, "-c", "../escape"},
      {"new-cert", "-d", kDomain, "-m", kEmail, "-c", ".."},
      {"renew"},
      {"renew", "-d", kDomain},
      {"renew", "-c", "a/b"},
      {"revoke", "-c", ""},
      {"revoke", "-c", "Ab12Cd", "extra"},
      {"revoke", "--c", "Ab12Cd"},
  };
  for (const auto& args : lines) {
    std::string shown;
    for (const std::string& a : args) shown += "[" + a + "]";
    SCOPED_TRACE(shown);
    EXPECT_EQ(RunTool(args).error(), 200);
  }
  EXPECT_EQ(DirEntries(root.Archive()), (std::vector<std::string>{"SERVICES"}));
  EXPECT_FALSE(Exists(root.Path("/usr/zeph/etc/letsencrypt/work")));
}

TEST(ZephLetsencryptTool, RefusesBadInputBeforeAskingAnyServer) {
  ApplianceRoot root;
  WriteToolConfig(ClosedServerConfig());
  for (const char* domain : {"", "-a.example", "a..example", "a_b.example", "exa mple.com",
                             "example.com.", "*.", "a.*.example", "\xC3\xA9t\xC3\xA9.example",
                             "a.example,", "a.example,,b.example", ",a.example",
                             "a.example,b_c.example", " a.example"}) {
    SCOPED_TRACE(domain);
    EXPECT_EQ(RunTool({"new-cert", "-d", domain, "-m", kEmail, "-c", "Ab12Cd.temp"}).error(),
              102);
  }
  // A wildcard name is validated with DNS-01 only.
  for (const char* domain : {"*.zeph.test", "nas.zeph.test,*.zeph.test"}) {
    SCOPED_TRACE(domain);
    ToolAnswer w = RunTool({"new-cert", "-d", domain, "-m", kEmail, "-c", "Ab12Cd.temp"});
    EXPECT_EQ(w.error(), 102);
    EXPECT_NE(w.msg().find("DNS-01"), std::string::npos) << w.msg();
  }
  const std::string long_label(64, 'a');
  EXPECT_EQ(RunTool({"new-cert", "-d", long_label + ".example", "-m", kEmail, "-c", "X.temp"})
                .error(),
            102);
  // No e-mail and no account to fall back on; an e-mail that cannot be one.
  ToolAnswer a = RunTool({"new-cert", "-d", kDomain, "-m", "", "-c", "Ab12Cd.temp"});
  EXPECT_EQ(a.error(), 101);
  EXPECT_NE(a.msg().find("no e-mail"), std::string::npos) << a.msg();
  EXPECT_EQ(RunTool({"new-cert", "-d", kDomain, "-m", "a/b@x.example", "-c", "X.temp"}).error(),
            101);

  // Configuration files that cannot be used.
  const std::string closed = ClosedServerConfig()["directory_url"].asString();
  const std::string ok_url = "\"directory_url\": \"" + closed + "\"";
  for (const std::string& config :
       {std::string("not json"), std::string("[1]"),
        "{" + ok_url + ", \"timeout_s\": 0}", "{" + ok_url + ", \"timeout_s\": \"5\"}",
        std::string("{\"directory_url\": \"http://127.0.0.1:1/dir\"}"),
        "{" + ok_url + ", \"ca_bundle\": \"missing.pem\"}",
        "{" + ok_url + ", \"http_address\": \"80\"}",
        "{" + ok_url + ", \"key_type\": \"dsa1024\"}",
        "{" + ok_url + ", \"environment\": {\"TOKEN\": 5}}",
        "{" + ok_url + ", \"dns_provider\": \"../x\"}"}) {
    SCOPED_TRACE(config);
    WriteToolConfig(Json::Value(config));
    a = RunTool({"new-cert", "-d", kDomain, "-m", kEmail, "-c", "Ab12Cd.temp"});
    EXPECT_EQ(a.error(), 108);
    EXPECT_NE(a.msg().find("config.json"), std::string::npos) << a.msg();
  }
  EXPECT_FALSE(Exists(root.Path("/usr/zeph/etc/letsencrypt/work")));
}

TEST(ZephLetsencryptTool, RenewAndRevokeRefuseCertificatesItDidNotIssue) {
  ApplianceRoot root;
  WriteToolConfig(ClosedServerConfig());
  const std::string id = root.CreateCertificate("self.example");
  ASSERT_FALSE(id.empty());
  const auto before = Snapshot(root.Archive("/" + id));
  for (const char* command : {"renew", "revoke"}) {
    SCOPED_TRACE(command);
    ToolAnswer a = RunTool({command, "-c", id});
    EXPECT_EQ(a.error(), 106);
    EXPECT_NE(a.msg().find("renew.json"), std::string::npos) << a.msg();
    EXPECT_EQ(RunTool({command, "-c", "NoSuch"}).error(), 106);
  }
  // A renew.json that says nothing usable is no better.
  for (const char* renew : {"{}", "broken", "{\"domain\": \"a.example\"}"}) {
    SCOPED_TRACE(renew);
    WriteFile(root.Archive("/" + id + "/renew.json"), renew, 0600);
    EXPECT_EQ(RunTool({"renew", "-c", id}).error(), 106);
    EXPECT_EQ(RunTool({"revoke", "-c", id}).error(), 106);
  }
  unlink(root.Archive("/" + id + "/renew.json").c_str());
  EXPECT_EQ(Snapshot(root.Archive("/" + id)), before);
  EXPECT_EQ(Leftovers(root), std::vector<std::string>{});
}

TEST(ZephLetsencryptTool, UnreachableAndSilentServers) {
  if (!LegoInstalled()) GTEST_SKIP() << "lego is not installed (scripts/setup.sh installs it)";
  ApplianceRoot root;
  WriteToolConfig(ClosedServerConfig());
  ToolAnswer a = RunTool({"new-cert", "-d", kDomain, "-m", kEmail, "-c", "Ab12Cd.temp"});
  EXPECT_EQ(a.error(), 100);
  EXPECT_NE(a.msg().find("connection refused"), std::string::npos) << a.msg();
  // lego's words went to standard error, and no file into the archive.
  EXPECT_NE(a.err.find("Could not create client"), std::string::npos) << a.err;
  EXPECT_EQ(DirEntries(root.Archive("/Ab12Cd.temp")), std::vector<std::string>{});
  EXPECT_EQ(DirEntries(root.Path("/usr/zeph/etc/letsencrypt/work")), std::vector<std::string>{});
  EXPECT_EQ(ModeOf(root.Path("/usr/zeph/etc/letsencrypt/lego")), 0700u);

  // A server that takes the connection and never answers: lego is stopped
  // after "timeout_s".
  UniqueFd silent(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(addr);
  ASSERT_EQ(bind(silent.get(), reinterpret_cast<struct sockaddr*>(&addr), len), 0);
  ASSERT_EQ(listen(silent.get(), 8), 0);
  ASSERT_EQ(getsockname(silent.get(), reinterpret_cast<struct sockaddr*>(&addr), &len), 0);
  Json::Value config = ClosedServerConfig();
  config["directory_url"] = "https://127.0.0.1:" + std::to_string(ntohs(addr.sin_port)) + "/dir";
  config["timeout_s"] = 1;
  WriteToolConfig(config);
  a = RunTool({"new-cert", "-d", kDomain, "-m", kEmail, "-c", "Ab12Cd.temp"});
  EXPECT_EQ(a.error(), 109);
  EXPECT_EQ(DirEntries(root.Path("/usr/zeph/etc/letsencrypt/work")), std::vector<std::string>{});
}

TEST(ZephLetsencryptTool, WaitsForAnotherRunNoLongerThanItsTimeOut) {
  ApplianceRoot root;
  Json::Value config = ClosedServerConfig();
  config["timeout_s"] = 1;
  WriteToolConfig(config);
  MakeDirs(root.Path("/usr/zeph/etc/letsencrypt"));
  int held = -1;
  ASSERT_TRUE(QLIBCFileLockTimeByFile(root.Path("/usr/zeph/etc/letsencrypt/.lock").c_str(),
                                      QLIBC_LOCK_EXCLUSIVE, 0, &held));
  ToolAnswer a = RunTool({"new-cert", "-d", kDomain, "-m", kEmail, "-c", "Ab12Cd.temp"});
  QLIBCFileUnlockByFile(held);
  EXPECT_EQ(a.error(), 109);
  EXPECT_NE(a.msg().find("lock"), std::string::npos) << a.msg();
  EXPECT_EQ(DirEntries(root.Path("/usr/zeph/etc/letsencrypt/work")), std::vector<std::string>{});
}

class PebbleToolTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!LegoInstalled() || !PebbleInstalled()) {
      GTEST_SKIP() << "pebble or lego is not installed (scripts/setup.sh installs both)";
    }
    MakeDirs(root_.Path("/pebble"));
    pebble_.reset(new Pebble(root_.Path("/pebble")));
    std::string error;
    ASSERT_TRUE(pebble_->Start(&error)) << error;
    WriteToolConfig(PebbleToolConfig(*pebble_));
  }

  // Issues a certificate into the archive directory `id` (made by hand, as
  // the module's create would have made it).
  ToolAnswer Issue(const std::string& id, const std::string& email = kEmail) {
    ToolAnswer a = RunTool({"new-cert", "-d", kDomain, "-m", email, "-c", id});
    EXPECT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
    return a;
  }

  ApplianceRoot root_;
  std::unique_ptr<Pebble> pebble_;
};

TEST_F(PebbleToolTest, NewCertWritesACompleteSetAndRecordsTheAccount) {
  // Upper case in the command line; the certificate is for the name.
  ToolAnswer a = RunTool({"new-cert", "-d", "NAS.zeph.test", "-m", kEmail, "-c", "Ab12Cd.temp"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  const std::string dir = root_.Archive("/Ab12Cd.temp");
  ASSERT_EQ(DirEntries(dir), kSetFiles);
  for (const char* pem : {"cert.pem", "chain.pem", "fullchain.pem", "privkey.pem"}) {
    EXPECT_EQ(ModeOf(dir + "/" + pem), 0400u) << pem;
  }
  EXPECT_EQ(ModeOf(dir + "/renew.json"), 0600u);

  const std::string cert = ReadFile(dir + "/cert.pem");
  const std::string chain = ReadFile(dir + "/chain.pem");
  EXPECT_EQ(ReadFile(dir + "/fullchain.pem"), cert + chain);
  std::vector<ssl::X509Ptr> leaf = Certs(cert);
  std::vector<ssl::X509Ptr> issuers = Certs(chain);
  ASSERT_EQ(leaf.size(), 1u);
  ASSERT_GE(issuers.size(), 1u);
  EXPECT_EQ(X509_check_issued(issuers[0].get(), leaf[0].get()), X509_V_OK);
  EXPECT_EQ(X509_check_host(leaf[0].get(), kDomain, 0, 0, nullptr), 1);
  EXPECT_NE(X509_check_host(leaf[0].get(), "other.zeph.test", 0, 0, nullptr), 1);
  ssl::BioPtr key_bio(BIO_new_file((dir + "/privkey.pem").c_str(), "r"));
  ssl::EvpPkeyPtr key(PEM_read_bio_PrivateKey(key_bio.get(), nullptr, nullptr, nullptr));
  ASSERT_TRUE(key);
  EXPECT_EQ(X509_check_private_key(leaf[0].get(), key.get()), 1);
  EXPECT_EQ(EVP_PKEY_base_id(key.get()), EVP_PKEY_RSA);

  Json::Value renew;
  ASSERT_TRUE(JsonFromFile(renew, dir + "/renew.json"));
  EXPECT_EQ(renew["domain"].asString(), kDomain);
  EXPECT_EQ(renew["email"].asString(), kEmail);
  EXPECT_EQ(renew["directory_url"].asString(), pebble_->DirectoryUrl());
  EXPECT_EQ(renew["lego_path"].asString(), "/usr/zeph/etc/letsencrypt/lego");
  EXPECT_EQ(renew["account"], a.answer["account"]);
  EXPECT_EQ(renew["serial"], a.answer["serial"]);
  EXPECT_EQ(a.answer["domain"].asString(), kDomain);

  const std::string account = root_.Path("/usr/zeph/etc/letsencrypt/account/" +
                                         a.answer["account"].asString());
  Json::Value info;
  ASSERT_TRUE(JsonFromFile(info, account + "/info.json"));
  EXPECT_EQ(info["contact"].asString(), kEmail);
  EXPECT_EQ(ModeOf(account + "/info.json"), 0600u);
  EXPECT_EQ(ModeOf(root_.Path("/usr/zeph/etc/letsencrypt/lego")), 0700u);
  EXPECT_EQ(DirEntries(root_.Path("/usr/zeph/etc/letsencrypt/work")), std::vector<std::string>{});

  // Without an e-mail the one recorded account is used.
  ToolAnswer again = RunTool({"new-cert", "-d", kDomain, "-m", "", "-c", "Ef34Gh.temp"});
  ASSERT_EQ(again.error(), 0) << again.msg();
  EXPECT_EQ(again.answer["account"], a.answer["account"]);
  EXPECT_NE(again.answer["serial"], a.answer["serial"]);
  EXPECT_EQ(DirEntries(root_.Path("/usr/zeph/etc/letsencrypt/account")).size(), 1u);
}

TEST_F(PebbleToolTest, RenewReplacesTheSetWholeOrNotAtAll) {
  MakeDirs(root_.Archive("/Ab12Cd"));
  const ToolAnswer issued = Issue("Ab12Cd");
  const std::string dir = root_.Archive("/Ab12Cd");
  const auto first = Snapshot(dir);
  // What a renewal killed in the middle would have left.
  MakeDirs(root_.Archive("/.Ab12Cd.renew.Zz99Yy"));
  WriteFile(root_.Archive("/.Ab12Cd.renew.Zz99Yy/cert.pem"), "half", 0400);

  ToolAnswer a = RunTool({"renew", "-c", "Ab12Cd"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  const auto second = Snapshot(dir);
  ASSERT_EQ(DirEntries(dir), kSetFiles);
  EXPECT_NE(a.answer["serial"], issued.answer["serial"]);
  for (const char* name : {"cert.pem", "privkey.pem", "fullchain.pem"}) {
    EXPECT_NE(second.at(name), first.at(name)) << name;
  }
  EXPECT_EQ(second.at("fullchain.pem"), second.at("cert.pem") + second.at("chain.pem"));
  Json::Value renew;
  ASSERT_TRUE(JsonParse(second.at("renew.json"), renew));
  EXPECT_EQ(renew["serial"], a.answer["serial"]);
  EXPECT_EQ(ModeOf(dir + "/privkey.pem"), 0400u);
  EXPECT_EQ(Leftovers(root_), std::vector<std::string>{});

  // The server is gone: the renewal fails and the set stays as it was.
  pebble_->Stop();
  a = RunTool({"renew", "-c", "Ab12Cd"});
  EXPECT_EQ(a.error(), 100);
  EXPECT_EQ(Snapshot(dir), second);
  EXPECT_EQ(Leftovers(root_), std::vector<std::string>{});

  // A new server that does not know the account refuses it.
  std::string error;
  ASSERT_TRUE(pebble_->Start(&error)) << error;
  a = RunTool({"renew", "-c", "Ab12Cd"});
  EXPECT_EQ(a.error(), 101) << a.msg();
  EXPECT_EQ(Snapshot(dir), second);
}

TEST_F(PebbleToolTest, RevokeRevokesAtTheServer) {
  MakeDirs(root_.Archive("/Ab12Cd"));
  Issue("Ab12Cd");
  const auto set = Snapshot(root_.Archive("/Ab12Cd"));
  ToolAnswer a = RunTool({"revoke", "-c", "Ab12Cd"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_EQ(a.answer["domain"].asString(), kDomain);
  EXPECT_EQ(Snapshot(root_.Archive("/Ab12Cd")), set);
  // The server has it as revoked: a second revocation is refused.
  a = RunTool({"revoke", "-c", "Ab12Cd"});
  EXPECT_EQ(a.error(), 110);
  EXPECT_NE(a.msg().find("alreadyRevoked"), std::string::npos) << a.msg();
}

// DNS-01 validated for real by pebble against its challenge test server,
// at a CA that demands external account binding, with the settings made
// as the page makes them.
class PebbleDnsToolTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!LegoInstalled() || !PebbleInstalled() || !ChallengeServerInstalled()) {
      GTEST_SKIP() << "lego, pebble or pebble-challtestsrv is not installed";
    }
    MakeDirs(root_.Path("/pebble"));
    challenges_.reset(new ChallengeServer(root_.Path("/pebble")));
    std::string error;
    ASSERT_TRUE(challenges_->Start(&error)) << error;
    PebbleOptions options;
    options.dns_server = challenges_->DnsAddress();
    options.require_eab = true;
    pebble_.reset(new Pebble(root_.Path("/pebble"), options));
    ASSERT_TRUE(pebble_->Start(&error)) << error;
    Json::Value settings = challenges_->ToolSettings();
    settings["directory_url"] = pebble_->DirectoryUrl();
    settings["ca_bundle_pem"] = ReadFile(pebble_->ca_file());
    settings["eab_kid"] = kEabKid;
    settings["eab_hmac_key"] = kEabHmacKey;
    settings["timeout_s"] = 90;
    ASSERT_EQ(Update(settings), "");
  }
  // Changes the tool's settings; the refused setting, "" when saved.
  std::string Update(const Json::Value& update) {
    acme::Settings saved;
    acme::SettingsError error;
    return acme::UpdateSettings(root_.Path("/usr/zeph/etc/letsencrypt"), update, &saved,
                                &error)
               ? ""
               : error.setting + ": " + error.message;
  }

  ApplianceRoot root_;
  std::unique_ptr<ChallengeServer> challenges_;
  std::unique_ptr<Pebble> pebble_;
};

TEST_F(PebbleDnsToolTest, OneCertificateForSeveralNamesAndAWildcard) {
  const std::vector<std::string> names = {"nas.zeph.test", "www.zeph.test", "*.zeph.test"};
  ToolAnswer a = RunTool({"new-cert", "-d", "NAS.zeph.test, www.zeph.test,*.zeph.test",
                          "-m", kEmail, "-c", "Ab12Cd.temp"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_EQ(a.answer["domain"].asString(), names[0]);
  EXPECT_EQ(a.answer["domains"].size(), 3u);
  // The account was registered with the binding, and lego was never given
  // the HMAC key.
  EXPECT_EQ(a.err.find(kEabHmacKey), std::string::npos);
  const std::string dir = root_.Archive("/Ab12Cd.temp");
  auto sans = [](const std::string& pem) {
    std::vector<std::string> out;
    std::vector<ssl::X509Ptr> certs = Certs(pem);
    if (certs.empty()) return out;
    ssl::GeneralNamesPtr gens(static_cast<GENERAL_NAMES*>(
        X509_get_ext_d2i(certs[0].get(), NID_subject_alt_name, nullptr, nullptr)));
    for (int i = 0; gens && i < sk_GENERAL_NAME_num(gens.get()); ++i) {
      const ASN1_IA5STRING* dns = sk_GENERAL_NAME_value(gens.get(), i)->d.dNSName;
      out.emplace_back(reinterpret_cast<const char*>(ASN1_STRING_get0_data(dns)),
                       static_cast<size_t>(ASN1_STRING_length(dns)));
    }
    std::sort(out.begin(), out.end());
    return out;
  };
  std::vector<std::string> sorted = names;
  std::sort(sorted.begin(), sorted.end());
  EXPECT_EQ(sans(ReadFile(dir + "/cert.pem")), sorted);
  Json::Value renew;
  ASSERT_TRUE(JsonFromFile(renew, dir + "/renew.json"));
  EXPECT_EQ(renew["domains"].size(), 3u);

  // A renewal asks for the same names, with the account already there.
  ASSERT_EQ(rename(dir.c_str(), root_.Archive("/Ab12Cd").c_str()), 0);
  const std::string before = ReadFile(root_.Archive("/Ab12Cd/cert.pem"));
  a = RunTool({"renew", "-c", "Ab12Cd"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_NE(ReadFile(root_.Archive("/Ab12Cd/cert.pem")), before);
  EXPECT_EQ(sans(ReadFile(root_.Archive("/Ab12Cd/cert.pem"))), sorted);
  // Back on HTTP-01 the wildcard cannot be renewed.
  Json::Value http;
  http["challenge"] = "http";
  ASSERT_EQ(Update(http), "");
  a = RunTool({"renew", "-c", "Ab12Cd"});
  EXPECT_EQ(a.error(), 102);
  EXPECT_NE(a.msg().find("DNS-01"), std::string::npos) << a.msg();

  // Without the binding, or with a wrong key, a new account is refused.
  Json::Value wrong;
  wrong["eab_hmac_key"] = std::string(kEabHmacKey).substr(0, 40) + "AAAAAAAA";
  ASSERT_EQ(Update(wrong), "");
  EXPECT_EQ(RunTool({"new-cert", "-d", "nas.zeph.test", "-m", "other@zeph.test", "-c",
                     "Cd34Ef.temp"}).error(),
            101);
  Json::Value none;
  none["eab_kid"] = "";
  none["eab_hmac_key"] = "";
  ASSERT_EQ(Update(none), "");
  a = RunTool({"new-cert", "-d", "nas.zeph.test", "-m", "third@zeph.test", "-c",
               "Ef56Gh.temp"});
  EXPECT_EQ(a.error(), 101) << a.msg();
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
