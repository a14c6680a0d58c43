// The certificate methods through the real method table on a private, provisioned root;
// the Let's Encrypt tool is replaced by small scripts.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <regex>
#include <sstream>

#include "module/archive/archive_testing.h"
#include "module/archive/info.h"
#include "module/methods/action_log.h"
#include "module/methods/cert_info.h"
#include "module/methods/csr.h"
#include "module/methods/letsencrypt.h"
#include "module/methods/methods_test_support.h"
#include "module/methods/properties.h"
#include "module/mkcert/verify.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace test {
namespace {


Json::Value Parse(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(JsonParse(text, v)) << text;
  return v;
}

Json::Value Setting(const Json::Value& service, const std::string& id, const std::string& old_id) {
  Json::Value s;
  s["service"] = service;
  s["id"] = id;
  s["old_id"] = old_id;
  return s;
}

Json::Value Settings(const std::vector<Json::Value>& settings) {
  Json::Value p;
  p["settings"] = Json::Value(Json::arrayValue);
  for (const Json::Value& s : settings) p["settings"].append(s);
  return p;
}

// An event as "<message id> <level> <text1>|<text2>"; every event of the
// module is of type 1 with an empty text3.
std::string Summary(const Json::Value& e) {
  EXPECT_EQ(e["type"].asInt(), 1);
  EXPECT_EQ(e["text3"].asString(), "");
  std::ostringstream out;
  out << std::hex << std::uppercase << e["message_id"].asUInt() << std::dec << " "
      << e["level"].asInt() << " " << e["text1"].asString() << "|" << e["text2"].asString();
  return out.str();
}

// The key and the signature algorithm of the PEM certificate or request at `path`:
// "rsa1024 sha256WithRSAEncryption", "P-256 ecdsa-with-SHA384".
std::string KeyAndSignature(const std::string& path) {
  const bool req = ReadFile(path).find("REQUEST") != std::string::npos;
  const std::string text =
      test::Run({"/usr/bin/openssl", req ? "req" : "x509", "-noout", "-text", "-in", path}).out;
  std::smatch bits, sig, curve;
  std::regex_search(text, bits, std::regex("Public-Key: \\(([0-9]+) bit\\)"));
  std::regex_search(text, sig, std::regex("Signature Algorithm: (\\S+)"));
  const bool ec = std::regex_search(text, curve, std::regex("NIST CURVE: (\\S+)"));
  return (ec ? curve[1].str() : "rsa" + bits[1].str()) + " " + sig[1].str();
}

// The subject of the request at `path`: "C=TW,L=Taipel,CN=t".
std::string RequestSubject(const std::string& path) {
  return test::Run({"/usr/bin/openssl", "req", "-noout", "-subject", "-nameopt",
                    "utf8,sep_comma_plus,-esc_msb", "-in", path}).out;
}

class MethodsTest : public ::testing::Test {
 protected:
  Json::Value Listed(const std::string& id) const {
    CallResult r = root_.Call(kCrt, "list");
    EXPECT_TRUE(r.ok()) << r.code();
    for (const Json::Value& c : r.data()["certificates"]) {
      if (c["id"].asString() == id) return c;
    }
    return Json::Value();
  }
  void Bind(const Json::Value& service, const std::string& id, const std::string& old_id) {
    CallResult r = root_.Call(kService, "set", Settings({Setting(service, id, old_id)}));
    ASSERT_TRUE(r.ok() && !r.data().isMember("err_settings")) << r.code();
  }
  std::vector<std::string> Summaries(size_t from = 0) const {
    std::vector<std::string> out;
    const std::vector<Json::Value> events = root_.Events();
    for (size_t i = from; i < events.size(); ++i) out.push_back(Summary(events[i]));
    return out;
  }
  std::string LastEvent() const { return Summary(root_.Events().back()); }
  // `r` answered `code` (0: success) with `data` (JSON text), and `event` was logged last.
  void ExpectAnswer(const CallResult& r, int code, const std::string& data,
                    const std::string& event) const {
    EXPECT_EQ(r.ok() ? 0 : r.code(), code);
    EXPECT_EQ(r.data(), Parse(data));
    EXPECT_EQ(LastEvent(), event);
  }
  void EditInfo(const std::function<void(Json::Value&)>& edit) const {
    Json::Value info = root_.Info();
    edit(info);
    ASSERT_TRUE(JsonToFile(info, root_.Archive("/INFO"), true));
  }
  std::string Dir(const std::string& id) const { return root_.Archive("/" + id); }
  std::string WebCert() const { return ReadFile(root_.Path(kWebCert)); }
  std::string IdParam(const std::string& id) const { return "{\"id\": \"" + id + "\"}"; }
  void InstallLetsEncryptTool(const std::string& body) const {
    WriteFile(root_.Path("/usr/zeph/sbin/zeph-letsencrypt"),
              "#!/bin/sh\necho \"$@\" >> \"$ZEPH_ROOT/tool.calls\"\n" + body + "\n", 0755);
  }
  bool ToolCalled(const std::string& args) const {
    return ReadFile(root_.Path("/tool.calls")).find(args) != std::string::npos;
  }

