#include "module/archive/checksum.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

#include "module/archive/archive_testing.h"
#include "test_support.h"

namespace {

using ZEPH::test::HasUtilsLine;
using ZEPH::test::InfoEntry;
using ZEPH::test::JsonArray;
using ZEPH::test::MakeArchiveCert;
using ZEPH::test::ReadFile;
using ZEPH::test::ServiceObject;
using ZEPH::test::WriteFile;

class ChecksumTest : public ::testing::Test {
 protected:
  std::string CertPem(const std::string& id) const {
    return MakeArchivePath(id) + "/cert.pem";
  }
  std::string MakeArchivePath(const std::string& id) const {
    return root_.Path("/usr/zeph/etc/certificate/_archive/" + id);
  }
  bool Logged(const std::string& message) const {
    return HasUtilsLine(root_.Log(), message);
  }
  ZEPH::test::TempRoot root_;
};

TEST_F(ChecksumTest, EveryBoundServiceGetsTheFingerprintOfItsCertificate) {
  for (const char* id : {"AAAAAA", "BBBBBB", "CCCCCC"}) MakeArchiveCert(id);
  // Only the first certificate of a chain counts.
  const std::string c = ZEPH::test::OpensslFingerprint(CertPem("CCCCCC"));
  WriteFile(CertPem("CCCCCC"),
            ReadFile(CertPem("CCCCCC")) + ReadFile(CertPem("AAAAAA")));
  Json::Value info(Json::objectValue);
  info["AAAAAA"] = InfoEntry();
  info["CCCCCC"] = InfoEntry(JsonArray({ServiceObject("zeta", "last")}));
  info["BBBBBB"] = InfoEntry(JsonArray(
      {ServiceObject("system", "default"), ServiceObject("pkg", "web", true)}));
  ZEPH::test::WriteInfo(info);

  Json::Value list;  // a null value becomes the array
  ASSERT_TRUE(GenCrtChecksum(list));
  const std::string b = ZEPH::test::OpensslFingerprint(CertPem("BBBBBB"));
  ASSERT_EQ(b.size(), 64u);
  // Sorted by id, then in array order; the same value for each service.
  struct Row {
    const char* service;
    const char* subscriber;
    std::string checksum;
  };
  Json::Value expected(Json::arrayValue);
  for (const Row& row : {Row{"default", "system", b}, Row{"web", "pkg", b},
                         Row{"last", "zeta", c}}) {
    Json::Value element(Json::objectValue);
    element["service"] = row.service;
    element["subscriber"] = row.subscriber;
    element["checksum"] = row.checksum;
    expected.append(element);
  }
  EXPECT_EQ(list, expected);
  EXPECT_EQ(root_.Log(), "");
}

TEST_F(ChecksumTest, FailuresStopTheListAndKeepWhatWasAppended) {
  MakeArchiveCert("AAAAAA");
  MakeArchiveCert("CCCCCC");
  Json::Value info(Json::objectValue);
  info["AAAAAA"] = InfoEntry(JsonArray({ServiceObject("system", "default")}));
  info["BBBBBB"] = Json::Value(Json::objectValue);  // no "services"
  info["CCCCCC"] = InfoEntry(JsonArray({ServiceObject("x", "y")}));
  ZEPH::test::WriteInfo(info);
  Json::Value list(Json::arrayValue);
  EXPECT_FALSE(GenCrtChecksum(list));
  EXPECT_TRUE(Logged("Incorrect format for " + ZEPH::test::InfoPath()));
  ASSERT_EQ(list.size(), 1u);
  EXPECT_EQ(list[0]["service"], "default");

  // A cert.pem that is a link to a certificate elsewhere is refused.
  info.removeMember("BBBBBB");
  ZEPH::test::WriteInfo(info);
  ZEPH::test::MakeCertSet(root_.Path("/elsewhere"), "other");
  unlink(CertPem("CCCCCC").c_str());
  symlink(root_.Path("/elsewhere/cert.pem").c_str(), CertPem("CCCCCC").c_str());
  list = Json::Value(Json::arrayValue);
  EXPECT_FALSE(GenCrtChecksum(list));
  EXPECT_TRUE(Logged("Invalid path for " + CertPem("CCCCCC") + ", " +
                     root_.Path("/elsewhere/cert.pem") + "."));
  EXPECT_EQ(list.size(), 1u);

  // Missing and unreadable certificates; the OpenSSL queue is cleared
  // before it is printed, so the bracket is empty.
  unlink(CertPem("CCCCCC").c_str());
  EXPECT_FALSE(GenCrtChecksum(list));
  EXPECT_TRUE(Logged("Realpath " + CertPem("CCCCCC") +
                     " failed. No such file or directory"));
  WriteFile(CertPem("CCCCCC"), "not a certificate\n");
  EXPECT_FALSE(GenCrtChecksum(list));
  EXPECT_TRUE(Logged("Read X509 failed. []"));

  // Missing, broken and non-object catalogues.
  for (const char* text : {"", "{\"AAAAAA\": ", "[1]"}) {
    WriteFile(ZEPH::test::InfoPath(), text);
    if (*text == '\0') unlink(ZEPH::test::InfoPath().c_str());
    root_.ClearLog();
    EXPECT_FALSE(GenCrtChecksum(list)) << text;
    EXPECT_TRUE(Logged("Open " + ZEPH::test::InfoPath() + " failed. "));
  }
}

}  // namespace
