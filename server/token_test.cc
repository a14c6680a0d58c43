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

TEST(LoadOrCreateToken, MakesAPrivateRandomTokenOnceOrReadsTheAdministratorsOne) {
  TempRoot root;
  const std::string path = root.Path("/token");
  std::string token, again, other, error;
  ASSERT_TRUE(LoadOrCreateToken(path, &token, &error)) << error;
  EXPECT_EQ(token.size(), 64u);
  EXPECT_EQ(token.find_first_not_of("0123456789abcdef"), std::string::npos) << token;
  EXPECT_EQ(ReadFile(path), token + "\n");
  EXPECT_EQ(ModeOf(path), 0600u);
  ASSERT_TRUE(LoadOrCreateToken(path, &again, &error)) << error;
  EXPECT_EQ(again, token);
  // Another file gets another token; no temporary file is left beside them.
  ASSERT_TRUE(LoadOrCreateToken(root.Path("/other"), &other, &error)) << error;
  EXPECT_NE(other, token);
  EXPECT_EQ(ZEPH::test::DirEntries(root.dir()), (std::vector<std::string>{"other", "tmp", "token"}));

  // An administrator's token is read and made private.
  WriteFile(path, std::string(40, 'x') + "\r\n", 0644);
  ASSERT_TRUE(LoadOrCreateToken(path, &token, &error)) << error;
  EXPECT_EQ(token, std::string(40, 'x'));
  EXPECT_EQ(ModeOf(path), 0600u);
}

TEST(LoadOrCreateToken, RefusesUnusableFiles) {
  TempRoot root;
  WriteFile(root.Path("/short"), "abc\n", 0600);
  WriteFile(root.Path("/spaces"), std::string(20, 'a') + " " + std::string(20, 'b'), 0600);
  WriteFile(root.Path("/target"), std::string(64, 'a'), 0600);
  ASSERT_EQ(symlink(root.Path("/target").c_str(), root.Path("/link").c_str()), 0);
  for (const char* name : {"/short", "/spaces", "/link", "/missing/dir/token"}) {
    std::string token, error;
    EXPECT_FALSE(LoadOrCreateToken(root.Path(name), &token, &error)) << name;
    EXPECT_FALSE(error.empty()) << name;
    EXPECT_TRUE(token.empty()) << name;
  }
  std::string token, error;
  LoadOrCreateToken(root.Path("/short"), &token, &error);
  EXPECT_NE(error.find("usable token"), std::string::npos) << error;
}

TEST(TokenAccepts, OnlyTheExactTokenWithTheBearerScheme) {
  const std::string token = "0123456789abcdef0123456789abcdef";
  std::string last_differs = token, first_differs = token;
  last_differs.back() = 'e';
  first_differs.front() = '1';
  const std::pair<std::string, bool> cases[] = {
      {"Bearer " + token, true}, {"bearer " + token, true}, {"BEARER  " + token + " ", true},
      {"", false}, {token, false}, {"Basic " + token, false}, {"Bearer", false}, {"Bearer ", false},
      {"Bearer " + token.substr(0, 31), false}, {"Bearer " + token + "0", false},
      {"Bearer " + last_differs, false}, {"Bearer " + first_differs, false}};
  for (const auto& c : cases) EXPECT_EQ(TokenAccepts(c.first, token), c.second) << c.first;
}

}  // namespace