  ApplianceRoot root_;
  const std::string csr_ = root_.Path("/usr/zeph/etc/ssl/.gen/server.csr");
  const std::string key_ = root_.Path("/usr/zeph/etc/ssl/.gen/server.key");
};

TEST_F(MethodsTest, CreateListsWhatIsInsideTheCertificateAndLogs) {
  const std::string id = root_.CreateCertificate("nas.local", Parse(
      "{\"alias\": \"nas1;10.0.0.1;fe80::1\", \"as_default\": true, "
      "\"ca_email\": \"ca@example.com\"}"));
  Json::Value c = Listed(id);
  Json::Value time;
  EXPECT_TRUE(c.removeMember("valid_from", &time) && c.removeMember("valid_till", &time));
  Json::Value expected = Parse(
      "{\"desc\": \"made by a test\", \"is_default\": true, \"is_ecc\": false, "
      "\"renewable\": false, \"user_deletable\": true, \"services\": [], "
      "\"signature_algorithm\": \"sha256WithRSAEncryption\", "
      "\"sub_alt_name\": [\"nas1\", \"10.0.0.1\", \"fe80::1\", \"nas.local\"], "
      "\"subject\": {\"country\": \"TW\", \"city\": \"Taipel\", "
      "\"organization\": \"Zeph Test\", \"common_name\": \"nas.local\"}, \"issuer\": "
      "{\"country\": \"TW\", \"city\": \"Taipel\", \"organization\": \"Zeph Test\", "
      "\"common_name\": \"nas.local CA\", \"email\": \"ca@example.com\"}}");
  expected["id"] = id;
  expected["self_signed_cacrt_info"]["subject"] = expected["issuer"];
  expected["self_signed_cacrt_info"]["issuer"] = expected["issuer"];
  EXPECT_EQ(c, expected);
  EXPECT_EQ(Summaries(), (std::vector<std::string>{"12B00001 1 nas.local|",
                                                    "12B00003 1 nas.local|"}));
  // UTF-8 values are shown as given; without aliases the common name is the only name.
  const std::string org = "\u65e5\u672c Caf\u00e9 \U0001F510", cn = "\U0001F510.example";
  c = Listed(root_.CreateCertificate(cn, Parse("{\"organization\": \"" + org + "\"}")));
  EXPECT_EQ(c["subject"]["common_name"].asString() + "|" + c["subject"]["organization"].asString(),
            cn + "|" + org);
  EXPECT_EQ(c["sub_alt_name"], Parse("[\"" + cn + "\"]"));
  // Failed creations and replacements and unknown actions go unlogged; a certificate
  // without a directory is named by the id it was given.
  const size_t base = root_.Events().size();
  LogAction(CERT_ACTION_DELETE, true, id, "x", "ignored");
  LogAction(CERT_ACTION_SERVICE_SET, false, id, "x", "FTP");
  LogAction(CERT_ACTION_CREATE, false, id, "x", "");
  LogAction(CERT_ACTION_REPLACE, false, id, "x", "");
  LogAction(static_cast<CERT_ACTION>(7), true, id, "x", "");
  LogAction(CERT_ACTION_RECREATE, false, "", "fallback", "");
  test::Run({"/bin/rm", "-rf", Dir(id)});
  LogAction(CERT_ACTION_RESET, true, id, "x", "");
  EXPECT_EQ(Summaries(base), (std::vector<std::string>{"12B00005 1 nas.local|",
      "12B00008 3 nas.local|FTP", "12B00010 3 fallback|", "12B00011 1 x|"}));
  EXPECT_EQ(GetCrtSubjectCN("../x"), "");
}

TEST_F(MethodsTest, CreateInReplaceModeKeepsIdAndBindingsAndRedeploys) {
  const std::string id = root_.CreateCertificate("first.example");
  Bind(root_.WebService(), id, "");
  Json::Value replace = CreateParams("second.example");
  replace["id"] = id;
  CallResult r = root_.Call(kCrt, "create", replace);
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(r.data()["id"].asString(), id);
  EXPECT_TRUE(r.data()["restart_httpd"].asBool() && r.response.httpd_restart());
  EXPECT_EQ(WebCert(), ReadFile(Dir(id) + "/cert.pem"));
  const Json::Value c = Listed(id);
  EXPECT_EQ(c["subject"]["common_name"].asString(), "second.example");
  EXPECT_EQ(c["services"], Settings({root_.WebService()})["settings"]);
  EXPECT_EQ(LastEvent(), "12B00004 1 second.example|");
}

// Refused parameters make and record nothing; a line break would add lines to
// openssl's configuration. A key length openssl refuses leaves an empty directory.
TEST_F(MethodsTest, CreateRefusesBadParameters) {
  const struct {
    const char* member;
    const char* value;  // JSON
    int code;
  } kRows[] = {
      {"id", "\"../etc\"", 5503},
      {"ca_organization", "\"Zeph\\nbasicConstraints = CA:true\"", 5503},
      {"ca_organization", "\"Caf\xE9\"", 5503},
      {"ca_organization", "\"\xED\xA0\x80\"", 5503},
      {"alias", "\"a\\nbasicConstraints = CA:true\"", 5501},
      {"key_type", "\"ec521\"", 5503},
      {"key_type", "256", 5503},
      {"ca_key_type", "\"EC256\"", 5503},
      {"key_length", "1", 5501},
  };
  for (const auto& row : kRows) {
    Json::Value params = CreateParams("x.example");
    params[row.member] = Parse(row.value);
    CallResult r = root_.Call(kCrt, "create", params);
    EXPECT_EQ(r.code(), row.code) << row.member << " " << row.value;
    EXPECT_TRUE(r.data().isNull());
  }
  EXPECT_TRUE(root_.Events().empty());
  for (const std::string& entry : DirEntries(root_.Archive())) {
    if (entry == "SERVICES") continue;
    EXPECT_EQ(DirEntries(Dir(entry)), std::vector<std::string>{}) << entry;
  }
}

// Each key is made as asked; a certificate signs with the digest of its authority's
// key, an EC one claims no key encipherment. Recreate keeps both types.
TEST_F(MethodsTest, KeyTypesAreMadeAsAskedAndKeptByRecreate) {
  const struct {
    const char* key_type;  // nullptr: not given
    const char* ca_key_type;
    const char* server;     // KeyAndSignature(cert.pem)
    const char* authority;  // KeyAndSignature(zeph-ca-cert.pem)
  } kRows[] = {
      {nullptr, nullptr, "rsa1024 sha256WithRSAEncryption", "rsa1024 sha256WithRSAEncryption"},
      {"ec256", "ec384", "P-256 ecdsa-with-SHA384", "P-384 ecdsa-with-SHA384"},
      {"ec384", "rsa", "P-384 sha256WithRSAEncryption", "rsa1024 sha256WithRSAEncryption"},
      {"rsa", "ec256", "rsa1024 ecdsa-with-SHA256", "P-256 ecdsa-with-SHA256"},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.server);
    Json::Value extra(Json::objectValue);
    if (row.key_type) extra["key_type"] = row.key_type;
    if (row.ca_key_type) extra["ca_key_type"] = row.ca_key_type;
    const std::string id = root_.CreateCertificate("kt.example", extra), dir = Dir(id);
    const bool rsa = std::string(row.server).compare(0, 3, "rsa") == 0;
    EXPECT_TRUE(SignedByOwnAuthority(dir));
    EXPECT_EQ(verifyCrtAndKey(dir + "/cert.pem", dir + "/privkey.pem"), 0);
    const std::string text = test::Run({"/usr/bin/openssl", "x509", "-noout", "-ext", "keyUsage",
                                        "-in", dir + "/cert.pem"}).out;
    EXPECT_EQ(text.find("Key Encipherment") != std::string::npos, rsa) << text;
    ASSERT_TRUE(root_.Call(kCrt, "recreate", IdParam(id)).ok());
    EXPECT_EQ(KeyAndSignature(dir + "/cert.pem"), row.server);
    EXPECT_EQ(KeyAndSignature(dir + "/zeph-ca-cert.pem"), row.authority);
  }
}

