// CRT create and list, through the real method table on a private root.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <regex>
#include <thread>

#include "module/methods/methods_test_support.h"
#include "module/mkcert/verify.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::CreateParams;
using ZEPH::test::Exists;
using ZEPH::test::ReadFile;

const char kCrt[] = "ZEPH.Core.Certificate.CRT";

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
  Json::Value extra;
  extra["alias"] = "nas1;10.0.0.1;fe80::1";
  extra["as_default"] = true;
  extra["ca_email"] = "ca@example.com";
  const std::string id = root.CreateCertificate("nas.local", extra);
  ASSERT_TRUE(std::regex_match(id, std::regex("[A-Za-z0-9]{6}")));
  EXPECT_FALSE(Exists(root.Archive("/" + id + ".temp")));
  EXPECT_EQ(ReadFile(root.Archive("/DEFAULT")), id + "\n");

  const Json::Value c = Listed(root, id);
  ASSERT_TRUE(c.isObject());
  const std::vector<std::string> keys = {
      "desc", "id", "is_default", "is_ecc", "issuer", "renewable",
      "self_signed_cacrt_info", "services", "signature_algorithm",
      "sub_alt_name", "subject", "user_deletable", "valid_from", "valid_till"};
  EXPECT_EQ(c.getMemberNames(), keys);
  EXPECT_EQ(c["desc"].asString(), "made by a test");
  EXPECT_TRUE(c["is_default"].asBool());
  EXPECT_FALSE(c["is_ecc"].asBool());
  EXPECT_FALSE(c["renewable"].asBool());
  EXPECT_TRUE(c["user_deletable"].asBool());
  EXPECT_EQ(c["services"], Json::Value(Json::arrayValue));
  EXPECT_EQ(c["signature_algorithm"].asString(), "sha256WithRSAEncryption");

  Json::Value subject;
  subject["country"] = "TW";
  subject["city"] = "Taipel";
  subject["organization"] = "Zeph Test";
  subject["common_name"] = "nas.local";
  EXPECT_EQ(c["subject"], subject);
  Json::Value ca_subject = subject;
  ca_subject["common_name"] = "nas.local CA";
  ca_subject["email"] = "ca@example.com";
  EXPECT_EQ(c["issuer"], ca_subject);
  EXPECT_EQ(c["self_signed_cacrt_info"]["subject"], ca_subject);
  EXPECT_EQ(c["self_signed_cacrt_info"]["issuer"], ca_subject);

  Json::Value sans(Json::arrayValue);
  for (const char* s : {"nas1", "10.0.0.1", "fe80::1", "nas.local"}) sans.append(s);
  EXPECT_EQ(c["sub_alt_name"], sans);

  const std::regex time("[A-Z][a-z]{2} [ 123][0-9] [0-9]{2}:[0-9]{2}:[0-9]{2} 20[0-9]{2} GMT");
  EXPECT_TRUE(std::regex_match(c["valid_from"].asString(), time)) << c["valid_from"];
  EXPECT_TRUE(std::regex_match(c["valid_till"].asString(), time)) << c["valid_till"];

  // The creation and the new default are both in the event log.
  std::vector<Json::Value> events = root.Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0]["message_id"].asUInt(), 0x12B00001u);  // set default
  EXPECT_EQ(events[1]["message_id"].asUInt(), 0x12B00003u);  // created
  EXPECT_EQ(events[1]["level"].asInt(), 1);
  EXPECT_EQ(events[1]["text1"].asString(), "nas.local");
}

TEST(CreateAndList, AnEmptyAliasGivesOnlyTheCommonName) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("only.example");
  Json::Value sans(Json::arrayValue);
  sans.append("only.example");
  EXPECT_EQ(Listed(root, id)["sub_alt_name"], sans);
  EXPECT_FALSE(Listed(root, id)["is_default"].asBool());
}

TEST(CreateAndList, ReplaceModeKeepsIdAndBindingsAndRedeploys) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("first.example");
  Json::Value setting;
  setting["service"] = root.WebService();
  setting["id"] = id;
  setting["old_id"] = "";
  Json::Value params;
  params["settings"].append(setting);
  ASSERT_TRUE(root.Call("ZEPH.Core.Certificate.Service", "set", params).ok());
  const std::string deployed = root.Path("/usr/zeph/etc/certificate/system/default/cert.pem");
  const std::string before = ReadFile(deployed);
  ASSERT_FALSE(before.empty());

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

