#include <gtest/gtest.h>

#include "test_support.h"
#include "zeph/api.h"
#include "zeph/server_form_handler.h"

namespace {

using ZEPH::test::TempRoot;

TEST(Request, ParametersAndFallbacks) {
  Json::Value params;
  params["id"] = "Ab3xYz";
  params["nothing"] = Json::Value();
  ZEPH::APIRequest request(params);
  EXPECT_EQ(request.GetParam("id", "").asString(), "Ab3xYz");
  EXPECT_EQ(request.GetParam("desc", "fallback").asString(), "fallback");
  EXPECT_TRUE(request.HasParam("nothing"));
  EXPECT_FALSE(request.HasParam("desc"));

  ZEPH::APIRequest not_object(Json::Value(5));
  EXPECT_FALSE(not_object.HasParam("id"));
  EXPECT_EQ(not_object.GetParam("id", 7).asInt(), 7);
}

TEST(Response, RecordsTheLastOutcomeAndCountsThem) {
  ZEPH::APIResponse response;
  EXPECT_EQ(response.outcome(), ZEPH::APIResponse::Outcome::kNone);
  response.SetError(5503, Json::Value());
  response.SetHttpdRestart(true);
  EXPECT_EQ(response.outcome(), ZEPH::APIResponse::Outcome::kError);
  EXPECT_EQ(response.error_code(), 5503);
  EXPECT_TRUE(response.data().isNull());
  Json::Value data;
  data["id"] = "x";
  response.SetSuccess(data);
  EXPECT_EQ(response.outcome(), ZEPH::APIResponse::Outcome::kSuccess);
  EXPECT_EQ(response.data(), data);
  EXPECT_EQ(response.outcome_count(), 2);
  EXPECT_TRUE(response.httpd_restart());
  EXPECT_TRUE(response.enable_output());
}

class RecordingSink : public ZEPH::DownloadSink {
 public:
  bool Deliver(const ZEPH::HeaderList& headers, const std::string& path) override {
    headers_ = headers;
    path_ = path;
    return true;
  }
  ZEPH::HeaderList headers_;
  std::string path_;
};

TEST(Download, GoesToTheThreadsSinkOnce) {
  {
    ZEPH::APIDownload orphan;
    EXPECT_FALSE(orphan.Output("/x"));  // no sink installed
  }
  RecordingSink outer, inner;
  ZEPH::ScopedDownloadSink outer_scope(&outer);
  {
    ZEPH::ScopedDownloadSink inner_scope(&inner);
    ZEPH::APIDownload download;
    download.SetHeader("Content-Type", "application/zip");
    EXPECT_TRUE(download.Output("/file.zip"));
    EXPECT_FALSE(download.Output("/again.zip"));
  }
  EXPECT_EQ(inner.path_, "/file.zip");
  ASSERT_EQ(inner.headers_.size(), 1u);
  EXPECT_EQ(inner.headers_[0].second, "application/zip");
  ZEPH::APIDownload after;  // the outer sink is back
  EXPECT_TRUE(after.Output("/outer"));
  EXPECT_EQ(outer.path_, "/outer");
}

class LoadingHandler : public ServerFormHandler {
 public:
  LoadingHandler() : ServerFormHandler(true, "formtest") {}
  void HandleLoadAction(ZEPH::APIRequest*, ZEPH::APIResponse* r) override {
    r->SetSuccess("loaded");
  }
  void HandleApplyAction(ZEPH::APIRequest*, ZEPH::APIResponse* r) override {
    r->SetSuccess("applied");
  }
};

TEST(ServerFormHandler, ProcessPicksLoadOrApplyUnderItsLock) {
  TempRoot root;
  Json::Value apply;
  apply["action"] = "apply";
  for (const auto& c : {std::make_pair(Json::Value(Json::objectValue), "loaded"),
                        std::make_pair(apply, "applied")}) {
    LoadingHandler handler;
    ZEPH::APIRequest request(c.first);
    ZEPH::APIResponse response;
    EXPECT_TRUE(handler.Process(&request, &response));
    EXPECT_EQ(response.data().asString(), c.second);
    EXPECT_TRUE(ZEPH::test::Exists(root.Path("/tmp/formtest.lock")));
  }
  ServerFormHandler base(false, nullptr);
  ZEPH::APIRequest request;
  ZEPH::APIResponse response;
  base.Process(&request, &response);
  EXPECT_EQ(response.error_code(), 5501);
}

}  // namespace