TEST_F(MethodsTest, ListLeavesOutWhatItCannotReadAndFailsWithoutACatalogue) {
  EXPECT_EQ(root_.Call(kCrt, "list").code(), 5501);  // no INFO yet
  WriteFile(root_.Archive("/INFO"), "[]");
  EXPECT_EQ(root_.Call(kCrt, "list").code(), 5501);
  WriteFile(root_.Archive("/INFO"), "{}");
  EXPECT_EQ(root_.Call(kCrt, "list").data()["certificates"], Json::Value(Json::arrayValue));
  const std::string good = root_.CreateCertificate("good.example");
  const std::string broken = root_.CreateCertificate("broken.example");
  const std::string bare = root_.CreateCertificate("bare.example");
  const std::string unreadable = root_.CreateCertificate("unreadable.example");
  const std::string ca_less = root_.CreateCertificate("ca-less.example");
  unlink((Dir(broken) + "/fullchain.pem").c_str());
  WriteFile(Dir(unreadable) + "/cert.pem", "not a certificate");
  WriteFile(Dir(ca_less) + "/zeph-ca-cert.pem", "junk");
  EditInfo([&](Json::Value& info) {
    info[bare] = Json::Value(Json::objectValue);  // no "desc", no "user_deletable"
    info["nothere"]["desc"] = "no directory";
  });
  CallResult r = root_.Call(kCrt, "list");
  ASSERT_TRUE(r.ok());
  std::vector<std::string> ids, expected = {good, bare, ca_less};
  for (const Json::Value& c : r.data()["certificates"]) ids.push_back(c["id"].asString());
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(ids, expected);
  const Json::Value b = Listed(bare);
  EXPECT_TRUE(b["desc"].isNull() && b["services"].isNull() && b["user_deletable"].asBool());
  EXPECT_FALSE(Listed(ca_less).isMember("self_signed_cacrt_info"));
}

