// Keys, requests and certificates are made by the real openssl and read
// back with the OpenSSL library.
#include "module/mkcert/generate.h"

#include <gtest/gtest.h>
#include <time.h>

#include <regex>

#include "module/common/paths.h"
#include "module/mkcert/cert_set.h"
#include "module/mkcert/config_files.h"
#include "module/mkcert/mkcert_test_util.h"

namespace ZEPH {
namespace test {
namespace {

std::vector<std::string> Without(std::vector<std::string> names,
                                 const std::string& drop) {
  names.erase(std::remove(names.begin(), names.end(), drop), names.end());
  return names;
}

// The last line of `text`, without its line feed.
std::string LastLine(std::string text) {
  if (!text.empty() && text.back() == '\n') text.pop_back();
  return text.substr(text.rfind('\n') + 1);
}

TEST(GenKey, MakesAnOwnerOnlyRsaKeyOfTheGivenLength) {
  GenRoot root;
  const std::string key = root.Path("/keys/new/k.pem");  // parent made
  ASSERT_EQ(genKey(key, 1024), 0);
  EXPECT_EQ(ModeOf(key), 0400u);
  ssl::EvpPkeyPtr pkey = LoadKey(key);
  ASSERT_TRUE(pkey);
  EXPECT_EQ(EVP_PKEY_base_id(pkey.get()), EVP_PKEY_RSA);
  EXPECT_EQ(EVP_PKEY_bits(pkey.get()), 1024);
}

TEST(GenKey, RefusesBadInputBeforeRunningAnything) {
  GenRoot root;
  const std::vector<std::string> before = DirEntries(root.dir());
  EXPECT_EQ(genKey("", 1024), -1);
  EXPECT_EQ(genKey(root.Path("/k.pem"), 0), -1);
  // A request's -1 arrives as the largest unsigned value.
  EXPECT_EQ(genKey(root.Path("/k.pem"), static_cast<unsigned int>(-1)), -1);
  EXPECT_EQ(genKey(root.Path("/k.pem"), kMaxKeyBits + 1), -1);
  EXPECT_EQ(LogCount(root, "Failed to genKey with invalid parameters"), 4);
  EXPECT_EQ(Without(DirEntries(root.dir()), "test.log"), before);

  WriteFile(root.Path("/blocker"), "");
  EXPECT_EQ(genKey(root.Path("/blocker/k.pem"), 1024), -1);
  EXPECT_TRUE(Logged(
      root, "Failed to generate directory for " + root.Path("/blocker/k.pem")));
  // openssl refuses a length below its minimum.
  EXPECT_EQ(genKey(root.Path("/k.pem"), 100), -1);
  EXPECT_TRUE(Logged(root, "Error when execute"));
}

TEST(GenCsr, MakesARequestForTheSubject) {
  GenRoot root;
  const std::string key = root.Path("/k.pem");
  ASSERT_EQ(genKey(key, 1024), 0);
  _tag_CSR_ARGUMENT subject = Subject("TW", "", "Taipel", "Arvelon Inc.", "",
                                      "nas.example.com", "ops@example.com");
  const std::string cfg = root.Path("/cfg.d/req.cfg");
  const std::string csr = root.Path("/csr/dir/r.csr");
  ASSERT_EQ(genCsr(cfg, key, csr, &subject), 0);
  EXPECT_EQ(ModeOf(csr), 0400u);
  ssl::X509ReqPtr req = LoadCsr(csr);
  ASSERT_TRUE(req);
  X509_NAME* name = X509_REQ_get_subject_name(req.get());
  EXPECT_EQ(Attr(name, NID_countryName), "TW");
  EXPECT_EQ(Attr(name, NID_stateOrProvinceName), "");
  EXPECT_EQ(Attr(name, NID_localityName), "Taipel");
  EXPECT_EQ(Attr(name, NID_organizationName), "Arvelon Inc.");
  EXPECT_EQ(Attr(name, NID_organizationalUnitName), "");
  EXPECT_EQ(Attr(name, NID_commonName), "nas.example.com");
  EXPECT_EQ(Attr(name, NID_pkcs9_emailAddress), "ops@example.com");
  ssl::EvpPkeyPtr pkey = LoadKey(key);
  EXPECT_EQ(X509_REQ_verify(req.get(), pkey.get()), 1);
  EXPECT_NE(ReadFile(cfg).find("commonName                      = "
                               "'nas.example.com'\n"),
            std::string::npos);
}

TEST(GenCsr, PassesQuotesThroughUnescaped) {
  // The tool's configuration reader takes quotes as quoting, so a value
  // holding a single quote closes the quoted value early and loses its
  // quotes in the request: the file holds the value as it was given, the
  // request what the tool made of it.
  GenRoot root;
  const std::string key = root.Path("/k.pem");
  ASSERT_EQ(genKey(key, 1024), 0);
  _tag_CSR_ARGUMENT subject;
  subject.common_name = "O'Brien \"NAS\"";
  const std::string cfg = root.Path("/req.cfg");
  ASSERT_EQ(genCsr(cfg, key, root.Path("/r.csr"), &subject), 0);
  EXPECT_NE(ReadFile(cfg).find("= 'O'Brien \"NAS\"'\n"), std::string::npos);
  ssl::X509ReqPtr req = LoadCsr(root.Path("/r.csr"));
  ASSERT_TRUE(req);
  EXPECT_EQ(Attr(X509_REQ_get_subject_name(req.get()), NID_commonName),
            "OBrien NAS");
}

TEST(GenCsr, RefusesBadInput) {
  GenRoot root;
  const std::string key = root.Path("/k.pem");
  const std::string cfg = root.Path("/req.cfg");
  const std::string csr = root.Path("/r.csr");
  _tag_CSR_ARGUMENT subject;
  subject.common_name = "x";

  EXPECT_EQ(genCsr("", key, csr, &subject), -1);
  EXPECT_EQ(genCsr(cfg, "", csr, &subject), -1);
  EXPECT_EQ(genCsr(cfg, key, "", &subject), -1);
  EXPECT_EQ(genCsr(cfg, key, csr, nullptr), -1);
  EXPECT_EQ(LogCount(root, "Failed to generate csr with invalid paramters"), 4);
  EXPECT_EQ(genCsr(cfg, key, csr, &subject), -1);
  EXPECT_TRUE(Logged(root, "Key is not existed"));
  EXPECT_FALSE(Exists(cfg));

  ASSERT_EQ(genKey(key, 1024), 0);
  MakeDirs(cfg);  // the configuration cannot be written
  EXPECT_EQ(genCsr(cfg, key, csr, &subject), -1);
  EXPECT_TRUE(LoggedWithLibError(root, "Open " + cfg + " failed"));
  EXPECT_TRUE(Logged(root, "Failed to generate csr config file failed"));
  EXPECT_FALSE(Exists(csr));

  // A subject without any attribute gives an empty name section, which the
  // tool refuses.
  _tag_CSR_ARGUMENT empty;
  const std::string cfg2 = root.Path("/req2.cfg");
  EXPECT_EQ(genCsr(cfg2, key, csr, &empty), -1);
  EXPECT_TRUE(Logged(root, "Create CSR failed, command"));
  EXPECT_FALSE(Exists(csr));
}

// A request and an authority to sign it with, made in `root`.
struct Authority {
  std::string key, cert, csr, server_key, server_csr;
};

Authority MakeAuthority(const GenRoot& root) {
  Authority a;
  const std::string dir = root.NewSetDir("ca");
  a.key = dir + "/ca.key";
  a.cert = dir + "/ca.pem";
  a.server_key = dir + "/server.key";
  a.server_csr = dir + "/server.csr";
  _tag_CSR_ARGUMENT ca = Subject("TW", "", "", "Test", "", "Test CA", "");
  _tag_CSR_ARGUMENT server = Subject("", "", "", "", "", "server.test", "");
  EXPECT_EQ(genKey(a.key, 1024), 0);
  EXPECT_EQ(
      genCsr(root.Path(cert::kCaCfg), a.key, root.Path(cert::kCaCsr), &ca), 0);
  EXPECT_EQ(genCACrt(a.cert, a.key), 0);
  EXPECT_EQ(genKey(a.server_key, 1024), 0);
  EXPECT_EQ(
      genCsr(root.Path(cert::kServerCfg), a.server_key, a.server_csr, &server),
      0);
  return a;
}

TEST(GenCrt, RefusesBadInputBeforeTouchingAnyFile) {
  GenRoot root;
  const Authority a = MakeAuthority(root);
  const std::string cfg = root.Path("/x.cfg");
  const std::string serial = root.Path("/serial");
  const std::string out = root.Path("/out/cert.pem");
  WriteFile(serial, "01");
  root.ClearLog();

  EXPECT_EQ(genCrt(cfg, a.server_csr, a.cert, serial, out, a.key, false, 0, ""),
            -1);
  EXPECT_EQ(
      genCrt(cfg, a.server_csr, a.cert, serial, out, a.key, false, -5, ""), -1);
  EXPECT_EQ(genCrt("", a.server_csr, a.cert, serial, out, a.key, false, 1, ""),
            -1);
  EXPECT_EQ(genCrt(cfg, "", a.cert, serial, out, a.key, false, 1, ""), -1);
  EXPECT_EQ(genCrt(cfg, a.server_csr, "", serial, out, a.key, false, 1, ""),
            -1);
  EXPECT_EQ(genCrt(cfg, a.server_csr, a.cert, serial, out, "", false, 1, ""),
            -1);
  EXPECT_EQ(genCrt(cfg, a.server_csr, a.cert, "", out, a.key, false, 1, ""),
            -1);
  EXPECT_EQ(genCrt(cfg, a.server_csr, a.cert, serial, "", a.key, false, 1, ""),
            -1);
  EXPECT_EQ(LogCount(root, "genCrt params invalid"), 8);
  EXPECT_EQ(genCrt(cfg, root.Path("/none.csr"), a.cert, serial, out, a.key,
                   false, 1, ""),
            -1);
  EXPECT_TRUE(Logged(root, "Csr is not existed"));
  EXPECT_EQ(genCrt(cfg, a.server_csr, a.cert, serial, out,
                   root.Path("/none.key"), false, 1, ""),
            -1);
  EXPECT_TRUE(Logged(root, "Key is not existed"));
  EXPECT_EQ(genCrt(cfg, a.server_csr, a.cert, root.Path("/none.serial"), out,
                   a.key, false, 1, ""),
            -1);
  EXPECT_TRUE(Logged(root, "Serial file is not existed"));
  EXPECT_FALSE(Exists(cfg));
  EXPECT_FALSE(Exists(root.Path("/out")));
  EXPECT_EQ(ReadFile(serial), "01");
}

TEST(GenCrt, SignsWithTheAuthorityAndAdvancesTheSerial) {
  GenRoot root;
  const Authority a = MakeAuthority(root);
  const std::string serial = root.Path("/serial");
  WriteFile(serial, "0A0F");  // the last number used
  const std::string cfg = root.Path("/ext/server.crt.cfg");
  const std::string out = root.Path("/out/cert.pem");
  ASSERT_EQ(genCrt(cfg, a.server_csr, a.cert, serial, out, a.key, false, 30,
                   "nas;;192.168.1.2;fe80::1"),
            0);
  EXPECT_EQ(ModeOf(out), 0400u);
  ssl::X509Ptr cert = LoadCert(out);
  ssl::X509Ptr ca = LoadCert(a.cert);
  ASSERT_TRUE(cert && ca);
  EXPECT_EQ(ValidityDays(cert.get()), 30);
  EXPECT_EQ(SerialHex(cert.get()), "0A10");
  EXPECT_EQ(X509_verify(cert.get(), X509_get0_pubkey(ca.get())), 1);
  EXPECT_EQ(X509_NAME_cmp(X509_get_issuer_name(cert.get()),
                          X509_get_subject_name(ca.get())),
            0);
  EXPECT_EQ(
      AltNames(cert.get()),
      (std::vector<std::string>{"DNS:nas", "IP:192.168.1.2", "IP:fe80::1"}));
  EXPECT_EQ(LastLine(ReadFile(cfg)),
            "subjectAltName = \"DNS:nas, IP:192.168.1.2, IP:fe80::1\"");
  // The tool takes the next number and writes it back.
  EXPECT_EQ(ReadFile(serial), "0A10\n");
}

TEST(GenCrt, GoesAheadWhenTheExtensionFileCannotBeWritten) {
  GenRoot root;
  const Authority a = MakeAuthority(root);
  const std::string serial = root.Path("/serial");
  WriteFile(serial, "01");
  const std::string cfg = root.Path("/ext-is-a-dir");
  MakeDirs(cfg);
  root.ClearLog();
  // The writer fails, the tool runs anyway, reads no extensions from the
  // directory and signs: a certificate without alternative names.
  EXPECT_EQ(genCrt(cfg, a.server_csr, a.cert, serial, root.Path("/c.pem"),
                   a.key, false, 10, "nas"),
            0);
  EXPECT_TRUE(LoggedWithLibError(root, "fopen " + cfg + " failed"));
  ssl::X509Ptr cert = LoadCert(root.Path("/c.pem"));
  ASSERT_TRUE(cert);
  EXPECT_EQ(AltNames(cert.get()), std::vector<std::string>{});

  // Where the file's directory cannot be made, the tool finds no file.
  WriteFile(root.Path("/blocker"), "");
  const std::string unmakeable = root.Path("/blocker/server.crt.cfg");
  root.ClearLog();
  EXPECT_EQ(genCrt(unmakeable, a.server_csr, a.cert, serial,
                   root.Path("/c2.pem"), a.key, false, 10, "nas"),
            -1);
  EXPECT_TRUE(Logged(root, "generate directory failed"));
  EXPECT_TRUE(Logged(root, "Error when execute"));
  EXPECT_FALSE(Exists(root.Path("/c2.pem")));
}

TEST(GenSerial, SeedsFromTheTimeAndTheAddressTail) {
  struct Case {
    const char* address;
    const char* tail;
  };
  for (const Case& c :
       {Case{"00113201abcd\n", "abcd"}, Case{"001132abcde\n", "cde1"},
        Case{"00113201", ""}, Case{"0011", ""}}) {
    GenRoot root(c.address);
    const long long before = time(nullptr);
    ASSERT_EQ(genSerial(), 0) << c.address;
    const long long after = time(nullptr);
    const std::string serial = ReadFile(root.Path(cert::kSerialFile));
    EXPECT_EQ(serial.size() % 2, 0u) << serial;
    ASSERT_GE(serial.size(), 10u);
    // Ten digits of time until 2286; then the tail, as is.
    const long long t = std::stoll(serial.substr(0, 10));
    EXPECT_GE(t, before);
    EXPECT_LE(t, after);
    EXPECT_EQ(serial.substr(10), c.tail) << c.address;
  }
}

TEST(GenSerial, ReportsMissingFiles) {
  GenRoot root;
  unlink(root.Path(cert::kMacAddressFile).c_str());
  EXPECT_EQ(genSerial(), -1);
  EXPECT_TRUE(Logged(root, "Open /proc/sys/kernel/zeph_mac_address1 failed"));
  WriteFile(root.Path(cert::kMacAddressFile), "  \n");
  EXPECT_EQ(genSerial(), -1);
  EXPECT_TRUE(Logged(root, "Fetch /proc/sys/kernel/zeph_mac_address1 failed"));
  EXPECT_FALSE(Exists(root.Path(cert::kSerialFile)));

  WriteFile(root.Path(cert::kMacAddressFile), "00113201abcd\n");
  test::Run({"/bin/rm", "-rf", root.Path("/usr/zeph/etc/ssl")});
  EXPECT_EQ(genSerial(), -1);
  EXPECT_TRUE(Logged(root, "Open /usr/zeph/etc/ssl/.mkcert.serial failed"));
}

TEST(GenServerCrt, SeedsAMissingSerialFileThenCountsUp) {
  GenRoot root("00113201abcd\n");
  const Authority a = MakeAuthority(root);
  const std::string serial = root.Path(cert::kSerialFile);
  ASSERT_FALSE(Exists(serial));
  const std::string out1 = root.Path("/s1.pem");
  ASSERT_EQ(genServerCrt(a.server_csr, a.cert, out1, a.key, 5, "nas"), 0);
  ssl::X509Ptr first = LoadCert(out1);
  ASSERT_TRUE(first);
  // Seeded with time digits and "abcd"; the tool signs with the number
  // after the one in the file and leaves the number it used there.
  const std::string first_serial = SerialHex(first.get());
  EXPECT_TRUE(std::regex_match(first_serial, std::regex("[0-9]{10}ABCE")))
      << first_serial;
  EXPECT_EQ(ReadFile(serial), first_serial + "\n");

  const std::string out2 = root.Path("/s2.pem");
  ASSERT_EQ(genServerCrt(a.server_csr, a.cert, out2, a.key, 5, "nas"), 0);
  ssl::X509Ptr second = LoadCert(out2);
  ASSERT_TRUE(second);
  EXPECT_EQ(SerialHex(second.get()),
            first_serial.substr(0, first_serial.size() - 4) + "ABCF");
  // The server extension file sits at its fixed place.
  EXPECT_EQ(LastLine(ReadFile(root.Path(cert::kServerCrtCfg))),
            "subjectAltName = \"DNS:nas\"");
}

TEST(GenServerCrt, FailsWhenNoSerialCanBeMade) {
  GenRoot root;
  const Authority a = MakeAuthority(root);
  unlink(root.Path(cert::kMacAddressFile).c_str());
  root.ClearLog();
  EXPECT_EQ(
      genServerCrt(a.server_csr, a.cert, root.Path("/s.pem"), a.key, 5, "nas"),
      -1);
  EXPECT_TRUE(Logged(root, "Open /proc/sys/kernel/zeph_mac_address1 failed"));
  EXPECT_FALSE(Exists(root.Path("/s.pem")));
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
