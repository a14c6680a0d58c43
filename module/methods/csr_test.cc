// CSR create, renew and sign, and the certificate reader.
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

// The subject of the request at `path`, as the list shows names.
Json::Value RequestSubject(const std::string& path) {
  ZEPH::UniqueFile f(fopen(path.c_str(), "re"));
  ZEPH::ssl::X509ReqPtr req(f ? PEM_read_X509_REQ(f.get(), nullptr, nullptr, nullptr)
                              : nullptr);
  EXPECT_TRUE(req) << path;
  Json::Value name;
  if (req) X509_NAME2Json(X509_REQ_get_subject_name(req.get()), name);
  return name;
}

class CsrTest : public ::testing::Test {
 protected:
  ApplianceRoot root_;
  const std::string csr_ = root_.Path("/usr/zeph/etc/ssl/.gen/server.csr");
  const std::string key_ = root_.Path("/usr/zeph/etc/ssl/.gen/server.key");
};

TEST_F(CsrTest, CreateTakesTheSubjectAsTypedOrTheDefaults) {
  // The wrapper demands all seven fields; the worker's defaults serve
  // callers that reach it directly.
  _tag_CSR_ARGUMENT subject;
  ZEPH::APIRequest empty;
  EXPECT_EQ(fillCSRInfo(&empty, nullptr, false), -1);
  ASSERT_EQ(fillCSRInfo(&empty, &subject, true), 0);
  EXPECT_NE(subject.email, kDefaultEmail);
  ASSERT_EQ(fillCSRInfo(&empty, &subject, false), 0);
  ASSERT_TRUE(generateCSR(1024, subject));
  Json::Value expected;
  expected["country"] = "TW";
  expected["state"] = "Taipei";
  expected["city"] = "Taipel";
  expected["organization"] = "Organization";
  expected["department"] = "Department";
  expected["common_name"] = kDefaultCommonName;
  expected["email"] = kDefaultEmail;
  EXPECT_EQ(RequestSubject(csr_), expected);
  EXPECT_EQ(ZEPH::test::KeyBits(ZEPH::test::ReadFile(key_)), 1024);

  // Values go into the request configuration unescaped: quotes are the
  // configuration parser's to interpret, but a request is still made.
  ZEPH::test::CallResult r = root_.Call(kCsr, "create",
      "{\"country\": \"DE\", \"state\": \"\", \"city\": \"K\u00f6ln\", "
      "\"organization\": \"O'Neil \\\"Q\\\"\", \"department\": \"\", "
      "\"common_name\": \"q.example\", \"email\": \"\", \"key_length\": 1024}");
  ASSERT_TRUE(r.ok()) << r.code();
  const Json::Value typed = RequestSubject(csr_);
  EXPECT_EQ(typed.getMemberNames(),
            (std::vector<std::string>{"city", "common_name", "country", "organization"}));
  EXPECT_EQ(typed["country"].asString(), "DE");
  EXPECT_EQ(typed["common_name"].asString(), "q.example");
  EXPECT_EQ(typed["city"].asString(), "K\u00f6ln");
  EXPECT_EQ(ZEPH::test::ModeOf(key_), 0400u);
}

// Renewal keeps the subject and key length of the certificate but the
// country. Without "key_type" a renewal of an EC certificate makes a
// 2048-bit RSA key, as it always did; "key_type" chooses the key of a
// request, made new or renewed, which is signed with the digest of its key.
TEST_F(CsrTest, RenewAndKeyTypes) {
  Json::Value extra;
  extra["key_length"] = 1536;
  const std::string rsa = root_.CreateCertificate("renew.example", extra);
  const std::string dir = root_.Archive("/EcCert");
  ZEPH::test::MakeDirs(dir);
  ZEPH::test::CommandResult made = ZEPH::test::Run(
      {"/usr/bin/openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt",
       "ec_paramgen_curve:prime256v1", "-nodes", "-keyout", dir + "/privkey.pem",
       "-out", dir + "/cert.pem", "-days", "30", "-subj", "/C=TW/CN=ec.example"});
  ASSERT_EQ(made.status, 0) << made.err;
  ZEPH::test::Run({"/bin/cp", dir + "/cert.pem", dir + "/fullchain.pem"});
  const std::string typed =
      "\"country\": \"TW\", \"state\": \"\", \"city\": \"\", \"organization\": \"\", "
      "\"department\": \"\", \"email\": \"\", \"common_name\": \"typed.example\", "
      "\"key_length\": 1024";
  const struct {
    const char* method;
    std::string params;
    int code;
    const char* request;  // KeyAndSignature of the request made
    const char* subject;  // country, common name and city of the request
  } kRows[] = {
      {"renew", "\"id\": \"" + rsa + "\", \"country\": \"JP\", \"common_name\": \"x\", "
       "\"city\": \"x\"", 0, "rsa1536 sha256WithRSAEncryption", "JP renew.example Taipel"},
      {"renew", "\"id\": \"EcCert\"", 0, "rsa2048 sha256WithRSAEncryption", "TW ec.example "},
      {"renew", "\"id\": \"EcCert\", \"key_type\": \"rsa\"", 0,
       "rsa2048 sha256WithRSAEncryption", "TW ec.example "},
      {"renew", "\"id\": \"EcCert\", \"key_type\": \"ec384\"", 0, "P-384 ecdsa-with-SHA384",
       "TW ec.example "},
      {"renew", "\"id\": \"EcCert\", \"key_type\": \"ec\"", 5503, "", ""},
      {"renew", "\"id\": \"nosuch\"", 5501, "", ""},
      {"create", typed + ", \"key_type\": \"ec256\"", 0, "P-256 ecdsa-with-SHA256",
       "TW typed.example "},
      {"create", typed + ", \"key_type\": \"ec384\"", 0, "P-384 ecdsa-with-SHA384",
       "TW typed.example "},
      {"create", typed + ", \"key_type\": [\"ec256\"]", 5503, "", ""},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(std::string(row.method) + " " + row.params);
    unlink(csr_.c_str());
    ZEPH::test::CallResult r = root_.Call(kCsr, row.method, "{" + row.params + "}");
    EXPECT_EQ(r.ok() ? 0 : r.code(), row.code);
    if (row.code != 0) {
      EXPECT_FALSE(Exists(csr_));
      continue;
    }
    EXPECT_EQ(ZEPH::test::KeyAndSignature(csr_), row.request);
    const Json::Value subject = RequestSubject(csr_);
    EXPECT_EQ(subject["country"].asString() + " " + subject["common_name"].asString() + " " +
                  subject["city"].asString(),
              row.subject);
    EXPECT_TRUE(ZEPH::test::RequestFitsKey(ZEPH::test::ReadFile(csr_),
                                           ZEPH::test::ReadFile(key_)));
  }
  EXPECT_TRUE(root_.LogContains("Invalid crt id [nosuch]."));
}