// Defaults serve callers of the worker. Renewal keeps subject and key length but the
// country; without "key_type" an EC one renews with 2048-bit RSA. Typed values go unescaped.
TEST_F(MethodsTest, CsrCreateAndRenewMakeTheRequestsAsked) {
  _tag_CSR_ARGUMENT subject;
  APIRequest empty;
  EXPECT_EQ(fillCSRInfo(&empty, nullptr, false), -1);
  ASSERT_EQ(fillCSRInfo(&empty, &subject, true), 0);
  EXPECT_NE(subject.email, kDefaultEmail);
  ASSERT_EQ(fillCSRInfo(&empty, &subject, false), 0);
  ASSERT_TRUE(generateCSR(1024, subject));
  EXPECT_EQ(RequestSubject(csr_), std::string("subject=C=TW,ST=Taipei,L=Taipel,O=Organization,") +
            "OU=Department,CN=" + kDefaultCommonName + ",emailAddress=" + kDefaultEmail + "\n");
  EXPECT_EQ(KeyBits(ReadFile(key_)), 1024);
  const std::string rsa = root_.CreateCertificate("renew.example", Parse("{\"key_length\": 1536}"));
  const std::string ec = "\"id\": \"" +
      root_.CreateCertificate("ec", Parse("{\"key_type\": \"ec256\"}")) + "\"";
  const std::string typed =
      "\"country\": \"TW\", \"state\": \"\", \"city\": \"\", \"organization\": \"\", "
      "\"department\": \"\", \"email\": \"\", \"common_name\": \"t\", \"key_length\": 1024";
  const struct {
    const char* method;
    std::string params;
    int code;
    const char* request;  // KeyAndSignature of the request made
    const char* subject;  // RequestSubject of the request
  } kRows[] = {
      {"renew", "\"id\": \"" + rsa + "\", \"country\": \"JP\", \"common_name\": \"x\", "
       "\"city\": \"x\"", 0, "rsa1536 sha256WithRSAEncryption",
       "C=JP,L=Taipel,O=Zeph Test,CN=renew.example"},
      {"renew", ec, 0, "rsa2048 sha256WithRSAEncryption", "C=TW,L=Taipel,O=Zeph Test,CN=ec"},
      {"renew", ec + ", \"key_type\": \"ec384\"", 0, "P-384 ecdsa-with-SHA384",
       "C=TW,L=Taipel,O=Zeph Test,CN=ec"},
      {"renew", ec + ", \"key_type\": \"ec\"", 5503, "", ""},
      {"renew", "\"id\": \"nosuch\"", 5501, "", ""},
      {"create", "\"country\": \"DE\", \"state\": \"\", \"city\": \"K\u00f6ln\", "
       "\"organization\": \"O'Neil \\\"Q\\\"\", \"department\": \"\", \"common_name\": "
       "\"q\", \"email\": \"\", \"key_length\": 1024", 0, "rsa1024 sha256WithRSAEncryption",
       "C=DE,L=K\u00f6ln,O=ONeil Q,CN=q"},
      {"create", typed + ", \"key_type\": \"ec256\"", 0, "P-256 ecdsa-with-SHA256", "C=TW,CN=t"},
      {"create", typed + ", \"key_type\": \"ec384\"", 0, "P-384 ecdsa-with-SHA384", "C=TW,CN=t"},
      {"create", typed + ", \"key_type\": [\"ec256\"]", 5503, "", ""},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(std::string(row.method) + " " + row.params);
    unlink(csr_.c_str());
    CallResult r = root_.Call(kCsr, row.method, "{" + row.params + "}");
    EXPECT_EQ(r.ok() ? 0 : r.code(), row.code);
    if (row.code != 0) {
      EXPECT_FALSE(Exists(csr_));
      continue;
    }
    EXPECT_EQ(KeyAndSignature(csr_), row.request);
    EXPECT_EQ(RequestSubject(csr_), std::string("subject=") + row.subject + "\n");
    EXPECT_TRUE(RequestFitsKey(ReadFile(csr_), ReadFile(key_)));
    EXPECT_EQ(ModeOf(key_), 0400u);
  }
}

