// The server's parts on their own: call input, event log, downloads, options, the served
// certificate and the access token.
#include <gtest/gtest.h>
#include <httplib.h>
#include <unistd.h>

#include <algorithm>
#include <iterator>
#include <set>
#include <string>
#include <vector>

#include "server/call_input.h"
#include "server/event_log.h"
#include "server/http_download.h"
#include "server/options.h"
#include "server/served_certificate.h"
#include "server/token.h"
#include "test_support.h"
#include "webapid_test_support.h"
#include "zeph/json_file.h"
#include "zeph/root.h"
#include "zeph/system.h"

namespace {

namespace webapid = ZEPH::webapid;
using ZEPH::test::DirEntries;
using ZEPH::test::Exists;
using ZEPH::test::MakeDirs;
using ZEPH::test::ModeOf;
using ZEPH::test::PemFingerprint;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;
using webapid::CallError;
using webapid::CallInput;

// Feeds a part's content in pieces of 1000 bytes.
void AddPart(CallInput& input, const std::string& name, const std::string& filename,
             const std::string& content) {
  ASSERT_TRUE(input.BeginPart(name, filename));
  for (size_t i = 0; i < content.size(); i += 1000) {
    ASSERT_TRUE(input.AddPartData(content.data() + i, std::min<size_t>(1000, content.size() - i)));
  }
}

// The status of a failed Finish, 0 when it succeeds (its parameters in `params`).
int Finish(CallInput& input, Json::Value* params = nullptr) {
  Json::Value ignored;
  CallError error;
  return input.Finish(params ? params : &ignored, &error) ? 0 : error.status;
}

TEST(CallInput, FilePartsAreKeptPrivatelyUntilTheEndAndBadOrOversizedInputIsRefused) {
  TempRoot root;
  CallInput json(root.Path("/tmp")), empty(root.Path("/tmp"));
  const std::string text = R"({"id": "abc123", "as_default": true, "ids": ["a", "b"]})";
  ASSERT_TRUE(json.AddJson(text.data(), 20) && json.AddJson(text.data() + 20, text.size() - 20));
  Json::Value params;
  ASSERT_EQ(Finish(json, &params), 0);
  EXPECT_EQ(ZEPH::JsonCompact(params), R"({"as_default":true,"id":"abc123","ids":["a","b"]})");
  ASSERT_EQ(Finish(empty, &params), 0);
  EXPECT_EQ(params, Json::Value(Json::objectValue));
  std::string dir;
  {  // The client's file name, the part's name when it gave none, or a parameter's value.
    CallInput input(root.Path("/tmp"));
    AddPart(input, "csr", "upload.csr", "CSR");
    AddPart(input, "params", "", R"({"desc": "imported", "csr": "mine.csr"})");
    AddPart(input, "key", "server.key", "KEY BYTES");
    AddPart(input, "cert", "", std::string(20000, 'c'));
    ASSERT_EQ(Finish(input, &params), 0);
    dir = input.upload_dir();
    ASSERT_EQ(dir.compare(0, root.Path("/tmp/").size(), root.Path("/tmp/")), 0) << dir;
    EXPECT_EQ(ZEPH::JsonCompact(params),
              R"({"cert":"cert","cert_tmp":")" + dir + R"(/cert","csr":"mine.csr","csr_tmp":")" +
                  dir + R"(/csr","desc":"imported","key":"server.key","key_tmp":")" + dir +
                  R"(/key"})");
    EXPECT_EQ(ReadFile(dir + "/key") + ReadFile(dir + "/csr"), "KEY BYTESCSR");
    EXPECT_EQ(ReadFile(dir + "/cert"), std::string(20000, 'c'));
    EXPECT_EQ(ModeOf(dir), 0700u);
    EXPECT_EQ(ModeOf(dir + "/key"), 0600u);
    WriteFile(dir + "/key.rewritten", "x");  // left by the method: goes too
  }
  EXPECT_FALSE(Exists(dir));
  // Refused parts; bodies over their limits. Nothing is left.
  const std::vector<std::pair<std::string, std::string>> cases[] = {
      {{"key", "a"}, {"passwd", "b"}}, {{"key", "a"}, {"key", "b"}},
      {{"params", "{}"}, {"params", "{}"}}, {{"key_tmp", "/etc/shadow"}},
      {{"params", R"({"cert_tmp": "/etc/shadow"})"}, {"cert", "c"}}, {{"params", "[]"}},
      {{"params", "{"}},
  };
  for (const auto& parts : cases) {
    CallInput input(root.Path("/tmp"));
    for (const auto& part : parts) AddPart(input, part.first, "", part.second);
    EXPECT_EQ(Finish(input), 400) << parts.back().first << " " << parts.back().second;
  }
  {
    CallInput big_input(root.Path("/tmp"));
    ASSERT_TRUE(big_input.BeginPart("key", "k"));
    const std::string chunk(1 << 20, 'x');
    size_t fed = 0;
    for (bool go_on = true; go_on && fed < 2 * CallInput::kMaxBodyBytes; fed += chunk.size()) {
      go_on = big_input.AddPartData(chunk.data(), chunk.size());
    }
    EXPECT_LE(fed, CallInput::kMaxBodyBytes + chunk.size());
    EXPECT_EQ(Finish(big_input), 413);
  }
  {  // a JSON body over 1 MiB is refused by the server itself, whatever nginx lets through
    CallInput big_json(root.Path("/tmp"));
    const std::string body = "{\"desc\": \"" + std::string(CallInput::kMaxJsonBytes, 'x');
    for (size_t i = 0; i < body.size(); i += 4096) {
      ASSERT_TRUE(big_json.AddJson(body.data() + i, std::min<size_t>(4096, body.size() - i)));
    }
    EXPECT_EQ(Finish(big_json), 413);
  }
  EXPECT_EQ(DirEntries(root.Path("/tmp")), std::vector<std::string>());
}

