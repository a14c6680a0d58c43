#include "module/archive/expiry.h"

#include <gtest/gtest.h>
#include <openssl/err.h>
#include <openssl/pem.h>

#include <string>

#include "module/archive/archive_testing.h"
#include "module/archive/ssl_errors.h"
#include "module/common/ssl_ptr.h"
#include "test_support.h"

namespace {

using ZEPH::test::HasUtilsLine;
using ZEPH::test::ReadFile;
using ZEPH::test::WriteFile;

constexpr long kDay = 86400;

TEST(ExpiryTest, ExpiresWithinDaysByTheFirstCertificate) {
  ZEPH::test::TempRoot root;
  const std::string dir = root.Path("/certs");
  ASSERT_TRUE(ZEPH::test::MakeCertSet(dir, "expiry"));  // 365 days
  const std::string valid = dir + "/cert.pem";
  const std::string expired = dir + "/expired.pem";
  ASSERT_TRUE(ZEPH::test::WriteCertWithValidity(dir + "/privkey.pem", expired,
                                                -10 * kDay, -1 * kDay));
  WriteFile(dir + "/valid-first.pem", ReadFile(valid) + ReadFile(expired));
  WriteFile(dir + "/expired-first.pem", ReadFile(expired) + ReadFile(valid));

  EXPECT_TRUE(isPemExpire(expired, 0));
  EXPECT_TRUE(isPemExpire(dir + "/expired-first.pem", 0));
  EXPECT_TRUE(isPemExpire(valid, 400));
  EXPECT_EQ(root.Log(), "");
  EXPECT_FALSE(isPemExpire(valid, 300));
  EXPECT_FALSE(isPemExpire(dir + "/valid-first.pem", 0));
  EXPECT_TRUE(HasUtilsLine(root.Log(), valid + " will not expired at "));

  // Unreadable files never expire.
  EXPECT_FALSE(isPemExpire(dir + "/missing.pem", 0));
  EXPECT_TRUE(HasUtilsLine(
      root.Log(),
      "Failed to open " + dir + "/missing.pem (No such file or directory)"));
  EXPECT_FALSE(isPemExpire(dir + "/privkey.pem", 10000));
  EXPECT_TRUE(
      HasUtilsLine(root.Log(), "Failed to read " + dir + "/privkey.pem ("));
  EXPECT_EQ(ERR_peek_error(), 0u);
}

TEST(ExpiryTest, RenewableExactlyWhenRenewJsonExists) {
  ZEPH::test::TempRoot root;
  const std::string dir =
      root.Path("/usr/zeph/etc/certificate/_archive/Le1234");
  ZEPH::test::MakeDirs(dir);
  EXPECT_FALSE(CertificateRenewable("Le1234"));
  WriteFile(dir + "/renew.json", "");  // the content does not matter
  EXPECT_TRUE(CertificateRenewable("Le1234"));
}

TEST(SslErrorsTest, LogsTheMessageAndEmptiesTheQueue) {
  ZEPH::test::TempRoot root;
  const std::string garbage = "-----BEGIN CERTIFICATE-----\n!!!\n";
  ZEPH::ssl::BioPtr bio(
      BIO_new_mem_buf(garbage.data(), static_cast<int>(garbage.size())));
  ASSERT_EQ(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr), nullptr);
  ASSERT_NE(ERR_peek_error(), 0u);
  log_ssl_errors("PEM to DER failed.");
  EXPECT_TRUE(HasUtilsLine(root.Log(), "PEM to DER failed. []"));
  EXPECT_EQ(ERR_peek_error(), 0u);
}

}  // namespace