// A failed signing answers success, as it always did, but leaves no certificate. The
// information of a file covers every certificate in it.
TEST_F(MethodsTest, CsrSignAndCertificateInfoUseTheCertificatesOfASet) {
  const std::string id = root_.CreateCertificate("info.example");
  const std::string upload = root_.Path("/upload.csr");
  ASSERT_EQ(test::Run({"/usr/bin/openssl", "req", "-new", "-newkey", "rsa:1024", "-nodes",
                       "-keyout", root_.Path("/upload.key"), "-out", upload, "-subj", "/CN=client"})
                .status, 0);
  const std::string signed_crt = root_.Path("/usr/zeph/etc/ssl/.gen/server.crt");
  auto sign = [&](const std::string& sign_id, const std::string& days, const std::string& csr) {
    return root_.Call(kCsr, "sign", "{\"id\": \"" + sign_id + "\", \"days\": " + days +
                                        ", \"csr\": \"x\", \"csr_tmp\": \"" + csr +
                                        "\", \"alias\": \"client.example;10.1.2.3\"}");
  };
  WriteFile(root_.Path("/junk.csr"), "-----BEGIN CERTIFICATE REQUEST-----\n");
  EXPECT_EQ(sign(id, "0", upload).code(), 5503);
  EXPECT_EQ(sign("nosuch", "30", upload).code(), 5503);
  EXPECT_EQ(sign(id, "30", root_.Path("/junk.csr")).code(), 5501);
  EXPECT_EQ(sign(id, "30", root_.Path("/missing.csr")).code(), 5501);
  EXPECT_FALSE(Exists(signed_crt));
  ASSERT_TRUE(sign(id, "30", upload).ok());
  EXPECT_TRUE(IssuedBy(ReadFile(signed_crt), ReadFile(Dir(id) + "/zeph-ca-cert.pem")));
  WriteFile(root_.Path("/usr/zeph/etc/ssl/.mkcert.serial"), "zz");
  EXPECT_TRUE(sign(id, "30", upload).ok());
  EXPECT_FALSE(Exists(signed_crt));
  unlink((Dir(id) + "/zeph-ca-privkey.pem").c_str());
  EXPECT_EQ(sign(id, "30", upload).code(), 5503);
  const std::string chain = root_.Path("/chain.pem");
  WriteFile(chain, ReadFile(Dir(id) + "/cert.pem") + ReadFile(Dir(id) + "/zeph-ca-cert.pem"));
  APIRequest request(Parse("{\"additional\": [\"valid_till\", \"bogus\"]}"));
  Json::Value out(Json::arrayValue);
  ASSERT_EQ(getCertificateInfo(chain, out, &request), 0);
  ASSERT_EQ(out.size(), 2u);
  EXPECT_TRUE(out[0].isMember("valid_till") && !out[0].isMember("valid_from"));
  EXPECT_EQ(out[1]["subject"]["common_name"].asString(), "info.example CA");
  EXPECT_EQ(out[1]["type"].asString(), "server_cert");
  WriteFile(root_.Path("/empty.pem"), "");
  EXPECT_EQ(getCertificateInfo(root_.Path("/empty.pem"), out, nullptr), 3);
  EXPECT_EQ(getCertificateInfo(root_.Path("/missing.pem"), out, nullptr), 4);
}