TEST(EventLog, EachActionHasItsOwnSentenceAndEventsAreReadBackNewestFirst) {
  std::set<std::string> named, unnamed;
  for (unsigned int low : {1, 2, 3, 4, 5, 6, 7, 8, 9, 0x10, 0x11, 0x12}) {
    const unsigned int id = 0x12B00000 + low;
    const std::string with = webapid::EventSentence(id, "nas1", "FTP");
    const std::string without = webapid::EventSentence(id, "", "");
    EXPECT_EQ(with.find("Event 0x"), std::string::npos) << std::hex << id;
    EXPECT_EQ(without.find("\"\""), std::string::npos) << without;
    EXPECT_TRUE(low == 0x11 || with.find("\"nas1\"") != std::string::npos) << with;
    named.insert(with);
    unnamed.insert(without);
  }
  EXPECT_EQ(named.size() + unnamed.size(), 24u);
  TempRoot root;
  const std::string path = ZEPH::RootPath(webapid::kEventsFile);
  Json::Value events;
  ASSERT_TRUE(webapid::ReadEvents(path, 10, &events));  // no log yet
  EXPECT_EQ(events, Json::Value(Json::arrayValue));
  // Logged: level, id, name, services, day, days left; read back: severity, sentence.
  struct Row {
    int level; unsigned int id; const char* text[4]; const char* severity; std::string sentence;
  };
  const std::string expires = "Certificate \"nas1\" expires ";
  const std::string not_auto = " and will not be renewed automatically.";
  const Row rows[] = {
      {1, 0x12B00003, {"first", "", "", ""}, "info", "Certificate \"first\" was created."},
      {1, 0x12B00007, {"4", "Web", "", ""}, "info", "Service \"Web\" now uses certificate \"4\"."},
      {3, 0x12B00010, {"", "", "", ""}, "error", "A certificate could not be recreated."},
      {3, 0x12B00008, {"n", "", "", ""}, "error",
       "A service could not be bound to certificate \"n\"."},
      {1, 0x12B0000A, {"nas1", "", "", ""}, "info", "Event 0x12B0000A."},
      {2, 0x12B00013, {"nas1", "Web, FTP", "2026-12-01", "12"}, "warning",
       expires + "in 12 days (on 2026-12-01)" + not_auto + " Web, FTP use it."},
      {2, 0x12B00013, {"nas1", "FTP", "2026-12-01", "1"}, "warning",
       expires + "in 1 day (on 2026-12-01)" + not_auto + " FTP uses it."},
      {2, 0x12B00013, {"nas1", "FTP", "2026-12-01", "0"}, "warning",
       expires + "today (on 2026-12-01)" + not_auto + " FTP uses it."},
      {2, 0x12B00013, {"nas1", "FTP", "2026-11-01", "-3"}, "warning",
       "Certificate \"nas1\" expired on 2026-11-01 and is not renewed. FTP uses it."},
      {2, 0x12B00013, {"", "", "", ""}, "warning", "A certificate expires today" + not_auto},
  };
  const Json::ArrayIndex count = std::size(rows);
  for (const Row& r : rows) {
    ASSERT_EQ(ZEPHLogSet1(1, r.level, r.id, r.text[0], r.text[1], r.text[2], r.text[3]), 0);
  }
  ASSERT_TRUE(webapid::ReadEvents(path, 100, &events));
  ASSERT_EQ(events.size(), count);
  for (Json::ArrayIndex i = 0; i < count; ++i) {
    const Row& r = rows[count - 1 - i];
    EXPECT_EQ(events[i]["message"].asString(), r.sentence);
    EXPECT_EQ(events[i]["severity"].asString() + " " + events[i]["text1"].asString(),
              r.severity + std::string(" ") + r.text[0]) << r.sentence;
    EXPECT_EQ(events[i]["message_id"].asUInt(), r.id) << r.sentence;
  }
  MakeDirs(root.Path("/log/events.jsonl"));  // a directory where the log should be
  EXPECT_FALSE(webapid::ReadEvents(root.Path("/log/events.jsonl"), 10, &events));
  // 5 MiB of old events, then junk, then two events; only the log's tail is read.
  const std::string old_line = "{\"time\":1,\"type\":1,\"level\":1,\"message_id\":313524225,"
                               "\"text1\":\"old\",\"text2\":\"\",\"text3\":\"\",\"text4\":\"\"}\n";
  std::string content;
  while (content.size() < (5u << 20)) content += old_line;
  content += "not json\n[1,2]\n{\"message_id\":\"text\"}\n\n";
  WriteFile(path, content);
  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00011, "", "", "", ""), 0);
  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00005, "gone", "", "", ""), 0);
  ASSERT_TRUE(webapid::ReadEvents(path, 1000, &events));
  ASSERT_EQ(events.size(), 1000u);
  EXPECT_EQ(events[0]["text1"].asString(), "gone");
  EXPECT_EQ(events[1]["message"].asString() + " " + events[2]["message"].asString(),
            "The certificates were reset to a new default certificate. "
            "Certificate \"old\" was made the default certificate.");
  ASSERT_TRUE(webapid::ReadEvents(path, 1u << 30, &events));
  EXPECT_LT(events.size(), content.size() / old_line.size());
  EXPECT_GT(events.size(), (4u << 20) / old_line.size() - 2);
}

