#include "module/mkcert/verify.h"

#include <gtest/gtest.h>

#include "module/mkcert/cert_set.h"
#include "module/mkcert/mkcert_test_util.h"

namespace ZEPH {
namespace test {
namespace {

constexpr char kBom[] = "\xEF\xBB\xBF";

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

TEST_F(VerifyTest, MatchesACertificateWithItsOwnKeyOnly) {
  EXPECT_EQ(verifyCrtAndKey(One("cert.pem"), One("privkey.pem")), 0);
  EXPECT_EQ(
      verifyCrtAndKey(One("zeph-ca-cert.pem"), One("zeph-ca-privkey.pem")), 0);
  EXPECT_EQ(verifyCrtAndKey(One("cert.pem"), Two("privkey.pem")), 1);
  EXPECT_EQ(verifyCrtAndKey(One("cert.pem"), One("zeph-ca-privkey.pem")), 1);
  EXPECT_EQ(root_.Log(), "");
}

TEST_F(VerifyTest, StripsByteOrderMarksInPlaceFirst) {
  const std::string cert = root_.Path("/bom-cert.pem");
  const std::string key = root_.Path("/bom-key.pem");
  const std::string cert_pem = ReadFile(One("cert.pem"));
  const std::string key_pem = ReadFile(One("privkey.pem"));
  WriteFile(cert, kBom + cert_pem, 0600);
  WriteFile(key, kBom + key_pem, 0600);
  EXPECT_EQ(verifyCrtAndKey(cert, key), 0);
  EXPECT_EQ(ReadFile(cert), cert_pem);
  EXPECT_EQ(ReadFile(key), key_pem);
}

TEST_F(VerifyTest, ReportsWhatCannotBeRead) {
  const std::string missing = root_.Path("/missing.pem");
  const std::string garbage = root_.Path("/garbage.pem");
  WriteFile(garbage, "-----BEGIN CERTIFICATE-----\nnot base64\n");

  EXPECT_EQ(verifyCrtAndKey(missing, One("privkey.pem")), -1);
  EXPECT_TRUE(Logged(root_, "Failed to strip utf8 BOM"));
  root_.ClearLog();
  EXPECT_EQ(verifyCrtAndKey(garbage, One("privkey.pem")), -1);
  EXPECT_TRUE(Logged(root_, "Failed to read cert from " + garbage));
  // A certificate file is no key file.
  EXPECT_EQ(verifyCrtAndKey(One("cert.pem"), One("cert.pem")), -1);
  EXPECT_TRUE(
      Logged(root_, "Failed to read private key from " + One("cert.pem")));

  // An unreadable file fails at the first step that reads it.
  const std::string locked = root_.Path("/locked.pem");
  WriteFile(locked, ReadFile(One("cert.pem")), 0000);
  if (geteuid() != 0) {
    root_.ClearLog();
    EXPECT_EQ(verifyCrtAndKey(locked, One("privkey.pem")), -1);
    EXPECT_TRUE(Logged(root_, "Failed to strip utf8 BOM"));
  }
}

TEST_F(VerifyTest, ChainCountsIssuersByName) {
  const std::string empty = root_.Path("/empty.pem");
  WriteFile(empty, "");
  const std::string both = root_.Path("/both.pem");
  WriteFile(both,
            ReadFile(One("cert.pem")) + ReadFile(One("zeph-ca-cert.pem")));
  const std::string mixed = root_.Path("/mixed.pem");
  WriteFile(mixed,
            ReadFile(One("cert.pem")) + ReadFile(Two("zeph-ca-cert.pem")));

  // Leaf and its authority, in either file, in either order.
  EXPECT_EQ(
      verifyCrtChain(One("cert.pem").c_str(), One("zeph-ca-cert.pem").c_str()),
      0);
  EXPECT_EQ(
      verifyCrtChain(One("zeph-ca-cert.pem").c_str(), One("cert.pem").c_str()),
      0);
  EXPECT_EQ(verifyCrtChain(both.c_str(), empty.c_str()), 0);
  // One certificate alone.
  EXPECT_EQ(verifyCrtChain(One("cert.pem").c_str(), empty.c_str()), 0);
  // Unrelated authority, alone or beside the leaf.
  EXPECT_EQ(
      verifyCrtChain(One("cert.pem").c_str(), Two("zeph-ca-cert.pem").c_str()),
      1);
  EXPECT_EQ(verifyCrtChain(mixed.c_str(), empty.c_str()), 1);
  // A third, unrelated certificate breaks a chain of two.
  EXPECT_EQ(verifyCrtChain(both.c_str(), Two("cert.pem").c_str()), 1);
  // Nothing at all.
  EXPECT_EQ(verifyCrtChain(empty.c_str(), empty.c_str()), 1);
  EXPECT_EQ(root_.Log(), "");
}

TEST_F(VerifyTest, ChainRefusesMissingAndUnreadableFiles) {
  const std::string cert = One("cert.pem");
  const std::string missing = root_.Path("/missing.pem");
  EXPECT_EQ(verifyCrtChain(nullptr, cert.c_str()), -1);
  EXPECT_EQ(verifyCrtChain("", cert.c_str()), -1);
  EXPECT_EQ(verifyCrtChain(cert.c_str(), nullptr), -1);
  EXPECT_EQ(verifyCrtChain(cert.c_str(), ""), -1);
  EXPECT_EQ(verifyCrtChain(missing.c_str(), cert.c_str()), -1);
  EXPECT_EQ(verifyCrtChain(cert.c_str(), missing.c_str()), -1);
  EXPECT_EQ(LogCount(root_, "sanity check failed"), 6);

  if (geteuid() != 0) {
    const std::string locked = root_.Path("/locked.pem");
    WriteFile(locked, ReadFile(cert), 0000);
    root_.ClearLog();
    EXPECT_EQ(verifyCrtChain(cert.c_str(), locked.c_str()), -1);
    EXPECT_TRUE(LoggedWithLibError(root_, "Open " + locked + " failed"));
    EXPECT_TRUE(LoggedWithLibError(root_, "Get X509 certificate failed."));
  }
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
