// CRT create and list, and the action log, through the real method table on
// a private root. Concurrent creations are the soak's, failing storage the
// fault sweep's.
#include <gtest/gtest.h>
#include <unistd.h>

#include <regex>

#include "module/methods/action_log.h"
#include "module/methods/methods_test_support.h"
#include "module/mkcert/verify.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::CreateParams;
using ZEPH::test::KeyAndSignature;
using ZEPH::test::ReadFile;

const char kCrt[] = "ZEPH.Core.Certificate.CRT";

Json::Value Parse(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(ZEPH::JsonParse(text, v)) << text;
  return v;
}

Json::Value Listed(const ApplianceRoot& root, const std::string& id) {
  ZEPH::test::CallResult r = root.Call(kCrt, "list");
  EXPECT_TRUE(r.ok()) << r.code();
  for (const Json::Value& c : r.data()["certificates"]) {
    if (c["id"].asString() == id) return c;
  }
  return Json::Value();
}

TEST(CreateAndList, ANewCertificateIsListedWithWhatIsInsideIt) {
  ApplianceRoot root;
  Json::Value extra = Parse(
      "{\"alias\": \"nas1;10.0.0.1;fe80::1\", \"as_default\": true, "
      "\"ca_email\": \"ca@example.com\"}");
  const std::string id = root.CreateCertificate("nas.local", extra);
  ASSERT_TRUE(std::regex_match(id, std::regex("[A-Za-z0-9]{6}")));
  EXPECT_FALSE(ZEPH::test::Exists(root.Archive("/" + id + ".temp")));
  EXPECT_EQ(ReadFile(root.Archive("/DEFAULT")), id + "\n");

  Json::Value c = Listed(root, id);
  const std::vector<std::string> keys = {
      "desc", "id", "is_default", "is_ecc", "issuer", "renewable",
      "self_signed_cacrt_info", "services", "signature_algorithm",
      "sub_alt_name", "subject", "user_deletable", "valid_from", "valid_till"};
  ASSERT_EQ(c.getMemberNames(), keys);
  const std::regex time("[A-Z][a-z]{2} [ 123][0-9] [0-9]{2}:[0-9]{2}:[0-9]{2} 20[0-9]{2} GMT");
  EXPECT_TRUE(std::regex_match(c["valid_from"].asString(), time)) << c["valid_from"];
  EXPECT_TRUE(std::regex_match(c["valid_till"].asString(), time)) << c["valid_till"];
  const Json::Value ca = Parse(
      "{\"country\": \"TW\", \"city\": \"Taipel\", \"organization\": \"Zeph Test\", "
      "\"common_name\": \"nas.local CA\", \"email\": \"ca@example.com\"}");
  EXPECT_EQ(c["self_signed_cacrt_info"]["subject"], ca);
  EXPECT_EQ(c["self_signed_cacrt_info"]["issuer"], ca);
  for (const char* k : {"valid_from", "valid_till", "self_signed_cacrt_info"}) c.removeMember(k);
  Json::Value expected = Parse(
      "{\"desc\": \"made by a test\", \"is_default\": true, \"is_ecc\": false, "
      "\"renewable\": false, \"user_deletable\": true, \"services\": [], "
      "\"signature_algorithm\": \"sha256WithRSAEncryption\", "
      "\"sub_alt_name\": [\"nas1\", \"10.0.0.1\", \"fe80::1\", \"nas.local\"], "
      "\"subject\": {\"country\": \"TW\", \"city\": \"Taipel\", "
      "\"organization\": \"Zeph Test\", \"common_name\": \"nas.local\"}}");
  expected["id"] = id;
  expected["issuer"] = ca;
  EXPECT_EQ(c, expected);

  // The creation and the new default are both in the event log.
  std::vector<Json::Value> events = root.Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0]["message_id"].asUInt(), 0x12B00001u);  // set default
  EXPECT_EQ(events[1]["message_id"].asUInt(), 0x12B00003u);  // created
  EXPECT_EQ(events[1]["level"].asInt(), 1);
  EXPECT_EQ(events[1]["text1"].asString(), "nas.local");

  // Subject values arrive as UTF-8 and are stored and shown as given;
  // without aliases the common name is the only alternative name.
  const std::string org = "\u65e5\u672c Caf\u00e9 \U0001F510", cn = "\U0001F510.example";
  const std::string other = root.CreateCertificate(
      cn, Parse("{\"organization\": \"" + org + "\", \"ca_organization\": \"" + org + "\"}"));
  c = Listed(root, other);
  EXPECT_EQ(c["subject"]["common_name"].asString(), cn);
  EXPECT_EQ(c["subject"]["organization"].asString(), org);
  EXPECT_EQ(c["issuer"]["organization"].asString(), org);
  EXPECT_EQ(c["issuer"]["common_name"].asString(), cn + " CA");
  EXPECT_EQ(c["sub_alt_name"], Parse("[\"" + cn + "\"]"));
  EXPECT_FALSE(c["is_default"].asBool());
  EXPECT_EQ(root.Events().back()["text1"].asString(), cn);
}

