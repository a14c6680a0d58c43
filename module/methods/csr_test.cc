// CSR create, renew and sign.
#include <gtest/gtest.h>
#include <openssl/pem.h>
#include <unistd.h>

#include "module/common/ssl_ptr.h"
#include "module/methods/cert_info.h"
#include "module/methods/csr.h"
#include "module/methods/methods_test_support.h"
#include "zeph/unique_fd.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::Exists;

const char kCsr[] = "ZEPH.Core.Certificate.CSR";

Json::Value RequestSubject(const std::string& path, int* bits) {
  ZEPH::UniqueFile f(fopen(path.c_str(), "re"));
  EXPECT_TRUE(f) << path;
  if (!f) return Json::Value();
  ZEPH::ssl::X509ReqPtr req(PEM_read_X509_REQ(f.get(), nullptr, nullptr, nullptr));
  EXPECT_TRUE(req);
  if (!req) return Json::Value();
  ZEPH::ssl::EvpPkeyPtr key(X509_REQ_get_pubkey(req.get()));
  *bits = EVP_PKEY_base_id(key.get()) == EVP_PKEY_RSA ? EVP_PKEY_bits(key.get()) : -1;
  Json::Value name;
  X509_NAME2Json(X509_REQ_get_subject_name(req.get()), name);
  return name;
}

TEST(CsrCreate, DefaultsAndTypedSubject) {
  ApplianceRoot root;
  // The wrapper demands all seven fields; the worker's defaults serve
  // callers that reach it directly.
  _tag_CSR_ARGUMENT subject;
  ZEPH::APIRequest empty;
  ASSERT_EQ(fillCSRInfo(&empty, &subject, false), 0);
  ASSERT_TRUE(generateCSR(1024, subject));
  int bits = 0;
  Json::Value expected;
  expected["country"] = "TW";
  expected["state"] = "Taipei";
  expected["city"] = "Taipel";
  expected["organization"] = "Organization";
  expected["department"] = "Department";
  expected["common_name"] = kDefaultCommonName;
  expected["email"] = kDefaultEmail;
  const std::string csr = root.Path("/usr/zeph/etc/ssl/.gen/server.csr");
  EXPECT_EQ(RequestSubject(csr, &bits), expected);
  EXPECT_EQ(bits, 1024);
  EXPECT_EQ(fillCSRInfo(&empty, nullptr, false), -1);
  ASSERT_EQ(fillCSRInfo(&empty, &subject, true), 0);
  EXPECT_NE(subject.email, kDefaultEmail);

  ZEPH::test::CallResult r = root.Call(kCsr, "create",
      "{\"country\": \"DE\", \"state\": \"\", \"city\": \"Bonn\", "
      "\"organization\": \"Zeph\", \"department\": \"\", "
      "\"common_name\": \"nas.example.org\", \"email\": \"\", \"key_length\": 1024}");
  ASSERT_TRUE(r.ok()) << r.code();
  Json::Value typed;
  typed["country"] = "DE";
  typed["city"] = "Bonn";
  typed["organization"] = "Zeph";
  typed["common_name"] = "nas.example.org";
  EXPECT_EQ(RequestSubject(csr, &bits), typed);

  // Values go into the request configuration unescaped: quotes are the
  // configuration parser's to interpret, but a request is still made.
  r = root.Call(kCsr, "create",
      "{\"country\": \"TW\", \"state\": \"\", \"city\": \"K\u00f6ln\", "
      "\"organization\": \"O'Neil \\\"Q\\\"\", \"department\": \"\", "
      "\"common_name\": \"q.example\", \"email\": \"\", \"key_length\": 1024}");
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(RequestSubject(csr, &bits)["common_name"].asString(), "q.example");
  EXPECT_EQ(RequestSubject(csr, &bits)["city"].asString(), "K\u00f6ln");
  EXPECT_EQ(ZEPH::test::ModeOf(root.Path("/usr/zeph/etc/ssl/.gen/server.key")), 0400u);
}

