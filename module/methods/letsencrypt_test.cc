// The Let's Encrypt tool protocol and the LetsEncrypt methods. The tool's
// answers are what is under test here, so each case installs a small
// script in the tool's place that answers as a real tool could; the real
// tool is tested against a real ACME server with its own tests, and the
// methods under failing storage by the fault sweep.
#include <gtest/gtest.h>
#include <unistd.h>

#include "module/methods/letsencrypt.h"
#include "module/methods/methods_test_support.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::Exists;

const char kLe[] = "ZEPH.Core.Certificate.LetsEncrypt";

void InstallTool(const ApplianceRoot& root, const std::string& body) {
  ZEPH::test::WriteFile(root.Path("/usr/zeph/sbin/zeph-letsencrypt"),
                        "#!/bin/sh\necho \"$@\" >> \"$ZEPH_ROOT/tool.calls\"\n" + body, 0755);
}

TEST(RunLetsEncrypt, MakesEveryAnswerAnObjectWithAnError) {
  ApplianceRoot root;
  // Provisioning installed the real tool; first there is none at all.
  unlink(root.Path("/usr/zeph/sbin/zeph-letsencrypt").c_str());
  Json::Value a = RunLetsEncrypt("renew", "-c", "x");
  EXPECT_EQ(a["error"].asInt(), 1);
  EXPECT_EQ(a["msg"].asString(), "failed to call zeph-letsencrypt.");
  const char kNoCode[] = "zeph-letsencrypt has no error code.";
  const struct {
    const char* body;
    int error;
    const char* msg;  // nullptr: no "msg"
  } kRows[] = {
      {"echo '{}'", 1, kNoCode},
      {"echo '{\"error\": 107}'", 107, "unknow message."},
      {"echo '{\"error\": 205, \"msg\": \"x\"}'", 205, "x"},
      {"echo '{\"error\": 0}'; exit 3", 0, nullptr},
      {"printf 'not\\njson'", 1, "zeph-letsencrypt output is not a json: not\njson"},
      {"echo '{\"error\": 0,'; echo ' \"extra\": [1]}'", 0, nullptr},
      // Whatever follows the answer is not the module's concern.
      {"echo '{\"error\": 0}'; echo 'lego: done'", 0, nullptr},
      {"echo 'null'", 1, kNoCode},
      {"echo '[{\"error\": 0}]'", 1, kNoCode},
      {"echo '{\"error\": \"zero\"}'", 1, "unknow message."},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.body);
    InstallTool(root, std::string(row.body) + "\n");
    a = RunLetsEncrypt("revoke", "-c", "Ab3xYz");
    EXPECT_EQ(a["error"].asInt(), row.error);
    EXPECT_EQ(a.isMember("msg"), row.msg != nullptr);
    if (row.msg != nullptr) {
      EXPECT_EQ(a["msg"].asString(), row.msg);
    }
  }
  EXPECT_TRUE(root.LogContains("zeph-letsencrypt failed. 205 [x]"));
  // Every argument reached the tool as given.
  EXPECT_NE(ZEPH::test::ReadFile(root.Path("/tool.calls")).find("revoke -c Ab3xYz\n"),
            std::string::npos);
}

TEST(RunLetsEncrypt, ErrorNumbersMapOntoApiCodesWithTheirGaps) {
  const std::pair<int, int> kTable[] = {
      {100, 5520}, {101, 5521}, {102, 5522}, {103, 5523}, {104, 5524}, {105, 5525},
      {106, 5526}, {107, 5501}, {108, 5528}, {109, 5529}, {110, 5530}, {111, 5501},
      {200, 5527}, {205, 5527}, {201, 5501}, {1, 5501},   {0, 5501},   {-1, 5501}};
  for (const auto& row : kTable) {
    EXPECT_EQ(LetsEncryptErrorToApiError(row.first), row.second) << row.first;
  }
}