TEST(CreateAndList, ReplaceModeKeepsIdAndBindingsAndRedeploys) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("first.example");
  Json::Value setting;
  setting["settings"][0]["service"] = root.WebService();
  setting["settings"][0]["id"] = id;
  setting["settings"][0]["old_id"] = "";
  ASSERT_TRUE(root.Call("ZEPH.Core.Certificate.Service", "set", setting).ok());
  const std::string deployed = root.Path("/usr/zeph/etc/certificate/system/default/cert.pem");
  const std::string before = ReadFile(deployed);

  Json::Value replace = CreateParams("second.example");
  replace["id"] = id;
  ZEPH::test::CallResult r = root.Call(kCrt, "create", replace);
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(r.data()["id"].asString(), id);
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(r.response.httpd_restart());
  EXPECT_NE(ReadFile(deployed), before);
  EXPECT_EQ(ReadFile(deployed), ReadFile(root.Archive("/" + id + "/cert.pem")));
  const Json::Value c = Listed(root, id);
  EXPECT_EQ(c["subject"]["common_name"].asString(), "second.example");
  ASSERT_EQ(c["services"].size(), 1u);
  EXPECT_EQ(c["services"][0]["service"].asString(), "default");
  EXPECT_EQ(root.Events().back()["message_id"].asUInt(), 0x12B00004u);
}

// Refused parameters make nothing and record nothing. A line break would
// add lines of its own to openssl's configuration; bytes that are not
// UTF-8 would be stored as nonsense.
TEST(CreateAndList, BadParametersAreRefused) {
  ApplianceRoot root;
  const struct {
    const char* member;
    const char* value;  // JSON
    int code;
    const char* log;
  } kRows[] = {
      {"id", "\"../etc\"", 5503, "../etc is not a valid cert id"},
      {"ca_organization", "\"Zeph\\nbasicConstraints = CA:true\"", 5503, ""},
      {"ca_organization", "\"Caf\xE9\"", 5503, ""},
      {"ca_organization", "\"\xED\xA0\x80\"", 5503, ""},
      {"ca_organization", "\"\xF0\x9F\x94\"", 5503, ""},
      {"alias", "\"a\\nbasicConstraints = CA:true\"", 5501, "genCrt params invalid"},
      {"key_type", "\"ec521\"", 5503, "Invalid key type [ec521]"},
      {"key_type", "256", 5503, ""},
      {"ca_key_type", "\"EC256\"", 5503, ""},
      {"ca_key_type", "\"\"", 5503, ""},
      {"key_type", "null", 5503, ""},
      // A key length openssl refuses: the random directory stays, empty.
      {"key_length", "1", 5501, "Failed to generate cert set"},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(std::string(row.member) + " " + row.value);
    Json::Value params = CreateParams("x.example");
    params[row.member] = Parse(row.value);
    ZEPH::test::CallResult r = root.Call(kCrt, "create", params);
    EXPECT_EQ(r.code(), row.code);
    EXPECT_TRUE(r.data().isNull());
    EXPECT_TRUE(root.LogContains(row.log));
  }
  EXPECT_TRUE(root.LogContains("certificate:"));
  EXPECT_TRUE(root.Events().empty());
  // What a failure leaves is the empty directory of a random id.
  for (const std::string& entry : ZEPH::test::DirEntries(root.Archive())) {
    if (entry == "SERVICES") continue;
    EXPECT_TRUE(std::regex_match(entry, std::regex("[A-Za-z0-9]{6}"))) << entry;
    EXPECT_EQ(ZEPH::test::DirEntries(root.Archive("/" + entry)), std::vector<std::string>{});
  }
}

