#include "module/mkcert/cert_set.h"

#include <gtest/gtest.h>

#include "module/common/paths.h"
#include "module/mkcert/mkcert_test_util.h"
#include "module/mkcert/verify.h"

namespace ZEPH {
namespace test {
namespace {

const std::vector<std::string> kSetFiles = {"cert.pem", "fullchain.pem",
                                            "privkey.pem", "zeph-ca-cert.pem",
                                            "zeph-ca-privkey.pem"};

// The whole default set, checked the way a client and an administrator
// would look at it.
TEST(GenDefaultCrt, MakesTheAppliancesDefaultSet) {
  GenRoot root;
  const std::string dir = root.NewSetDir("default");
  ASSERT_EQ(genDefaultCrt(dir), 0) << root.Log();

  EXPECT_EQ(DirEntries(dir), kSetFiles);
  for (const std::string& f : kSetFiles) {
    EXPECT_EQ(ModeOf(dir + "/" + f), 0400u) << f;
  }
  EXPECT_EQ(ReadFile(dir + "/cert.pem"), ReadFile(dir + "/fullchain.pem"));

  ssl::X509Ptr ca = LoadCert(dir + "/zeph-ca-cert.pem");
  ssl::X509Ptr cert = LoadCert(dir + "/cert.pem");
  ASSERT_TRUE(ca && cert);
  for (X509_NAME* name :
       {X509_get_subject_name(ca.get()), X509_get_issuer_name(ca.get()),
        X509_get_issuer_name(cert.get())}) {
    EXPECT_EQ(Attr(name, NID_countryName), "TW");
    EXPECT_EQ(Attr(name, NID_stateOrProvinceName), "");
    EXPECT_EQ(Attr(name, NID_localityName), "Taipel");
    EXPECT_EQ(Attr(name, NID_organizationName), "Arvelon Inc.");
    EXPECT_EQ(Attr(name, NID_organizationalUnitName), "");
    EXPECT_EQ(Attr(name, NID_commonName), "Arvelon Inc. CA");
    EXPECT_EQ(Attr(name, NID_pkcs9_emailAddress), "");
    EXPECT_EQ(X509_NAME_entry_count(name), 4);
  }
  X509_NAME* server = X509_get_subject_name(cert.get());
  EXPECT_EQ(Attr(server, NID_countryName), "TW");
  EXPECT_EQ(Attr(server, NID_localityName), "Taipel");
  EXPECT_EQ(Attr(server, NID_organizationName), "Arvelon Inc.");
  EXPECT_EQ(Attr(server, NID_commonName), "arvelon");
  EXPECT_EQ(X509_NAME_entry_count(server), 4);

  // The authority.
  EXPECT_EQ(ExtensionText(ca.get(), NID_basic_constraints),
            "CA:TRUE, pathlen:0");
  EXPECT_EQ(ExtensionText(ca.get(), NID_netscape_cert_type), "SSL CA");
  EXPECT_EQ(ExtensionText(ca.get(), NID_netscape_comment),
            "mod_ssl generated custom CA certificate");
  EXPECT_EQ(X509_verify(ca.get(), X509_get0_pubkey(ca.get())), 1);
  // The server certificate.
  EXPECT_EQ(ExtensionText(cert.get(), NID_basic_constraints), "");
  EXPECT_EQ(ExtensionText(cert.get(), NID_netscape_cert_type), "SSL Server");
  EXPECT_EQ(ExtensionText(cert.get(), NID_netscape_comment),
            "mod_ssl generated custom server certificate");
  EXPECT_EQ(ExtensionText(cert.get(), NID_key_usage),
            "Digital Signature, Key Encipherment");
  EXPECT_TRUE(ExtensionCritical(cert.get(), NID_key_usage));
  EXPECT_EQ(ExtensionText(cert.get(), NID_ext_key_usage),
            "TLS Web Server Authentication, TLS Web Client Authentication");
  EXPECT_EQ(AltNames(cert.get()), std::vector<std::string>{"DNS:arvelon"});
  EXPECT_EQ(X509_verify(cert.get(), X509_get0_pubkey(ca.get())), 1);
  // Both.
  for (X509* c : {ca.get(), cert.get()}) {
    EXPECT_EQ(ValidityDays(c), 366);
    EXPECT_LE(X509_cmp_current_time(X509_get0_notBefore(c)), 0);
    EXPECT_EQ(CertKeyBits(c), 2048);
  }
  EXPECT_EQ(verifyCrtChain((dir + "/cert.pem").c_str(),
                           (dir + "/zeph-ca-cert.pem").c_str()),
            0);
}

TEST(GenCertSet, NamesEveryAliasInOrder) {
  GenRoot root;
  const std::string a = root.NewSetDir("a");
  const std::string b = root.NewSetDir("b");
  _tag_CSR_ARGUMENT ca = Subject("DE", "Berlin", "Berlin", "Example", "IT",
                                 "Example CA", "ca@example.com");
  _tag_CSR_ARGUMENT server = Subject("DE", "Berlin", "Berlin", "Example", "IT",
                                     "nas.example.com", "nas@example.com");
  MakeSet(a, ca, server, "nas.example.com;;10.0.0.5;2001:db8::1;nas");
  MakeSet(b, ca, server, "");

  ssl::X509Ptr cert_a = LoadCert(a + "/cert.pem");
  ssl::X509Ptr cert_b = LoadCert(b + "/cert.pem");
  ASSERT_TRUE(cert_a && cert_b);
  EXPECT_EQ(AltNames(cert_a.get()),
            (std::vector<std::string>{"DNS:nas.example.com", "IP:10.0.0.5",
                                      "IP:2001:db8::1", "DNS:nas"}));
  EXPECT_EQ(CertKeyBits(cert_a.get()), 1024);
  X509_NAME* subject = X509_get_subject_name(cert_a.get());
  EXPECT_EQ(Attr(subject, NID_stateOrProvinceName), "Berlin");
  EXPECT_EQ(Attr(subject, NID_organizationalUnitName), "IT");
  EXPECT_EQ(Attr(subject, NID_pkcs9_emailAddress), "nas@example.com");
  // Without aliases only "email:copy" is left: the subject's e-mail.
  EXPECT_EQ(AltNames(cert_b.get()),
            std::vector<std::string>{"other:1"});  // GEN_EMAIL
}

TEST(GenCASet, RefusesAPathThatIsNoDirectory) {
  GenRoot root;
  _tag_CSR_ARGUMENT ca = Subject("TW", "", "", "", "", "CA", "");
  const std::string file = root.Path("/a-file");
  WriteFile(file, "x");
  EXPECT_EQ(genCASet(&ca, 1024, file), -1);
  EXPECT_TRUE(Logged(root, "Invalid paramter [" + file + "]"));
  const std::string missing = root.Path("/missing");
  EXPECT_EQ(genCASet(&ca, 1024, missing), -1);
  EXPECT_TRUE(Logged(root, "Invalid paramter [" + missing + "]"));
  EXPECT_EQ(genCASet(&ca, 1024, ""), -1);
  EXPECT_TRUE(Logged(root, "Invalid paramter []"));
  EXPECT_EQ(ReadFile(file), "x");
  EXPECT_FALSE(Exists(missing));
  EXPECT_FALSE(Exists(root.Path(cert::kCaCsr)));
}

TEST(GenCASet, ReportsTheStepThatFailed) {
  GenRoot root;
  const std::string dir = root.NewSetDir("set");
  _tag_CSR_ARGUMENT ca = Subject("TW", "", "", "", "", "CA", "");
  EXPECT_EQ(genCASet(&ca, 0, dir), -1);
  EXPECT_TRUE(Logged(root, "genCAKey() failed"));
  EXPECT_EQ(genCASet(&ca, -1024, dir), -1);
  EXPECT_EQ(LogCount(root, "Failed to genKey with invalid parameters"), 2);
  EXPECT_EQ(DirEntries(dir), std::vector<std::string>{});

  // The key stays behind when the request cannot be made.
  _tag_CSR_ARGUMENT empty;
  EXPECT_EQ(genCASet(&empty, 1024, dir), -1);
  EXPECT_TRUE(Logged(root, "genCACsr() failed"));
  EXPECT_EQ(DirEntries(dir), std::vector<std::string>{"zeph-ca-privkey.pem"});
}

TEST(GenCertSet, FailsAtSigningWithoutTheAuthorityFiles) {
  GenRoot root;
  const std::string dir = root.NewSetDir("no-ca");
  _tag_CSR_ARGUMENT server = Subject("TW", "", "", "", "", "nas", "");
  EXPECT_EQ(genCertSet(&server, 1024, "nas", dir), -1);
  EXPECT_TRUE(Logged(root, "Key is not existed"));
  EXPECT_TRUE(Logged(root, "Failed to generate cert"));
  EXPECT_EQ(DirEntries(dir), std::vector<std::string>{"privkey.pem"});

  EXPECT_EQ(genCertSet(&server, 0, "nas", dir), -1);
  EXPECT_TRUE(Logged(root, "Failed to generate key"));
}

TEST(GenDefaultCrt, ReportsWhichHalfFailed) {
  GenRoot root;
  const std::string file = root.Path("/not-a-dir");
  WriteFile(file, "");
  EXPECT_EQ(genDefaultCrt(file), -1);
  EXPECT_TRUE(Logged(root, "Generate CA key & crt failed"));
  EXPECT_FALSE(Logged(root, "Failed to generate cert set"));
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
