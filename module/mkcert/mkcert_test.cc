// Generation and checks of keys, requests, certificates, configuration files and sets by
// the real openssl; the configuration files show in the certificates' extensions and names.
#include <gtest/gtest.h>
#include <time.h>
#include <unistd.h>


#include "module/common/paths.h"
#include "module/mkcert/cert_set.h"
#include "module/mkcert/config_files.h"
#include "module/mkcert/generate.h"
#include "module/mkcert/mkcert_test_util.h"
#include "module/mkcert/verify.h"
#include "zeph/qlibc_string.h"

namespace ZEPH {
namespace test {
namespace {

const std::vector<std::string> kSetFiles = {"cert.pem", "fullchain.pem", "privkey.pem",
                                            "zeph-ca-cert.pem", "zeph-ca-privkey.pem"};

// What `openssl x509 -noout <args> -in <path>` prints.
std::string X509Text(const std::string& path, const std::vector<std::string>& args) {
  std::vector<std::string> argv = {"/usr/bin/openssl", "x509", "-noout"};
  argv.insert(argv.end(), args.begin(), args.end());
  argv.insert(argv.end(), {"-in", path});
  return Run(argv).out;
}

// The days from the start to the end of the validity of the certificate at
// `path`; -1 when it cannot be read.
int ValidDays(const std::string& path) {
  ssl::X509Ptr x = LoadCert(path);
  int days = -1, seconds = 0;
  if (x) ASN1_TIME_diff(&days, &seconds, X509_get0_notBefore(x.get()), X509_get0_notAfter(x.get()));
  EXPECT_TRUE(x && X509_cmp_current_time(X509_get0_notBefore(x.get())) <= 0) << path;
  return days;
}

// The default set as a client and an administrator see it (names: the mkcert tool test).
TEST(CertSet, DefaultSetHasItsExtensionsModesAndValidity) {
  GenRoot root;
  const std::string dir = root.NewSetDir("default");
  ASSERT_EQ(genDefaultCrt(dir), 0) << root.Log();
  EXPECT_EQ(DirEntries(dir), kSetFiles);
  for (const std::string& f : kSetFiles) EXPECT_EQ(ModeOf(dir + "/" + f), 0400u) << f;
  const std::string ca = dir + "/zeph-ca-cert.pem", cert = dir + "/cert.pem";
  const std::vector<std::string> exts = {
      "-ext", "basicConstraints,nsCertType,nsComment,keyUsage,extendedKeyUsage"};
  EXPECT_EQ(X509Text(ca, exts),
            "X509v3 Basic Constraints: \n    CA:TRUE, pathlen:0\n"
            "Netscape Comment: \n    mod_ssl generated custom CA certificate\n"
            "Netscape Cert Type: \n    SSL CA\n");
  EXPECT_EQ(X509Text(cert, exts),
            "Netscape Comment: \n    mod_ssl generated custom server certificate\n"
            "Netscape Cert Type: \n    SSL Server\n"
            "X509v3 Key Usage: critical\n    Digital Signature, Key Encipherment\n"
            "X509v3 Extended Key Usage: \n"
            "    TLS Web Server Authentication, TLS Web Client Authentication\n");
  EXPECT_TRUE(IssuedBy(ReadFile(cert), ReadFile(ca)));
  EXPECT_EQ(ValidDays(ca), 366);
  EXPECT_EQ(ValidDays(cert), 366);
}

struct Authority {  // a request and an authority to sign it with
  std::string key, cert, server_csr;
};

Authority MakeAuthority(const GenRoot& root) {
  const std::string dir = root.NewSetDir("ca");
  Authority a{dir + "/ca.key", dir + "/ca.pem", dir + "/server.csr"};
  _tag_CSR_ARGUMENT ca = Subject("TW", "", "", "Test", "", "Test CA", "");
  _tag_CSR_ARGUMENT server = Subject("", "", "", "", "", "server.test", "");
  EXPECT_EQ(genKey(a.key, 1024), 0);
  EXPECT_EQ(genCsr(root.Path(cert::kCaCfg), a.key, root.Path(cert::kCaCsr), &ca), 0);
  EXPECT_EQ(genCACrt(a.cert, a.key), 0);
  EXPECT_EQ(genKey(dir + "/server.key", 1024), 0);
  EXPECT_EQ(genCsr(root.Path(cert::kServerCfg), dir + "/server.key", a.server_csr, &server), 0);
  return a;
}

// genCrt signs with the number after the one in the serial file and writes
// it back; genServerCrt first seeds a missing serial file.
TEST(GenCrt, SignsWithTheAuthorityAndAdvancesTheSerial) {
  GenRoot root("00113201abcd\n");
  const Authority a = MakeAuthority(root);
  const std::string serial = root.Path("/serial"), out = root.Path("/out/cert.pem");
  WriteFile(serial, "0A0F");
  ASSERT_EQ(genCrt(root.Path("/ext/server.crt.cfg"), a.server_csr, a.cert, serial, out, a.key,
                   false, 30, "nas;;192.168.1.2;fe80::1"), 0);
  for (const std::string& f : {out, a.key, a.server_csr}) EXPECT_EQ(ModeOf(f), 0400u) << f;
  EXPECT_TRUE(IssuedBy(ReadFile(out), ReadFile(a.cert)));
  EXPECT_EQ(X509Text(out, {"-serial", "-ext", "subjectAltName"}),
            "serial=0A10\nX509v3 Subject Alternative Name: \n"
            "    DNS:nas, IP Address:192.168.1.2, IP Address:FE80:0:0:0:0:0:0:1\n");
  EXPECT_EQ(ValidDays(out), 30);
  EXPECT_EQ(ReadFile(serial), "0A10\n");
  const std::string seeded = root.Path(cert::kSerialFile), s1 = root.Path("/s1.pem");
  ASSERT_EQ(genServerCrt(a.server_csr, a.cert, s1, a.key, 5, "nas"), 0);
  EXPECT_EQ("serial=" + ReadFile(seeded), X509Text(s1, {"-serial"}));
}

// Ten digits of time until 2286; then the tail of the address, as is.
TEST(GenSerial, SeedsFromTheTimeAndTheAddressTail) {
  const char* const kRows[][2] = {{"00113201abcd\n", "abcd"}, {"001132abcde\n", "cde1"},
                                  {"00113201", ""}, {"0011", ""}};
  for (const auto& row : kRows) {
    GenRoot root(row[0]);
    const long long before = time(nullptr);
    ASSERT_EQ(genSerial(), 0) << row[0];
    const std::string serial = ReadFile(root.Path(cert::kSerialFile));
    ASSERT_GE(serial.size(), 10u);
    const long long t = std::stoll(serial.substr(0, 10));
    EXPECT_TRUE(t >= before && t <= time(nullptr)) << serial;
    EXPECT_EQ(serial.substr(10), row[1]) << row[0];
  }
}

// Two complete sets from two different authorities.
class VerifyTest : public ::testing::Test {
 protected:
  void SetUp() override {
    one_ = root_.NewSetDir("one");
    two_ = root_.NewSetDir("two");
    MakeSet(one_, Subject("TW", "", "", "One", "", "One CA", ""),
            Subject("TW", "", "", "One", "", "one.test", ""), "one.test");
    MakeSet(two_, Subject("TW", "", "", "Two", "", "Two CA", ""),
            Subject("TW", "", "", "Two", "", "two.test", ""), "two.test");
  }
  std::string One(const char* f) const { return one_ + "/" + f; }
  std::string Two(const char* f) const { return two_ + "/" + f; }

