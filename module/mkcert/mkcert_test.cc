// Generation and checks of keys, requests, certificates, configuration files and sets by
// the real openssl; the configuration files show in the certificates' extensions and names.
#include <gtest/gtest.h>
#include <time.h>
#include <unistd.h>

#include <functional>
#include <regex>

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

UniqueSzList List(const std::vector<const char*>& items) {
  UniqueSzList list(QLIBCSzListAlloc(8));
  for (const char* item : items) QLIBCSzListAdd(list.get(), item);
  return list;
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

// The default set as a client and an administrator see it (subjects and names are the
// mkcert tool test's); without aliases only "email:copy" is left: the subject's e-mail.
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
  EXPECT_TRUE(IssuedBy(ReadFile(ca), ReadFile(ca)));
  EXPECT_EQ(ValidDays(ca), 366);
  EXPECT_EQ(ValidDays(cert), 366);
  const std::string b = root.NewSetDir("b");
  MakeSet(b, Subject("DE", "", "", "Example", "", "CA", ""),
          Subject("DE", "", "", "Example", "", "nas.example.com", "nas@example.com"), "");
  ssl::X509Ptr email_only = LoadCert(b + "/cert.pem");
  EXPECT_TRUE(email_only && AltNames(email_only.get()) == std::vector<std::string>{"other:1"});
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
  const std::string first = X509Text(s1, {"-serial"});
  EXPECT_TRUE(std::regex_match(first, std::regex("serial=[0-9]{10}ABCE\n"))) << first;
  EXPECT_EQ(ReadFile(seeded), first.substr(7));
  EXPECT_NE(ReadFile(root.Path(cert::kServerCrtCfg)).find("\nsubjectAltName = \"DNS:nas\"\n"),
            std::string::npos);
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
    root_.ClearLog();
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
  EXPECT_EQ(root_.Log(), "");
}

