// The module's Let's Encrypt methods end to end: the real method table,
// the tool that provisioning installed into the root, lego, and a pebble
// server on 127.0.0.1.
#include <gtest/gtest.h>
#include <openssl/pem.h>

#include "module/common/ssl_ptr.h"
#include "module/methods/methods_test_support.h"
#include "pebble_test_support.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace test {
namespace {

const char kLe[] = "ZEPH.Core.Certificate.LetsEncrypt";
const char kWebCert[] = "/usr/zeph/etc/certificate/system/default/cert.pem";

std::string Serial(const std::string& pem_path) {
  ssl::BioPtr bio(BIO_new_file(pem_path.c_str(), "r"));
  ssl::X509Ptr cert(bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)
                        : nullptr);
  if (!cert) return "";
  ssl::BioPtr out(BIO_new(BIO_s_mem()));
  i2a_ASN1_INTEGER(out.get(), X509_get0_serialNumber(cert.get()));
  char* data = nullptr;
  const long n = BIO_get_mem_data(out.get(), &data);
  return std::string(data, static_cast<size_t>(n));
}

Json::Value Listed(const ApplianceRoot& root, const std::string& id) {
  CallResult list = root.Call("ZEPH.Core.Certificate.CRT", "list");
  EXPECT_TRUE(list.ok()) << list.code();
  for (const Json::Value& c : list.data()["certificates"]) {
    if (c["id"].asString() == id) return c;
  }
  ADD_FAILURE() << id << " is not listed";
  return Json::Value();
}

TEST(LetsEncryptMethods, CreateRenewListAndDeleteAgainstPebble) {
  if (!LegoInstalled() || !PebbleInstalled()) {
    GTEST_SKIP() << "pebble or lego is not installed (scripts/setup.sh installs both)";
  }
  ApplianceRoot root;
  // "zephcert init" (the same provisioning) put the tool where the module
  // runs it from.
  const std::string tool = root.Path("/usr/zeph/sbin/zeph-letsencrypt");
  ASSERT_EQ(ModeOf(tool), 0755u);
  MakeDirs(root.Path("/pebble"));
  Pebble pebble(root.Path("/pebble"));
  std::string error;
  ASSERT_TRUE(pebble.Start(&error)) << error;
  WriteToolConfig(PebbleToolConfig(pebble));

  // The default certificate (deleting needs one).
  CallResult r = root.Call(kLe, "create",
                           "{\"desc\": \"public\", \"domain_name\": \"www.zeph.test\", "
                           "\"email\": \"owner@zeph.test\", \"as_default\": true}");
  ASSERT_TRUE(r.ok()) << r.code() << "\n" << root.Log();
  const std::string id = r.data()["id"].asString();
  EXPECT_FALSE(Exists(root.Archive("/" + id + ".temp")));
  Json::Value listed = Listed(root, id);
  EXPECT_TRUE(listed["renewable"].asBool());
  EXPECT_EQ(listed["desc"].asString(), "public");
  Json::Value names(Json::arrayValue);
  names.append("www.zeph.test");
  EXPECT_EQ(listed["sub_alt_name"], names);
  EXPECT_EQ(listed["issuer"]["common_name"].asString().rfind("Pebble Intermediate CA", 0), 0u)
      << listed["issuer"].toStyledString();

  // Bound to the web administration service, a renewal redeploys it.
  Json::Value bind;
  bind["settings"][0]["service"] = root.WebService();
  bind["settings"][0]["id"] = id;
  bind["settings"][0]["old_id"] = "";
  ASSERT_TRUE(root.Call("ZEPH.Core.Certificate.Service", "set", bind).ok());
  const std::string before = Serial(root.Archive("/" + id + "/cert.pem"));
  ASSERT_EQ(Serial(root.Path(kWebCert)), before);

  r = root.Call(kLe, "renew", "{\"id\": \"" + id + "\"}");
  ASSERT_TRUE(r.ok()) << r.code() << "\n" << root.Log();
  EXPECT_EQ(r.data()["id"].asString(), id);
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  const std::string after = Serial(root.Archive("/" + id + "/cert.pem"));
  EXPECT_NE(after, before);
  EXPECT_EQ(Serial(root.Path(kWebCert)), after);

  r = root.Call("ZEPH.Core.Certificate.LetsEncrypt.Account", "list");
  ASSERT_TRUE(r.ok());
  Json::Value expected;
  expected["email"][0]["contact"] = "owner@zeph.test";
  EXPECT_EQ(r.data(), expected);

  // A failure of the ACME side reaches the caller as its API code, and a
  // failed creation leaves no directory.
  pebble.Stop();
  r = root.Call(kLe, "create",
                "{\"desc\": \"x\", \"domain_name\": \"two.zeph.test\", "
                "\"email\": \"owner@zeph.test\"}");
  EXPECT_EQ(r.code(), 5520);
  EXPECT_TRUE(r.data().isNull());
  EXPECT_TRUE(root.LogContains("zeph-letsencrypt failed. 100 ["));
  ASSERT_TRUE(pebble.Start(&error)) << error;

  // Several names make one certificate (with an account the restarted
  // server knows); a wildcard wants DNS-01, and a request of several names
  // is told why it failed.
  r = root.Call(kLe, "create",
                "{\"desc\": \"w\", \"domain_name\": \"four.zeph.test,*.zeph.test\", "
                "\"email\": \"owner@zeph.test\"}");
  EXPECT_EQ(r.code(), 5522);
  EXPECT_NE(r.data()["msg"].asString().find("DNS-01"), std::string::npos) << r.data();
  r = root.Call(kLe, "create",
                "{\"desc\": \"two\", \"domain_name\": \"a.zeph.test, b.zeph.test\", "
                "\"email\": \"fourth@zeph.test\"}");
  ASSERT_TRUE(r.ok()) << r.code() << "\n" << root.Log();
  Json::Value two(Json::arrayValue);
  two.append("a.zeph.test");
  two.append("b.zeph.test");
  EXPECT_EQ(Listed(root, r.data()["id"].asString())["sub_alt_name"], two);
  EXPECT_EQ(Listed(root, r.data()["id"].asString())["subject"]["common_name"].asString(),
            "a.zeph.test");

  // Deleting a certificate revokes it. A copy of its renew.json and
  // cert.pem lets the tool ask the server again afterwards: it answers
  // that the certificate is revoked already. The restarted pebble knows
  // neither the first account nor its certificates: the proof is made with
  // a certificate of a new account there.
  r = root.Call(kLe, "create",
                "{\"desc\": \"y\", \"domain_name\": \"three.zeph.test\", "
                "\"email\": \"second@zeph.test\"}");
  ASSERT_TRUE(r.ok()) << r.code() << "\n" << root.Log();
  const std::string third = r.data()["id"].asString();
  MakeDirs(root.Archive("/Proof1"));
  WriteFile(root.Archive("/Proof1/cert.pem"), ReadFile(root.Archive("/" + third + "/cert.pem")));
  WriteFile(root.Archive("/Proof1/renew.json"),
            ReadFile(root.Archive("/" + third + "/renew.json")));
  r = root.Call("ZEPH.Core.Certificate.CRT", "delete", "{\"ids\": [\"" + third + "\"]}");
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_FALSE(Exists(root.Archive("/" + third)));
  ToolAnswer proof = RunTool({"revoke", "-c", "Proof1"}, tool);
  EXPECT_EQ(proof.error(), 110);
  EXPECT_NE(proof.msg().find("alreadyRevoked"), std::string::npos) << proof.msg();
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