TEST(CsrRenew, KeepsSubjectAndKeyLengthButTheCountry) {
  ApplianceRoot root;
  Json::Value extra;
  extra["key_length"] = 1536;
  const std::string id = root.CreateCertificate("renew.example", extra);
  ZEPH::test::CallResult r = root.Call(kCsr, "renew",
      "{\"id\": \"" + id + "\", \"country\": \"JP\", \"common_name\": \"ignored\", \"city\": \"ignored\"}");
  ASSERT_TRUE(r.ok()) << r.code();
  int bits = 0;
  Json::Value subject = RequestSubject(root.Path("/usr/zeph/etc/ssl/.gen/server.csr"), &bits);
  EXPECT_EQ(bits, 1536);
  EXPECT_EQ(subject["country"].asString(), "JP");
  EXPECT_EQ(subject["common_name"].asString(), "renew.example");
  EXPECT_EQ(subject["city"].asString(), "Taipel");

  EXPECT_EQ(root.Call(kCsr, "renew", "{\"id\": \"nosuch\"}").code(), 5501);
  EXPECT_TRUE(root.LogContains("Invalid crt id [nosuch]."));
}

// Without "key_type" a renewal of an EC certificate makes a 2048-bit RSA
// key, as it always did; "key_type" chooses the key of a request, made new
// or renewed, and the request is signed with the digest of its key.
TEST(CsrKeys, KeyTypeChoosesTheKeyOfARequest) {
  ApplianceRoot root;
  const std::string dir = root.Archive("/EcCert");
  ZEPH::test::MakeDirs(dir);
  ZEPH::test::CommandResult made = ZEPH::test::Run(
      {"/usr/bin/openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt",
       "ec_paramgen_curve:prime256v1", "-nodes", "-keyout", dir + "/privkey.pem",
       "-out", dir + "/cert.pem", "-days", "30", "-subj", "/C=TW/CN=ec.example"});
  ASSERT_EQ(made.status, 0) << made.err;
  ZEPH::test::Run({"/bin/cp", dir + "/cert.pem", dir + "/fullchain.pem"});
  const std::string typed =
      "\"country\": \"TW\", \"state\": \"\", \"city\": \"\", "
      "\"organization\": \"\", \"department\": \"\", \"email\": \"\", "
      "\"common_name\": \"typed.example\", \"key_length\": 1024";
  struct Row {
    const char* method;
    std::string params;
    int code;
    const char* request;  // KeyAndSignature of the request made
  };
  const Row kRows[] = {
      {"renew", "\"id\": \"EcCert\"", 0, "rsa2048 sha256WithRSAEncryption"},
      {"renew", "\"id\": \"EcCert\", \"key_type\": \"rsa\"", 0,
       "rsa2048 sha256WithRSAEncryption"},
      {"renew", "\"id\": \"EcCert\", \"key_type\": \"ec384\"", 0,
       "P-384 ecdsa-with-SHA384"},
      {"renew", "\"id\": \"EcCert\", \"key_type\": \"ec\"", 5503, ""},
      {"create", typed, 0, "rsa1024 sha256WithRSAEncryption"},
      {"create", typed + ", \"key_type\": \"ec256\"", 0, "P-256 ecdsa-with-SHA256"},
      {"create", typed + ", \"key_type\": \"ec384\"", 0, "P-384 ecdsa-with-SHA384"},
      {"create", typed + ", \"key_type\": [\"ec256\"]", 5503, ""},
  };
  const std::string csr = root.Path("/usr/zeph/etc/ssl/.gen/server.csr");
  const std::string key = root.Path("/usr/zeph/etc/ssl/.gen/server.key");
  for (const Row& row : kRows) {
    SCOPED_TRACE(std::string(row.method) + " " + row.params);
    unlink(csr.c_str());
    ZEPH::test::CallResult r = root.Call(kCsr, row.method, "{" + row.params + "}");
    EXPECT_EQ(r.ok() ? 0 : r.code(), row.code);
    if (row.code != 0) {
      EXPECT_FALSE(Exists(csr));
      continue;
    }
    EXPECT_EQ(ZEPH::test::KeyAndSignature(csr), row.request);
    int bits = 0;
    EXPECT_EQ(RequestSubject(csr, &bits)["common_name"].asString(),
              row.method == std::string("renew") ? "ec.example" : "typed.example");
    EXPECT_TRUE(ZEPH::test::RequestFitsKey(ZEPH::test::ReadFile(csr),
                                           ZEPH::test::ReadFile(key)));
  }
}