// Runs the answer's content provider as the server does, in pieces of at most `piece` bytes.
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
  webapid::HttpDownload download;
  EXPECT_FALSE(download.Deliver({}, root.Path("/missing")));
  EXPECT_FALSE(download.Deliver({}, root.Path("/tmp")));  // a directory
  {
    ZEPH::ScopedDownloadSink scope(&download);
    ZEPH::APIDownload out;
    out.SetHeader("content-disposition", "attachment; filename=\"archive.zip\"");
    out.SetHeader("Content-Length", "5");
    out.SetHeader("X-Bad", "a\r\nSet-Cookie: x=1");
    EXPECT_TRUE(out.Output(path));
  }
  EXPECT_FALSE(download.Deliver({}, path));  // only one per request
  // The worker replaces the file right after: the answer is still the file it named.
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
  for (size_t piece : {1000000, 333}) EXPECT_EQ(Body(res, piece), content) << piece;
  // Nothing that could break the header block passes.
  const std::pair<std::string, std::string> safe[] = {
      {"content-disposition", "attachment; filename=\"a b.zip\""}, {"X-Tab", "a\tb"}};
  const std::pair<std::string, std::string> unsafe[] = {
      {"", "x"}, {"Bad Name", "x"}, {"Bad:Name", "x"}, {"X", "a\nb"}, {"X", "a\rb"},
      {"X", std::string("a\0b", 3)}};
  for (const auto& h : safe) EXPECT_TRUE(webapid::IsSafeHeader(h.first, h.second)) << h.first;
  for (const auto& h : unsafe) EXPECT_FALSE(webapid::IsSafeHeader(h.first, h.second)) << h.first;
}

