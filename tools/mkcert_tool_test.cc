// The mkcert tool end to end: provisioned into a private root by
// "zephcert init", run as the module runs it, results read back with the
// OpenSSL library.
#include <gtest/gtest.h>
#include <openssl/pem.h>

#include <algorithm>

#include "module/common/paths.h"
#include "module/mkcert/cert_set.h"
#include "module/mkcert/mkcert_test_util.h"

namespace ZEPH {
namespace test {
namespace {

const std::vector<std::string> kSetFiles = {"cert.pem", "fullchain.pem",
                                            "privkey.pem", "zeph-ca-cert.pem",
                                            "zeph-ca-privkey.pem"};

// The name in RFC 2253 form, most specific attribute first: "CN=..,O=..".
std::string NameText(X509_NAME* name) {
  ssl::BioPtr mem(BIO_new(BIO_s_mem()));
  X509_NAME_print_ex(mem.get(), name, 0, XN_FLAG_RFC2253);
  char* data = nullptr;
  long n = BIO_get_mem_data(mem.get(), &data);
  return std::string(data, static_cast<size_t>(n));
}

// A root provisioned by zephcert, with the tool in it.
class MkcertTool : public ::testing::Test {
 protected:
  void SetUp() override {
    CommandResult r =
        test::Run({BinDir() + "/zephcert", "--root", root_.dir(), "init"});
    ASSERT_EQ(r.status, 0) << r.err;
    tool_ = root_.Path(cert::kMkcertTool);
    archive_ = root_.Path(cert::kArchiveDir);
  }
  CommandResult Mkcert(const std::vector<std::string>& args) {
    std::vector<std::string> argv = {tool_};
    argv.insert(argv.end(), args.begin(), args.end());
    return test::Run(argv);
  }