// A refused issuance leaves no directory; an empty domain never runs the tool; replace
// mode needs a certificate. Accounts are listed by their contact.
TEST_F(MethodsTest, LetsEncryptToolAnswersCreateRenewAndAccounts) {
  const char kNoCode[] = "zeph-letsencrypt has no error code.";
  const struct {
    const char* body;  // nullptr: no tool
    int error;
    const char* msg;  // nullptr: no "msg"
  } kRows[] = {
      {nullptr, 1, "failed to call zeph-letsencrypt."},
      {"echo '{}'", 1, kNoCode},
      {"echo '{\"error\": 107}'", 107, "unknow message."},
      {"echo '{\"error\": 205, \"msg\": \"x\"}'", 205, "x"},
      {"echo '{\"error\": 0}'; exit 3", 0, nullptr},
      {"printf 'not\\njson'", 1, "zeph-letsencrypt output is not a json: not\njson"},
      {"echo '{\"error\": 0,'; echo ' \"extra\": [1]}'", 0, nullptr},
      {"echo '{\"error\": 0}'; echo 'lego: done'", 0, nullptr},
      {"echo 'null'", 1, kNoCode},
      {"echo '[{\"error\": 0}]'", 1, kNoCode},
      {"echo '{\"error\": \"zero\"}'", 1, "unknow message."},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.body ? row.body : "no tool");
    row.body ? InstallLetsEncryptTool(row.body)
             : static_cast<void>(unlink(root_.Path("/usr/zeph/sbin/zeph-letsencrypt").c_str()));
    const Json::Value a = RunLetsEncrypt("revoke", "-c", "Ab3xYz");
    EXPECT_EQ(a["error"].asInt(), row.error);
    EXPECT_EQ(a.isMember("msg"), row.msg != nullptr);
    EXPECT_EQ(a["msg"].asString(), row.msg ? row.msg : "");
  }
  EXPECT_TRUE(ToolCalled("revoke -c Ab3xYz\n"));
  const std::pair<int, int> kCodes[] = {
      {100, 5520}, {101, 5521}, {102, 5522}, {103, 5523}, {104, 5524}, {105, 5525}, {106, 5526},
      {107, 5501}, {108, 5528}, {109, 5529}, {110, 5530}, {200, 5527}, {205, 5527}, {0, 5501}};
  for (const auto& c : kCodes) EXPECT_EQ(LetsEncryptErrorToApiError(c.first), c.second) << c.first;
  const std::string source = root_.CreateCertificate("le.example");
  InstallLetsEncryptTool("cp \"" + Dir(source) + "\"/*.pem \"" + root_.Archive() +
                         "/$7\"/ && echo '{\"error\": 0}'");
  CallResult r = root_.Call(kLe, "create",
      "{\"desc\": \"le\", \"domain_name\": \"nas.example\", \"email\": \"a@example.com\", "
      "\"user_deletable\": false}");
  ASSERT_TRUE(r.ok()) << r.code();
  const std::string id = r.data()["id"].asString();
  EXPECT_FALSE(r.data().isMember("restart_httpd"));
  EXPECT_TRUE(Exists(Dir(id) + "/fullchain.pem"));
  EXPECT_FALSE(Exists(Dir(id + ".temp")));
  EXPECT_FALSE(root_.Info()[id]["user_deletable"].asBool());
  EXPECT_TRUE(ToolCalled("new-cert -d nas.example -m a@example.com -c " + id + ".temp"));
  InstallLetsEncryptTool("echo '{\"error\": 103, \"msg\": \"rate limited\"}'");
  const std::vector<std::string> before = DirEntries(root_.Archive());
  EXPECT_EQ(root_.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"n.example\"}").code(),
            5523);
  EXPECT_EQ(DirEntries(root_.Archive()), before);
  unlink(root_.Path("/tool.calls").c_str());
  EXPECT_EQ(root_.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"\"}").code(), 5503);
  EXPECT_FALSE(Exists(root_.Path("/tool.calls")));
  EXPECT_EQ(root_.Call(kLe, "create", "{\"desc\": \"\", \"domain_name\": \"d\", \"id\": \"no\"}")
                .code(), 5503);
  InstallLetsEncryptTool("echo '{\"error\": 0}'");
  r = root_.Call(kLe, "renew", IdParam(source));
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(r.data()["id"].asString(), source);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  InstallLetsEncryptTool("echo '{\"error\": 110, \"msg\": \"gone\"}'");
  EXPECT_EQ(root_.Call(kLe, "renew", IdParam(source)).code(), 5530);
  EXPECT_EQ(root_.Call(kLe, "renew", IdParam("a/b")).code(), 5503);
  const std::string account = "ZEPH.Core.Certificate.LetsEncrypt.Account";
  EXPECT_EQ(root_.Call(account, "list").data()["email"], Json::Value(Json::arrayValue));
  const std::string kInfos[] = {"{\"contact\": \"admin@example.com\", \"other\": 1}",
                                "{\"contact\": \"\"}", "{\"contact\": 5}", "not json"};
  for (int i = 0; i < 4; ++i) {
    const std::string dir = root_.Path("/usr/zeph/etc/letsencrypt/account/") + std::to_string(i);
    MakeDirs(dir);
    WriteFile(dir + "/info.json", kInfos[i]);
  }
  EXPECT_EQ(root_.Call(account, "list").data()["email"],
            Parse("[{\"contact\": \"admin@example.com\"}]"));
}

