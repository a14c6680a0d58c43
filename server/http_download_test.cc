#include "server/http_download.h"

#include <gtest/gtest.h>
#include <httplib.h>
#include <unistd.h>

#include "test_support.h"

namespace {

using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;
using ZEPH::webapid::HttpDownload;
using ZEPH::webapid::IsSafeHeader;

// Runs the answer's content provider the way the server does: pieces of
// at most `piece` bytes until the announced length.
std::string Body(httplib::Response& res, size_t piece) {
  std::string body;
  httplib::DataSink sink;
  sink.write = [&body](const char* data, size_t size) {
    body.append(data, size);
    return true;
  };
  for (size_t offset = 0; offset < res.content_length_;) {
    const size_t before = body.size();
    if (!res.content_provider_(offset, std::min(piece, res.content_length_ - offset), sink)) break;
    offset += body.size() - before;
  }
  return body;
}

TEST(HttpDownload, StreamsTheFileItWasGivenWithTheMethodsSafeHeaders) {
  TempRoot root;
  const std::string path = root.Path("/archive.zip");
  std::string content;
  for (int i = 0; i < 200000; ++i) content.push_back(static_cast<char>(i * 7));
  WriteFile(path, content, 0400);

  HttpDownload download;
  EXPECT_FALSE(download.Deliver({}, root.Path("/missing")));
  EXPECT_FALSE(download.Deliver({}, root.Path("/tmp")));  // a directory
  EXPECT_FALSE(download.delivered());
  {
    ZEPH::ScopedDownloadSink scope(&download);
    ZEPH::APIDownload out;
    out.SetHeader("content-disposition", "attachment; filename=\"archive.zip\"");
    out.SetHeader("Content-Length", "5");
    out.SetHeader("X-Bad", "a\r\nSet-Cookie: x=1");
    EXPECT_TRUE(out.Output(path));
  }
  ASSERT_TRUE(download.delivered());
  EXPECT_FALSE(download.Deliver({}, path));  // only one per request
  // The worker replaces the file right after: the answer is still the
  // file it named.
  ASSERT_EQ(unlink(path.c_str()), 0);
  WriteFile(path, "replaced");

  httplib::Response res;
  download.Respond(&res);
  EXPECT_EQ(res.status, 200);
  EXPECT_EQ(res.get_header_value("content-disposition"), "attachment; filename=\"archive.zip\"");
  EXPECT_FALSE(res.has_header("X-Bad"));
  EXPECT_FALSE(res.has_header("Content-Length"));  // framing is the server's
  EXPECT_EQ(res.get_header_value("Content-Type"), "application/octet-stream");
  ASSERT_EQ(res.content_length_, content.size());
  EXPECT_EQ(Body(res, 1000000), content);
  EXPECT_EQ(Body(res, 333), content);

  // The method's own type is kept.
  HttpDownload typed;
  ASSERT_TRUE(typed.Deliver({{"Content-Type", "application/zip"}}, path));
  httplib::Response typed_res;
  typed.Respond(&typed_res);
  EXPECT_EQ(typed_res.get_header_value("Content-Type"), "application/zip");
  EXPECT_EQ(Body(typed_res, 3), "replaced");
}

TEST(IsSafeHeader, RefusesWhatCouldBreakTheHeaderBlock) {
  const std::tuple<std::string, std::string, bool> cases[] = {
      {"content-disposition", "attachment; filename=\"a b.zip\"", true}, {"X-Tab", "a\tb", true},
      {"", "x", false}, {"Bad Name", "x", false}, {"Bad:Name", "x", false}, {"X", "a\nb", false},
      {"X", "a\rb", false}, {"X", std::string("a\0b", 3), false}};
  for (const auto& c : cases) {
    EXPECT_EQ(IsSafeHeader(std::get<0>(c), std::get<1>(c)), std::get<2>(c)) << std::get<0>(c);
  }
}

}  // namespace