TEST_F(CsrTest, SignUsesTheCertificatesAuthorityAndRefusesBadInput) {
  const std::string id = root_.CreateCertificate("ca-holder.example");
  const std::string upload = root_.Path("/upload.csr");
  ZEPH::test::CommandResult made = ZEPH::test::Run(
      {"/usr/bin/openssl", "req", "-new", "-newkey", "rsa:1024", "-nodes", "-keyout",
       root_.Path("/upload.key"), "-out", upload, "-subj", "/CN=client.example"});
  ASSERT_EQ(made.status, 0) << made.err;
  const std::string signed_crt = root_.Path("/usr/zeph/etc/ssl/.gen/server.crt");
  auto sign = [&](const std::string& sign_id, const std::string& days, const std::string& csr) {
    return root_.Call(kCsr, "sign", "{\"id\": \"" + sign_id + "\", \"days\": " + days +
                                        ", \"csr\": \"x\", \"csr_tmp\": \"" + csr +
                                        "\", \"alias\": \"client.example;10.1.2.3\"}");
  };
  ZEPH::test::WriteFile(root_.Path("/junk.csr"), "-----BEGIN CERTIFICATE REQUEST-----\n");
  EXPECT_EQ(sign(id, "0", upload).code(), 5503);
  EXPECT_EQ(sign("nosuch", "30", upload).code(), 5503);
  EXPECT_EQ(sign(id, "30", root_.Path("/junk.csr")).code(), 5501);
  EXPECT_TRUE(root_.LogContains("Check CSR file failed"));
  EXPECT_EQ(sign(id, "30", root_.Path("/missing.csr")).code(), 5501);
  EXPECT_FALSE(Exists(signed_crt));

  ASSERT_TRUE(sign(id, "30", upload).ok());
  Json::Value infos(Json::arrayValue);
  ASSERT_EQ(getCertificateInfo(signed_crt, infos, nullptr), 0);
  EXPECT_EQ(infos[0]["issuer"]["common_name"].asString(), "ca-holder.example CA");
  EXPECT_EQ(infos[0]["subject"]["common_name"].asString(), "client.example");

  // A signing that fails answers success, as it always did, but leaves no
  // certificate behind, neither an empty one nor the earlier one.
  ZEPH::test::WriteFile(root_.Path("/usr/zeph/etc/ssl/.mkcert.serial"), "zz");
  EXPECT_TRUE(sign(id, "30", upload).ok());
  EXPECT_TRUE(root_.LogContains("Generate crt failed"));
  EXPECT_FALSE(Exists(signed_crt));

  // Without the authority files the certificate cannot sign.
  unlink(root_.Archive("/" + id + "/zeph-ca-privkey.pem").c_str());
  EXPECT_EQ(sign(id, "30", upload).code(), 5503);
  EXPECT_TRUE(root_.LogContains("No Zeph CA info. [" + id + "]"));
}

TEST_F(CsrTest, CertificateInfoReadsEveryCertificateOfAFile) {
  const std::string id = root_.CreateCertificate("info.example");
  const std::string chain = root_.Path("/chain.pem");
  ZEPH::test::WriteFile(chain, ZEPH::test::ReadFile(root_.Archive("/" + id + "/cert.pem")) +
                                   ZEPH::test::ReadFile(root_.Archive("/" + id + "/zeph-ca-cert.pem")));
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
  const std::string odd = root_.Path("/odd.pem");
  ASSERT_EQ(ZEPH::test::Run({"/usr/bin/openssl", "req", "-x509", "-newkey", "ed25519", "-nodes",
                             "-keyout", root_.Path("/odd.key"), "-out", odd, "-subj",
                             "/serialNumber=42"}).status, 0);
  out = Json::Value(Json::arrayValue);
  ASSERT_EQ(getCertificateInfo(odd, out, nullptr), 0);
  EXPECT_EQ(out[0]["issuer"], Json::Value(Json::objectValue));
  EXPECT_EQ(out[0]["subject"], Json::Value(Json::objectValue));
  ZEPH::test::WriteFile(root_.Path("/empty.pem"), "");
  EXPECT_EQ(getCertificateInfo(root_.Path("/empty.pem"), out, nullptr), 3);
  EXPECT_EQ(getCertificateInfo(root_.Path("/missing.pem"), out, nullptr), 4);
}

}  // namespace