// "key_type" and "ca_key_type" of CRT create choose each key; a request
// signs with the digest of its own key, a certificate with that of the
// authority's key. Recreate keeps both types; the list tells EC apart.
TEST(CreateAndList, KeyTypesAreMadeAsAskedAndKeptByRecreate) {
  ApplianceRoot root;
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
    const std::string id = root.CreateCertificate("kt.example", extra);
    ASSERT_FALSE(id.empty());
    const std::string dir = root.Archive("/" + id);
    const bool rsa = std::string(row.server).compare(0, 3, "rsa") == 0;
    EXPECT_EQ(KeyAndSignature(dir + "/cert.pem"), row.server);
    EXPECT_EQ(KeyAndSignature(dir + "/zeph-ca-cert.pem"), row.authority);
    EXPECT_TRUE(ZEPH::test::SignedByOwnAuthority(dir));
    EXPECT_EQ(verifyCrtAndKey(dir + "/cert.pem", dir + "/privkey.pem"), 0);
    EXPECT_EQ(Listed(root, id)["is_ecc"].asBool(), !rsa);
    // An EC key cannot encipher: its certificate does not claim it can.
    const std::string text = ZEPH::test::Run({"/usr/bin/openssl", "x509", "-noout", "-ext",
                                              "keyUsage", "-in", dir + "/cert.pem"}).out;
    EXPECT_EQ(text.find("Key Encipherment") != std::string::npos, rsa) << text;

    const std::string before = ReadFile(dir + "/cert.pem");
    ASSERT_TRUE(root.Call(kCrt, "recreate", "{\"id\": \"" + id + "\"}").ok());
    EXPECT_NE(ReadFile(dir + "/cert.pem"), before);
    EXPECT_EQ(KeyAndSignature(dir + "/cert.pem"), row.server);
    EXPECT_EQ(KeyAndSignature(dir + "/zeph-ca-cert.pem"), row.authority);
  }
}

