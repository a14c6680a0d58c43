#include "server/served_certificate.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "test_support.h"
#include "tls_test_support.h"

namespace {

using ZEPH::test::MakeCertSet;
using ZEPH::test::PemFingerprint;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::webapid::ServedCertificate;

// What `openssl x509 -fingerprint -sha256` says, without the label.
std::string ToolFingerprint(const std::string& pem) {
  std::string out =
      ZEPH::test::Run({"/usr/bin/openssl", "x509", "-in", pem, "-noout", "-fingerprint", "-sha256"}).out;
  out = out.substr(out.find('=') + 1);
  while (!out.empty() && out.back() == '\n') out.pop_back();
  return out;
}

class ServedCertificateTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = root_.Path("/service");
    ASSERT_TRUE(MakeCertSet(dir_, "first.example"));
    ASSERT_TRUE(MakeCertSet(root_.Path("/second"), "second.example"));
  }
  // Replaces the service directory the way a deployment does: a new
  // directory renamed onto the old one.
  void Deploy(const std::string& from) {
    const std::string temp = "'" + dir_ + ".temp'";
    ASSERT_EQ(ZEPH::test::Run({"/bin/sh", "-c", "rm -rf " + temp + " && cp -r '" + from + "' " + temp +
                                                    " && rm -rf '" + dir_ + "' && mv " + temp + " '" + dir_ + "'"})
                  .status,
              0);
  }
  ServedCertificate Make() {
    return ServedCertificate(dir_, root_.Path("/copy"), [this](const std::string& l) { log_.push_back(l); });
  }
  std::string CopiedChain() { return ReadFile(root_.Path("/copy/fullchain.pem")); }

  TempRoot root_;
  std::string dir_;
  std::vector<std::string> log_;
};

TEST_F(ServedCertificateTest, LoadCopiesTheCheckedPairPrivately) {
  ServedCertificate served = Make();
  std::string error;
  ASSERT_TRUE(served.Load(&error)) << error;
  EXPECT_EQ(served.Fingerprint(), ToolFingerprint(dir_ + "/cert.pem"));
  EXPECT_NE(served.NotAfter().find("GMT"), std::string::npos);
  EXPECT_EQ(CopiedChain(), ReadFile(dir_ + "/fullchain.pem"));
  EXPECT_EQ(ReadFile(served.key_path()), ReadFile(dir_ + "/privkey.pem"));
  EXPECT_EQ(ZEPH::test::ModeOf(root_.Path("/copy")), 0700u);
  EXPECT_EQ(ZEPH::test::ModeOf(served.key_path()), 0600u);
  // Nothing changed: nothing to reload, also when asked to look.
  EXPECT_FALSE(served.Refresh(false));
  EXPECT_FALSE(served.Refresh(true));
}

TEST_F(ServedCertificateTest, APairTlsWouldRefuseNeverReplacesTheCopy) {
  ServedCertificate served = Make();
  std::string error;
  ASSERT_TRUE(served.Load(&error)) << error;
  const std::string first_chain = CopiedChain();
  const std::string first = served.Fingerprint();
  const std::string weak = root_.Path("/weak");
  ZEPH::test::MakeDirs(weak);
  ASSERT_EQ(ZEPH::test::Run({"/usr/bin/openssl", "req", "-x509", "-newkey", "rsa:1024", "-nodes", "-keyout",
                             weak + "/privkey.pem", "-out", weak + "/fullchain.pem", "-days", "30", "-subj",
                             "/CN=weak.example"})
                .status,
            0);
  struct Case {
    const char* what;
    std::string shell;   // breaks the service's pair
    const char* logged;  // in the log line saying why
  };
  const Case cases[] = {
      {"a new certificate beside the old key", "cp " + root_.Path("/second/fullchain.pem") + " " + dir_,
       "does not belong"},
      {"the directory gone", "rm -rf " + dir_, "no certificate files"},
      {"garbage",
       "mkdir -p " + dir_ + " && echo junk > " + dir_ + "/fullchain.pem && echo junk > " + dir_ + "/privkey.pem",
       "no certificate in"},
      {"a key TLS refuses", "rm -rf " + dir_ + " && cp -r " + weak + " " + dir_, "refused by TLS"},
  };
  for (const Case& c : cases) {
    ASSERT_EQ(ZEPH::test::Run({"/bin/sh", "-c", c.shell}).status, 0) << c.what;
    EXPECT_FALSE(served.Refresh(true)) << c.what;
    EXPECT_EQ(served.Fingerprint(), first) << c.what;
    EXPECT_EQ(CopiedChain(), first_chain) << c.what;
    ASSERT_FALSE(log_.empty()) << c.what;
    EXPECT_NE(log_.back().find(c.logged), std::string::npos) << log_.back();
    EXPECT_NE(log_.back().find("keeping the certificate in use"), std::string::npos);
  }
  // Then a complete pair: taken up by a look without being asked.
  Deploy(root_.Path("/second"));
  EXPECT_TRUE(served.Refresh(false));
  EXPECT_EQ(served.Fingerprint(), PemFingerprint(root_.Path("/second/cert.pem")));
  EXPECT_EQ(CopiedChain(), ReadFile(root_.Path("/second/fullchain.pem")));
  EXPECT_NE(log_.back().find(served.Fingerprint()), std::string::npos);
}

TEST_F(ServedCertificateTest, LoadSaysWhyThereIsNoPair) {
  std::string error;
  ServedCertificate missing(root_.Path("/nowhere"), root_.Path("/copy"), nullptr);
  EXPECT_FALSE(missing.Load(&error));
  EXPECT_NE(error.find(root_.Path("/nowhere")), std::string::npos) << error;
  EXPECT_TRUE(missing.Fingerprint().empty());

  ASSERT_EQ(ZEPH::test::Run({"/bin/cp", root_.Path("/second/privkey.pem"), dir_ + "/privkey.pem"}).status, 0);
  ServedCertificate mismatched = Make();
  EXPECT_FALSE(mismatched.Load(&error));
  EXPECT_NE(error.find("does not belong"), std::string::npos) << error;
  EXPECT_FALSE(ZEPH::test::Exists(mismatched.chain_path()));
}

}  // namespace