TEST(LetsEncryptCalls, CreateRenewAndAccounts) {
  ApplianceRoot root;
  const std::string source = root.CreateCertificate("le.example");
  // A tool that issues by copying a ready set into the directory it is told.
  InstallTool(root, "dir=\"$ZEPH_ROOT/usr/zeph/etc/certificate/_archive/$7\"\n"
                    "cp \"$ZEPH_ROOT/usr/zeph/etc/certificate/_archive/" + source +
                    "\"/*.pem \"$dir\"/ && echo '{\"error\": 0}'\n");
  ZEPH::test::CallResult r = root.Call(kLe, "create",
      "{\"desc\": \"le\", \"domain_name\": \"nas.example\", \"email\": \"a@example.com\", "
      "\"user_deletable\": false}");
  ASSERT_TRUE(r.ok()) << r.code();
  const std::string id = r.data()["id"].asString();
  EXPECT_FALSE(r.data().isMember("restart_httpd"));
  EXPECT_TRUE(Exists(root.Archive("/" + id + "/fullchain.pem")));
  EXPECT_FALSE(Exists(root.Archive("/" + id + ".temp")));
  EXPECT_FALSE(root.Info()[id]["user_deletable"].asBool());
  EXPECT_NE(ZEPH::test::ReadFile(root.Path("/tool.calls"))
                .find("new-cert -d nas.example -m a@example.com -c " + id + ".temp"),
            std::string::npos);

  // A refusal: mapped code, and no directory of the failed issuance stays.
  InstallTool(root, "echo '{\"error\": 103, \"msg\": \"rate limited\"}'\n");
  const std::vector<std::string> before = ZEPH::test::DirEntries(root.Archive());
  EXPECT_EQ(root.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"nas.example\"}").code(),
            5523);
  EXPECT_EQ(ZEPH::test::DirEntries(root.Archive()), before);
  EXPECT_TRUE(root.LogContains("Failed to create Let's Encrypt certificate. [103][rate limited]"));
  // An empty domain never runs the tool; replace mode needs a certificate.
  unlink(root.Path("/tool.calls").c_str());
  EXPECT_EQ(root.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"\"}").code(), 5503);
  EXPECT_FALSE(Exists(root.Path("/tool.calls")));
  EXPECT_EQ(root.Call(kLe, "create",
                      "{\"desc\": \"\", \"domain_name\": \"d\", \"id\": \"nosuch\"}").code(), 5503);

  InstallTool(root, "echo '{\"error\": 0}'\n");
  r = root.Call(kLe, "renew", "{\"id\": \"" + source + "\"}");
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(r.data()["id"].asString(), source);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(root.LogContains("handle le renew. [" + source + "]"));
  InstallTool(root, "echo '{\"error\": 110, \"msg\": \"gone\"}'\n");
  EXPECT_EQ(root.Call(kLe, "renew", "{\"id\": \"" + source + "\"}").code(), 5530);
  EXPECT_EQ(root.Call(kLe, "renew", "{\"id\": \"a/b\"}").code(), 5503);

  // Accounts are listed by their contact; others are left out.
  const std::string account = "ZEPH.Core.Certificate.LetsEncrypt.Account";
  EXPECT_EQ(root.Call(account, "list").data()["email"], Json::Value(Json::arrayValue));
  const std::string accounts = root.Path("/usr/zeph/etc/letsencrypt/account");
  const std::pair<const char*, const char*> kInfos[] = {
      {"a", "{\"contact\": \"admin@example.com\"}"}, {"b", "{\"contact\": \"\"}"},
      {"c", "{\"contact\": 5}"}, {"d", "not json"},
      {"e", "{\"contact\": \"ops@example.com\", \"other\": 1}"}};
  for (const auto& info : kInfos) {
    ZEPH::test::MakeDirs(accounts + "/" + info.first);
    ZEPH::test::WriteFile(accounts + "/" + info.first + "/info.json", info.second);
  }
  r = root.Call(account, "list");
  ASSERT_TRUE(r.ok());
  Json::Value expected(Json::arrayValue);
  expected[0]["contact"] = "admin@example.com";
  expected[1]["contact"] = "ops@example.com";
  EXPECT_EQ(r.data()["email"], expected);
}

}  // namespace