TEST(CreateAndList, ACreationThatFailsLeavesNoWorkDirectory) {
  ApplianceRoot root;
  // Not a valid id: nothing is made and the failure is not recorded.
  Json::Value params = CreateParams("x.example");
  params["id"] = "../etc";
  ZEPH::test::CallResult r = root.Call(kCrt, "create", params);
  EXPECT_EQ(r.code(), 5503);
  EXPECT_TRUE(r.data().isNull());
  EXPECT_TRUE(root.LogContains("certificate:"));
  EXPECT_TRUE(root.LogContains("../etc is not a valid cert id"));
  EXPECT_TRUE(root.Events().empty());

  // A key length openssl refuses: the random directory stays, empty.
  params = CreateParams("x.example");
  params["key_length"] = 1;
  r = root.Call(kCrt, "create", params);
  EXPECT_EQ(r.code(), 5501);
  EXPECT_TRUE(root.LogContains("Failed to generate cert set"));
  std::string listing = ZEPH::test::Run({"/bin/ls", "-A", root.Archive()}).out;
  EXPECT_TRUE(std::regex_match(listing, std::regex("SERVICES\n[A-Za-z0-9]{6}\n|"
                                                   "[A-Za-z0-9]{6}\nSERVICES\n")))
      << listing;
  EXPECT_EQ(listing.find(".temp"), std::string::npos);
}

TEST(CreateAndList, InvalidSubjectValuesAreRefused) {
  ApplianceRoot root;
  // A line break would add lines of its own to openssl's configuration;
  // bytes that are not UTF-8 would be stored as nonsense.
  for (const char* value : {"Zeph\nbasicConstraints = CA:true", "Caf\xE9",
                            "\xED\xA0\x80", "\xF0\x9F\x94"}) {
    Json::Value params = CreateParams("x.example");
    params["ca_organization"] = value;
    EXPECT_EQ(root.Call(kCrt, "create", params).code(), 5503) << value;
  }
  Json::Value params = CreateParams("x.example");
  params["alias"] = "a\nbasicConstraints = CA:true";
  EXPECT_EQ(root.Call(kCrt, "create", params).code(), 5501);
  EXPECT_TRUE(root.LogContains("genCrt params invalid"));
  EXPECT_FALSE(ZEPH::test::Exists(root.Archive("/INFO")));
}

// Subject values arrive as UTF-8 and are stored as such: the list and the
// event log show exactly the text that was given.
TEST(CreateAndList, SubjectsInAnyScriptAreListedAsGiven) {
  ApplianceRoot root;
  const char* const kRows[][2] = {
      // organization, common name
      {"Caf\u00e9 Z\u00fcrich \u2615", "caf\u00e9.example"},
      {"\u65e5\u672c\u306e\u4f1a\u793e", "\u65e5\u672c.example"},
      {"Vault \U0001F510 Labs", "\U0001F510.example"},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row[1]);
    Json::Value extra;
    extra["organization"] = row[0];
    extra["ca_organization"] = row[0];
    const std::string id = root.CreateCertificate(row[1], extra);
    ASSERT_FALSE(id.empty());
    const Json::Value c = Listed(root, id);
    EXPECT_EQ(c["subject"]["common_name"].asString(), row[1]);
    EXPECT_EQ(c["subject"]["organization"].asString(), row[0]);
    EXPECT_EQ(c["issuer"]["organization"].asString(), row[0]);
    EXPECT_EQ(c["issuer"]["common_name"].asString(), std::string(row[1]) + " CA");
    EXPECT_EQ(root.Events().back()["text1"].asString(), row[1]);
  }
}

