// The mkcert tool end to end: provisioned into a private root by
// "zephcert init", run as the module runs it, results read back with the
// OpenSSL library.
#include <gtest/gtest.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>
#include <arpa/inet.h>
#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>

#include "module/common/paths.h"
#include "module/common/ssl_ptr.h"
#include "module/mkcert/cert_set.h"
#include "test_support.h"

namespace ZEPH {
namespace test {
namespace {

const std::vector<std::string> kSetFiles = {
    "cert.pem", "fullchain.pem", "privkey.pem", "zeph-ca-cert.pem",
    "zeph-ca-privkey.pem"};

std::vector<std::string> DirEntries(const std::string& dir) {
  std::vector<std::string> names;
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* e = readdir(d)) {
      const std::string n = e->d_name;
      if (n != "." && n != "..") names.push_back(n);
    }
    closedir(d);
  }
  std::sort(names.begin(), names.end());
  return names;
}

ssl::X509Ptr LoadCert(const std::string& path) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  return ssl::X509Ptr(
      bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr);
}

// "C=..,ST=..,L=..,O=..,OU=..,CN=..,emailAddress=.." in RFC 2253 form.
std::string NameText(X509_NAME* name) {
  ssl::BioPtr mem(BIO_new(BIO_s_mem()));
  X509_NAME_print_ex(mem.get(), name, 0, XN_FLAG_RFC2253);
  char* data = nullptr;
  long n = BIO_get_mem_data(mem.get(), &data);
  return std::string(data, static_cast<size_t>(n));
}

std::vector<std::string> AltNames(X509* cert) {
  std::vector<std::string> out;
  ssl::GeneralNamesPtr names(static_cast<GENERAL_NAMES*>(
      X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr)));
  for (int i = 0; names && i < sk_GENERAL_NAME_num(names.get()); ++i) {
    const GENERAL_NAME* gn = sk_GENERAL_NAME_value(names.get(), i);
    if (gn->type == GEN_DNS) {
      out.push_back(
          "DNS:" +
          std::string(reinterpret_cast<const char*>(
                          ASN1_STRING_get0_data(gn->d.dNSName)),
                      static_cast<size_t>(ASN1_STRING_length(gn->d.dNSName))));
    } else if (gn->type == GEN_IPADD) {
      char text[INET6_ADDRSTRLEN] = "?";
      inet_ntop(ASN1_STRING_length(gn->d.iPAddress) == 4 ? AF_INET : AF_INET6,
                ASN1_STRING_get0_data(gn->d.iPAddress), text, sizeof(text));
      out.push_back(std::string("IP:") + text);
    } else {
      out.push_back("type:" + std::to_string(gn->type));
    }
  }
  return out;
}

int KeyBits(X509* cert) { return EVP_PKEY_bits(X509_get0_pubkey(cert)); }

// A root provisioned by zephcert, with the tool in it.
class MkcertTool : public ::testing::Test {
 protected:
  void SetUp() override {
    CommandResult r = test::Run({BinDir() + "/zephcert", "--root", root_.dir(), "init"});
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
  EXPECT_EQ(KeyBits(cert.get()), 2048);
  EXPECT_EQ(ReadFile(dir + "/cert.pem"), ReadFile(dir + "/fullchain.pem"));
}

TEST_F(MkcertTool, RecreatesAnArchivedCertificateKeepingItsIdentity) {
  // An existing certificate "Xy12Zq" with its own subjects and aliases.
  const std::string source = archive_ + "/Xy12Zq";
  MakeDirs(source);
  _tag_CSR_ARGUMENT ca_subject;
  ca_subject.country = "DE";
  ca_subject.state = "Bavaria";
  ca_subject.organization = "Example GmbH";
  ca_subject.common_name = "Example Root";
  _tag_CSR_ARGUMENT subject;
  subject.country = "DE";
  subject.city = "Munich";
  subject.organization = "Example GmbH";
  subject.department = "Storage";
  subject.common_name = "nas.example.de";
  subject.email = "it@example.de";
  ASSERT_EQ(genCASet(&ca_subject, 1024, source), 0);
  ASSERT_EQ(genCertSet(&subject, 1024, "nas.example.de;10.0.0.1;2001:db8::7;nas",
                       source),
            0);
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
  EXPECT_EQ(KeyBits(cert.get()), 1024);
  EXPECT_EQ(KeyBits(ca.get()), 1024);
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
  _tag_CSR_ARGUMENT subject;
  subject.common_name = "imported.example";
  _tag_CSR_ARGUMENT ca_subject;
  ca_subject.common_name = "Foreign CA";
  ASSERT_EQ(genCASet(&ca_subject, 1024, scratch), 0);
  ASSERT_EQ(genCertSet(&subject, 1024, "imported.example", scratch), 0);
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
  EXPECT_EQ(AltNames(cert.get()), std::vector<std::string>{"DNS:imported.example"});
  EXPECT_EQ(KeyBits(cert.get()), 1024);
  EXPECT_EQ(KeyBits(ca.get()), 1024);
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
  CommandResult r = test::Run({tree + "/zephcert", "--root", root_.dir(), "init"});
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
