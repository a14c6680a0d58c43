// The mkcert tool provisioned by "zephcert init" and run as the module runs it.
#include <gtest/gtest.h>
#include <openssl/pem.h>

#include <algorithm>

#include "module/common/paths.h"
#include "module/mkcert/cert_set.h"
#include "module/mkcert/mkcert_test_util.h"

namespace ZEPH {
namespace test {
namespace {

const char kDefaultCa[] = "CN=Arvelon Inc. CA,O=Arvelon Inc.,L=Taipel,C=TW";

class MkcertTool : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(Init(BinDir()), 0); }
  int Init(const std::string& bin) {
    return test::Run({bin + "/zephcert", "--root", root_.dir(), "init"}).status;
  }
  CommandResult Mkcert(const std::vector<std::string>& args) {
    std::vector<std::string> argv = {tool_};
    argv.insert(argv.end(), args.begin(), args.end());
    return test::Run(argv);
  }
  // `dir` holds `subject` (RFC 2253, most specific first) with `alt_names` and `bits`, by `ca`.
  void ExpectSet(const std::string& dir, const std::string& subject,
                 const std::vector<std::string>& alt_names, int bits, const std::string& ca) {
    EXPECT_EQ(DirEntries(dir), (std::vector<std::string>{"cert.pem", "fullchain.pem",
                                                         "privkey.pem", "zeph-ca-cert.pem",
                                                         "zeph-ca-privkey.pem"}));
    ssl::X509Ptr cert = LoadCert(dir + "/cert.pem");
    ASSERT_TRUE(cert);
    EXPECT_EQ(test::Run({"/usr/bin/openssl", "x509", "-noout", "-subject", "-issuer", "-nameopt",
                         "RFC2253", "-in", dir + "/cert.pem"}).out,
              "subject=" + subject + "\nissuer=" + ca + "\n");
    EXPECT_TRUE(IssuedBy(ReadFile(dir + "/cert.pem"), ReadFile(dir + "/zeph-ca-cert.pem")));
    EXPECT_EQ(AltNames(cert.get()), alt_names);
    EXPECT_EQ(CertKeyBits(cert.get()), bits);
    EXPECT_EQ(ReadFile(dir + "/cert.pem"), ReadFile(dir + "/fullchain.pem"));
  }