// Generations share the appliance's work files. Creations at once must
// each sign with their own authority, and a request a CSR method left for
// export must keep the key it was made with.
TEST(CreateAndList, ConcurrentCreationsSignWithTheirOwnAuthority) {
  ApplianceRoot root;
  ASSERT_TRUE(root.Call("ZEPH.Core.Certificate.CSR", "create",
                        "{\"country\": \"TW\", \"state\": \"\", "
                        "\"city\": \"\", \"organization\": \"\", "
                        "\"department\": \"\", \"email\": \"\", "
                        "\"common_name\": \"pending.example\", "
                        "\"key_length\": 1024}")
                  .ok());
  constexpr int kCreations = 6;
  std::vector<std::string> ids(kCreations);
  std::vector<std::thread> threads;
  for (int i = 0; i < kCreations; ++i) {
    threads.emplace_back([&root, &ids, i] {
      ids[i] = root.CreateCertificate("c" + std::to_string(i) + ".example");
    });
  }
  for (std::thread& t : threads) t.join();
  for (int i = 0; i < kCreations; ++i) {
    ASSERT_EQ(ids[i].size(), 6u) << i;
    EXPECT_TRUE(ZEPH::test::SignedByOwnAuthority(root.Archive("/" + ids[i]))) << i;
    EXPECT_EQ(Listed(root, ids[i])["subject"]["common_name"].asString(),
              "c" + std::to_string(i) + ".example");
  }
  const std::string gen = root.Path("/usr/zeph/etc/ssl/.gen");
  EXPECT_EQ(verifyCsrAndKey(gen + "/server.csr", gen + "/server.key"), 0);
}

// "key_type" and "ca_key_type" of CRT create choose each key; a request
// signs with the digest of its own key, a certificate with that of the
// authority's key. Recreate keeps both types; the list tells EC apart.
TEST(KeyTypes, CreateMakesTheKeysAskedForAndRecreateKeepsThem) {
  ApplianceRoot root;
  struct Row {
    const char* key_type;     // nullptr: not given
    const char* ca_key_type;
    const char* server;       // ZEPH::test::KeyAndSignature(cert.pem)
    const char* authority;    // ZEPH::test::KeyAndSignature(zeph-ca-cert.pem)
    bool is_ecc;
  };
  const Row kRows[] = {
      {nullptr, nullptr, "rsa1024 sha256WithRSAEncryption",
       "rsa1024 sha256WithRSAEncryption", false},
      {"rsa", "rsa", "rsa1024 sha256WithRSAEncryption",
       "rsa1024 sha256WithRSAEncryption", false},
      {"ec256", "ec256", "P-256 ecdsa-with-SHA256", "P-256 ecdsa-with-SHA256", true},
      {"ec384", "ec384", "P-384 ecdsa-with-SHA384", "P-384 ecdsa-with-SHA384", true},
      {"ec256", "ec384", "P-256 ecdsa-with-SHA384", "P-384 ecdsa-with-SHA384", true},
      {"ec384", nullptr, "P-384 sha256WithRSAEncryption",
       "rsa1024 sha256WithRSAEncryption", true},
      {"rsa", "ec256", "rsa1024 ecdsa-with-SHA256", "P-256 ecdsa-with-SHA256", false},
  };
  for (const Row& row : kRows) {
    SCOPED_TRACE(std::string(row.key_type ? row.key_type : "-") + "/" +
                 (row.ca_key_type ? row.ca_key_type : "-"));
    Json::Value extra(Json::objectValue);
    if (row.key_type) extra["key_type"] = row.key_type;
    if (row.ca_key_type) extra["ca_key_type"] = row.ca_key_type;
    const std::string id = root.CreateCertificate("kt.example", extra);
    ASSERT_FALSE(id.empty());
    const std::string dir = root.Archive("/" + id);
    EXPECT_EQ(ZEPH::test::KeyAndSignature(dir + "/cert.pem"), row.server);
    EXPECT_EQ(ZEPH::test::KeyAndSignature(dir + "/zeph-ca-cert.pem"), row.authority);
    EXPECT_TRUE(ZEPH::test::SignedByOwnAuthority(dir));
    EXPECT_EQ(verifyCrtAndKey(dir + "/cert.pem", dir + "/privkey.pem"), 0);
    EXPECT_EQ(Listed(root, id)["is_ecc"].asBool(), row.is_ecc);
    // An EC key cannot encipher: its certificate does not claim it can.
    const std::string text = ZEPH::test::Run(
        {"/usr/bin/openssl", "x509", "-noout", "-ext", "keyUsage", "-in",
         dir + "/cert.pem"}).out;
    EXPECT_EQ(text.find("Key Encipherment") != std::string::npos,
              std::string(row.server).compare(0, 3, "rsa") == 0) << text;

    const std::string before = ReadFile(dir + "/cert.pem");
    ASSERT_TRUE(root.Call(kCrt, "recreate", "{\"id\": \"" + id + "\"}").ok());
    EXPECT_NE(ReadFile(dir + "/cert.pem"), before);
    EXPECT_EQ(ZEPH::test::KeyAndSignature(dir + "/cert.pem"), row.server);
    EXPECT_EQ(ZEPH::test::KeyAndSignature(dir + "/zeph-ca-cert.pem"), row.authority);
  }
  // Anything else is refused before a directory is made.
  const std::vector<std::string> archive = ZEPH::test::DirEntries(root.Archive());
  for (const char* bad : {"{\"key_type\": \"ec521\"}", "{\"key_type\": 256}",
                          "{\"ca_key_type\": \"EC256\"}",
                          "{\"ca_key_type\": \"\"}", "{\"key_type\": null}"}) {
    SCOPED_TRACE(bad);
    Json::Value params = CreateParams("bad.example");
    Json::Value extra;
    ASSERT_TRUE(ZEPH::JsonParse(bad, extra));
    for (const std::string& k : extra.getMemberNames()) params[k] = extra[k];
    EXPECT_EQ(root.Call(kCrt, "create", params).code(), 5503);
  }
  EXPECT_EQ(ZEPH::test::DirEntries(root.Archive()), archive);
  EXPECT_TRUE(root.LogContains("Invalid key type [ec521]"));
}

