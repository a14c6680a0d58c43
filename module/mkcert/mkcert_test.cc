// Key, request, certificate and configuration generation and the checks of
// sets. The products are made by the real openssl and read back with the
// OpenSSL library or the openssl tool: the configuration files show in
// the certificates' extensions and names.
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

const std::vector<std::string> kSetFiles = {"cert.pem", "fullchain.pem",
                                            "privkey.pem", "zeph-ca-cert.pem",
                                            "zeph-ca-privkey.pem"};

// What `openssl x509 -noout <args> -in <path>` prints.
std::string X509Text(const std::string& path,
                     const std::vector<std::string>& args) {
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

// The whole default set, as a client and an administrator see it (the
// subjects and names are checked through the mkcert tool's tests).
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
  const std::string issuer = X509Text(ca, {"-subject"}).substr(8);
  EXPECT_EQ(X509Text(ca, {"-issuer"}), "issuer=" + issuer);
  EXPECT_EQ(X509Text(cert, {"-issuer"}), "issuer=" + issuer);
  EXPECT_TRUE(IssuedBy(ReadFile(cert), ReadFile(ca)));
  EXPECT_TRUE(IssuedBy(ReadFile(ca), ReadFile(ca)));
  for (const std::string& c : {ca, cert}) {
    ssl::X509Ptr x = LoadCert(c);
    ASSERT_TRUE(x);
    int days = 0, seconds = 0;
    ASSERT_TRUE(ASN1_TIME_diff(&days, &seconds, X509_get0_notBefore(x.get()),
                               X509_get0_notAfter(x.get())));
    EXPECT_EQ(days, 366);
    EXPECT_LE(X509_cmp_current_time(X509_get0_notBefore(x.get())), 0);
  }
}

TEST(CertSet, NamesEveryAliasInOrderOrElseTheEmail) {
  GenRoot root;
  const std::string a = root.NewSetDir("a"), b = root.NewSetDir("b");
  const _tag_CSR_ARGUMENT ca = Subject("DE", "", "", "Example", "", "CA", "");
  const _tag_CSR_ARGUMENT server = Subject("DE", "Berlin", "Berlin", "Example", "IT",
                                           "nas.example.com", "nas@example.com");
  MakeSet(a, ca, server, "nas.example.com;;10.0.0.5;2001:db8::1;nas");
  MakeSet(b, ca, server, "");
  ssl::X509Ptr cert_a = LoadCert(a + "/cert.pem"), cert_b = LoadCert(b + "/cert.pem");
  ASSERT_TRUE(cert_a && cert_b);
  EXPECT_EQ(AltNames(cert_a.get()),
            (std::vector<std::string>{"DNS:nas.example.com", "IP:10.0.0.5",
                                      "IP:2001:db8::1", "DNS:nas"}));
  // Without aliases only "email:copy" is left: the subject's e-mail.
  EXPECT_EQ(AltNames(cert_b.get()), std::vector<std::string>{"other:1"});
}

// A request and an authority to sign it with, made in `root`.
struct Authority {
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
  EXPECT_EQ(genCsr(root.Path(cert::kServerCfg), dir + "/server.key", a.server_csr,
                   &server), 0);
  return a;
}

TEST(GenCrt, SignsWithTheAuthorityAndAdvancesTheSerial) {
  GenRoot root;
  const Authority a = MakeAuthority(root);
  const std::string serial = root.Path("/serial");
  WriteFile(serial, "0A0F");  // the last number used
  const std::string cfg = root.Path("/ext/server.crt.cfg");
  const std::string out = root.Path("/out/cert.pem");
  ASSERT_EQ(genCrt(cfg, a.server_csr, a.cert, serial, out, a.key, false, 30,
                   "nas;;192.168.1.2;fe80::1"), 0);
  for (const std::string& f : {out, a.key, a.server_csr}) EXPECT_EQ(ModeOf(f), 0400u) << f;
  EXPECT_TRUE(IssuedBy(ReadFile(out), ReadFile(a.cert)));
  EXPECT_EQ(SubjectCommonName(ReadFile(out)), "server.test");
  EXPECT_EQ(X509Text(out, {"-serial", "-ext", "subjectAltName"}),
            "serial=0A10\nX509v3 Subject Alternative Name: \n"
            "    DNS:nas, IP Address:192.168.1.2, IP Address:FE80:0:0:0:0:0:0:1\n");
  ssl::X509Ptr cert = LoadCert(out);
  ASSERT_TRUE(cert);
  int days = 0, seconds = 0;
  ASSERT_TRUE(ASN1_TIME_diff(&days, &seconds, X509_get0_notBefore(cert.get()),
                             X509_get0_notAfter(cert.get())));
  EXPECT_EQ(days, 30);
  // The tool takes the next number and writes it back.
  EXPECT_EQ(ReadFile(serial), "0A10\n");
}