  GenRoot root_;
  std::string one_, two_;
};

TEST_F(VerifyTest, KeysAndChainsMatchOnlyTheirOwn) {
  const std::string bom_cert = root_.Path("/bom-cert.pem"), bom_key = root_.Path("/bom-key.pem");
  WriteFile(bom_cert, "\xEF\xBB\xBF" + ReadFile(One("cert.pem")), 0600);
  WriteFile(bom_key, "\xEF\xBB\xBF" + ReadFile(One("privkey.pem")), 0600);
  const std::string both = root_.Path("/both.pem"), mixed = root_.Path("/mixed.pem");
  const std::string empty = root_.Path("/empty.pem");
  WriteFile(both, ReadFile(One("cert.pem")) + ReadFile(One("zeph-ca-cert.pem")));
  WriteFile(mixed, ReadFile(One("cert.pem")) + ReadFile(Two("zeph-ca-cert.pem")));
  WriteFile(empty, "");
  const struct {
    std::string a, b;
    int key, chain;  // verifyCrtAndKey(a, b), verifyCrtChain(a, b)
  } kRows[] = {
      {One("cert.pem"), One("privkey.pem"), 0, -2},
      {One("cert.pem"), Two("privkey.pem"), 1, -2},
      {bom_cert, bom_key, 0, -2},  // byte-order marks are stripped in place first
      {One("cert.pem"), One("zeph-ca-cert.pem"), -2, 0},
      {One("zeph-ca-cert.pem"), One("cert.pem"), -2, 0},
      {both, empty, -2, 0},
      {One("cert.pem"), empty, -2, 0},
      {One("cert.pem"), Two("zeph-ca-cert.pem"), -2, 1},
      {mixed, empty, -2, 1},
      {both, Two("cert.pem"), -2, 1},
      {empty, empty, -2, 1},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.a + " " + row.b);
    EXPECT_EQ(row.key == -2 ? -2 : verifyCrtAndKey(row.a, row.b), row.key);
    EXPECT_EQ(row.chain == -2 ? -2 : verifyCrtChain(row.a.c_str(), row.b.c_str()), row.chain);
  }
  EXPECT_EQ(ReadFile(bom_cert), ReadFile(One("cert.pem")));
  EXPECT_EQ(ReadFile(bom_key), ReadFile(One("privkey.pem")));
}

// Every refusal and failure answers -1 (the extension file that cannot be written 0:
// signing goes ahead without it) and touches no file beyond what the row names.
TEST_F(VerifyTest, FailuresAnswerMinusOneAndTouchNoFile) {
  const GenRoot& r = root_;
  const std::string k = r.Path("/k.pem"), cfg = r.Path("/req.cfg"), csr = r.Path("/r.csr");
  const std::string blocker = r.Path("/blocker"), taken = r.Path("/taken");
  const std::string serial = r.Path("/serial"), garbage = r.Path("/garbage.pem");
  WriteFile(blocker, "a file, not a directory");
  MakeDirs(taken);
  WriteFile(serial, "01");
  WriteFile(garbage, "-----BEGIN CERTIFICATE-----\nnot base64\n");
  const Authority a = MakeAuthority(root_);
  const std::string cert = One("cert.pem"), key = One("privkey.pem");
  const std::string missing = r.Path("/missing.pem");
  const std::string below = blocker + "/sub/x.cfg", mac = r.Path(cert::kMacAddressFile);
  const std::string no_ca = root_.NewSetDir("no-ca"), out = r.Path("/out/c.pem");
  const char* const c = cert.c_str();
  UniqueSzList nas(QLIBCSzListAlloc(8));
  QLIBCSzListAdd(nas.get(), "nas1");
  _tag_CSR_ARGUMENT x = Subject("", "", "", "", "", "x", ""), none;
  auto crt = [&](const std::string& cf, const std::string& s, const std::string& ca,
                 const std::string& sr, const std::string& o, const std::string& pk,
                 int days) { return genCrt(cf, s, ca, sr, o, pk, false, days, "nas"); };
  const std::string& ca = a.cert, &ca_key = a.key, &req = a.server_csr;
  EXPECT_EQ(makeParentDir(""), -1);
  EXPECT_EQ(makeParentDir(below), -1);
  EXPECT_EQ(generateCACNF(nullptr), -1);
  EXPECT_EQ(generateCACNF(""), -1);
  EXPECT_EQ(generateCACNF(below.c_str()), -1);
  EXPECT_EQ(generateCACNF(taken.c_str()), -1);
  EXPECT_EQ(generateServerCNF("", nas.get()), -1);
  EXPECT_EQ(generateServerCNF(cfg.c_str(), nullptr), -1);
  EXPECT_EQ(generateServerCNF(below.c_str(), nas.get()), -1);
  EXPECT_EQ(generateServerCNF(taken.c_str(), nas.get()), -1);
  EXPECT_EQ(modifyCsrCfg("", &x), -1);
  EXPECT_EQ(modifyCsrCfg(cfg, nullptr), -1);
  EXPECT_EQ(modifyCsrCfg(below, &x), -1);
  EXPECT_EQ(modifyCsrCfg(taken, &x), -1);
  EXPECT_EQ(genKey("", 1024), -1);
  EXPECT_EQ(genKey(k, 0), -1);
  EXPECT_EQ(genKey(k, static_cast<unsigned int>(-1)), -1);  // a request's -1
  EXPECT_EQ(genKey(k, kMaxKeyBits + 1), -1);
  EXPECT_EQ(genKey(blocker + "/k.pem", 1024), -1);
  EXPECT_EQ(genKey(k, 100), -1);  // below openssl's minimum
  EXPECT_EQ(genCsr("", k, csr, &x), -1);
  EXPECT_EQ(genCsr(cfg, "", csr, &x), -1);
  EXPECT_EQ(genCsr(cfg, k, "", &x), -1);
  EXPECT_EQ(genCsr(cfg, k, csr, nullptr), -1);
  EXPECT_EQ(genCsr(cfg, k, csr, &x), -1);
  EXPECT_EQ(genCsr(taken, a.key, csr, &x), -1);
  EXPECT_EQ(genCsr(r.Path("/req2.cfg"), a.key, csr, &none), -1);  // empty name section
  EXPECT_EQ(crt(cfg, req, ca, serial, out, ca_key, 0), -1);
  EXPECT_EQ(crt(cfg, req, ca, serial, out, ca_key, -5), -1);
  EXPECT_EQ(crt("", req, ca, serial, out, ca_key, 1), -1);
  EXPECT_EQ(crt(cfg, "", ca, serial, out, ca_key, 1), -1);
  EXPECT_EQ(crt(cfg, req, "", serial, out, ca_key, 1), -1);
  EXPECT_EQ(crt(cfg, req, ca, serial, out, "", 1), -1);
  EXPECT_EQ(crt(cfg, req, ca, "", out, ca_key, 1), -1);
  EXPECT_EQ(crt(cfg, req, ca, serial, "", ca_key, 1), -1);
  EXPECT_EQ(crt(cfg, csr, ca, serial, out, ca_key, 1), -1);
  EXPECT_EQ(crt(cfg, req, ca, serial, out, k, 1), -1);
  EXPECT_EQ(crt(cfg, req, ca, missing, out, ca_key, 1), -1);
  EXPECT_EQ(crt(taken, req, ca, serial, r.Path("/c.pem"), ca_key, 1), 0);
  EXPECT_EQ(crt(below, req, ca, serial, r.Path("/c2.pem"), ca_key, 1), -1);
  EXPECT_EQ(genCASet(&x, 1024, blocker), -1);
  EXPECT_EQ(genCASet(&x, 1024, missing), -1);
  EXPECT_EQ(genCASet(&x, 1024, ""), -1);
  EXPECT_EQ(genCASet(&x, 0, taken), -1);
  EXPECT_EQ(genCASet(&x, -1024, taken), -1);
  EXPECT_EQ(genCASet(&none, 1024, taken), -1);  // leaves the key behind
  EXPECT_EQ(genCertSet(&x, 0, "nas", taken), -1);
  EXPECT_EQ(genCertSet(&x, 1024, "nas", no_ca), -1);
  EXPECT_EQ(genDefaultCrt(blocker), -1);
  EXPECT_EQ(verifyCrtAndKey(missing, key), -1);
  EXPECT_EQ(verifyCrtAndKey(garbage, key), -1);
  EXPECT_EQ(verifyCrtAndKey(cert, cert), -1);  // a certificate file is no key file
  EXPECT_EQ(verifyCrtChain(nullptr, c), -1);
  EXPECT_EQ(verifyCrtChain("", c), -1);
  EXPECT_EQ(verifyCrtChain(c, nullptr), -1);
  EXPECT_EQ(verifyCrtChain(c, ""), -1);
  EXPECT_EQ(verifyCrtChain(missing.c_str(), c), -1);
  EXPECT_EQ(verifyCrtChain(c, missing.c_str()), -1);
  unlink(mac.c_str());
  EXPECT_EQ(genSerial(), -1);
  unlink(r.Path(cert::kSerialFile).c_str());
  EXPECT_EQ(genServerCrt(req, ca, r.Path("/s.pem"), ca_key, 5, "nas"), -1);
  WriteFile(mac, "  \n");
  EXPECT_EQ(genSerial(), -1);
  WriteFile(mac, "00113201abcd\n");
  test::Run({"/bin/rm", "-rf", r.Path("/usr/zeph/etc/ssl")});
  EXPECT_EQ(genSerial(), -1);
  for (const std::string& f : {csr, r.Path("/out"), r.Path("/c2.pem"), r.Path("/s.pem"), missing,
                               cfg}) {
    EXPECT_FALSE(Exists(f)) << f;
  }
  EXPECT_EQ(ReadFile(serial), "02\n");  // only the row that signed counted up
  EXPECT_EQ(ReadFile(blocker), "a file, not a directory");
  EXPECT_EQ(DirEntries(taken), std::vector<std::string>{"zeph-ca-privkey.pem"});
  EXPECT_EQ(DirEntries(no_ca), std::vector<std::string>{"privkey.pem"});
  ssl::X509Ptr without_names = LoadCert(r.Path("/c.pem"));
  EXPECT_TRUE(without_names && AltNames(without_names.get()).empty());
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