  TempRoot root_;
  const std::string tool_ = root_.Path(cert::kMkcertTool);
  const std::string archive_ = root_.Path(cert::kArchiveDir);
};

// Recreating keeps the archived identity with new keys (an imported one gets the default
// authority); bad arguments fail with one line and write nothing; unknown names get the default
// set. init installs the built tool, refreshes an older build's copy, keeps an administrator's.
TEST_F(MkcertTool, RecreatesProvisionsAndMakesTheDefaultSet) {
  MakeDirs(archive_ + "/Xy12Zq");
  MakeSet(archive_ + "/Xy12Zq", Subject("DE", "Bavaria", "", "Example GmbH", "", "Example CA", ""),
          Subject("DE", "", "Munich", "Example GmbH", "Storage", "nas.example.de", "it@example.de"),
          "nas.example.de;10.0.0.1;2001:db8::7;nas");
  MakeDirs(root_.Path("/scratch"));
  MakeSet(root_.Path("/scratch"), Subject("", "", "", "", "", "Foreign CA", ""),
          Subject("", "", "", "", "", "imported.example", ""), "imported.example");
  MakeDirs(archive_ + "/imp0rt");
  WriteFile(archive_ + "/imp0rt/cert.pem", ReadFile(root_.Path("/scratch/cert.pem")), 0400);
  MakeDirs(archive_ + "/Xy12Zq.temp");
  MakeDirs(archive_ + "/imp0rt.temp");
  WriteFile(archive_ + "/imp0rt.temp/privkey.pem", "stale", 0400);
  WriteFile(archive_ + "/imp0rt.temp/notes.txt", "kept");
  const std::string old_cert = ReadFile(archive_ + "/Xy12Zq/cert.pem");
  for (const char* name : {"Xy12Zq.temp", "imp0rt.temp"}) {
    CommandResult r = Mkcert({name});
    ASSERT_EQ(r.status, 0) << r.err << root_.Log();
    EXPECT_EQ(r.err, "");
  }
  ExpectSet(archive_ + "/Xy12Zq.temp",
            "emailAddress=it@example.de,CN=nas.example.de,OU=Storage,O=Example GmbH,L=Munich,C=DE",
            {"DNS:nas.example.de", "IP:10.0.0.1", "IP:2001:db8::7", "DNS:nas"}, 1024,
            "CN=Example CA,O=Example GmbH,ST=Bavaria,C=DE");
  EXPECT_FALSE(CertificateFitsKey(old_cert, ReadFile(archive_ + "/Xy12Zq.temp/privkey.pem")));
  EXPECT_EQ(ReadFile(archive_ + "/Xy12Zq/cert.pem"), old_cert);
  EXPECT_EQ(ReadFile(archive_ + "/imp0rt.temp/notes.txt"), "kept");
  unlink((archive_ + "/imp0rt.temp/notes.txt").c_str());
  ExpectSet(archive_ + "/imp0rt.temp", "CN=imported.example", {"DNS:imported.example"}, 1024,
            kDefaultCa);
  WriteFile(archive_ + "/plainfile", "x");
  MakeDirs(archive_ + "/broken");
  WriteFile(archive_ + "/broken/cert.pem", "not a certificate");
  const std::vector<std::string> entries = DirEntries(archive_);
  const std::pair<std::vector<std::string>, int> kFailures[] = {
      {{}, 2}, {{"a", "b"}, 2}, {{""}, 2}, {{"."}, 2}, {{".."}, 2}, {{"a/b"}, 2},
      {{"plainfile"}, 1}, {{"broken.temp"}, 1}};
  for (const auto& c : kFailures) {
    CommandResult r = Mkcert(c.first);
    SCOPED_TRACE(c.first.empty() ? "(none)" : c.first[0]);
    EXPECT_EQ(r.status, c.second);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
    EXPECT_EQ(r.err.rfind("mkcert: ", 0), 0u) << r.err;
  }
  EXPECT_EQ(DirEntries(archive_), entries);
  EXPECT_EQ(ReadFile(archive_ + "/plainfile"), "x");
  for (const char* name : {"abc123", "nosuch.temp"}) {
    SCOPED_TRACE(name);
    CommandResult r = Mkcert({name});
    ASSERT_EQ(r.status, 0) << r.err << root_.Log();
    EXPECT_EQ(r.out + r.err, "");
    EXPECT_EQ(ModeOf(archive_ + "/" + name), 0700u);
    ExpectSet(archive_ + "/" + name, "CN=arvelon,O=Arvelon Inc.,L=Taipel,C=TW", {"DNS:arvelon"},
              2048, kDefaultCa);
  }
  test::Run({"/bin/rm", "-rf", archive_});
  CommandResult r = Mkcert({"abc123"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "mkcert: no certificate archive at " + archive_ + "\n");
  EXPECT_FALSE(Exists(archive_));
  const std::string built = ReadFile(BinDir() + "/mkcert"), own = "#!/bin/sh\nexit 0\n";
  EXPECT_EQ(ReadFile(tool_), built);
  EXPECT_EQ(ModeOf(tool_), 0755u);
  MakeDirs(root_.Path("/oldbin"));
  for (const char* file : {"zephcert", "ZEPH.Core.Certificate.so"})
    test::Run({"/bin/cp", BinDir() + "/" + file, root_.Path("/oldbin/") + file});
  WriteFile(root_.Path("/oldbin/mkcert"), built + "old", 0755);
  unlink(tool_.c_str());
  ASSERT_EQ(Init(root_.Path("/oldbin")), 0);
  ASSERT_EQ(ReadFile(tool_), built + "old");
  ASSERT_EQ(Init(BinDir()), 0);
  EXPECT_EQ(ReadFile(tool_), built);
  WriteFile(tool_, own, 0755);
  ASSERT_EQ(Init(BinDir()), 0);
  EXPECT_EQ(ReadFile(tool_), own);
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