// Every refusal and failure answers -1 (the extension file that cannot be
// written 0: signing goes ahead without it), logs why, and touches no file
// beyond what the row names.
TEST_F(VerifyTest, FailuresAnswerAndLogWhy) {
  const GenRoot& r = root_;
  const std::string k = r.Path("/k.pem"), cfg = r.Path("/req.cfg"), csr = r.Path("/r.csr");
  const std::string blocker = r.Path("/blocker"), taken = r.Path("/taken");
  const std::string serial = r.Path("/serial"), garbage = r.Path("/garbage.pem");
  WriteFile(blocker, "a file, not a directory");
  MakeDirs(taken);
  WriteFile(serial, "01");
  WriteFile(garbage, "-----BEGIN CERTIFICATE-----\nnot base64\n");
  const Authority a = MakeAuthority(root_);
  const std::string cert = One("cert.pem"), key = One("privkey.pem"), missing = r.Path("/missing.pem");
  const std::string below = blocker + "/sub/x.cfg", mac = r.Path(cert::kMacAddressFile);
  const std::string no_ca = root_.NewSetDir("no-ca"), out = r.Path("/out/c.pem");
  const char* const c = cert.c_str();
  UniqueSzList nas = List({"nas1"});
  _tag_CSR_ARGUMENT x = Subject("", "", "", "", "", "x", ""), none;
  auto crt = [&](const std::string& cf, const std::string& s, const std::string& ca,
                 const std::string& sr, const std::string& o, const std::string& pk,
                 int days) { return genCrt(cf, s, ca, sr, o, pk, false, days, "nas"); };
  const std::string& ca = a.cert, &ca_key = a.key, &req = a.server_csr;
  const std::string kBadKey = "Failed to genKey with invalid parameters";
  const std::string kBadCsr = "Failed to generate csr with invalid paramters";
  const std::string kBadCrt = "genCrt params invalid", kNoDir = "generate directory failed";
  const std::string kSanity = "sanity check failed";
  const std::string kNoMac = "Open /proc/sys/kernel/zeph_mac_address1 failed";
  const struct {
    std::function<int()> call;
    std::string log;  // the message logged; ending in "[": its beginning
    int result = -1;
  } kRows[] = {
      {[&] { return makeParentDir(""); }, "Failed to generate directory with invalid parameters"},
      {[&] { return makeParentDir(below); }, "Exec mkdir failed"},
      {[&] { return generateCACNF(nullptr); }, "CA CNF name is null or empty.["},
      {[&] { return generateCACNF(""); }, "CA CNF name is null or empty.["},
      {[&] { return generateCACNF(below.c_str()); }, kNoDir},
      {[&] { return generateCACNF(taken.c_str()); }, "fopen " + taken + " failed["},
      {[&] { return generateServerCNF("", nas.get()); }, "Server CNF name is null or empty.["},
      {[&] { return generateServerCNF(cfg.c_str(), nullptr); }, "alias list is null"},
      {[&] { return generateServerCNF(below.c_str(), nas.get()); }, kNoDir},
      {[&] { return generateServerCNF(taken.c_str(), nas.get()); }, "fopen " + taken + " failed["},
      {[&] { return modifyCsrCfg("", &x); }, "modifyCsrCfg sanity failed.["},
      {[&] { return modifyCsrCfg(cfg, nullptr); }, "modifyCsrCfg sanity failed.["},
      {[&] { return modifyCsrCfg(below, &x); }, kNoDir},
      {[&] { return modifyCsrCfg(taken, &x); }, "Open " + taken + " failed["},
      {[&] { return genKey("", 1024); }, kBadKey},
      {[&] { return genKey(k, 0); }, kBadKey},
      // A request's -1 arrives as the largest unsigned value.
      {[&] { return genKey(k, static_cast<unsigned int>(-1)); }, kBadKey},
      {[&] { return genKey(k, kMaxKeyBits + 1); }, kBadKey},
      {[&] { return genKey(blocker + "/k.pem", 1024); },
       "Failed to generate directory for " + blocker + "/k.pem"},
      {[&] { return genKey(k, 100); }, "Error when execute"},  // below openssl's minimum
      {[&] { return genCsr("", k, csr, &x); }, kBadCsr},
      {[&] { return genCsr(cfg, "", csr, &x); }, kBadCsr},
      {[&] { return genCsr(cfg, k, "", &x); }, kBadCsr},
      {[&] { return genCsr(cfg, k, csr, nullptr); }, kBadCsr},
      {[&] { return genCsr(cfg, k, csr, &x); }, "Key is not existed"},
      {[&] { return genCsr(taken, a.key, csr, &x); }, "Failed to generate csr config file failed"},
      // An empty name section: the tool refuses it.
      {[&] { return genCsr(r.Path("/req2.cfg"), a.key, csr, &none); }, "Create CSR failed, command"},
      {[&] { return crt(cfg, req, ca, serial, out, ca_key, 0); }, kBadCrt},
      {[&] { return crt(cfg, req, ca, serial, out, ca_key, -5); }, kBadCrt},
      {[&] { return crt("", req, ca, serial, out, ca_key, 1); }, kBadCrt},
      {[&] { return crt(cfg, "", ca, serial, out, ca_key, 1); }, kBadCrt},
      {[&] { return crt(cfg, req, "", serial, out, ca_key, 1); }, kBadCrt},
      {[&] { return crt(cfg, req, ca, serial, out, "", 1); }, kBadCrt},
      {[&] { return crt(cfg, req, ca, "", out, ca_key, 1); }, kBadCrt},
      {[&] { return crt(cfg, req, ca, serial, "", ca_key, 1); }, kBadCrt},
      {[&] { return crt(cfg, csr, ca, serial, out, ca_key, 1); }, "Csr is not existed"},
      {[&] { return crt(cfg, req, ca, serial, out, k, 1); }, "Key is not existed"},
      {[&] { return crt(cfg, req, ca, missing, out, ca_key, 1); }, "Serial file is not existed"},
      // The writer fails, the tool reads no extensions from a directory.
      {[&] { return crt(taken, req, ca, serial, r.Path("/c.pem"), ca_key, 1); },
       "fopen " + taken + " failed[", 0},
      // Without its directory the tool finds no extension file.
      {[&] { return crt(below, req, ca, serial, r.Path("/c2.pem"), ca_key, 1); }, "Error when execute"},
      {[&] { return genCASet(&x, 1024, blocker); }, "Invalid paramter [" + blocker + "]"},
      {[&] { return genCASet(&x, 1024, missing); }, "Invalid paramter [" + missing + "]"},
      {[&] { return genCASet(&x, 1024, ""); }, "Invalid paramter []"},
      {[&] { return genCASet(&x, 0, taken); }, "genCAKey() failed"},
      {[&] { return genCASet(&x, -1024, taken); }, kBadKey},
      // The key stays behind when the request cannot be made.
      {[&] { return genCASet(&none, 1024, taken); }, "genCACsr() failed"},
      {[&] { return genCertSet(&x, 0, "nas", taken); }, "Failed to generate key"},
      {[&] { return genCertSet(&x, 1024, "nas", no_ca); }, "Failed to generate cert"},
      {[&] { return genDefaultCrt(blocker); }, "Generate CA key & crt failed"},
      {[&] { return verifyCrtAndKey(missing, key); }, "Failed to strip utf8 BOM"},
      {[&] { return verifyCrtAndKey(garbage, key); }, "Failed to read cert from " + garbage},
      // A certificate file is no key file.
      {[&] { return verifyCrtAndKey(cert, cert); }, "Failed to read private key from " + cert},
      {[&] { return verifyCrtChain(nullptr, c); }, kSanity},
      {[&] { return verifyCrtChain("", c); }, kSanity},
      {[&] { return verifyCrtChain(c, nullptr); }, kSanity},
      {[&] { return verifyCrtChain(c, ""); }, kSanity},
      {[&] { return verifyCrtChain(missing.c_str(), c); }, kSanity},
      {[&] { return verifyCrtChain(c, missing.c_str()); }, kSanity},
      {[&] { unlink(mac.c_str()); return genSerial(); }, kNoMac},
      {[&] { unlink(r.Path(cert::kSerialFile).c_str());
             return genServerCrt(req, ca, r.Path("/s.pem"), ca_key, 5, "nas"); }, kNoMac},
      {[&] { WriteFile(mac, "  \n"); return genSerial(); },
       "Fetch /proc/sys/kernel/zeph_mac_address1 failed"},
      {[&] { WriteFile(mac, "00113201abcd\n"); test::Run({"/bin/rm", "-rf", r.Path("/usr/zeph/etc/ssl")});
             return genSerial(); }, "Open /usr/zeph/etc/ssl/.mkcert.serial failed"},
  };
  for (const auto& row : kRows) {
    const std::string log = row.log;
    SCOPED_TRACE(log);
    root_.ClearLog();
    EXPECT_EQ(row.call(), row.result);
    EXPECT_TRUE(Logged(root_, log, log.back() == '[')) << root_.Log();
  }
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