TEST(Options, ListenAddressesEveryOptionAndBadCommandLines) {
  std::string address = "keep";
  int port = -1;
  // Only a port: the address stays. Refused ones leave both untouched.
  for (const char* text : {"0.0.0.0:9000", "[localhost]:0", ":65535"}) {
    ASSERT_TRUE(webapid::ParseListen(text, &address, &port)) << text;
  }
  for (const char* text : {"127.0.0.1", "127.0.0.1:", "127.0.0.1:65536", "127.0.0.1:8a",
                           "127.0.0.1:-1", "::1:80", "[]:80", "[::1:80", "host:123456"}) {
    EXPECT_FALSE(webapid::ParseListen(text, &address, &port)) << text;
    EXPECT_EQ(address + ":" + std::to_string(port), "localhost:65535") << text;
  }
  webapid::Options options;
  std::string error;
  ASSERT_TRUE(webapid::ParseOptions({}, &options, &error));
  EXPECT_EQ(options.address + ":" + std::to_string(options.port),
            "127.0.0.1:" + std::to_string(webapid::kDefaultPort));
  EXPECT_FALSE(options.has_root);
  for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
           {"--root"}, {"--root", ""}, {"--listen", "nowhere"}, {"--verbose"}, {"serve"},
           {"--module"}, {"--web"}}) {
    error.clear();
    EXPECT_FALSE(webapid::ParseOptions(args, &options, &error)) << args[0];
    EXPECT_FALSE(error.empty()) << args[0];
  }
}

TEST(ServedCertificate, OnlyACheckedPairIsCopiedPrivatelyAndAFailureSaysWhy) {
  TempRoot root;
  const std::string dir = root.Path("/service"), weak = root.Path("/weak");
  const std::string second = root.Path("/second"), copy = root.Path("/copy");
  auto shell = [](const std::string& script) {
    ASSERT_EQ(ZEPH::test::Run({"/bin/sh", "-c", script}).status, 0) << script;
  };
  ASSERT_TRUE(ZEPH::test::MakeCertSet(dir, "first.example"));
  ASSERT_TRUE(ZEPH::test::MakeCertSet(second, "second.example"));
  shell("mkdir " + weak + " && /usr/bin/openssl req -x509 -newkey rsa:1024 -nodes -keyout " + weak +
        "/privkey.pem -out " + weak + "/fullchain.pem -days 30 -subj /CN=weak.example 2>/dev/null");
  std::string error;
  webapid::ServedCertificate missing(root.Path("/nowhere"), copy, nullptr);
  EXPECT_FALSE(missing.Load(&error));
  EXPECT_NE(error.find(root.Path("/nowhere")), std::string::npos) << error;
  EXPECT_TRUE(missing.Fingerprint().empty() && !Exists(missing.chain_path()));
  EXPECT_FALSE(webapid::ServedCertificate(weak, copy, nullptr).Load(&error)) << "weak";
  std::vector<std::string> log;
  webapid::ServedCertificate served(dir, copy, [&log](const std::string& l) { log.push_back(l); });
  ASSERT_TRUE(served.Load(&error)) << error;
  const std::string first = served.Fingerprint(), first_chain = ReadFile(copy + "/fullchain.pem");
  EXPECT_EQ(first, PemFingerprint(dir + "/cert.pem"));
  EXPECT_EQ(first_chain, ReadFile(dir + "/fullchain.pem"));
  EXPECT_EQ(ReadFile(served.key_path()), ReadFile(dir + "/privkey.pem"));
  EXPECT_EQ(ModeOf(copy), 0700u);
  EXPECT_EQ(ModeOf(served.key_path()), 0600u);
  // Nothing changed: nothing to reload.
  EXPECT_FALSE(served.Refresh(false));
  EXPECT_FALSE(served.Refresh(true));
  // What breaks the service's pair and why; the served pair stays.
  const std::pair<std::string, const char*> cases[] = {
      {"cp " + second + "/fullchain.pem " + dir, "does not belong"},
      {"rm -rf " + dir, "no certificate files"},
      {"mkdir -p " + dir + " && cd " + dir + " && echo junk | tee fullchain.pem > privkey.pem",
       "no certificate in"},
      {"rm -rf " + dir + " && cp -r " + weak + " " + dir, "refused by TLS"},
  };
  for (const auto& c : cases) {
    shell(c.first);
    EXPECT_FALSE(served.Refresh(true)) << c.second;
    EXPECT_EQ(served.Fingerprint(), first) << c.second;
    EXPECT_EQ(ReadFile(copy + "/fullchain.pem"), first_chain) << c.second;
    ASSERT_FALSE(log.empty()) << c.second;
    EXPECT_NE(log.back().find(c.second), std::string::npos) << log.back();
  }
  // A new directory renamed onto the old one: taken up unasked.
  shell("cp -r " + second + " " + dir + ".new && rm -rf " + dir + " && mv " + dir + ".new " + dir);
  EXPECT_TRUE(served.Refresh(false));
  EXPECT_EQ(served.Fingerprint(), PemFingerprint(second + "/cert.pem"));
  EXPECT_EQ(ReadFile(copy + "/fullchain.pem"), ReadFile(second + "/fullchain.pem"));
}