// A failure logs the attempt to set the default; a missing record is made; the four-argument
// form changes deletability, keeps services; a dropped record (mid-delete) stays dropped.
TEST_F(MethodsTest, CrtSetWritesDescriptionDefaultAndRecords) {
  auto set = [&](const std::string& rest) { return root_.Call(kCrt, "set", "{" + rest + "}"); };
  EXPECT_EQ(set("\"id\": \"..\", \"desc\": \"\", \"as_default\": true").code(), 5501);
  EXPECT_EQ(Summaries(), std::vector<std::string>{"12B00002 3 |"});
  EXPECT_FALSE(Exists(root_.Archive("/DEFAULT")));
  const std::string id = root_.CreateCertificate("a.example");
  EditInfo([&](Json::Value& info) { info.removeMember(id); });
  ExpectAnswer(set("\"id\": \"" + id + "\", \"desc\": \"caf\xC3\xA9 'q'\", \"as_default\": true"),
               0, "null", "12B00001 1 a.example|");
  Json::Value record = Parse("{\"desc\": \"caf\xC3\xA9 'q'\", \"services\": [], "
                             "\"user_deletable\": true}");
  EXPECT_EQ(root_.Info()[id], record);
  EXPECT_EQ(ReadFile(root_.Archive("/DEFAULT")), id + "\n");
  EditInfo([&](Json::Value& info) { info[id]["services"].append(root_.WebService()); });
  ASSERT_TRUE(SetCrtProperty(id, "system", false, false));
  record = Parse("{\"desc\": \"system\", \"user_deletable\": false}");
  record["services"].append(root_.WebService());
  EXPECT_EQ(root_.Info()[id], record);
  const std::string gone = root_.CreateCertificate("gone.example");
  ASSERT_TRUE(DropCertInfo(gone));
  EXPECT_EQ(set("\"id\": \"" + gone + "\", \"desc\": \"back\"").code(), 5501);
  EXPECT_FALSE(root_.Info().isMember(gone));
  WriteFile(root_.Archive("/INFO"), "{broken");
  EXPECT_EQ(set("\"id\": \"" + id + "\", \"desc\": \"d\"").code(), 5501);
  EXPECT_EQ(ReadFile(root_.Archive("/INFO")), "{broken");
}

// Bad settings are reported; a failed binding or a non-web service restarts nothing.
TEST_F(MethodsTest, ServiceSetReportsTheBadSettingsAndRestartsOnlyForTheWebService) {
  const Json::Value web = root_.WebService();
  CallResult r = root_.Call(kService, "set", Settings({Setting(web, "nosuch", "")}));
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(r.data()["err_settings"].size(), 1u);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool() || r.response.httpd_restart());
  EXPECT_EQ(LastEvent(), "12B00008 3 |" + web["display_name"].asString());
  const std::string a = root_.CreateCertificate("a.example");
  Json::Value no_old_id = Setting(web, a, "");
  no_old_id.removeMember("old_id");
  r = root_.Call(kService, "set", Settings({Json::Value(5), no_old_id, Setting(web, a, "")}));
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(r.data()["err_settings"], Settings({Json::Value(5), no_old_id})["settings"]);
  ASSERT_EQ(root_.Info()[a]["services"].size(), 1u);
  EXPECT_EQ(LastEvent(), "12B00007 1 a.example|" + web["display_name"].asString());
  const std::string b = root_.CreateCertificate("b.example");
  Json::Value ftp = web;
  ftp["subscriber"] = "ftp";
  ftp["service"] = "ftpd";
  ftp["display_name"] = "FTP";
  Bind(ftp, a, "");
  r = root_.Call(kService, "set", Settings({Setting(ftp, b, a)}));
  ASSERT_TRUE(r.ok());
  EXPECT_FALSE(r.data().isMember("err_settings") || r.data()["restart_httpd"].asBool());
  EXPECT_EQ(root_.Info()[a]["services"].size(), 1u);  // the web service only
  EXPECT_EQ(root_.Info()[b]["services"], Settings({ftp})["settings"]);
}

// A default certificate bound to the web service, made by the provisioned tool.
class StoreTest : public MethodsTest {
 protected:
  void SetUp() override {
    ASSERT_TRUE(Reset().ok()) << root_.Log();
    default_id_ = Default();
    ASSERT_EQ(ReadFile(root_.Archive("/DEFAULT")), default_id_ + "\n");
  }
  CallResult Reset() const { return root_.Call("ZEPH.Core.Certificate", "reset"); }
  std::string Default() const { return ReadFile(root_.Archive("/DEFAULT")).substr(0, 6); }
  std::string default_id_;
};

// A second reset replaces the default and removes what users may delete. A broken
// catalogue is set aside; without the service registry nothing changes.
TEST_F(StoreTest, ResetReplacesTheDefaultAndKeepsWhatUsersMayNotDelete) {
  const std::string mine = root_.CreateCertificate("mine.example");
  const std::string kept = root_.CreateCertificate("kept.example");
  EditInfo([&](Json::Value& info) { info[kept]["user_deletable"] = false; });
  CallResult r = Reset();
  ExpectAnswer(r, 0, "{\"err_ids\": [], \"restart_httpd\": true}", "12B00011 1 |");
  EXPECT_TRUE(r.response.httpd_restart());
  EXPECT_FALSE(Exists(Dir(mine)) || Exists(Dir(default_id_)));
  std::vector<std::string> expected = {Default(), kept};
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(root_.Info().getMemberNames(), expected);
  WriteFile(root_.Archive("/INFO"), "{ broken");
  ASSERT_TRUE(Reset().ok());
  EXPECT_EQ(ReadFile(root_.Archive("/INFO.broken")), "{ broken");
  EXPECT_EQ(root_.Info()[Default()]["services"].size(), 1u);
  EXPECT_EQ(WebCert(), ReadFile(Dir(Default()) + "/cert.pem"));
  unlink(root_.Archive("/SERVICES").c_str());
  const std::vector<std::string> before = DirEntries(root_.Archive());
  ExpectAnswer(Reset(), 5501, "{}", "12B00012 3 |");
  EXPECT_EQ(DirEntries(root_.Archive()), before);
}