TEST(CreateAndList, ListLeavesOutWhatItCannotReadAndFailsWithoutACatalogue) {
  ApplianceRoot root;
  EXPECT_EQ(root.Call(kCrt, "list").code(), 5501);  // no INFO yet
  EXPECT_TRUE(root.LogContains("Broken [" + root.Archive("/INFO") + "]"));
  for (const char* info : {"{\"a\": ", "[]"}) {
    ZEPH::test::WriteFile(root.Archive("/INFO"), info);
    EXPECT_EQ(root.Call(kCrt, "list").code(), 5501) << info;
  }
  ZEPH::test::WriteFile(root.Archive("/INFO"), "{}");
  EXPECT_EQ(root.Call(kCrt, "list").data()["certificates"], Json::Value(Json::arrayValue));

  const std::string good = root.CreateCertificate("good.example");
  const std::string broken = root.CreateCertificate("broken.example");
  const std::string bare = root.CreateCertificate("bare.example");
  const std::string unreadable = root.CreateCertificate("unreadable.example");
  const std::string ca_less = root.CreateCertificate("ca-less.example");
  unlink(root.Archive("/" + broken + "/fullchain.pem").c_str());
  ZEPH::test::WriteFile(root.Archive("/" + unreadable + "/cert.pem"), "not a certificate");
  ZEPH::test::WriteFile(root.Archive("/" + ca_less + "/zeph-ca-cert.pem"), "junk");
  // A record without "desc" and "user_deletable" is still listed.
  Json::Value info = root.Info();
  info[bare] = Json::Value(Json::objectValue);
  info["nothere"]["desc"] = "no directory";
  ASSERT_TRUE(ZEPH::JsonToFile(info, root.Archive("/INFO"), true));
  root.ClearLog();

  ZEPH::test::CallResult r = root.Call(kCrt, "list");
  ASSERT_TRUE(r.ok());
  std::vector<std::string> ids;
  for (const Json::Value& c : r.data()["certificates"]) ids.push_back(c["id"].asString());
  std::vector<std::string> expected = {good, bare, ca_less};
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(ids, expected);
  EXPECT_TRUE(Listed(root, bare)["desc"].isNull());
  EXPECT_TRUE(Listed(root, bare)["services"].isNull());
  EXPECT_TRUE(Listed(root, bare)["user_deletable"].asBool());
  EXPECT_FALSE(Listed(root, ca_less).isMember("self_signed_cacrt_info"));
  for (const std::string& line :
       {std::string("nothere is not a valid cert directory"),
        "Lack of necessary files in cert dir [" + root.Archive("/" + broken) + "]",
        "Failed to PEM_read_X509. [" + root.Archive("/" + unreadable + "/cert.pem") + "]",
        "Failed to get cert info. [" + unreadable + "]"}) {
    EXPECT_TRUE(root.LogContains(line)) << line;
  }
}

TEST(ActionLog, MessageIdsLevelsAndDisplayNames) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("nas1");
  const size_t base = root.Events().size();
  LogAction(CERT_ACTION_DELETE, true, id, "x", "ignored");
  LogAction(CERT_ACTION_SERVICE_SET, false, id, "x", "FTP");
  // A failed creation or replacement and an unknown action go unlogged.
  LogAction(CERT_ACTION_CREATE, false, id, "x", "");
  LogAction(CERT_ACTION_REPLACE, false, id, "x", "");
  LogAction(static_cast<CERT_ACTION>(7), true, id, "x", "");
  LogAction(CERT_ACTION_RECREATE, false, "", "fallback", "");
  ZEPH::test::Run({"/bin/rm", "-rf", root.Archive("/" + id)});
  LogAction(CERT_ACTION_RESET, true, id, "x", "");
  const struct {
    unsigned id;
    int level;
    const char* text1;
    const char* text2;
  } kExpected[] = {{0x12B00005, 1, "nas1", ""},
                   {0x12B00008, 3, "nas1", "FTP"},
                   {0x12B00010, 3, "fallback", ""},
                   {0x12B00011, 1, "x", ""}};
  const std::vector<Json::Value> events = root.Events();
  ASSERT_EQ(events.size() - base, 4u);
  for (size_t i = 0; i < 4; ++i) {
    const Json::Value& e = events[base + i];
    EXPECT_EQ(e["message_id"].asUInt(), kExpected[i].id) << i;
    EXPECT_EQ(e["type"].asInt(), 1);
    EXPECT_EQ(e["level"].asInt(), kExpected[i].level) << i;
    EXPECT_EQ(e["text1"].asString(), kExpected[i].text1) << i;
    EXPECT_EQ(e["text2"].asString(), kExpected[i].text2) << i;
    EXPECT_EQ(e["text3"].asString(), "");
  }
  EXPECT_EQ(GetCrtSubjectCN(id), "");
  EXPECT_EQ(GetCrtSubjectCN("../x"), "");
}

}  // namespace
