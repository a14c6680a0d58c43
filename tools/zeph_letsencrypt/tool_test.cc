// zeph-letsencrypt as the module runs it: a child process in a provisioned
// root, answering one JSON object. The ACME cases run lego against a real
// pebble server on 127.0.0.1; nothing is sent anywhere else.
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
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace test {
namespace {

const char kDomain[] = "nas.zeph.test";
const char kEmail[] = "admin@zeph.test";
const std::string kEtc = "/usr/zeph/etc/letsencrypt";
const std::vector<std::string> kSetFiles = {"cert.pem", "chain.pem", "fullchain.pem",
                                            "privkey.pem", "renew.json"};
const std::vector<std::string> kNone;

std::vector<std::string> NewCert(const std::string& domain, const std::string& id = "Ab12Cd.temp",
                                 const std::string& email = kEmail) {
  return {"new-cert", "-d", domain, "-m", email, "-c", id};
}

std::vector<ssl::X509Ptr> Certs(const std::string& pem) {
  std::vector<ssl::X509Ptr> out;
  ssl::BioPtr bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  while (X509* c = PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)) out.emplace_back(c);
  return out;
}

// The DNS names of the first certificate of `pem`, sorted.
std::vector<std::string> Sans(const std::string& pem) {
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
}

std::map<std::string, std::string> Snapshot(const std::string& dir) {
  std::map<std::string, std::string> files;
  for (const std::string& name : DirEntries(dir)) files[name] = ReadFile(dir + "/" + name);
  return files;
}

// Hidden entries of the archive: what a renewal might leave behind.
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

TEST(ZephLetsencryptTool, RefusesBadInputBeforeAskingAnyServer) {
  ApplianceRoot root;
  struct Row {
    std::vector<std::string> args;
    int error;
    std::string msg;     // part of the message, "" for any
    std::string config;  // the configuration file's text, "" for a closed server
  };
  std::vector<Row> rows;
  for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
           {}, {"frobnicate"}, {"new-cert", "-d", kDomain, "-m", kEmail},
           {"new-cert", "-d", kDomain, "-m", kEmail, "-c"},
           {"new-cert", "-d", kDomain, "-d", kDomain, "-m", kEmail, "-c", "Ab12Cd.temp"},
           NewCert(kDomain, "../escape"), NewCert(kDomain, ".."), {"renew"},
           {"renew", "-d", kDomain}, {"renew", "-c", "a/b"}, {"revoke", "-c", ""},
           {"revoke", "-c", "Ab12Cd", "extra"}, {"revoke", "--c", "Ab12Cd"}}) {
    rows.push_back({args, 200, "", ""});
  }
  for (const char* domain :
       {"", "-a.example", "a..example", "a_b.example", "exa mple.com", "example.com.", "*.",
        "a.*.example", "\xC3\xA9t\xC3\xA9.example", "a.example,", "a.example,,b.example",
        ",a.example", "a.example,b_c.example", " a.example"}) {
    rows.push_back({NewCert(domain), 102, "", ""});
  }
  rows.push_back({NewCert(std::string(64, 'a') + ".example"), 102, "", ""});
  // A wildcard name is validated with DNS-01 only.
  rows.push_back({NewCert("*.zeph.test"), 102, "DNS-01", ""});
  rows.push_back({NewCert("nas.zeph.test,*.zeph.test"), 102, "DNS-01", ""});
  // No e-mail and no account to fall back on; an e-mail that cannot be one.
  rows.push_back({NewCert(kDomain, "Ab12Cd.temp", ""), 101, "no e-mail", ""});
  rows.push_back({NewCert(kDomain, "X.temp", "a/b@x.example"), 101, "", ""});
  // Configuration files that cannot be used.
  const std::string url = "\"directory_url\": \"" +
                          ClosedServerConfig()["directory_url"].asString() + "\", ";
  for (const std::string& config :
       {std::string("not json"), std::string("[1]"), "{" + url + "\"timeout_s\": 0}",
        "{" + url + "\"timeout_s\": \"5\"}", std::string("{\"directory_url\": \"http://127.0.0.1:1/dir\"}"),
        "{" + url + "\"ca_bundle\": \"missing.pem\"}", "{" + url + "\"http_address\": \"80\"}",
        "{" + url + "\"key_type\": \"dsa1024\"}", "{" + url + "\"environment\": {\"T\": 5}}",
        "{" + url + "\"dns_provider\": \"../x\"}"}) {
    rows.push_back({NewCert(kDomain), 108, "config.json", config});
  }
  for (const Row& row : rows) {
    std::string shown = row.config;
    for (const std::string& a : row.args) shown += "[" + a + "]";
    SCOPED_TRACE(shown);
    WriteToolConfig(row.config.empty() ? ClosedServerConfig() : Json::Value(row.config));
    ToolAnswer a = RunTool(row.args);
    EXPECT_EQ(a.error(), row.error);
    EXPECT_NE(a.msg().find(row.msg), std::string::npos) << a.msg();
  }
  EXPECT_EQ(DirEntries(root.Archive()), (std::vector<std::string>{"SERVICES"}));
  EXPECT_FALSE(Exists(root.Path(kEtc + "/work")));
}

