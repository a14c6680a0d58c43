// zephcert end to end: the real executable loading the real module.
#include <gtest/gtest.h>
#include <unistd.h>

#include <map>
#include <regex>
#include <set>
#include <string>
#include <vector>

#include "test_support.h"
#include "tools/zeph_letsencrypt/pebble_test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::CommandResult;
using ZEPH::test::Exists;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;

CommandResult Zephcert(std::vector<std::string> args) {
  args.insert(args.begin(), ZEPH::test::BinDir() + "/zephcert");
  return ZEPH::test::Run(args);
}

Json::Value ParseAnswer(const CommandResult& r) {
  Json::Value answer;
  EXPECT_TRUE(ZEPH::JsonParse(r.out, answer)) << r.out << r.err;
  return answer;
}

size_t Lines(const std::string& text) {
  size_t n = 0;
  for (char c : text) n += c == '\n';
  return n;
}

TEST(ZephcertInit, ProvisionsARootAndKeepsWhatIsThere) {
  TempRoot root;
  const std::string dir = root.Path("/appliance");
  CommandResult r = Zephcert({"init", "--root", dir});
  ASSERT_EQ(r.status, 0) << r.err;

  for (const char* d : {"/usr/zeph/etc/certificate/_archive", "/usr/zeph/etc/ssl",
                        "/usr/zeph/bin", "/usr/zeph/sbin", "/usr/local/etc/certificate",
                        "/usr/zeph/share/certificate.d", "/usr/libexec/certificate.d",
                        "/tmp", "/var/log/zeph"}) {
    EXPECT_TRUE(Exists(dir + d)) << d;
  }
  Json::Value services;
  ASSERT_TRUE(ZEPH::JsonFromFile(
      services, dir + "/usr/zeph/etc/certificate/_archive/SERVICES"));
  ASSERT_TRUE(services.isArray());
  ASSERT_EQ(services.size(), 1u);
  EXPECT_EQ(services[0]["subscriber"].asString(), "system");
  EXPECT_EQ(services[0]["service"].asString(), "default");
  EXPECT_FALSE(services[0]["isPkg"].asBool());
  EXPECT_FALSE(services[0]["owner"].asString().empty());
  EXPECT_FALSE(services[0]["display_name"].asString().empty());
  EXPECT_EQ(ReadFile(dir + "/usr/zeph/etc/features.conf"),
            "support_self_sign_cert=yes\n");
  EXPECT_TRUE(std::regex_match(ReadFile(dir + "/proc/sys/kernel/zeph_mac_address1"),
                               std::regex("[0-9a-f]{12}\n")));
  // A fresh root starts with a default certificate serving the web service.
  std::string id = ReadFile(dir + "/usr/zeph/etc/certificate/_archive/DEFAULT");
  ASSERT_EQ(id.size(), 7u);
  id.pop_back();
  EXPECT_EQ(ReadFile(dir + "/usr/zeph/etc/certificate/system/default/cert.pem"),
            ReadFile(dir + "/usr/zeph/etc/certificate/_archive/" + id + "/cert.pem"));

  // A second init leaves an administrator's files alone.
  ZEPH::test::WriteFile(dir + "/usr/zeph/etc/certificate/_archive/SERVICES", "[]\n");
  ZEPH::test::WriteFile(dir + "/usr/zeph/etc/certificate/_archive/INFO", "{}\n");
  r = Zephcert({"--root", dir, "init"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(ReadFile(dir + "/usr/zeph/etc/certificate/_archive/SERVICES"), "[]\n");
  EXPECT_EQ(ReadFile(dir + "/usr/zeph/etc/certificate/_archive/INFO"), "{}\n");
}

TEST(ZephcertCall, AnswersOneJsonObjectWithTheMethodsOutcome) {
  TempRoot root;
  ASSERT_EQ(Zephcert({"init", "--root", root.dir()}).status, 0);

  // A rule failure: "id" must be a string.
  CommandResult r = Zephcert({"--root", root.dir(), "call",
                              "ZEPH.Core.Certificate.CSR", "renew", "{\"id\": 5}"});
  EXPECT_EQ(r.status, 1) << r.err;
  EXPECT_EQ(Lines(r.out), 1u);
  Json::Value answer = ParseAnswer(r);
  EXPECT_FALSE(answer["success"].asBool());
  EXPECT_EQ(answer["error"]["code"].asInt(), 5503);
  EXPECT_TRUE(answer["error"].isMember("data"));
  EXPECT_TRUE(answer["error"]["data"].isNull());
  EXPECT_FALSE(answer["httpd_restart"].asBool());
  EXPECT_FALSE(answer.isMember("download"));

  // The import wrapper's own codes reach the caller.
  r = Zephcert({"--root", root.dir(), "call", "ZEPH.Core.Certificate", "import",
                "{\"desc\": \"d\", \"key_tmp\": \"/k\"}"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(ParseAnswer(r)["error"]["code"].asInt(), 5510);
}

TEST(ZephcertCall, RefusesCallsItCannotMake) {
  TempRoot root;
  ASSERT_EQ(Zephcert({"init", "--root", root.dir()}).status, 0);
  const std::string blocker = root.Path("/file");
  ZEPH::test::WriteFile(blocker, "x");
  const std::vector<std::vector<std::string>> bad = {
      {"--root", root.dir(), "call", "ZEPH.Core.Nothing", "list"},
      {"--root", root.dir(), "call", "ZEPH.Core.Certificate.CRT", "nothing"},
      {"--root", root.dir(), "call", "ZEPH.Core.Certificate.CRT", "list", "--version", "2"},
      {"--root", root.dir(), "call", "ZEPH.Core.Certificate.CRT", "list", "{\"id\":"},
      {"--root", root.dir(), "call", "ZEPH.Core.Certificate.CRT", "list", "[1]"},
      {"--root", root.dir(), "call", "ZEPH.Core.Certificate.CRT", "list", "--module",
       root.Path("/missing.so")},
      {"--root", root.Path("/missing"), "call", "ZEPH.Core.Certificate.CRT", "list"},
      {"--root", blocker + "/sub", "init"},
      {"call", "ZEPH.Core.Certificate.CRT"},
      {"--bogus"},
      {},
  };
  for (const auto& args : bad) {
    std::string joined;
    for (const auto& a : args) joined += a + " ";
    SCOPED_TRACE(joined);
    CommandResult r = Zephcert(args);
    EXPECT_EQ(r.status, 2);
    EXPECT_EQ(r.out, "");
    EXPECT_FALSE(r.err.empty());
  }
  EXPECT_FALSE(Exists(root.Path("/missing")));
  // One line for a refused call (usage text aside).
  CommandResult r = Zephcert({"--root", root.dir(), "call", "X", "y"});
  EXPECT_EQ(Lines(r.err), 1u);
  EXPECT_EQ(r.err.rfind("zephcert: ", 0), 0u);
}

}  // namespace

namespace {

// Who runs zephcert in the workflow: the tests' own user (root on the
// development machine and in CI), or an ordinary user on a root that user
// owns, as a developer trying the product out does. Tests that do not run
// as root already are such a user.
enum class RunAs { kTestUser, kOrdinaryUser };

class ZephcertWorkflow : public ::testing::TestWithParam<RunAs> {
 protected:
  void SetUp() override {
    if (GetParam() == RunAs::kOrdinaryUser && geteuid() == 0) {
      // The root and everything in it belong to the user who runs it.
      ASSERT_EQ(ZEPH::test::Run({"/bin/chown", "-R", "nobody:nogroup",
                                 root_.dir()}).status, 0);
      wrap_ = {"/usr/bin/setpriv", "--reuid=nobody", "--regid=nogroup",
               "--clear-groups"};
    }
  }

  CommandResult Run(std::vector<std::string> args, const std::string* input = nullptr) {
    args.insert(args.begin(), {ZEPH::test::BinDir() + "/zephcert", "--root",
                               root_.dir()});
    args.insert(args.begin(), wrap_.begin(), wrap_.end());
    return input ? ZEPH::test::Run(args, *input) : ZEPH::test::Run(args);
  }

  // Calls a method; its answer, after checking that the exit status agrees
  // with it. With `secret`, the parameters go in on standard input ("-").
  Json::Value Call(const std::string& api, const std::string& method,
                   const Json::Value& params, const std::string& output = "",
                   bool secret = false) {
    const std::string text = ZEPH::JsonCompact(params);
    std::vector<std::string> args = {"call", api, method, secret ? "-" : text};
    if (!output.empty()) args.insert(args.end(), {"--output", output});
    const CommandResult r = Run(args, secret ? &text : nullptr);
    Json::Value answer = ParseAnswer(r);
    EXPECT_EQ(r.status, answer["success"].asBool() ? 0 : 1)
        << api << " " << method << ": " << r.out << r.err;
    return answer;
  }

  // Exports `params` to a file; the names in the archive.
  std::set<std::string> Exported(const Json::Value& params) {
    const std::string zip = root_.Path("/export.zip");
    unlink(zip.c_str());
    const Json::Value answer = Call("ZEPH.Core.Certificate", "export", params, zip);
    EXPECT_EQ(answer["download"]["bytes"].asUInt64(), ReadFile(zip).size());
    return ZEPH::test::ZipMembers(zip);
  }

  // openssl run by the test itself; the files it makes are the caller's.
  void Openssl(const std::vector<std::string>& args) {
    std::vector<std::string> argv = {"/usr/bin/openssl"};
    argv.insert(argv.end(), args.begin(), args.end());
    const CommandResult r = ZEPH::test::Run(argv);
    ASSERT_EQ(r.status, 0) << r.err;
  }

  TempRoot root_;
  std::vector<std::string> wrap_;
};

std::string Subject(const std::string& cn) {
  return "\"country\": \"TW\", \"state\": \"\", \"city\": \"Taipel\", "
         "\"organization\": \"Zeph\", \"department\": \"\", \"email\": \"\", "
         "\"common_name\": \"" + cn + "\"";
}

Json::Value Params(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(ZEPH::JsonParse(text, v)) << text;
  return v;
}

// Every method, in the order an administrator meets them, with the
// products checked where they land.
TEST_P(ZephcertWorkflow, EveryMethodEndToEnd) {
  ASSERT_EQ(Run({"init"}).status, 0);
  const std::string archive = root_.Path("/usr/zeph/etc/certificate/_archive");

  Json::Value a = Call("ZEPH.Core.Certificate.CRT", "create", Params(
      "{" + Subject("cli.example") + ", \"ca_country\": \"TW\", "
      "\"ca_state\": \"\", \"ca_city\": \"\", \"ca_organization\": \"Zeph\", "
      "\"ca_department\": \"\", \"ca_common_name\": \"cli CA\", "
      "\"ca_email\": \"\", \"desc\": \"from the shell\", \"as_default\": true, "
      "\"key_length\": 1024, \"ca_key_length\": 1024}"));
  const std::string id = a["data"]["id"].asString();
  ASSERT_EQ(id.size(), 6u) << ZEPH::JsonCompact(a);

  // An EC set, handed out as a PKCS#12 file whose passphrase never shows
  // on a command line.
  a = Call("ZEPH.Core.Certificate.CRT", "create", Params(
      "{" + Subject("ec.example") + ", \"ca_country\": \"TW\", "
      "\"ca_state\": \"\", \"ca_city\": \"\", \"ca_organization\": \"Zeph\", "
      "\"ca_department\": \"\", \"ca_common_name\": \"ec CA\", "
      "\"ca_email\": \"\", \"desc\": \"ec\", \"key_type\": \"ec384\", "
      "\"ca_key_type\": \"ec256\"}"));
  const std::string ec_id = a["data"]["id"].asString();
  ASSERT_EQ(ec_id.size(), 6u) << ZEPH::JsonCompact(a);
  const std::string p12 = root_.Path("/ec.p12");
  a = Call("ZEPH.Core.Certificate", "export",
           Params("{\"file\": \"archive\", \"id\": \"" + ec_id +
                  "\", \"format\": \"pkcs12\", \"passphrase\": \"s3cret\", "
                  "\"legacy\": true}"),
           p12, true);
  EXPECT_EQ(a["download"]["headers"]["content-disposition"].asString(),
            "attachment; filename=\"ec.example.p12\"");
  const CommandResult p12_info = ZEPH::test::Run(
      {"/usr/bin/openssl", "pkcs12", "-info", "-noout", "-in", p12, "-passin",
       "pass:s3cret"});
  EXPECT_EQ(p12_info.status, 0) << p12_info.err;
  EXPECT_NE(p12_info.err.find("pbeWithSHA1And3-KeyTripleDES-CBC"), std::string::npos);

  a = Call("ZEPH.Core.Certificate.CRT", "list", Json::objectValue);
  // The certificate init made, the new one, now the default, and the EC one.
  std::map<std::string, Json::Value> listed;
  for (const Json::Value& c : a["data"]["certificates"]) listed[c["id"].asString()] = c;
  ASSERT_EQ(listed.size(), 3u);
  EXPECT_TRUE(listed[id]["is_default"].asBool());
  EXPECT_EQ(listed[id]["subject"]["common_name"].asString(), "cli.example");
  EXPECT_FALSE(listed[id]["is_ecc"].asBool());
  EXPECT_TRUE(listed[ec_id]["is_ecc"].asBool());

  Json::Value services;
  ASSERT_TRUE(ZEPH::JsonFromFile(services, archive + "/SERVICES"));
  Json::Value settings;
  settings["settings"][0]["service"] = services[0];
  settings["settings"][0]["id"] = id;
  settings["settings"][0]["old_id"] = "";
  a = Call("ZEPH.Core.Certificate.Service", "set", settings);
  EXPECT_TRUE(a["data"]["restart_httpd"].asBool());
  EXPECT_TRUE(a["httpd_restart"].asBool());
  EXPECT_EQ(ReadFile(root_.Path("/usr/zeph/etc/certificate/system/default/fullchain.pem")),
            ReadFile(archive + "/" + id + "/fullchain.pem"));
  EXPECT_TRUE(Call("ZEPH.Core.Certificate.CRT", "set",
                   Params("{\"id\": \"" + id + "\", \"desc\": \"renamed\"}"))["success"]
                  .asBool());

  // Requests: made, renewed from the certificate, exported with their key.
  EXPECT_TRUE(Call("ZEPH.Core.Certificate.CSR", "create",
                   Params("{" + Subject("req.example") + ", \"key_length\": 1024}"))
                  ["success"].asBool());
  using Names = std::set<std::string>;
  EXPECT_EQ(Exported(Params("{\"file\": \"csr_set\"}")),
            (Names{"server.csr", "server.key"}));
  EXPECT_TRUE(Call("ZEPH.Core.Certificate.CSR", "renew",
                   Params("{\"id\": \"" + id + "\"}"))["success"].asBool());
  EXPECT_EQ(Exported(Params("{\"file\": \"csr_set\"}")),
            (Names{"server.csr", "server.key"}));

  // The caller's files are handed to the module as private copies: a
  // certificate with a byte-order mark, read-only and somebody else's,
  // imports and stays as it was.
  const std::string up = root_.Path("/upload");
  ZEPH::test::MakeDirs(up);
  Openssl({"req", "-x509", "-newkey", "rsa:1024", "-nodes", "-keyout", up + "/ca.key",
           "-out", up + "/ca.pem", "-days", "30", "-subj", "/CN=Upload CA"});
  Openssl({"req", "-new", "-newkey", "rsa:1024", "-nodes", "-keyout",
           up + "/leaf.key", "-out", up + "/leaf.csr", "-subj", "/CN=up.example"});
  Openssl({"x509", "-req", "-in", up + "/leaf.csr", "-CA", up + "/ca.pem", "-CAkey",
           up + "/ca.key", "-CAcreateserial", "-days", "30", "-out", up + "/leaf.pem"});
  const std::string cert = "\xEF\xBB\xBF" + ReadFile(up + "/leaf.pem");
  ZEPH::test::WriteFile(up + "/leaf.pem", cert, 0444);
  ASSERT_EQ(chown((up + "/leaf.pem").c_str(), 0, 0), 0);
  ASSERT_EQ(ZEPH::test::Run({"/bin/chmod", "a+r", up + "/leaf.key", up + "/leaf.csr",
                             up + "/ca.pem", up + "/ca.key"}).status, 0);

  EXPECT_TRUE(Call("ZEPH.Core.Certificate.CSR", "sign", Params(
      "{\"id\": \"" + id + "\", \"days\": 30, \"csr\": \"leaf.csr\", \"csr_tmp\": \"" +
      up + "/leaf.csr\", \"alias\": \"up.example\"}"))["success"].asBool());
  EXPECT_EQ(Exported(Params("{\"file\": \"signed_set\"}")), Names{"server.crt"});

  Json::Value import = Params("{\"desc\": \"imported\", \"key_tmp\": \"" + up +
                              "/leaf.key\", \"cert_tmp\": \"" + up +
                              "/leaf.pem\", \"inter_cert_tmp\": \"" + up + "/ca.pem\"}");
  a = Call("ZEPH.Core.Certificate", "import", import);
  const std::string imported = a["data"]["id"].asString();
  ASSERT_EQ(imported.size(), 6u) << ZEPH::JsonCompact(a);
  EXPECT_EQ(ReadFile(up + "/leaf.pem"), cert);
  // The authority given as intermediate is a root: it is left out.
  EXPECT_EQ(Exported(Params("{\"file\": \"archive\", \"id\": \"" + imported + "\"}")),
            (Names{"privkey.pem", "cert.pem"}));
  EXPECT_EQ(ReadFile(archive + "/" + imported + "/cert.pem"), cert.substr(3));
  import["key_tmp"] = up + "/ca.key";
  EXPECT_EQ(Call("ZEPH.Core.Certificate", "import", import)["error"]["code"].asInt(),
            5514);

  a = Call("ZEPH.Core.Certificate.CRT", "recreate", Params("{\"id\": \"" + id + "\"}"));
  EXPECT_TRUE(a["data"]["restart_httpd"].asBool()) << ZEPH::JsonCompact(a);
  a = Call("ZEPH.Core.Certificate.CRT", "delete",
           Params("{\"ids\": [\"" + imported + "\"]}"));
  EXPECT_TRUE(a["success"].asBool()) << ZEPH::JsonCompact(a);
  EXPECT_FALSE(Exists(archive + "/" + imported));
  a = Call("ZEPH.Core.Certificate", "reset", Json::objectValue);
  EXPECT_TRUE(a["success"].asBool()) << ZEPH::JsonCompact(a);
  // No private copy of an upload outlives its call.
  for (const std::string& name : ZEPH::test::DirEntries(root_.Path("/tmp"))) {
    EXPECT_EQ(name.find("zephcert-upload"), std::string::npos) << name;
  }
}

// The Let's Encrypt settings through zephcert, the page's way: secrets go
// in on standard input and never come out; then one certificate for
// several names and a wildcard, validated by pebble with DNS-01 at a CA
// that demands external account binding.
TEST_P(ZephcertWorkflow, LetsEncryptSettingsAndSeveralNamesAgainstPebble) {
  using ZEPH::test::ChallengeServer;
  using ZEPH::test::Pebble;
  if (!ZEPH::test::LegoInstalled() || !ZEPH::test::PebbleInstalled() ||
      !ZEPH::test::ChallengeServerInstalled()) {
    GTEST_SKIP() << "lego, pebble or pebble-challtestsrv is not installed";
  }
  ASSERT_EQ(Run({"init"}).status, 0);
  const std::string dir = root_.Path("/pebble");
  ZEPH::test::MakeDirs(dir);
  ChallengeServer challenges(dir);
  std::string error;
  ASSERT_TRUE(challenges.Start(&error)) << error;
  ZEPH::test::PebbleOptions options;
  options.dns_server = challenges.DnsAddress();
  options.require_eab = true;
  Pebble pebble(dir, options);
  ASSERT_TRUE(pebble.Start(&error)) << error;
  // The ordinary user reads what the test made.
  ZEPH::test::Run({"/bin/chmod", "-R", "a+rX", dir});

  auto settings = [this](const std::string* input) {
    std::vector<std::string> args = {"letsencrypt-settings"};
    if (input != nullptr) args.push_back("-");
    const CommandResult r = Run(args, input);
    Json::Value answer = ParseAnswer(r);
    EXPECT_EQ(r.status, answer["success"].asBool() ? 0 : 1) << r.out << r.err;
    return answer;
  };
  Json::Value update = challenges.ToolSettings();
  update["directory_url"] = pebble.DirectoryUrl();
  update["ca_bundle_pem"] = ReadFile(pebble.ca_file());
  update["eab_kid"] = ZEPH::test::kEabKid;
  update["eab_hmac_key"] = ZEPH::test::kEabHmacKey;
  update["timeout_s"] = 90;
  std::string text = ZEPH::JsonCompact(update);
  Json::Value a = settings(&text);
  ASSERT_TRUE(a["success"].asBool()) << a;
  EXPECT_TRUE(a["data"]["eab_hmac_key_is_set"].asBool());
  EXPECT_EQ(a["data"]["challenge"].asString(), "dns");
  const std::string config = root_.Path("/usr/zeph/etc/letsencrypt/config.json");
  EXPECT_EQ(ZEPH::test::ModeOf(config), 0600u);
  const std::string saved = ReadFile(config);
  text = "{\"eab_kid\": \"\"}";
  a = settings(&text);
  EXPECT_EQ(a["error"]["setting"].asString(), "eab_kid") << a;
  EXPECT_EQ(ReadFile(config), saved);
  a = settings(nullptr);
  EXPECT_EQ(a["data"]["dns_provider"].asString(), "exec");
  for (const std::string& secret : {std::string(ZEPH::test::kEabHmacKey), challenges.hook()}) {
    EXPECT_EQ(ZEPH::JsonCompact(a).find(secret), std::string::npos) << secret;
  }

  a = Call("ZEPH.Core.Certificate.LetsEncrypt", "create",
           Params("{\"desc\": \"le\", \"domain_name\": \"nas.zeph.test,*.zeph.test\", "
                  "\"email\": \"admin@zeph.test\"}"));
  const std::string id = a["data"]["id"].asString();
  ASSERT_EQ(id.size(), 6u) << a;
  auto names = [this, &id] {
    Json::Value list = Call("ZEPH.Core.Certificate.CRT", "list", Json::objectValue);
    for (const Json::Value& c : list["data"]["certificates"]) {
      if (c["id"].asString() == id) return ZEPH::JsonCompact(c["sub_alt_name"]);
    }
    return std::string("not listed");
  };
  EXPECT_EQ(names(), "[\"nas.zeph.test\",\"*.zeph.test\"]");
  a = Call("ZEPH.Core.Certificate.LetsEncrypt", "renew", Params("{\"id\": \"" + id + "\"}"));
  EXPECT_TRUE(a["success"].asBool()) << a;
  EXPECT_EQ(names(), "[\"nas.zeph.test\",\"*.zeph.test\"]");
}

INSTANTIATE_TEST_SUITE_P(Users, ZephcertWorkflow,
                         ::testing::Values(RunAs::kTestUser, RunAs::kOrdinaryUser),
                         [](const ::testing::TestParamInfo<RunAs>& param) {
                           return param.param == RunAs::kTestUser ? "TestUser"
                                                                  : "OrdinaryUser";
                         });

}  // namespace