TEST(List, CatalogueProblemsAndEntriesLeftOut) {
  ApplianceRoot root;
  EXPECT_EQ(root.Call(kCrt, "list").code(), 5501);  // no INFO yet
  EXPECT_TRUE(root.LogContains("Broken [" + root.Archive("/INFO") + "]"));
  ZEPH::test::WriteFile(root.Archive("/INFO"), "{\"a\": ");
  EXPECT_EQ(root.Call(kCrt, "list").code(), 5501);
  ZEPH::test::WriteFile(root.Archive("/INFO"), "[]");
  EXPECT_EQ(root.Call(kCrt, "list").code(), 5501);
  ZEPH::test::WriteFile(root.Archive("/INFO"), "{}");
  ZEPH::test::CallResult r = root.Call(kCrt, "list");
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(r.data()["certificates"], Json::Value(Json::arrayValue));

  const std::string good = root.CreateCertificate("good.example");
  const std::string broken = root.CreateCertificate("broken.example");
  const std::string bare = root.CreateCertificate("bare.example");
  unlink(root.Archive("/" + broken + "/fullchain.pem").c_str());
  // A record without "desc" and "user_deletable" is still listed.
  Json::Value info = root.Info();
  info[bare] = Json::Value(Json::objectValue);
  info["nothere"]["desc"] = "no directory";
  ASSERT_TRUE(ZEPH::JsonToFile(info, root.Archive("/INFO"), true));
  root.ClearLog();

  r = root.Call(kCrt, "list");
  ASSERT_TRUE(r.ok());
  std::vector<std::string> ids;
  for (const Json::Value& c : r.data()["certificates"]) ids.push_back(c["id"].asString());
  std::vector<std::string> expected = {good, bare};
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(ids, expected);
  EXPECT_TRUE(Listed(root, bare)["desc"].isNull());
  EXPECT_TRUE(Listed(root, bare)["services"].isNull());
  EXPECT_TRUE(Listed(root, bare)["user_deletable"].asBool());
  EXPECT_TRUE(root.LogContains("nothere is not a valid cert directory"));
  EXPECT_TRUE(root.LogContains("Lack of necessary files in cert dir [" +
                               root.Archive("/" + broken) + "]"));
}

TEST(List, UnreadableCertificatesAreLeftOutAndABadCaIsIgnored) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("a.example");
  const std::string ca_less = root.CreateCertificate("b.example");
  ZEPH::test::WriteFile(root.Archive("/" + ca_less + "/zeph-ca-cert.pem"), "junk");
  ZEPH::test::WriteFile(root.Archive("/" + id + "/cert.pem"), "not a certificate");
  root.ClearLog();
  ZEPH::test::CallResult r = root.Call(kCrt, "list");
  ASSERT_TRUE(r.ok());
  ASSERT_EQ(r.data()["certificates"].size(), 1u);
  const Json::Value& c = r.data()["certificates"][0];
  EXPECT_EQ(c["id"].asString(), ca_less);
  EXPECT_FALSE(c.isMember("self_signed_cacrt_info"));
  EXPECT_TRUE(root.LogContains("Failed to PEM_read_X509. [" +
                               root.Archive("/" + id + "/cert.pem") + "]"));
  EXPECT_TRUE(root.LogContains("Failed to get cert info. [" + id + "]"));
}

}  // namespace