// A catalogue or DEFAULT naming a directory outside the archive (or the archive itself, by
// a NUL byte) is never acted on: a delete then finds no default to move services to.
TEST_F(StoreTest, NamesThatLeaveTheArchiveAreNeverActedOn) {
  const std::string victim = root_.Path("/usr/v");
  MakeDirs(victim);
  WriteFile(victim + "/keep", "precious");
  EditInfo([&](Json::Value& info) {
    info["../../../../v"] = InfoEntry();
    info[std::string("\0abc", 4)] = InfoEntry();
  });
  ASSERT_TRUE(Reset().ok()) << root_.Log();
  EXPECT_EQ(ReadFile(victim + "/keep"), "precious");
  EXPECT_TRUE(Exists(root_.Archive("/DEFAULT")));
  MakeCertSet(victim, "victim");
  const std::string mine = root_.CreateCertificate("mine.example");
  Bind(root_.WebService(), mine, "");
  WriteFile(root_.Archive("/DEFAULT"), "../../../../v\n");
  root_.Call(kCrt, "delete", "{\"ids\": [\"" + mine + "\"]}");
  EXPECT_NE(WebCert(), ReadFile(victim + "/cert.pem"));
}

// Recreate: an id that leads out of the archive removes nothing there; a failing tool
// keeps the set (new keys and the redeployment are the fault sweep's). Delete: services
// move to the default, which is never deleted; an id that cannot be removed is reported
// and logged as the id; without a default nothing goes.
TEST_F(StoreTest, RecreateAndDeleteKeepTheDefaultAndWhatIsOutside) {
  ExpectAnswer(root_.Call(kCrt, "recreate", IdParam(default_id_)), 0,
               "{\"restart_httpd\": true}", "12B00009 1 arvelon|");
  EXPECT_EQ(root_.Call(kCrt, "recreate", IdParam("nosuch")).code(), 5503);
  MakeDirs(root_.Path("/usr/zeph/etc/certificate/outside.temp"));
  ExpectAnswer(root_.Call(kCrt, "recreate", IdParam("../outside")), 5503, "null", "12B00010 3 |");
  EXPECT_TRUE(Exists(root_.Path("/usr/zeph/etc/certificate/outside.temp")));
  const std::string web_cert = root_.CreateCertificate("web.example");
  Bind(root_.WebService(), web_cert, default_id_);
  const std::string other = root_.CreateCertificate("other.example");
  ExpectAnswer(root_.Call(kCrt, "delete", "{\"ids\": [\"" + default_id_ + "\", \"" + web_cert +
                                              "\", \"" + other + "\"]}"),
               0, "{\"restart_httpd\": true}", "12B00005 1 other.example|");
  EXPECT_FALSE(Exists(Dir(web_cert)) || Exists(Dir(other)));
  EXPECT_EQ(WebCert(), ReadFile(Dir(default_id_) + "/cert.pem"));
  EXPECT_EQ(root_.Info().getMemberNames(), std::vector<std::string>{default_id_});
  EXPECT_EQ(root_.Call(kCrt, "delete", "{\"ids\": []}").data(),
            Parse("{\"restart_httpd\": false}"));
  const std::string a = root_.CreateCertificate("a.example");
  ExpectAnswer(root_.Call(kCrt, "delete", "{\"ids\": [\"" + a + "\", \"nosuch\", \"../x\"]}"), 5501,
               "{\"err_ids\": [\"nosuch\", \"../x\"], \"restart_httpd\": false}", "12B00006 3 |");
  EXPECT_FALSE(Exists(Dir(a)));
  unlink(root_.Archive("/DEFAULT").c_str());
  const Json::ArrayIndex events = root_.Events().size();
  const CallResult no_default = root_.Call(kCrt, "delete", "{\"ids\": []}");
  EXPECT_EQ(no_default.code(), 5501);
  EXPECT_EQ(no_default.data(), Parse("{\"restart_httpd\": false}"));
  EXPECT_EQ(root_.Events().size(), events);  // nothing was deleted, nothing is told
  WriteFile(root_.Path("/usr/zeph/bin/mkcert"), "#!/bin/sh\nexit 1\n", 0755);
  const std::string key = ReadFile(Dir(default_id_) + "/privkey.pem");
  ExpectAnswer(root_.Call(kCrt, "recreate", IdParam(default_id_)), 5501, "null",
               "12B00010 3 arvelon|");
  EXPECT_EQ(ReadFile(Dir(default_id_) + "/privkey.pem"), key);
  EXPECT_FALSE(Exists(Dir(default_id_ + ".temp")));
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
