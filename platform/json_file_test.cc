#include <gtest/gtest.h>

#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::JsonFromFile;
using ZEPH::JsonToFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;

TEST(JsonFile, RoundTripsBothLayouts) {
  TempRoot root;
  Json::Value info;
  info["Ab3xYz"]["desc"] = "caf\xC3\xA9 \"quoted\"";
  info["Ab3xYz"]["services"] = Json::Value(Json::arrayValue);
  info["Ab3xYz"]["user_deletable"] = true;
  for (bool styled : {true, false}) {
    const std::string path = root.Path("/INFO");
    ASSERT_TRUE(JsonToFile(info, path, styled));
    Json::Value back;
    ASSERT_TRUE(JsonFromFile(back, path));
    EXPECT_EQ(back, info);
  }
  EXPECT_FALSE(JsonToFile(info, root.Path("/missing/INFO"), true));
}

TEST(JsonFile, RefusesMissingAndMalformedFilesWithoutTouchingTheValue) {
  TempRoot root;
  Json::Value value("unchanged");
  EXPECT_FALSE(JsonFromFile(value, root.Path("/missing")));
  for (const char* bad : {"", "{", "{\"a\": 1} trailing", "{\"a\": 1,}",
                          "// comment\n{}", "{\"a\": 1}{\"b\": 2}"}) {
    WriteFile(root.Path("/bad"), bad);
    EXPECT_FALSE(JsonFromFile(value, root.Path("/bad"))) << bad;
    EXPECT_EQ(value, Json::Value("unchanged"));
  }
  WriteFile(root.Path("/arr"), "[1, 2]\n");
  ASSERT_TRUE(JsonFromFile(value, root.Path("/arr")));
  EXPECT_TRUE(value.isArray());
}

}  // namespace
