// zephcert end to end: the real executable loading the real module.
#include <gtest/gtest.h>
#include <unistd.h>

#include <regex>
#include <string>
#include <vector>

#include "test_support.h"
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

TEST(ZephcertCall, EveryRowOfTheTableCanBeCalled) {
  TempRoot root;
  ASSERT_EQ(Zephcert({"init", "--root", root.dir()}).status, 0);
  const std::pair<const char*, const char*> rows[] = {
      {"ZEPH.Core.Certificate", "reset"},
      {"ZEPH.Core.Certificate", "export"},
      {"ZEPH.Core.Certificate", "import"},
      {"ZEPH.Core.Certificate.CSR", "create"},
      {"ZEPH.Core.Certificate.CSR", "renew"},
      {"ZEPH.Core.Certificate.CSR", "sign"},
      {"ZEPH.Core.Certificate.CRT", "create"},
      {"ZEPH.Core.Certificate.CRT", "recreate"},
      {"ZEPH.Core.Certificate.CRT", "set"},
      {"ZEPH.Core.Certificate.CRT", "delete"},
      {"ZEPH.Core.Certificate.CRT", "list"},
      {"ZEPH.Core.Certificate.LetsEncrypt", "create"},
      {"ZEPH.Core.Certificate.LetsEncrypt", "renew"},
      {"ZEPH.Core.Certificate.LetsEncrypt.Account", "list"},
      {"ZEPH.Core.Certificate.Service", "set"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(std::string(row.first) + " " + row.second);
    CommandResult r = Zephcert({"--root", root.dir(), "call", row.first, row.second});
    ASSERT_TRUE(r.status == 0 || r.status == 1) << r.status << " " << r.err;
    Json::Value answer = ParseAnswer(r);
    EXPECT_EQ(answer["success"].asBool(), r.status == 0);
    EXPECT_TRUE(answer["httpd_restart"].isBool());
  }
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

TEST(ZephcertCall, CertificateMethodsWorkEndToEnd) {
  TempRoot root;
  ASSERT_EQ(Zephcert({"init", "--root", root.dir()}).status, 0);
  auto call = [&](const std::string& api, const std::string& method,
                  const std::string& params) {
    return Zephcert({"--root", root.dir(), "call", api, method, params});
  };
  const std::string subject =
      "\"country\": \"TW\", \"state\": \"\", \"city\": \"Taipel\", "
      "\"organization\": \"Zeph\", \"department\": \"\", \"email\": \"\"";
  CommandResult r = call("ZEPH.Core.Certificate.CRT", "create",
                         "{" + subject + ", \"common_name\": \"cli.example\", "
                         "\"ca_country\": \"TW\", \"ca_state\": \"\", \"ca_city\": \"\", "
                         "\"ca_organization\": \"Zeph\", \"ca_department\": \"\", "
                         "\"ca_common_name\": \"cli CA\", \"ca_email\": \"\", "
                         "\"desc\": \"from the shell\", \"as_default\": true, "
                         "\"key_length\": 1024, \"ca_key_length\": 1024}");
  ASSERT_EQ(r.status, 0) << r.out << r.err;
  const std::string id = ParseAnswer(r)["data"]["id"].asString();
  ASSERT_EQ(id.size(), 6u);

  r = call("ZEPH.Core.Certificate.CRT", "list", "{}");
  ASSERT_EQ(r.status, 0) << r.err;
  // The certificate init made, and the new one, now the default.
  Json::Value certs = ParseAnswer(r)["data"]["certificates"];
  ASSERT_EQ(certs.size(), 2u);
  const Json::Value& mine = certs[0]["id"].asString() == id ? certs[0] : certs[1];
  const Json::Value& first = certs[0]["id"].asString() == id ? certs[1] : certs[0];
  EXPECT_TRUE(mine["is_default"].asBool());
  EXPECT_EQ(mine["subject"]["common_name"].asString(), "cli.example");
  EXPECT_FALSE(first["is_default"].asBool());
  EXPECT_EQ(first["subject"]["common_name"].asString(), "arvelon");
  ASSERT_EQ(first["services"].size(), 1u);

  Json::Value services;
  ASSERT_TRUE(ZEPH::JsonFromFile(
      services, root.Path("/usr/zeph/etc/certificate/_archive/SERVICES")));
  Json::Value settings;
  settings["settings"][0]["service"] = services[0];
  settings["settings"][0]["id"] = id;
  settings["settings"][0]["old_id"] = "";
  r = call("ZEPH.Core.Certificate.Service", "set", ZEPH::JsonCompact(settings));
  ASSERT_EQ(r.status, 0) << r.err;
  Json::Value answer = ParseAnswer(r);
  EXPECT_TRUE(answer["data"]["restart_httpd"].asBool());
  EXPECT_TRUE(answer["httpd_restart"].asBool());
  EXPECT_EQ(ReadFile(root.Path("/usr/zeph/etc/certificate/system/default/fullchain.pem")),
            ReadFile(root.Path("/usr/zeph/etc/certificate/_archive/" + id + "/fullchain.pem")));

  r = call("ZEPH.Core.Certificate.CRT", "set",
           "{\"id\": \"" + id + "\", \"desc\": \"renamed\"}");
  EXPECT_EQ(r.status, 0) << r.err;
  r = call("ZEPH.Core.Certificate.CRT", "set", "{\"id\": \"zzzzzz\", \"desc\": \"\"}");
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(ParseAnswer(r)["error"]["code"].asInt(), 5501);
}

}  // namespace