TEST(ZephLetsencryptTool, RenewAndRevokeRefuseCertificatesItDidNotIssue) {
  ApplianceRoot root;
  WriteToolConfig(ClosedServerConfig());
  const std::string id = root.CreateCertificate("self.example");
  ASSERT_FALSE(id.empty());
  const auto before = Snapshot(root.Archive("/" + id));
  // No renew.json, or one that says nothing usable.
  for (const char* renew : {"", "{}", "broken", "{\"domain\": \"a.example\"}"}) {
    if (*renew != '\0') WriteFile(root.Archive("/" + id + "/renew.json"), renew, 0600);
    for (const char* command : {"renew", "revoke"}) {
      SCOPED_TRACE(std::string(command) + " " + renew);
      ToolAnswer a = RunTool({command, "-c", id});
      EXPECT_EQ(a.error(), 106);
      if (*renew == '\0') {
        EXPECT_NE(a.msg().find("renew.json"), std::string::npos) << a.msg();
      }
      EXPECT_EQ(RunTool({command, "-c", "NoSuch"}).error(), 106);
    }
  }
  unlink(root.Archive("/" + id + "/renew.json").c_str());
  EXPECT_EQ(Snapshot(root.Archive("/" + id)), before);
  EXPECT_EQ(Leftovers(root), kNone);
}