  TempRoot root_;
  std::string tool_;
  std::string archive_;
};

TEST_F(MkcertTool, InitInstallsTheBuiltTool) {
  EXPECT_EQ(ReadFile(tool_), ReadFile(BinDir() + "/mkcert"));
  EXPECT_EQ(ModeOf(tool_), 0755u);
}

TEST_F(MkcertTool, MakesTheDefaultSetSilently) {
  CommandResult r = Mkcert({"abc123"});
  ASSERT_EQ(r.status, 0) << r.err << root_.Log();
  EXPECT_EQ(r.out, "");
  EXPECT_EQ(r.err, "");
  const std::string dir = archive_ + "/abc123";
  EXPECT_EQ(DirEntries(dir), kSetFiles);
  EXPECT_EQ(ModeOf(dir), 0700u);
  ssl::X509Ptr cert = LoadCert(dir + "/cert.pem");
  ssl::X509Ptr ca = LoadCert(dir + "/zeph-ca-cert.pem");
  ASSERT_TRUE(cert && ca);
  EXPECT_EQ(NameText(X509_get_subject_name(cert.get())),
            "CN=arvelon,O=Arvelon Inc.,L=Taipel,C=TW");
  EXPECT_EQ(NameText(X509_get_subject_name(ca.get())),
            "CN=Arvelon Inc. CA,O=Arvelon Inc.,L=Taipel,C=TW");
  EXPECT_EQ(AltNames(cert.get()), std::vector<std::string>{"DNS:arvelon"});
  EXPECT_EQ(CertKeyBits(cert.get()), 2048);
  EXPECT_EQ(ReadFile(dir + "/cert.pem"), ReadFile(dir + "/fullchain.pem"));
}

TEST_F(MkcertTool, RecreatesAnArchivedCertificateKeepingItsIdentity) {
  // An existing certificate "Xy12Zq" with its own subjects and aliases.
  const std::string source = archive_ + "/Xy12Zq";
  MakeDirs(source);
  MakeSet(source,
          Subject("DE", "Bavaria", "", "Example GmbH", "", "Example Root", ""),
          Subject("DE", "", "Munich", "Example GmbH", "Storage",
                  "nas.example.de", "it@example.de"),
          "nas.example.de;10.0.0.1;2001:db8::7;nas");
  const std::string old_cert = ReadFile(source + "/cert.pem");

  // What the recreate method does: an empty working directory, then the tool.
  MakeDirs(archive_ + "/Xy12Zq.temp");
  CommandResult r = Mkcert({"Xy12Zq.temp"});
  ASSERT_EQ(r.status, 0) << r.err << root_.Log();
  EXPECT_EQ(r.err, "");
  const std::string dir = archive_ + "/Xy12Zq.temp";
  EXPECT_EQ(DirEntries(dir), kSetFiles);

  ssl::X509Ptr before = LoadCert(source + "/cert.pem");
  ssl::X509Ptr cert = LoadCert(dir + "/cert.pem");
  ssl::X509Ptr ca = LoadCert(dir + "/zeph-ca-cert.pem");
  ASSERT_TRUE(before && cert && ca);
  EXPECT_EQ(NameText(X509_get_subject_name(cert.get())),
            "emailAddress=it@example.de,CN=nas.example.de,OU=Storage,"
            "O=Example GmbH,L=Munich,C=DE");
  EXPECT_EQ(NameText(X509_get_subject_name(ca.get())),
            "CN=Example Root,O=Example GmbH,ST=Bavaria,C=DE");
  EXPECT_EQ(NameText(X509_get_issuer_name(cert.get())),
            NameText(X509_get_subject_name(ca.get())));
  EXPECT_EQ(AltNames(cert.get()),
            (std::vector<std::string>{"DNS:nas.example.de", "IP:10.0.0.1",
                                      "IP:2001:db8::7", "DNS:nas"}));
  EXPECT_EQ(CertKeyBits(cert.get()), 1024);
  EXPECT_EQ(CertKeyBits(ca.get()), 1024);
  // New key material; the original is untouched.
  EXPECT_NE(EVP_PKEY_cmp(X509_get0_pubkey(cert.get()),
                         X509_get0_pubkey(before.get())),
            1);
  EXPECT_EQ(ReadFile(source + "/cert.pem"), old_cert);
}

TEST_F(MkcertTool, RecreatingACertificateWithoutAuthorityUsesTheDefaultOne) {
  // An imported certificate: no authority files beside it, and a .temp
  // directory still holding an earlier attempt's read-only files.
  const std::string source = archive_ + "/imp0rt";
  const std::string scratch = archive_ + "/scratch";
  MakeDirs(scratch);
  MakeSet(scratch, Subject("", "", "", "", "", "Foreign CA", ""),
          Subject("", "", "", "", "", "imported.example", ""),
          "imported.example");
  MakeDirs(source);
  WriteFile(source + "/cert.pem", ReadFile(scratch + "/cert.pem"), 0400);
  const std::string dir = archive_ + "/imp0rt.temp";
  MakeDirs(dir);
  WriteFile(dir + "/privkey.pem", "stale", 0400);
  WriteFile(dir + "/notes.txt", "kept");

  CommandResult r = Mkcert({"imp0rt.temp"});
  ASSERT_EQ(r.status, 0) << r.err << root_.Log();
  ssl::X509Ptr cert = LoadCert(dir + "/cert.pem");
  ssl::X509Ptr ca = LoadCert(dir + "/zeph-ca-cert.pem");
  ASSERT_TRUE(cert && ca);
  EXPECT_EQ(NameText(X509_get_subject_name(cert.get())), "CN=imported.example");
  EXPECT_EQ(NameText(X509_get_subject_name(ca.get())),
            "CN=Arvelon Inc. CA,O=Arvelon Inc.,L=Taipel,C=TW");
  EXPECT_EQ(AltNames(cert.get()),
            std::vector<std::string>{"DNS:imported.example"});
  EXPECT_EQ(CertKeyBits(cert.get()), 1024);
  EXPECT_EQ(CertKeyBits(ca.get()), 1024);
  EXPECT_EQ(ReadFile(dir + "/notes.txt"), "kept");
}

TEST_F(MkcertTool, ATempNameOfNoCertificateGetsTheDefaultSet) {
  CommandResult r = Mkcert({"nosuch.temp"});
  ASSERT_EQ(r.status, 0) << r.err;
  ssl::X509Ptr cert = LoadCert(archive_ + "/nosuch.temp/cert.pem");
  ASSERT_TRUE(cert);
  EXPECT_EQ(NameText(X509_get_subject_name(cert.get())),
            "CN=arvelon,O=Arvelon Inc.,L=Taipel,C=TW");
}

TEST_F(MkcertTool, FailsWithOneLineAndWritesNothingElsewhere) {
  struct Case {
    std::vector<std::string> args;
    int status;
  };
  WriteFile(archive_ + "/plainfile", "x");
  MakeDirs(archive_ + "/broken");
  WriteFile(archive_ + "/broken/cert.pem", "not a certificate");
  const std::vector<std::string> before = DirEntries(archive_);
  for (const Case& c : {Case{{}, 2}, Case{{"a", "b"}, 2}, Case{{""}, 2},
                        Case{{"."}, 2}, Case{{".."}, 2}, Case{{"a/b"}, 2},
                        Case{{"plainfile"}, 1}, Case{{"broken.temp"}, 1}}) {
    CommandResult r = Mkcert(c.args);
    const std::string what = c.args.empty() ? "(none)" : c.args[0];
    EXPECT_EQ(r.status, c.status) << what;
    EXPECT_EQ(r.out, "") << what;
    EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
    EXPECT_EQ(r.err.rfind("mkcert: ", 0), 0u) << r.err;
  }
  EXPECT_EQ(DirEntries(archive_), before);
  EXPECT_EQ(ReadFile(archive_ + "/plainfile"), "x");

  // Without an archive there is nothing to write into.
  test::Run({"/bin/rm", "-rf", archive_});
  CommandResult r = Mkcert({"abc123"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "mkcert: no certificate archive at " + archive_ + "\n");
  EXPECT_FALSE(Exists(archive_));
}

TEST_F(MkcertTool, InitRefreshesItsOwnCopyButNotSomebodyElses) {
  // init records what it installed.
  const std::string marker = root_.Path("/usr/zeph/bin/.mkcert.provisioned");
  ASSERT_TRUE(Exists(marker));

  // A copy that init installed from an older build (here: a copied
  // executable tree whose tool differs by a few bytes) ...
  const std::string tree = root_.Path("/oldbin");
  MakeDirs(tree);
  for (const char* file : {"zephcert", "ZEPH.Core.Certificate.so"}) {
    test::Run({"/bin/cp", BinDir() + "/" + file, tree + "/" + file});
  }
  WriteFile(tree + "/mkcert", ReadFile(BinDir() + "/mkcert") + "old", 0755);
  unlink(tool_.c_str());
  CommandResult r =
      test::Run({tree + "/zephcert", "--root", root_.dir(), "init"});
  ASSERT_EQ(r.status, 0) << r.err;
  ASSERT_EQ(ReadFile(tool_), ReadFile(BinDir() + "/mkcert") + "old");
  // ... is refreshed by the current build's init.
  r = test::Run({BinDir() + "/zephcert", "--root", root_.dir(), "init"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(ReadFile(tool_), ReadFile(BinDir() + "/mkcert"));

  // An administrator's own tool stays.
  WriteFile(tool_, "#!/bin/sh\nexit 0\n", 0755);
  r = test::Run({BinDir() + "/zephcert", "--root", root_.dir(), "init"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(ReadFile(tool_), "#!/bin/sh\nexit 0\n");
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
