#include "server/call_input.h"

#include <gtest/gtest.h>

#include "test_support.h"

namespace {

using ZEPH::test::Exists;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::webapid::CallError;
using ZEPH::webapid::CallInput;

// Feeds a part's content in pieces of 1000 bytes.
void AddPart(CallInput& input, const std::string& name, const std::string& filename,
             const std::string& content) {
  ASSERT_TRUE(input.BeginPart(name, filename));
  for (size_t i = 0; i < content.size(); i += 1000) {
    ASSERT_TRUE(input.AddPartData(content.data() + i, std::min<size_t>(1000, content.size() - i)));
  }
}

CallError FinishFails(CallInput& input) {
  Json::Value params;
  CallError error;
  EXPECT_FALSE(input.Finish(&params, &error));
  return error;
}

TEST(CallInput, ParsesJsonGivenInPiecesAndAnEmptyBodyAsNoParameters) {
  TempRoot root;
  CallInput input(root.Path("/tmp"));
  const std::string text = R"({"id": "abc123", "as_default": true, "ids": ["a", "b"]})";
  for (size_t i = 0; i < text.size(); i += 3) {
    ASSERT_TRUE(input.AddJson(text.data() + i, std::min<size_t>(3, text.size() - i)));
  }
  Json::Value params;
  CallError error;
  ASSERT_TRUE(input.Finish(&params, &error)) << error.message;
  EXPECT_EQ(params["id"].asString(), "abc123");
  EXPECT_TRUE(params["as_default"].asBool());
  EXPECT_EQ(params["ids"].size(), 2u);
  EXPECT_TRUE(input.upload_dir().empty());
  CallInput empty(root.Path("/tmp"));
  ASSERT_TRUE(empty.Finish(&params, &error));
  EXPECT_EQ(params, Json::Value(Json::objectValue));
}

TEST(CallInput, AJsonBodyOverOneMebibyteIsReadPastAndRefused) {
  TempRoot root;
  CallInput input(root.Path("/tmp"));
  const std::string body = "{\"desc\": \"" + std::string(CallInput::kMaxJsonBytes, 'x') + "\"}";
  for (size_t i = 0; i < body.size(); i += 4096) {
    // Reading goes on to the end of the body.
    ASSERT_TRUE(input.AddJson(body.data() + i, std::min<size_t>(4096, body.size() - i)));
  }
  EXPECT_EQ(FinishFails(input).status, 413);
}

TEST(CallInput, StoresFilePartsPrivatelyAndRemovesThemAfterwards) {
  TempRoot root;
  std::string dir;
  {
    CallInput input(root.Path("/tmp"));
    AddPart(input, "params", "", R"({"desc": "imported", "id": ""})");
    AddPart(input, "key", "server.key", "KEY BYTES");
    AddPart(input, "cert", "", std::string(20000, 'c'));
    Json::Value params;
    CallError error;
    ASSERT_TRUE(input.Finish(&params, &error)) << error.message;
    dir = input.upload_dir();
    ASSERT_EQ(dir.compare(0, root.Path("/tmp/").size(), root.Path("/tmp/")), 0) << dir;
    EXPECT_EQ(ModeOf(dir), 0700u);
    EXPECT_EQ(params["desc"].asString(), "imported");
    EXPECT_EQ(params["key_tmp"].asString(), dir + "/key");
    EXPECT_EQ(params["cert_tmp"].asString(), dir + "/cert");
    EXPECT_FALSE(params.isMember("inter_cert_tmp"));
    // The client's file name, or the part's name when it gave none.
    EXPECT_EQ(params["key"].asString(), "server.key");
    EXPECT_EQ(params["cert"].asString(), "cert");
    EXPECT_EQ(ReadFile(dir + "/key"), "KEY BYTES");
    EXPECT_EQ(ReadFile(dir + "/cert"), std::string(20000, 'c'));
    EXPECT_EQ(ModeOf(dir + "/key"), 0600u);
    // A file the method leaves beside the uploads goes as well.
    ZEPH::test::WriteFile(dir + "/key.rewritten", "x");
  }
  EXPECT_FALSE(Exists(dir));

  // Parameters that name a part keep their value.
  CallInput input(root.Path("/tmp"));
  AddPart(input, "csr", "upload.csr", "CSR");
  AddPart(input, "params", "", R"({"csr": "mine.csr", "days": 30})");
  Json::Value params;
  CallError error;
  ASSERT_TRUE(input.Finish(&params, &error)) << error.message;
  EXPECT_EQ(params["csr"].asString(), "mine.csr");
  EXPECT_EQ(params["days"].asInt(), 30);
  EXPECT_EQ(ReadFile(params["csr_tmp"].asString()), "CSR");
}

TEST(CallInput, RefusesUnknownDuplicateAndServerOnlyPartsAndLeavesNothing) {
  TempRoot root;
  const std::vector<std::pair<std::string, std::string>> cases[] = {
      {{"key", "a"}, {"passwd", "b"}},
      {{"key", "a"}, {"key", "b"}},
      {{"params", "{}"}, {"params", "{}"}},
      {{"key_tmp", "/etc/shadow"}},
      {{"params", R"({"cert_tmp": "/etc/shadow"})"}, {"cert", "c"}},
      {{"params", "[]"}},
      {{"params", "{"}},
  };
  for (const auto& parts : cases) {
    CallInput input(root.Path("/tmp"));
    for (const auto& part : parts) AddPart(input, part.first, "", part.second);
    EXPECT_EQ(FinishFails(input).status, 400) << parts.back().first << " " << parts.back().second;
  }
  {
    // Past the whole body's limit reading stops.
    CallInput input(root.Path("/tmp"));
    ASSERT_TRUE(input.BeginPart("key", "k"));
    const std::string chunk(1 << 20, 'x');
    size_t fed = 0;
    for (bool go_on = true; go_on && fed < 2 * CallInput::kMaxBodyBytes; fed += chunk.size()) {
      go_on = input.AddPartData(chunk.data(), chunk.size());
    }
    EXPECT_LE(fed, CallInput::kMaxBodyBytes + chunk.size());
    EXPECT_EQ(FinishFails(input).status, 413);
  }
  EXPECT_EQ(ZEPH::test::DirEntries(root.Path("/tmp")), std::vector<std::string>());
}

}  // namespace
