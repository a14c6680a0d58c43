#include "server/token.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "test_support.h"

namespace {

using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;
using ZEPH::webapid::LoadOrCreateToken;
using ZEPH::webapid::TokenAccepts;

TEST(LoadOrCreateToken, MakesAPrivateRandomTokenOnceAndKeepsIt) {
  TempRoot root;
  const std::string path = root.Path("/token");
  std::string token, error;
  ASSERT_TRUE(LoadOrCreateToken(path, &token, &error)) << error;
  EXPECT_EQ(token.size(), 64u);
  EXPECT_EQ(token.find_first_not_of("0123456789abcdef"), std::string::npos)
      << token;
  EXPECT_EQ(ReadFile(path), token + "\n");
  EXPECT_EQ(ModeOf(path), 0600u);

  std::string again;
  ASSERT_TRUE(LoadOrCreateToken(path, &again, &error)) << error;
  EXPECT_EQ(again, token);

  // Another file gets another token.
  std::string other;
  ASSERT_TRUE(LoadOrCreateToken(root.Path("/other"), &other, &error)) << error;
  EXPECT_NE(other, token);
  // No temporary file is left beside the tokens.
  EXPECT_EQ(ZEPH::test::Run({"/bin/sh", "-c", "ls -A " + root.dir()}).out,
            "other\ntmp\ntoken\n");
}

TEST(LoadOrCreateToken, ReadsAnAdministratorsTokenAndMakesItPrivate) {
  TempRoot root;
  const std::string path = root.Path("/token");
  const std::string chosen(40, 'x');
  WriteFile(path, chosen + "\r\n", 0644);
  std::string token, error;
  ASSERT_TRUE(LoadOrCreateToken(path, &token, &error)) << error;
  EXPECT_EQ(token, chosen);
  EXPECT_EQ(ModeOf(path), 0600u);
}

TEST(LoadOrCreateToken, RefusesUnusableFiles) {
  TempRoot root;
  std::string token, error;
  WriteFile(root.Path("/short"), "abc\n", 0600);
  EXPECT_FALSE(LoadOrCreateToken(root.Path("/short"), &token, &error));
  EXPECT_NE(error.find("usable token"), std::string::npos) << error;

  WriteFile(root.Path("/spaces"),
            std::string(20, 'a') + " " + std::string(20, 'b'), 0600);
  EXPECT_FALSE(LoadOrCreateToken(root.Path("/spaces"), &token, &error));

  WriteFile(root.Path("/target"), std::string(64, 'a'), 0600);
  ASSERT_EQ(symlink(root.Path("/target").c_str(), root.Path("/link").c_str()),
            0);
  EXPECT_FALSE(LoadOrCreateToken(root.Path("/link"), &token, &error));

  EXPECT_FALSE(
      LoadOrCreateToken(root.Path("/missing/dir/token"), &token, &error));
  EXPECT_TRUE(token.empty());
}

TEST(TokenAccepts, OnlyTheExactTokenWithTheBearerScheme) {
  const std::string token = "0123456789abcdef0123456789abcdef";
  EXPECT_TRUE(TokenAccepts("Bearer " + token, token));
  EXPECT_TRUE(TokenAccepts("bearer " + token, token));
  EXPECT_TRUE(TokenAccepts("BEARER  " + token + " ", token));

  EXPECT_FALSE(TokenAccepts("", token));
  EXPECT_FALSE(TokenAccepts(token, token));
  EXPECT_FALSE(TokenAccepts("Basic " + token, token));
  EXPECT_FALSE(TokenAccepts("Bearer", token));
  EXPECT_FALSE(TokenAccepts("Bearer ", token));
  EXPECT_FALSE(TokenAccepts("Bearer " + token.substr(0, 31), token));
  EXPECT_FALSE(TokenAccepts("Bearer " + token + "0", token));
  std::string last_differs = token;
  last_differs.back() = 'e';
  EXPECT_FALSE(TokenAccepts("Bearer " + last_differs, token));
  std::string first_differs = token;
  first_differs.front() = '1';
  EXPECT_FALSE(TokenAccepts("Bearer " + first_differs, token));
}

}  // namespace
