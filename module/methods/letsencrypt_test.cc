// The Let's Encrypt tool protocol and the LetsEncrypt methods. The tool's
// answers are what is under test here, so each case installs a small
// script in the tool's place that answers as a real tool could; the real
// tool is tested against a real ACME server with its own tests.
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
                        "#!/bin/sh\necho \"$@\" >> \"$ZEPH_ROOT/tool.calls\"\n" + body,
                        0755);
}

TEST(RunLetsEncrypt, MakesEveryAnswerAnObjectWithAnError) {
  ApplianceRoot root;
  // Provisioning installed the real tool; first there is none at all.
  unlink(root.Path("/usr/zeph/sbin/zeph-letsencrypt").c_str());
  Json::Value a = RunLetsEncrypt("renew", "-c", "x");
  EXPECT_EQ(a["error"].asInt(), 1);
  EXPECT_EQ(a["msg"].asString(), "failed to call zeph-letsencrypt.");

  const struct {
    const char* body;
    int error;
    const char* msg;
    int api;
  } cases[] = {
      {"echo '{}'", 1, "zeph-letsencrypt has no error code.", 5501},
      {"echo '{\"error\": 107}'", 107, "unknow message.", 5501},
      {"echo '{\"error\": 205, \"msg\": \"x\"}'", 205, "x", 5527},
      {"echo '{\"error\": 0}'; exit 3", 0, nullptr, 0},
      {"printf 'not\\njson'", 1, "zeph-letsencrypt output is not a json: not\njson", 5501},
      {"echo '{\"error\": 0,'; echo ' \"extra\": [1]}'", 0, nullptr, 0},
      // Whatever follows the answer is not the module's concern.
      {"echo '{\"error\": 0}'; echo 'lego: done'", 0, nullptr, 0},
      {"echo 'null'", 1, "zeph-letsencrypt has no error code.", 5501},
      {"echo '[{\"error\": 0}]'", 1, "zeph-letsencrypt has no error code.", 5501},
      {"echo '{\"error\": \"zero\"}'", 1, "unknow message.", 5501},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.body);
    InstallTool(root, std::string(c.body) + "\n");
    a = RunLetsEncrypt("revoke", "-c", "Ab3xYz");
    EXPECT_EQ(a["error"].asInt(), c.error);
    if (c.msg != nullptr) {
      EXPECT_EQ(a["msg"].asString(), c.msg);
      EXPECT_EQ(LetsEncryptErrorToApiError(c.error), c.api);
    } else {
      EXPECT_FALSE(a.isMember("msg"));
    }
  }
  EXPECT_TRUE(root.LogContains("zeph-letsencrypt failed. 205 [x]"));
  // Every argument reached the tool as given.
  EXPECT_NE(ZEPH::test::ReadFile(root.Path("/tool.calls")).find("revoke -c Ab3xYz\n"),
            std::string::npos);
}

TEST(RunLetsEncrypt, ErrorNumbersMapOntoApiCodesWithTheirGaps) {
  const std::pair<int, int> table[] = {
      {100, 5520}, {101, 5521}, {102, 5522}, {103, 5523}, {104, 5524},
      {105, 5525}, {106, 5526}, {107, 5501}, {108, 5528}, {109, 5529},
      {110, 5530}, {111, 5501}, {200, 5527}, {205, 5527}, {201, 5501},
      {1, 5501},   {0, 5501},   {-1, 5501}};
  for (const auto& row : table) {
    EXPECT_EQ(LetsEncryptErrorToApiError(row.first), row.second) << row.first;
  }
}

TEST(LetsEncryptCreate, StoresTheToolsSetAndCleansUpAfterAFailure) {
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
  const std::string before = ZEPH::test::Run({"/bin/ls", root.Archive()}).out;
  r = root.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"nas.example\"}");
  EXPECT_EQ(r.code(), 5523);
  EXPECT_EQ(ZEPH::test::Run({"/bin/ls", root.Archive()}).out, before);
  EXPECT_TRUE(root.LogContains("Failed to create Let's Encrypt certificate. [103][rate limited]"));

  // Replace mode keeps the id; an empty domain never runs the tool.
  unlink(root.Path("/tool.calls").c_str());
  EXPECT_EQ(root.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"\"}").code(), 5503);
  EXPECT_FALSE(Exists(root.Path("/tool.calls")));
  EXPECT_EQ(root.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"d\", \"id\": \"nosuch\"}").code(),
            5503);
}

TEST(LetsEncryptRenew, RunsTheToolAndRedeploys) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("renew.example");
  InstallTool(root, "echo '{\"error\": 0}'\n");
  ZEPH::test::CallResult r = root.Call(kLe, "renew", "{\"id\": \"" + id + "\"}");
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(r.data()["id"].asString(), id);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(root.LogContains("handle le renew. [" + id + "]"));

  InstallTool(root, "echo '{\"error\": 110, \"msg\": \"gone\"}'\n");
  EXPECT_EQ(root.Call(kLe, "renew", "{\"id\": \"" + id + "\"}").code(), 5530);
  EXPECT_EQ(root.Call(kLe, "renew", "{\"id\": \"a/b\"}").code(), 5503);
}

TEST(LetsEncryptAccounts, ListsAccountsWithAContact) {
  ApplianceRoot root;
  ZEPH::test::CallResult r = root.Call("ZEPH.Core.Certificate.LetsEncrypt.Account", "list");
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(r.data()["email"], Json::Value(Json::arrayValue));

  const std::string accounts = root.Path("/usr/zeph/etc/letsencrypt/account");
  const std::pair<const char*, const char*> infos[] = {
      {"a", "{\"contact\": \"admin@example.com\"}"},
      {"b", "{\"contact\": \"\"}"},
      {"c", "{\"contact\": 5}"},
      {"d", "not json"},
      {"e", "{\"contact\": \"ops@example.com\", \"other\": 1}"},
  };
  for (const auto& info : infos) {
    ZEPH::test::MakeDirs(accounts + "/" + info.first);
    ZEPH::test::WriteFile(accounts + "/" + info.first + "/info.json", info.second);
  }
  r = root.Call("ZEPH.Core.Certificate.LetsEncrypt.Account", "list");
  ASSERT_TRUE(r.ok());
  Json::Value expected(Json::arrayValue);
  expected[0]["contact"] = "admin@example.com";
  expected[1]["contact"] = "ops@example.com";
  EXPECT_EQ(r.data()["email"], expected);
}

}  // namespace