// A closed port, a server that never answers (lego is stopped after
// "timeout_s") and another run holding the lock (waited for as long).
TEST(ZephLetsencryptTool, UnreachableSilentAndBusy) {
  ApplianceRoot root;
  const std::string work = root.Path(kEtc + "/work");
  Json::Value config = ClosedServerConfig();
  config["timeout_s"] = 1;
  WriteToolConfig(config);
  int held = -1;
  MakeDirs(root.Path(kEtc));
  ASSERT_TRUE(QLIBCFileLockTimeByFile(root.Path(kEtc + "/.lock").c_str(),
                                      QLIBC_LOCK_EXCLUSIVE, 0, &held));
  ToolAnswer a = RunTool(NewCert(kDomain));
  QLIBCFileUnlockByFile(held);
  EXPECT_EQ(a.error(), 109);
  EXPECT_NE(a.msg().find("lock"), std::string::npos) << a.msg();
  EXPECT_EQ(DirEntries(work), kNone);
  if (!LegoInstalled()) GTEST_SKIP() << "lego is not installed (scripts/setup.sh installs it)";

  a = RunTool(NewCert(kDomain));
  EXPECT_EQ(a.error(), 100);
  EXPECT_NE(a.msg().find("connection refused"), std::string::npos) << a.msg();
  // lego's words went to standard error, and no file into the archive.
  EXPECT_NE(a.err.find("Could not create client"), std::string::npos) << a.err;
  EXPECT_EQ(DirEntries(root.Archive("/Ab12Cd.temp")), kNone);
  EXPECT_EQ(DirEntries(work), kNone);
  EXPECT_EQ(ModeOf(root.Path(kEtc + "/lego")), 0700u);

  struct sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(addr);
  UniqueFd silent(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  ASSERT_EQ(bind(silent.get(), reinterpret_cast<struct sockaddr*>(&addr), len), 0);
  ASSERT_EQ(listen(silent.get(), 8), 0);
  ASSERT_EQ(getsockname(silent.get(), reinterpret_cast<struct sockaddr*>(&addr), &len), 0);
  config["directory_url"] = "https://127.0.0.1:" + std::to_string(ntohs(addr.sin_port)) + "/dir";
  WriteToolConfig(config);
  EXPECT_EQ(RunTool(NewCert(kDomain)).error(), 109);
  EXPECT_EQ(DirEntries(work), kNone);
}

TEST(ZephLetsencryptTool, NewCertRenewAndRevokeAgainstPebble) {
  if (!LegoInstalled() || !PebbleInstalled()) {
    GTEST_SKIP() << "pebble or lego is not installed (scripts/setup.sh installs both)";
  }
  ApplianceRoot root;
  MakeDirs(root.Path("/pebble"));
  Pebble pebble(root.Path("/pebble"));
  std::string error;
  ASSERT_TRUE(pebble.Start(&error)) << error;
  WriteToolConfig(PebbleToolConfig(pebble));

  // Upper case in the command line; the certificate is for the name. The
  // directory is made by hand, as the module's create would have made it.
  const std::string dir = root.Archive("/Ab12Cd");
  MakeDirs(dir);
  ToolAnswer a = RunTool(NewCert("NAS.zeph.test", "Ab12Cd"));
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  ASSERT_EQ(DirEntries(dir), kSetFiles);
  for (const std::string& file : kSetFiles) {
    EXPECT_EQ(ModeOf(dir + "/" + file), file == "renew.json" ? 0600u : 0400u) << file;
  }
  const auto first = Snapshot(dir);
  EXPECT_EQ(first.at("fullchain.pem"), first.at("cert.pem") + first.at("chain.pem"));
  std::vector<ssl::X509Ptr> leaf = Certs(first.at("cert.pem"));
  std::vector<ssl::X509Ptr> issuers = Certs(first.at("chain.pem"));
  ASSERT_EQ(leaf.size(), 1u);
  ASSERT_GE(issuers.size(), 1u);
  EXPECT_EQ(X509_check_issued(issuers[0].get(), leaf[0].get()), X509_V_OK);
  EXPECT_EQ(Sans(first.at("cert.pem")), std::vector<std::string>{kDomain});
  EXPECT_TRUE(CertificateFitsKey(first.at("cert.pem"), first.at("privkey.pem")));
  ssl::BioPtr key_bio(BIO_new_file((dir + "/privkey.pem").c_str(), "r"));
  ssl::EvpPkeyPtr key(PEM_read_bio_PrivateKey(key_bio.get(), nullptr, nullptr, nullptr));
  ASSERT_TRUE(key);
  EXPECT_EQ(EVP_PKEY_base_id(key.get()), EVP_PKEY_RSA);
  Json::Value renew;
  ASSERT_TRUE(JsonParse(first.at("renew.json"), renew));
  EXPECT_EQ(renew["domain"].asString(), kDomain);
  EXPECT_EQ(renew["email"].asString(), kEmail);
  EXPECT_EQ(renew["directory_url"].asString(), pebble.DirectoryUrl());
  EXPECT_EQ(renew["lego_path"].asString(), kEtc + "/lego");
  EXPECT_EQ(renew["account"], a.answer["account"]);
  EXPECT_EQ(renew["serial"], a.answer["serial"]);
  EXPECT_EQ(a.answer["domain"].asString(), kDomain);
  const std::string account = root.Path(kEtc + "/account/" +
                                        a.answer["account"].asString() + "/info.json");
  Json::Value info;
  ASSERT_TRUE(JsonFromFile(info, account));
  EXPECT_EQ(info["contact"].asString(), kEmail);
  EXPECT_EQ(ModeOf(account), 0600u);
  EXPECT_EQ(ModeOf(root.Path(kEtc + "/lego")), 0700u);
  EXPECT_EQ(DirEntries(root.Path(kEtc + "/work")), kNone);

  // Without an e-mail the one recorded account is used.
  MakeDirs(root.Archive("/Ef34Gh"));
  ToolAnswer other = RunTool(NewCert(kDomain, "Ef34Gh", ""));
  ASSERT_EQ(other.error(), 0) << other.msg();
  EXPECT_EQ(other.answer["account"], a.answer["account"]);
  EXPECT_NE(other.answer["serial"], a.answer["serial"]);
  EXPECT_EQ(DirEntries(root.Path(kEtc + "/account")).size(), 1u);

  // A renewal replaces the whole set, and clears what a renewal killed in
  // the middle would have left.
  MakeDirs(root.Archive("/.Ab12Cd.renew.Zz99Yy"));
  WriteFile(root.Archive("/.Ab12Cd.renew.Zz99Yy/cert.pem"), "half", 0400);
  ToolAnswer renewed = RunTool({"renew", "-c", "Ab12Cd"});
  ASSERT_EQ(renewed.error(), 0) << renewed.msg() << "\n" << renewed.err;
  ASSERT_EQ(DirEntries(dir), kSetFiles);
  const auto second = Snapshot(dir);
  EXPECT_NE(renewed.answer["serial"], a.answer["serial"]);
  for (const char* name : {"cert.pem", "privkey.pem", "fullchain.pem"}) {
    EXPECT_NE(second.at(name), first.at(name)) << name;
  }
  EXPECT_EQ(second.at("fullchain.pem"), second.at("cert.pem") + second.at("chain.pem"));
  ASSERT_TRUE(JsonParse(second.at("renew.json"), renew));
  EXPECT_EQ(renew["serial"], renewed.answer["serial"]);
  EXPECT_EQ(ModeOf(dir + "/privkey.pem"), 0400u);
  EXPECT_EQ(Leftovers(root), kNone);

  // Revoked at the server, the set left as it is: a second revocation is
  // refused.
  const auto set = Snapshot(root.Archive("/Ef34Gh"));
  a = RunTool({"revoke", "-c", "Ef34Gh"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_EQ(a.answer["domain"].asString(), kDomain);
  EXPECT_EQ(Snapshot(root.Archive("/Ef34Gh")), set);
  a = RunTool({"revoke", "-c", "Ef34Gh"});
  EXPECT_EQ(a.error(), 110);
  EXPECT_NE(a.msg().find("alreadyRevoked"), std::string::npos) << a.msg();

  // The server is gone, then a new one does not know the account: the
  // renewal fails and the set stays as it was.
  pebble.Stop();
  EXPECT_EQ(RunTool({"renew", "-c", "Ab12Cd"}).error(), 100);
  EXPECT_EQ(Snapshot(dir), second);
  EXPECT_EQ(Leftovers(root), kNone);
  ASSERT_TRUE(pebble.Start(&error)) << error;
  EXPECT_EQ(RunTool({"renew", "-c", "Ab12Cd"}).error(), 101);
  EXPECT_EQ(Snapshot(dir), second);
}

// DNS-01 validated for real by pebble against its challenge test server,
// at a CA that demands external account binding, with the settings made
// as the page makes them.
TEST(ZephLetsencryptTool, SeveralNamesAndAWildcardWithDnsAndBinding) {
  if (!LegoInstalled() || !PebbleInstalled() || !ChallengeServerInstalled()) {
    GTEST_SKIP() << "lego, pebble or pebble-challtestsrv is not installed";
  }
  ApplianceRoot root;
  MakeDirs(root.Path("/pebble"));
  ChallengeServer challenges(root.Path("/pebble"));
  std::string error;
  ASSERT_TRUE(challenges.Start(&error)) << error;
  Pebble pebble(root.Path("/pebble"), {challenges.DnsAddress(), true});
  ASSERT_TRUE(pebble.Start(&error)) << error;
  // Changes the tool's settings; the refused setting, "" when saved.
  auto update = [&root](const Json::Value& change) {
    acme::Settings saved;
    acme::SettingsError e;
    return acme::UpdateSettings(root.Path(kEtc), change, &saved, &e)
               ? "" : e.setting + ": " + e.message;
  };
  Json::Value settings = challenges.ToolSettings();
  settings["directory_url"] = pebble.DirectoryUrl();
  settings["ca_bundle_pem"] = ReadFile(pebble.ca_file());
  settings["eab_kid"] = kEabKid;
  settings["eab_hmac_key"] = kEabHmacKey;
  settings["timeout_s"] = 90;
  ASSERT_EQ(update(settings), "");

  const std::vector<std::string> names = {"*.zeph.test", "nas.zeph.test", "www.zeph.test"};
  ToolAnswer a = RunTool(NewCert("NAS.zeph.test, www.zeph.test,*.zeph.test"));
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_EQ(a.answer["domain"].asString(), "nas.zeph.test");
  EXPECT_EQ(a.answer["domains"].size(), 3u);
  // The account was registered with the binding; lego never saw the key.
  EXPECT_EQ(a.err.find(kEabHmacKey), std::string::npos);
  const std::string dir = root.Archive("/Ab12Cd.temp");
  EXPECT_EQ(Sans(ReadFile(dir + "/cert.pem")), names);
  Json::Value renew;
  ASSERT_TRUE(JsonFromFile(renew, dir + "/renew.json"));
  EXPECT_EQ(renew["domains"].size(), 3u);

  // A renewal asks for the same names, with the account already there.
  ASSERT_EQ(rename(dir.c_str(), root.Archive("/Ab12Cd").c_str()), 0);
  const std::string before = ReadFile(root.Archive("/Ab12Cd/cert.pem"));
  a = RunTool({"renew", "-c", "Ab12Cd"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_NE(ReadFile(root.Archive("/Ab12Cd/cert.pem")), before);
  EXPECT_EQ(Sans(ReadFile(root.Archive("/Ab12Cd/cert.pem"))), names);
  // Back on HTTP-01 the wildcard cannot be renewed.
  Json::Value http;
  http["challenge"] = "http";
  ASSERT_EQ(update(http), "");
  a = RunTool({"renew", "-c", "Ab12Cd"});
  EXPECT_EQ(a.error(), 102);
  EXPECT_NE(a.msg().find("DNS-01"), std::string::npos) << a.msg();

  // With a wrong key, or without the binding, a new account is refused.
  Json::Value wrong, none;
  wrong["eab_hmac_key"] = std::string(kEabHmacKey).substr(0, 40) + "AAAAAAAA";
  none["eab_kid"] = "";
  none["eab_hmac_key"] = "";
  ASSERT_EQ(update(wrong), "");
  EXPECT_EQ(RunTool(NewCert(kDomain, "Cd34Ef.temp", "other@zeph.test")).error(), 101);
  ASSERT_EQ(update(none), "");
  a = RunTool(NewCert(kDomain, "Ef56Gh.temp", "third@zeph.test"));
  EXPECT_EQ(a.error(), 101) << a.msg();
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
