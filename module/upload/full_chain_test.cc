// The full-chain builder on its own: byte layouts an upload can have.
#include "module/upload/full_chain.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "test_support.h"

namespace {

using ZEPH::test::Exists;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::WriteFile;

class FullChainTest : public ::testing::Test {
 protected:
  void SetUp() override { ZEPH::test::MakeDirs(dir_); }
  std::string Built() const { return ReadFile(dir_ + "/fullchain.pem"); }

  ZEPH::test::TempRoot root_;
  const std::string dir_ = root_.Path("/work.temp");
};

TEST_F(FullChainTest, LineFeedsAreAddedOnlyWhereMissing) {
  const struct {
    const char* cert;
    const char* chain;  // null: no chain.pem
    const char* full;
  } cases[] = {
      {"C1\nC2\n", nullptr, "C1\nC2\n"},
      {"C1\nC2", nullptr, "C1\nC2\n"},
      {"C1\nC2", "I1\nI2", "C1\nC2\nI1\nI2\n"},
      {"C1\n", "I1\n", "C1\nI1\n"},
      {"C1\r\nC2\r\n", "I1\r\nI2", "C1\r\nC2\r\nI1\r\nI2\n"},  // CRLF kept
      {"", "I1", "I1\n"},  // an empty file adds nothing
      {"C1", "", "C1\n"},
  };
  for (const auto& c : cases) {
    WriteFile(dir_ + "/cert.pem", c.cert);
    if (c.chain != nullptr) {
      WriteFile(dir_ + "/chain.pem", c.chain);
    } else {
      unlink((dir_ + "/chain.pem").c_str());
    }
    unlink((dir_ + "/fullchain.pem").c_str());
    ASSERT_TRUE(genChainCRT(dir_)) << c.cert;
    EXPECT_EQ(Built(), c.full) << c.cert;
    EXPECT_EQ(ModeOf(dir_ + "/fullchain.pem") & 07777, 0400u);
    EXPECT_EQ(ReadFile(dir_ + "/cert.pem"), c.cert);  // inputs untouched
  }
}

TEST_F(FullChainTest, LongLinesAndLargeFilesAreCopiedWhole) {
  std::string cert(100000, 'x');  // one line longer than any buffer
  cert += "\n";
  for (int i = 0; i < 20000; ++i) cert += "line " + std::to_string(i) + "\n";
  cert.pop_back();
  WriteFile(dir_ + "/cert.pem", cert);
  WriteFile(dir_ + "/chain.pem", "I\n");
  ASSERT_TRUE(genChainCRT(dir_));
  const std::string built = Built();
  // Compared whole; a mismatch only reports the sizes.
  EXPECT_TRUE(built == cert + "\nI\n") << built.size() << " " << cert.size();
}

TEST_F(FullChainTest, ReplacesAnEarlierResult) {
  WriteFile(dir_ + "/cert.pem", "C\n");
  WriteFile(dir_ + "/fullchain.pem", "stale content that is longer\n", 0600);
  ASSERT_TRUE(genChainCRT(dir_));
  EXPECT_EQ(Built(), "C\n");
}

TEST_F(FullChainTest, MissingCertificateFails) {
  EXPECT_FALSE(genChainCRT(dir_));
  EXPECT_TRUE(root_.LogContains("uploadsslca:"));
  EXPECT_TRUE(root_.LogContains("Open CA file failed"));
  EXPECT_FALSE(Exists(dir_ + "/fullchain.pem"));
  EXPECT_FALSE(genChainCRT(root_.Path("/no/such/dir")));
}

TEST_F(FullChainTest, UnreadableChainFails) {
  WriteFile(dir_ + "/cert.pem", "C\n");
  ZEPH::test::MakeDirs(dir_ + "/chain.pem");  // exists, cannot be read
  EXPECT_FALSE(genChainCRT(dir_));
}

}  // namespace