TEST(Token, MadeOnceRandomAndPrivateOrTheAdministratorsOneReadAndUnusableFilesRefused) {
  TempRoot root;
  const std::string path = root.Path("/token");
  std::string token, again, other, error;
  ASSERT_TRUE(webapid::LoadOrCreateToken(path, &token, &error)) << error;
  EXPECT_EQ(token.size(), 64u);
  EXPECT_EQ(token.find_first_not_of("0123456789abcdef"), std::string::npos) << token;
  EXPECT_EQ(ModeOf(path), 0600u);
  ASSERT_TRUE(webapid::LoadOrCreateToken(path, &again, &error)) << error;
  EXPECT_EQ(again, token);
  ASSERT_TRUE(webapid::LoadOrCreateToken(root.Path("/other"), &other, &error)) << error;
  EXPECT_NE(other, token);
  EXPECT_EQ(DirEntries(root.dir()), (std::vector<std::string>{"other", "tmp", "token"}));
  // An administrator's token is read and made private.
  WriteFile(path, std::string(40, 'x') + "\r\n", 0644);
  ASSERT_TRUE(webapid::LoadOrCreateToken(path, &token, &error)) << error;
  EXPECT_EQ(token, std::string(40, 'x'));
  EXPECT_EQ(ModeOf(path), 0600u);
  WriteFile(root.Path("/short"), "abc\n", 0600);
  WriteFile(root.Path("/spaces"), std::string(20, 'a') + " " + std::string(20, 'b'), 0600);
  ASSERT_EQ(symlink(path.c_str(), root.Path("/link").c_str()), 0);
  const std::pair<const char*, const char*> refused[] = {
      {"/short", "usable token"}, {"/spaces", "usable token"}, {"/link", "cannot read"},
      {"/missing/dir/token", "cannot create"}};
  for (const auto& c : refused) {
    token.clear();
    EXPECT_FALSE(webapid::LoadOrCreateToken(root.Path(c.first), &token, &error)) << c.first;
    EXPECT_NE(error.find(c.second), std::string::npos) << error;
    EXPECT_TRUE(token.empty()) << c.first;
  }
  // Only the exact token, with the Bearer scheme in any case and spaces around.
  const std::string t = "0123456789abcdef0123456789abcdef", last_differs = t.substr(0, 31) + "e";
  for (const std::string& accepted : {"Bearer " + t, "bearer " + t, "BEARER  " + t + " "}) {
    EXPECT_TRUE(webapid::TokenAccepts(accepted, t)) << accepted;
  }
  for (const std::string& wrong : {std::string(), t, "Basic " + t, std::string("Bearer "),
                                   "Bearer " + t.substr(0, 31), "Bearer " + last_differs}) {
    EXPECT_FALSE(webapid::TokenAccepts(wrong, t)) << wrong;
  }
}

}  // namespace