TEST(GenSerial, SeedsFromTheTimeAndTheAddressTail) {
  const char* const kRows[][2] = {{"00113201abcd\n", "abcd"}, {"001132abcde\n", "cde1"},
                                  {"00113201", ""}, {"0011", ""}};
  for (const auto& row : kRows) {
    GenRoot root(row[0]);
    const long long before = time(nullptr);
    ASSERT_EQ(genSerial(), 0) << row[0];
    const std::string serial = ReadFile(root.Path(cert::kSerialFile));
    ASSERT_GE(serial.size(), 10u);
    // Ten digits of time until 2286; then the tail, as is.
    const long long t = std::stoll(serial.substr(0, 10));
    EXPECT_GE(t, before);
    EXPECT_LE(t, time(nullptr));
    EXPECT_EQ(serial.substr(10), row[1]) << row[0];
  }
}

TEST(GenServerCrt, SeedsAMissingSerialFileThenCountsUp) {
  GenRoot root("00113201abcd\n");
  const Authority a = MakeAuthority(root);
  const std::string serial = root.Path(cert::kSerialFile);
  ASSERT_FALSE(Exists(serial));
  // Seeded with time digits and "abcd"; the tool signs with the number
  // after the one in the file and leaves the number it used there.
  ASSERT_EQ(genServerCrt(a.server_csr, a.cert, root.Path("/s1.pem"), a.key, 5, "nas"), 0);
  const std::string first = X509Text(root.Path("/s1.pem"), {"-serial"});
  EXPECT_TRUE(std::regex_match(first, std::regex("serial=[0-9]{10}ABCE\n"))) << first;
  EXPECT_EQ(ReadFile(serial), first.substr(7));
  ASSERT_EQ(genServerCrt(a.server_csr, a.cert, root.Path("/s2.pem"), a.key, 5, "nas"), 0);
  EXPECT_EQ(X509Text(root.Path("/s2.pem"), {"-serial"}),
            first.substr(0, first.size() - 5) + "ABCF\n");
  // The server extension file sits at its fixed place.
  EXPECT_NE(ReadFile(root.Path(cert::kServerCrtCfg)).find("\nsubjectAltName = \"DNS:nas\"\n"),
            std::string::npos);
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
  // Byte-order marks are stripped in place first.
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
      {One("zeph-ca-cert.pem"), One("zeph-ca-privkey.pem"), 0, -2},
      {One("cert.pem"), Two("privkey.pem"), 1, -2},
      {One("cert.pem"), One("zeph-ca-privkey.pem"), 1, -2},
      {bom_cert, bom_key, 0, -2},
      // Leaf and its authority, in either file, in either order.
      {One("cert.pem"), One("zeph-ca-cert.pem"), -2, 0},
      {One("zeph-ca-cert.pem"), One("cert.pem"), -2, 0},
      {both, empty, -2, 0},
      {One("cert.pem"), empty, -2, 0},  // one certificate alone
      // An unrelated authority, alone or beside the leaf; a third,
      // unrelated certificate; nothing at all.
      {One("cert.pem"), Two("zeph-ca-cert.pem"), -2, 1},
      {mixed, empty, -2, 1},
      {both, Two("cert.pem"), -2, 1},
      {empty, empty, -2, 1},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.a + " " + row.b);
    if (row.key != -2) {
      EXPECT_EQ(verifyCrtAndKey(row.a, row.b), row.key);
    }
    if (row.chain != -2) {
      EXPECT_EQ(verifyCrtChain(row.a.c_str(), row.b.c_str()), row.chain);
    }
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
  const std::string cert = One("cert.pem"), missing = r.Path("/missing.pem");
  const std::string below = blocker + "/sub/x.cfg", mac = r.Path(cert::kMacAddressFile);
  const std::string no_ca = root_.NewSetDir("no-ca");
  UniqueSzList nas = List({"nas1"});
  _tag_CSR_ARGUMENT x = Subject("", "", "", "", "", "x", ""), none;
  auto crt = [&](const std::string& c, const std::string& s, const std::string& ca,
                 const std::string& sr, const std::string& o, const std::string& key,
                 int days) { return genCrt(c, s, ca, sr, o, key, false, days, "nas"); };
  const std::string out = r.Path("/out/c.pem");
  const struct {
    std::function<int()> call;
    int result;
    std::string log;  // the message logged; ending in "[": its beginning
  } kRows[] = {
      {[&] { return makeParentDir(""); }, -1,
       "Failed to generate directory with invalid parameters"},
      {[&] { return makeParentDir(below); }, -1, "Exec mkdir failed"},
      {[&] { return generateCACNF(nullptr); }, -1, "CA CNF name is null or empty.["},
      {[&] { return generateCACNF(""); }, -1, "CA CNF name is null or empty.["},
      {[&] { return generateCACNF(below.c_str()); }, -1, "generate directory failed"},
      {[&] { return generateCACNF(taken.c_str()); }, -1, ("fopen " + taken + " failed[")},
      {[&] { return generateServerCNF("", nas.get()); }, -1, "Server CNF name is null or empty.["},
      {[&] { return generateServerCNF(cfg.c_str(), nullptr); }, -1, "alias list is null"},
      {[&] { return generateServerCNF(below.c_str(), nas.get()); }, -1, "generate directory failed"},
      {[&] { return generateServerCNF(taken.c_str(), nas.get()); }, -1,
       ("fopen " + taken + " failed[")},
      {[&] { return modifyCsrCfg("", &x); }, -1, "modifyCsrCfg sanity failed.["},
      {[&] { return modifyCsrCfg(cfg, nullptr); }, -1, "modifyCsrCfg sanity failed.["},
      {[&] { return modifyCsrCfg(below, &x); }, -1, "generate directory failed"},
      {[&] { return modifyCsrCfg(taken, &x); }, -1, ("Open " + taken + " failed[")},
      {[&] { return genKey("", 1024); }, -1, "Failed to genKey with invalid parameters"},
      {[&] { return genKey(k, 0); }, -1, "Failed to genKey with invalid parameters"},
      // A request's -1 arrives as the largest unsigned value.
      {[&] { return genKey(k, static_cast<unsigned int>(-1)); }, -1,
       "Failed to genKey with invalid parameters"},
      {[&] { return genKey(k, kMaxKeyBits + 1); }, -1, "Failed to genKey with invalid parameters"},
      {[&] { return genKey(blocker + "/k.pem", 1024); }, -1,
       ("Failed to generate directory for " + blocker + "/k.pem")},
      {[&] { return genKey(k, 100); }, -1, "Error when execute"},  // below openssl's minimum
      {[&] { return genCsr("", k, csr, &x); }, -1, "Failed to generate csr with invalid paramters"},
      {[&] { return genCsr(cfg, "", csr, &x); }, -1, "Failed to generate csr with invalid paramters"},
      {[&] { return genCsr(cfg, k, "", &x); }, -1, "Failed to generate csr with invalid paramters"},
      {[&] { return genCsr(cfg, k, csr, nullptr); }, -1, "Failed to generate csr with invalid paramters"},
      {[&] { return genCsr(cfg, k, csr, &x); }, -1, "Key is not existed"},
      {[&] { return genCsr(taken, a.key, csr, &x); }, -1, "Failed to generate csr config file failed"},
      // An empty name section: the tool refuses it.
      {[&] { return genCsr(r.Path("/req2.cfg"), a.key, csr, &none); }, -1,
       "Create CSR failed, command"},
      {[&] { return crt(cfg, a.server_csr, a.cert, serial, out, a.key, 0); }, -1, "genCrt params invalid"},
      {[&] { return crt(cfg, a.server_csr, a.cert, serial, out, a.key, -5); }, -1, "genCrt params invalid"},
      {[&] { return crt("", a.server_csr, a.cert, serial, out, a.key, 1); }, -1, "genCrt params invalid"},
      {[&] { return crt(cfg, "", a.cert, serial, out, a.key, 1); }, -1, "genCrt params invalid"},
      {[&] { return crt(cfg, a.server_csr, "", serial, out, a.key, 1); }, -1, "genCrt params invalid"},
      {[&] { return crt(cfg, a.server_csr, a.cert, serial, out, "", 1); }, -1, "genCrt params invalid"},
      {[&] { return crt(cfg, a.server_csr, a.cert, "", out, a.key, 1); }, -1, "genCrt params invalid"},
      {[&] { return crt(cfg, a.server_csr, a.cert, serial, "", a.key, 1); }, -1, "genCrt params invalid"},
      {[&] { return crt(cfg, csr, a.cert, serial, out, a.key, 1); }, -1, "Csr is not existed"},
      {[&] { return crt(cfg, a.server_csr, a.cert, serial, out, k, 1); }, -1, "Key is not existed"},
      {[&] { return crt(cfg, a.server_csr, a.cert, missing, out, a.key, 1); }, -1,
       "Serial file is not existed"},
      // The writer fails, the tool reads no extensions from a directory.
      {[&] { return crt(taken, a.server_csr, a.cert, serial, r.Path("/c.pem"), a.key, 1); }, 0,
       ("fopen " + taken + " failed[")},
      // Without its directory the tool finds no extension file.
      {[&] { return crt(below, a.server_csr, a.cert, serial, r.Path("/c2.pem"), a.key, 1); }, -1,
       "Error when execute"},
      {[&] { return genCASet(&x, 1024, blocker); }, -1, ("Invalid paramter [" + blocker + "]")},
      {[&] { return genCASet(&x, 1024, missing); }, -1, ("Invalid paramter [" + missing + "]")},
      {[&] { return genCASet(&x, 1024, ""); }, -1, "Invalid paramter []"},
      {[&] { return genCASet(&x, 0, taken); }, -1, "genCAKey() failed"},
      {[&] { return genCASet(&x, -1024, taken); }, -1, "Failed to genKey with invalid parameters"},
      // The key stays behind when the request cannot be made.
      {[&] { return genCASet(&none, 1024, taken); }, -1, "genCACsr() failed"},
      {[&] { return genCertSet(&x, 0, "nas", taken); }, -1, "Failed to generate key"},
      {[&] { return genCertSet(&x, 1024, "nas", no_ca); }, -1, "Failed to generate cert"},
      {[&] { return genDefaultCrt(blocker); }, -1, "Generate CA key & crt failed"},
      {[&] { return verifyCrtAndKey(missing, One("privkey.pem")); }, -1, "Failed to strip utf8 BOM"},
      {[&] { return verifyCrtAndKey(garbage, One("privkey.pem")); }, -1,
       ("Failed to read cert from " + garbage)},
      // A certificate file is no key file.
      {[&] { return verifyCrtAndKey(cert, cert); }, -1, ("Failed to read private key from " + cert)},
      {[&] { return verifyCrtChain(nullptr, cert.c_str()); }, -1, "sanity check failed"},
      {[&] { return verifyCrtChain("", cert.c_str()); }, -1, "sanity check failed"},
      {[&] { return verifyCrtChain(cert.c_str(), nullptr); }, -1, "sanity check failed"},
      {[&] { return verifyCrtChain(cert.c_str(), ""); }, -1, "sanity check failed"},
      {[&] { return verifyCrtChain(missing.c_str(), cert.c_str()); }, -1, "sanity check failed"},
      {[&] { return verifyCrtChain(cert.c_str(), missing.c_str()); }, -1, "sanity check failed"},
      {[&] { unlink(mac.c_str()); return genSerial(); }, -1,
       "Open /proc/sys/kernel/zeph_mac_address1 failed"},
      {[&] { unlink(r.Path(cert::kSerialFile).c_str());
             return genServerCrt(a.server_csr, a.cert, r.Path("/s.pem"), a.key, 5, "nas"); }, -1,
       "Open /proc/sys/kernel/zeph_mac_address1 failed"},
      {[&] { WriteFile(mac, "  \n"); return genSerial(); }, -1,
       "Fetch /proc/sys/kernel/zeph_mac_address1 failed"},
      {[&] { WriteFile(mac, "00113201abcd\n"); test::Run({"/bin/rm", "-rf", r.Path("/usr/zeph/etc/ssl")});
             return genSerial(); }, -1, "Open /usr/zeph/etc/ssl/.mkcert.serial failed"},
  };
  for (const auto& row : kRows) {
    const std::string log = row.log;
    SCOPED_TRACE(log);
    root_.ClearLog();
    EXPECT_EQ(row.call(), row.result);
    const bool prefix = log.back() == '[';
    EXPECT_TRUE(Logged(root_, log, prefix)) << root_.Log();
  }
  EXPECT_FALSE(Exists(csr));
  EXPECT_FALSE(Exists(r.Path("/out")));
  EXPECT_FALSE(Exists(r.Path("/c2.pem")));
  EXPECT_FALSE(Exists(r.Path("/s.pem")));
  EXPECT_FALSE(Exists(missing));
  EXPECT_FALSE(Exists(cfg));
  EXPECT_EQ(ReadFile(serial), "02\n");  // only the row that signed counted up
  EXPECT_EQ(ReadFile(blocker), "a file, not a directory");
  EXPECT_EQ(DirEntries(taken), std::vector<std::string>{"zeph-ca-privkey.pem"});
  EXPECT_EQ(DirEntries(no_ca), std::vector<std::string>{"privkey.pem"});
  ssl::X509Ptr signed_without_names = LoadCert(r.Path("/c.pem"));
  ASSERT_TRUE(signed_without_names);
  EXPECT_EQ(AltNames(signed_without_names.get()), std::vector<std::string>{});

  // An unreadable file fails at the first step that reads it.
  if (geteuid() != 0) {
    const std::string locked = r.Path("/locked.pem");
    WriteFile(locked, ReadFile(cert), 0000);
    root_.ClearLog();
    EXPECT_EQ(verifyCrtAndKey(locked, One("privkey.pem")), -1);
    EXPECT_TRUE(Logged(root_, "Failed to strip utf8 BOM"));
    EXPECT_EQ(verifyCrtChain(cert.c_str(), locked.c_str()), -1);
    EXPECT_TRUE(Logged(root_, "Open " + locked + " failed[", true));
    EXPECT_TRUE(Logged(root_, "Get X509 certificate failed.[", true));
  }
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