TEST(CsrSign, SignsWithTheCertificatesAuthorityAndRefusesBadInput) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("ca-holder.example");
  const std::string upload = root.Path("/upload.csr");
  ZEPH::test::CommandResult made = ZEPH::test::Run(
      {"/usr/bin/openssl", "req", "-new", "-newkey", "rsa:1024", "-nodes",
       "-keyout", root.Path("/upload.key"), "-out", upload, "-subj", "/CN=client.example"});
  ASSERT_EQ(made.status, 0) << made.err;
  const std::string signed_crt = root.Path("/usr/zeph/etc/ssl/.gen/server.crt");
  auto sign = [&](const std::string& sign_id, const std::string& days,
                  const std::string& csr) {
    return root.Call(kCsr, "sign", "{\"id\": \"" + sign_id + "\", \"days\": " + days +
                                       ", \"csr\": \"x\", \"csr_tmp\": \"" + csr +
                                       "\", \"alias\": \"client.example;10.1.2.3\"}");
  };

  EXPECT_EQ(sign(id, "0", upload).code(), 5503);
  EXPECT_EQ(sign("nosuch", "30", upload).code(), 5503);
  ZEPH::test::WriteFile(root.Path("/junk.csr"), "-----BEGIN CERTIFICATE REQUEST-----\n");
  EXPECT_EQ(sign(id, "30", root.Path("/junk.csr")).code(), 5501);
  EXPECT_TRUE(root.LogContains("Check CSR file failed"));
  EXPECT_EQ(sign(id, "30", root.Path("/missing.csr")).code(), 5501);
  EXPECT_FALSE(Exists(signed_crt));

  ASSERT_TRUE(sign(id, "30", upload).ok());
  Json::Value infos(Json::arrayValue);
  ASSERT_EQ(getCertificateInfo(signed_crt, infos, nullptr), 0);
  EXPECT_EQ(infos[0]["issuer"]["common_name"].asString(), "ca-holder.example CA");
  EXPECT_EQ(infos[0]["subject"]["common_name"].asString(), "client.example");

  // A signing that fails answers success, as it always did, but leaves no
  // certificate behind, neither an empty one nor the earlier one.
  ZEPH::test::WriteFile(root.Path("/usr/zeph/etc/ssl/.mkcert.serial"), "zz");
  EXPECT_TRUE(sign(id, "30", upload).ok());
  EXPECT_TRUE(root.LogContains("Generate crt failed"));
  EXPECT_FALSE(Exists(signed_crt));

  // Without the authority files the certificate cannot sign.
  unlink(root.Archive("/" + id + "/zeph-ca-privkey.pem").c_str());
  EXPECT_EQ(sign(id, "30", upload).code(), 5503);
  EXPECT_TRUE(root.LogContains("No Zeph CA info. [" + id + "]"));
}

TEST(CertificateInfo, ReadsEveryCertificateOfAFile) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("info.example");
  const std::string chain = root.Path("/chain.pem");
  ZEPH::test::WriteFile(chain, ZEPH::test::ReadFile(root.Archive("/" + id + "/cert.pem")) +
                                   ZEPH::test::ReadFile(root.Archive("/" + id + "/zeph-ca-cert.pem")));
  Json::Value params;
  params["additional"].append("valid_till");
  params["additional"].append("bogus");
  ZEPH::APIRequest request(params);
  Json::Value out(Json::arrayValue);
  ASSERT_EQ(getCertificateInfo(chain, out, &request), 0);
  ASSERT_EQ(out.size(), 2u);
  EXPECT_TRUE(out[0].isMember("valid_till"));
  EXPECT_FALSE(out[0].isMember("valid_from"));
  EXPECT_EQ(out[1]["subject"]["common_name"].asString(), "info.example CA");
  EXPECT_EQ(out[1]["type"].asString(), "server_cert");

  // A name with none of the known attributes is an empty object, not null.
  const std::string odd = root.Path("/odd.pem");
  ASSERT_EQ(ZEPH::test::Run({"/usr/bin/openssl", "req", "-x509", "-newkey", "ed25519",
                             "-nodes", "-keyout", root.Path("/odd.key"), "-out", odd,
                             "-subj", "/serialNumber=42"}).status, 0);
  out = Json::Value(Json::arrayValue);
  ASSERT_EQ(getCertificateInfo(odd, out, nullptr), 0);
  EXPECT_EQ(out[0]["issuer"], Json::Value(Json::objectValue));
  EXPECT_EQ(out[0]["subject"], Json::Value(Json::objectValue));

  ZEPH::test::WriteFile(root.Path("/empty.pem"), "");
  EXPECT_EQ(getCertificateInfo(root.Path("/empty.pem"), out, nullptr), 3);
  EXPECT_EQ(getCertificateInfo(root.Path("/missing.pem"), out, nullptr), 4);
}

}  // namespace
