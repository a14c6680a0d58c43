// zeph-webapid end to end: the real server process with the real module on
// a private root, spoken to over HTTPS by the curl tool and by a small
// OpenSSL client. The browser test drives the everyday calls (sign-in,
// list, create, set, bind, delete, import, export, CSR, reset); these are
// the server's own duties and its refusals.
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "test_support.h"
#include "tls_test_support.h"
#include "tools/zeph_letsencrypt/pebble_test_support.h"
#include "webapid_test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::Curl;
using ZEPH::test::CurlReply;
using ZEPH::test::Exists;
using ZEPH::test::PemFingerprint;
using ZEPH::test::ReadFile;
using ZEPH::test::ServerProcess;
using ZEPH::test::TempRoot;
using ZEPH::test::TlsConnection;
using ZEPH::test::WriteFile;

const std::string kArchive = "/usr/zeph/etc/certificate/_archive";
const std::string kWebCertDir = "/usr/zeph/etc/certificate/system/default";
const std::string kList = "/api/ZEPH.Core.Certificate.CRT/1/list";
const std::string kImport = "/api/ZEPH.Core.Certificate/1/import";
const std::string kExport = "/api/ZEPH.Core.Certificate/1/export";

Json::Value Parse(const std::string& text) {
  Json::Value value;
  EXPECT_TRUE(ZEPH::JsonParse(text, value)) << text;
  return value;
}

// The parameters of a CRT "create" for `common_name`.
Json::Value CreateParams(const std::string& common_name) {
  Json::Value p(Json::objectValue);
  for (const std::string pre : {"ca_", ""}) {
    p[pre + "country"] = "DE";
    p[pre + "state"] = p[pre + "city"] = "Berlin";
    p[pre + "organization"] = "Zeph";
    p[pre + "department"] = "IT";
    p[pre + "common_name"] = pre.empty() ? common_name : common_name + " CA";
    p[pre + "email"] = "admin@example.com";
  }
  p["desc"] = common_name;
  return p;
}

// The raw HTTP/1.1 request of a method call with `body`.
std::string RawCall(const std::string& path, const std::string& token, const std::string& body) {
  return "POST " + path + " HTTP/1.1\r\nHost: x\r\nAuthorization: Bearer " + token +
         "\r\nContent-Type: application/json\r\nContent-Length: " + std::to_string(body.size()) +
         "\r\n\r\n" + body;
}

class WebapidTest : public ::testing::Test {
 protected:
  // Whatever the test did, the server stops cleanly (under the sanitizers
  // this is also where leaks would show).
  void TearDown() override {
    if (server_ && server_->Alive()) {
      EXPECT_EQ(server_->Stop(), 0) << server_->Log();
    }
  }
  // A root whose web service holds a certificate made with the openssl
  // tool, as a deployment would leave it, beside an empty catalogue; the
  // server provisions the rest.
  void ProvisionWithCertificate() {
    ZEPH::test::MakeDirs(root_.Path(kArchive));
    WriteFile(root_.Path(kArchive + "/INFO"), "{}\n");
    ASSERT_TRUE(ZEPH::test::MakeCertSet(root_.Path(kWebCertDir), "start.example"));
  }
  void Start(const std::vector<std::string>& extra = {}) {
    ProvisionWithCertificate();
    server_.reset(new ServerProcess(root_.dir(), extra));
    ASSERT_TRUE(server_->listening()) << server_->Log();
    token_ = server_->Token();
    ASSERT_FALSE(token_.empty());
  }
  CurlReply Get(const std::string& path) { return Curl(server_->port(), path, {}, token_, root_.dir()); }
  CurlReply Post(const std::string& path, const std::string& json, std::vector<std::string> extra = {},
                 const std::string& content_type = "application/json") {
    WriteFile(root_.Path("/request.json"), json);
    std::vector<std::string> args = {"-X", "POST", "-H", "Content-Type: " + content_type,
                                     "--data-binary", "@" + root_.Path("/request.json")};
    args.insert(args.end(), extra.begin(), extra.end());
    return Curl(server_->port(), path, args, token_, root_.dir());
  }
  // A multipart call: `forms` are curl's -F arguments.
  CurlReply Form(const std::string& path, const std::vector<std::string>& forms) {
    std::vector<std::string> args;
    for (const std::string& form : forms) args.insert(args.end(), {"-F", form});
    return Curl(server_->port(), path, args, token_, root_.dir());
  }
  // Calls a method with the token; the answer must be HTTP 200 JSON.
  Json::Value Call(const std::string& api, const std::string& method,
                   const Json::Value& params = Json::Value(Json::objectValue)) {
    CurlReply r = Post("/api/" + api + "/1/" + method, ZEPH::JsonCompact(params));
    EXPECT_EQ(r.status, 200) << api << " " << method << ": " << r.body << r.error;
    return Parse(r.body);
  }
  std::string CreateCertificate(const Json::Value& params) {
    Json::Value answer = Call("ZEPH.Core.Certificate.CRT", "create", params);
    EXPECT_TRUE(answer["success"].asBool()) << answer;
    return answer["data"]["id"].asString();
  }
  std::string CertFingerprint(const std::string& id) {
    return PemFingerprint(root_.Path(kArchive + "/" + id + "/cert.pem"));
  }
  // The parameters of a Service "set" that binds the web service to `id`.
  Json::Value BindWebService(const std::string& id, const std::string& old_id) {
    Json::Value services, params(Json::objectValue);
    EXPECT_TRUE(ZEPH::JsonFromFile(services, root_.Path(kArchive + "/SERVICES")));
    Json::Value& setting = params["settings"].append(Json::objectValue);
    setting["service"] = services[0];
    setting["id"] = id;
    setting["old_id"] = old_id;
    return params;
  }
  std::vector<std::string> Uploads() {
    std::vector<std::string> found;
    for (const std::string& name : ZEPH::test::DirEntries(root_.Path("/tmp"))) {
      if (name.compare(0, 20, "zeph-webapid-upload.") == 0) found.push_back(name);
    }
    return found;
  }
  void ExpectStillServing() {
    ASSERT_TRUE(server_->Alive()) << server_->Log();
    CurlReply r = Get("/server/health");
    ASSERT_EQ(r.status, 200) << r.error;
    EXPECT_EQ(Parse(r.body)["data"]["pid"].asInt64(), server_->pid());
  }

  TempRoot root_;
  std::unique_ptr<ServerProcess> server_;
  std::string token_;
};

// --- Start and stop -----------------------------------------------------

TEST_F(WebapidTest, StartRefusalsSayWhyAndLeaveTheRootAlone) {
  // A root with certificates but none for the web service is never reset
  // behind the administrator's back.
  ZEPH::test::MakeDirs(root_.Path(kArchive));
  WriteFile(root_.Path(kArchive + "/INFO"), "{\"abcdef\": {}}\n");
  {
    ServerProcess server(root_.dir());
    ASSERT_FALSE(server.listening());
    EXPECT_EQ(server.Wait(), 1);
    EXPECT_NE(server.Log().find("bind a certificate to the web administration service"), std::string::npos)
        << server.Log();
    EXPECT_EQ(server.Log().find("reset"), std::string::npos) << server.Log();
    EXPECT_EQ(ReadFile(root_.Path(kArchive + "/INFO")), "{\"abcdef\": {}}\n");
  }
  ASSERT_TRUE(ZEPH::test::MakeCertSet(root_.Path(kWebCertDir), "start.example"));
  struct Case { std::vector<std::string> extra; int status; const char* logged; };
  const Case cases[] = {{{"--listen", "nowhere"}, 2, "usage: zeph-webapid"},
                        {{"--module", root_.Path("/missing.so")}, 1, "cannot load module"}};
  for (const Case& c : cases) {
    ServerProcess server(root_.dir(), c.extra);
    EXPECT_EQ(server.Wait(), c.status) << c.logged;
    EXPECT_NE(server.Log().find(c.logged), std::string::npos) << server.Log();
  }
}

TEST_F(WebapidTest, SigtermStopsTheServerCleanlyAfterLoggingEachRequest) {
  Start();
  ASSERT_EQ(Get("/server/health").status, 200);
  EXPECT_EQ(server_->Stop(), 0);
  for (const char* line : {"access: 127.0.0.1 \"GET /server/health\" 200 ", "stopping on SIGTERM",
                           "zeph-webapid: stopped"}) {
    EXPECT_NE(server_->Log().find(line), std::string::npos) << line << "\n" << server_->Log();
  }
}

// --- Authentication -----------------------------------------------------

TEST_F(WebapidTest, EveryRouteWithoutTheTokenIs401AndRunsNoModuleCode) {
  Start();
  const std::string create = ZEPH::JsonCompact(CreateParams("intruder"));
  const std::pair<const char*, const char*> routes[] = {
      {"POST", "/api/ZEPH.Core.Certificate.CRT/1/create"}, {"POST", "/api/ZEPH.Core.Certificate/1/reset"},
      {"POST", "/api/No.Such.API/1/list"}, {"POST", "/api"}, {"GET", "/api/ZEPH.Core.Certificate.CRT/1/list"},
      {"PUT", "/api/ZEPH.Core.Certificate.CRT/1/list"}, {"DELETE", "/api/ZEPH.Core.Certificate.CRT/1/delete"},
      {"GET", "/server/health"}, {"GET", "/server/services"}, {"GET", "/server/events"},
      {"GET", "/server/unknown"}, {"POST", "/server/health"}, {"GET", "/server/letsencrypt/settings"},
      {"POST", "/server/letsencrypt/settings"}, {"GET", "/server/letsencrypt/dns-providers"},
      {"GET", "/server/letsencrypt/dns-providers/exec"},
  };
  const std::string auths[] = {"", "Bearer " + std::string(token_.size(), 'f'), "Bearer " + token_ + "x",
                               "Basic " + token_, token_};
  for (const auto& route : routes) {
    for (const std::string& auth : auths) {
      std::vector<std::string> args = {"-X", route.first, "-H", "Content-Type: application/json",
                                        "--data-binary", create};
      if (!auth.empty()) args.insert(args.end(), {"-H", "Authorization: " + auth});
      CurlReply r = Curl(server_->port(), route.second, args, "", root_.dir());
      EXPECT_EQ(r.status, 401) << route.first << " " << route.second << " " << auth << r.error;
      EXPECT_EQ(Parse(r.body)["error"]["code"].asInt(), 401) << r.body;
    }
    // Without a body too.
    CurlReply r = Curl(server_->port(), route.second, {"-X", route.first}, "", root_.dir());
    EXPECT_EQ(r.status, 401) << route.first << " " << route.second;
  }
  // A multipart upload without the token stores nothing.
  WriteFile(root_.Path("/key.pem"), "KEY");
  for (const auto& c : {std::make_pair("POST", kImport), std::make_pair("PUT", std::string("/server/health"))}) {
    CurlReply r = Curl(server_->port(), c.second,
                       {"-X", c.first, "-F", "key=@" + root_.Path("/key.pem"), "-F", "params={\"desc\":\"x\"}"},
                       "", root_.dir());
    EXPECT_EQ(r.status, 401) << c.second;
  }
  // No module code ran: no certificate was made, the store was not reset,
  // nothing was logged by the module.
  EXPECT_EQ(ReadFile(root_.Path(kArchive + "/INFO")), "{}\n");
  EXPECT_FALSE(Exists(root_.Path(kArchive + "/DEFAULT")));
  EXPECT_FALSE(root_.LogContains("certificate:")) << root_.Log();
  EXPECT_FALSE(Exists(root_.Path("/var/log/zeph/events.jsonl")));
  EXPECT_FALSE(Exists(root_.Path("/usr/zeph/etc/letsencrypt/config.json")));
  EXPECT_TRUE(Uploads().empty());
  ExpectStillServing();
}

// --- Refused requests ---------------------------------------------------

TEST_F(WebapidTest, BadPathsMethodsAndEventLimitsAreRefusedWithAJsonError) {
  Start();
  for (const char* path : {"/api/No.Such.API/1/list", "/api/ZEPH.Core.Certificate.CRT/2/list",
                           "/api/ZEPH.Core.Certificate.CRT/1/frobnicate", "/api/ZEPH.Core.Certificate.CRT/one/list",
                           "/api/ZEPH.Core.Certificate.CRT/1/list/more", "/api/ZEPH.Core.Certificate.CRT/1/",
                           "/api/ZEPH.Core.Certificate.CRT"}) {
    CurlReply r = Post(path, "{}");
    EXPECT_EQ(r.status, 404) << path;
    Json::Value body = Parse(r.body);
    EXPECT_FALSE(body["success"].asBool()) << path;
    EXPECT_EQ(body["error"]["code"].asInt(), 404) << path;
    EXPECT_FALSE(body["error"]["data"]["message"].asString().empty()) << path;
  }
  struct Case { const char* path; int status; };
  const Case gets[] = {{kList.c_str(), 405},  // GET is not how methods are called
                       {"/server/nothing", 404}, {"/server/events?limit=0", 400},
                       {"/server/events?limit=x", 400}};
  for (const Case& c : gets) EXPECT_EQ(Get(c.path).status, c.status) << c.path;
  CreateCertificate(CreateParams("nas1.example"));
  EXPECT_EQ(Parse(Get("/server/events?limit=1").body)["data"]["events"].size(), 1u);
  ExpectStillServing();
}

TEST_F(WebapidTest, MalformedParametersAndServerOnlyPathsAreRefused) {
  Start();
  for (const char* body : {"{", "[1]", "\"x\"", "{\"a\":1} trailing", "{\"a\":1,\"a\":2}"}) {
    CurlReply r = Post(kList, body);
    EXPECT_EQ(r.status, 400) << body;
    EXPECT_EQ(Parse(r.body)["error"]["code"].asInt(), 400) << body;
  }
  // A client never names a server-side file.
  WriteFile(root_.Path("/evil.pem"), "whatever");
  for (const char* name : {"key_tmp", "cert_tmp", "inter_cert_tmp", "csr_tmp"}) {
    Json::Value params(Json::objectValue);
    params["desc"] = "x";
    params[name] = root_.Path("/evil.pem");
    CurlReply r = Post(kImport, ZEPH::JsonCompact(params));
    EXPECT_EQ(r.status, 400) << name;
    EXPECT_NE(Parse(r.body)["error"]["data"]["message"].asString().find(name), std::string::npos);
  }
  WriteFile(root_.Path("/params.json"), "{\"desc\":\"x\",\"cert_tmp\":\"/etc/passwd\"}");
  EXPECT_EQ(Form(kImport, {"params=<" + root_.Path("/params.json"), "key=@" + root_.Path("/evil.pem")}).status, 400);
  // Wrong content types; multipart without a boundary.
  for (const auto& c : {std::make_pair("text/plain", 415), std::make_pair("application/x-www-form-urlencoded", 415),
                        std::make_pair("multipart/form-data", 400)}) {
    EXPECT_EQ(Post(kList, "{}", {}, c.first).status, c.second) << c.first;
  }
  // Parameters of every wrong JSON type reach the method's rules: its
  // error 5503 over HTTP 200, not a server failure.
  const std::pair<std::string, std::string> calls[] = {
      {"CRT/1/recreate", "{\"id\":5}"}, {"CRT/1/recreate", "{\"id\":true}"}, {"CRT/1/recreate", "{\"id\":null}"},
      {"CRT/1/recreate", "{\"id\":[\"a\"]}"}, {"CRT/1/recreate", "{\"id\":{\"a\":1}}"},
      {"CRT/1/recreate", "{\"id\":1.5}"}, {"CRT/1/delete", "{\"ids\":[1,2]}"},
      {"Service/1/set", "{\"settings\":\"all\"}"}, {"CRT/1/set", "{\"id\":\"abcdef\",\"as_default\":\"yes\"}"}};
  for (const auto& c : calls) {
    CurlReply r = Post("/api/ZEPH.Core.Certificate." + c.first, c.second);
    ASSERT_EQ(r.status, 200) << c.second;
    EXPECT_EQ(Parse(r.body)["error"]["code"].asInt(), 5503) << c.second;
    EXPECT_TRUE(Parse(r.body)["error"]["data"].isNull()) << c.second;
  }
  EXPECT_TRUE(Uploads().empty());
  EXPECT_EQ(ReadFile(root_.Path("/evil.pem")), "whatever");
  ExpectStillServing();
}

TEST_F(WebapidTest, OversizedBodiesAreRefusedWith413) {
  Start();
  const std::string big = "{\"desc\":\"" + std::string((1 << 20) + 1, 'x') + "\"}";
  // curl waits for "100 Continue" before a large body, or sends it straight
  // away, or chunked without a declared length.
  for (const std::vector<std::string>& extra : {std::vector<std::string>{}, {"-H", "Expect:"},
                                                {"-H", "Transfer-Encoding: chunked"}}) {
    CurlReply r = Post(kList, big, extra);
    EXPECT_EQ(r.status, 413) << r.error;
    EXPECT_EQ(Parse(r.body)["error"]["code"].asInt(), 413);
  }
  // An upload part over 8 MiB.
  WriteFile(root_.Path("/huge.pem"), std::string((8 << 20) + 1, 'A'));
  WriteFile(root_.Path("/small.pem"), "KEY");
  CurlReply r = Form(kImport, {"params={\"desc\":\"x\"};type=application/json", "key=@" + root_.Path("/small.pem"),
                               "cert=@" + root_.Path("/huge.pem")});
  EXPECT_EQ(r.status, 413) << r.error;
  EXPECT_EQ(Parse(r.body)["error"]["code"].asInt(), 413);
  EXPECT_TRUE(Uploads().empty());
  // A body past every limit is not even read.
  r = Curl(server_->port(), kImport,
           {"-X", "POST", "-H", "Content-Type: multipart/form-data; boundary=x", "-H",
            "Content-Length: 999999999999", "-H", "Expect:", "--data-binary", "--x--"},
           token_, root_.dir());
  EXPECT_EQ(r.status, 413);
  ExpectStillServing();
}

// --- Bad input on the wire ----------------------------------------------

TEST_F(WebapidTest, GarbageOnTheSocketAndTruncatedBodiesLeaveTheServerServing) {
  Start();
  // Bytes that are not TLS at all (read to the server's close); a client
  // that connects and goes away, or stops in the handshake.
  const std::pair<std::string, bool> raw[] = {
      {"GET / HTTP/1.1\r\nHost: x\r\n\r\n\x16\x03\x01\xff\xff garbage", true},
      {"", false}, {std::string("\x16\x03\x01\x00\x05\x01\x00", 7), false}};
  for (const auto& c : raw) {
    ZEPH::UniqueFd fd = ZEPH::test::ConnectTcp(server_->port());
    ASSERT_TRUE(fd);
    ASSERT_EQ(write(fd.get(), c.first.data(), c.first.size()), static_cast<ssize_t>(c.first.size()));
    char buf[256];
    while (c.second && read(fd.get(), buf, sizeof(buf)) > 0) {
    }
  }
  // Garbage inside TLS; a multipart body whose final boundary never comes
  // (with an honest length), whose client goes away, or whose part headers
  // never end.
  const std::string head = "POST " + kImport + " HTTP/1.1\r\nHost: x\r\nAuthorization: Bearer " + token_ +
                           "\r\nContent-Type: multipart/form-data; boundary=BOUND\r\n";
  const std::string part = "--BOUND\r\nContent-Disposition: form-data; name=\"key\"; filename=\"k.pem\"\r\n\r\n" +
                           std::string(50000, 'k') + "\r\n";
  const std::string broken = "--BOUND\r\nContent-Disposition: form-data; name=\"key\"\r\n";
  struct Case { std::string raw; int status; };
  const Case cases[] = {
      {"\x01\x02 NONSENSE \xff\r\n\r\n", 400},
      {head + "Content-Length: " + std::to_string(part.size()) + "\r\n\r\n" + part, 400},
      {head + "Content-Length: 900000\r\n\r\n" + part, 0},
      {head + "Content-Length: " + std::to_string(broken.size()) + "\r\n\r\n" + broken, 400},
  };
  for (const Case& c : cases) {
    TlsConnection tls(server_->port());
    ASSERT_TRUE(tls.ok());
    ASSERT_TRUE(tls.Send(c.raw));
    if (c.status != 0) {
      EXPECT_EQ(tls.Receive().status, c.status) << c.raw.substr(0, 40);
    }
  }
  ExpectStillServing();
  EXPECT_TRUE(Uploads().empty());
}

TEST_F(WebapidTest, OnlyTls12WithForwardSecrecyAndAeadOrTls13IsSpoken) {
  Start();
  struct Case {
    int max_version;
    const char* ciphers;  // TLS 1.2 suites offered; "" for the defaults
    bool accepted;
  };
  const Case cases[] = {
      {0, "", true},  // TLS 1.3
      {TLS1_2_VERSION, "ECDHE-ECDSA-AES128-GCM-SHA256:ECDHE-RSA-AES128-GCM-SHA256", true},
      {TLS1_2_VERSION, "ECDHE-ECDSA-CHACHA20-POLY1305:ECDHE-RSA-CHACHA20-POLY1305", true},
      {TLS1_2_VERSION, "AES128-GCM-SHA256:AES256-GCM-SHA384", false},  // static RSA
      {TLS1_2_VERSION, "AES128-SHA:AES256-SHA", false},
      {TLS1_2_VERSION, "ECDHE-ECDSA-AES128-SHA:ECDHE-RSA-AES128-SHA", false},  // CBC-SHA1
      {TLS1_2_VERSION, "ECDHE-ECDSA-AES128-SHA256:ECDHE-RSA-AES128-SHA256", false},
      {TLS1_2_VERSION, "DHE-RSA-AES128-GCM-SHA256", false},
      {TLS1_1_VERSION, "", false},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(TlsConnection(server_->port(), c.max_version, c.ciphers).ok(), c.accepted)
        << c.max_version << " " << c.ciphers;
  }
}

TEST_F(WebapidTest, EveryAnswerCarriesTheSecurityHeaders) {
  Start();
  WriteFile(root_.Path("/big.json"), std::string((1 << 20) + 1, ' '));
  struct Case {
    std::string path;
    std::vector<std::string> args;
    bool token;
    int status;
    const char* cache;  // Cache-Control
  };
  const Case cases[] = {
      {"/", {"--http2"}, false, 200, "no-cache"},
      {"/app.js", {"--http1.1"}, false, 200, "no-cache"},
      {"/nothing", {}, false, 404, "no-store"},
      {"/server/health", {}, true, 200, "no-store"},
      {"/server/health", {}, false, 401, "no-store"},
      {kList, {"-X", "POST", "--data-binary", "@" + root_.Path("/big.json")}, true, 413, "no-store"},
  };
  for (const Case& c : cases) {
    CurlReply r = Curl(server_->port(), c.path, c.args, c.token ? token_ : "", root_.dir());
    EXPECT_EQ(r.status, c.status) << c.path;
    std::string headers = r.headers;
    for (char& ch : headers) ch = static_cast<char>(tolower(static_cast<unsigned char>(ch)));
    for (const std::string& header :
         {std::string("cache-control: ") + c.cache, std::string("strict-transport-security: max-age="),
          std::string("content-security-policy: default-src 'self'; frame-ancestors 'none'"),
          std::string("x-content-type-options: nosniff"), std::string("referrer-policy: no-referrer")}) {
      EXPECT_NE(headers.find(header), std::string::npos) << c.path << ": " << header << "\n" << r.headers;
    }
    // HTTP/2 is spoken, HTTP/1.1 too.
    if (!c.args.empty() && c.args[0] == "--http2") {
      EXPECT_EQ(r.headers.compare(0, 6, "HTTP/2"), 0) << r.headers;
    }
  }
}

TEST_F(WebapidTest, OnlyThePagesOwnFilesAreServed) {
  const std::string web = root_.Path("/web");
  ZEPH::test::MakeDirs(web + "/test/node_modules/x");
  WriteFile(web + "/index.html", "<html>page</html>");
  WriteFile(web + "/app.js", "let x = 1;");
  WriteFile(web + "/style.css", "p {}");
  for (const char* secret : {"/CMakeLists.txt", "/test/admin_page.test.mjs", "/test/node_modules/x/index.html"}) {
    WriteFile(web + secret, "SECRET");
  }
  WriteFile(root_.Path("/secret.txt"), "SECRET");
  Start({"--web", web});
  struct Case {
    const char* path;
    int status;
    const char* type;  // the start of the Content-Type
    const char* body;  // the whole body; "" for any
  };
  const Case cases[] = {
      {"/", 200, "text/html", "<html>page</html>"},
      {"/index.html", 200, "text/html", "<html>page</html>"},
      {"/app.js", 200, "text/javascript", "let x = 1;"},
      {"/style.css", 200, "text/css", "p {}"},
      {"/api.js", 404, "application/json", ""},  // missing here
      {"/CMakeLists.txt", 404, "application/json", ""},
      {"/test/admin_page.test.mjs", 404, "application/json", ""},
      {"/test/node_modules/x/index.html", 404, "application/json", ""},
      {"/app.js%00.html", 400, "application/json", ""},
      {"/app.js/", 404, "application/json", ""},
      {"/../secret.txt", 400, "application/json", ""},
      {"/%2e%2e/secret.txt", 400, "application/json", ""},
      {"/..%2fsecret.txt", 400, "application/json", ""},
      {"/test/%2e%2e/%2e%2e/secret.txt", 400, "application/json", ""},
      {"/../../../../../../etc/passwd", 400, "application/json", ""},
  };
  for (const Case& c : cases) {
    CurlReply r = Curl(server_->port(), c.path, {"--path-as-is"}, "", root_.dir());
    EXPECT_EQ(r.status, c.status) << c.path;
    EXPECT_NE(r.headers.find(std::string("content-type: ") + c.type), std::string::npos) << c.path << r.headers;
    if (*c.body != '\0') {
      EXPECT_EQ(r.body, c.body) << c.path;
    }
    EXPECT_EQ(r.body.find("SECRET"), std::string::npos) << c.path;
    EXPECT_EQ(r.body.find("root:"), std::string::npos) << c.path;
  }
  ExpectStillServing();
}

// --- Concurrency and certificate hand-over ------------------------------

TEST_F(WebapidTest, AListIsAnsweredWhileACreateIsRunning) {
  Start();
  const std::string first = CreateCertificate(CreateParams("first.example"));
  WriteFile(root_.Path("/create.json"), ZEPH::JsonCompact(CreateParams("second.example")));
  ZEPH::test::Background create(
      {"/usr/bin/curl", "-sS", "-k", "-o", root_.Path("/create.out"), "-H", "Authorization: Bearer " + token_,
       "-H", "Content-Type: application/json", "--data-binary", "@" + root_.Path("/create.json"),
       "https://127.0.0.1:" + std::to_string(server_->port()) + "/api/ZEPH.Core.Certificate.CRT/1/create"});
  // Wait until the create has made its new certificate's directory.
  bool started = false;
  for (int i = 0; i < 3000 && !started && create.Running(); ++i) {
    for (const std::string& name : ZEPH::test::DirEntries(root_.Path(kArchive))) {
      started = started || (name.size() == 6 && name != first);
    }
    if (!started) usleep(10 * 1000);
  }
  ASSERT_TRUE(started);
  Json::Value list = Call("ZEPH.Core.Certificate.CRT", "list");
  const bool create_still_running = create.Running();
  EXPECT_TRUE(list["success"].asBool()) << list;
  EXPECT_TRUE(create_still_running);
  // Answered in the middle: the new certificate is not listed yet.
  if (create_still_running) {
    EXPECT_EQ(list["data"]["certificates"].size(), 1u);
  }
  EXPECT_EQ(create.Wait(), 0);
  EXPECT_TRUE(Parse(ReadFile(root_.Path("/create.out")))["success"].asBool());
  EXPECT_EQ(Call("ZEPH.Core.Certificate.CRT", "list")["data"]["certificates"].size(), 2u);
}

TEST_F(WebapidTest, NewHandshakesGetANewlyBoundCertificateWithoutARestart) {
  Start();
  const pid_t pid = server_->pid();
  const std::string started_with = PemFingerprint(root_.Path(kWebCertDir + "/cert.pem"));
  const std::string id = CreateCertificate(CreateParams("handover.example"));
  const std::string other = CreateCertificate(CreateParams("other.example"));

  // A connection made before the change, with a slow call in flight.
  TlsConnection before(server_->port());
  ASSERT_TRUE(before.ok());
  EXPECT_EQ(before.LeafFingerprint(), started_with);
  ASSERT_TRUE(before.Send(RawCall("/api/ZEPH.Core.Certificate.CRT/1/create", token_,
                                  ZEPH::JsonCompact(CreateParams("in-flight.example")))));
  Json::Value bound = Call("ZEPH.Core.Certificate.Service", "set", BindWebService(id, ""));
  ASSERT_TRUE(bound["success"].asBool()) << bound;
  EXPECT_TRUE(bound["data"]["restart_httpd"].asBool()) << bound;

  // Once the answer is there, new connections get the new certificate.
  TlsConnection after(server_->port());
  ASSERT_TRUE(after.ok());
  EXPECT_EQ(after.LeafFingerprint(), CertFingerprint(id));
  EXPECT_NE(after.LeafFingerprint(), started_with);
  ZEPH::test::HttpReply reply =
      after.Exchange("GET /server/health HTTP/1.1\r\nHost: x\r\nAuthorization: Bearer " + token_ + "\r\n\r\n");
  ASSERT_EQ(reply.status, 200);
  EXPECT_EQ(Parse(reply.body)["data"]["pid"].asInt64(), pid);
  EXPECT_EQ(Parse(reply.body)["data"]["certificate"]["sha256"].asString(), CertFingerprint(id));
  // The call in flight finished on its connection, with its certificate.
  reply = before.Receive();
  ASSERT_EQ(reply.status, 200);
  EXPECT_TRUE(Parse(reply.body)["success"].asBool()) << reply.body;
  EXPECT_EQ(before.LeafFingerprint(), started_with);

  // Another program on the same root binds another certificate: the files
  // change under the server, which takes them up by itself.
  ZEPH::test::CommandResult r =
      ZEPH::test::Run({ZEPH::test::BinDir() + "/zephcert", "--root", root_.dir(), "call",
                       "ZEPH.Core.Certificate.Service", "set", ZEPH::JsonCompact(BindWebService(other, id))});
  ASSERT_EQ(r.status, 0) << r.out << r.err;
  std::string presented;
  for (int i = 0; i < 100 && presented != CertFingerprint(other); ++i) {
    usleep(50 * 1000);
    presented = TlsConnection(server_->port()).LeafFingerprint();
  }
  EXPECT_EQ(presented, CertFingerprint(other));
  EXPECT_EQ(server_->pid(), pid);
  ExpectStillServing();
}

// --- Downloads ----------------------------------------------------------

TEST_F(WebapidTest, ExportsAreDownloadsAndAnExportOfNothingAnswersNothing) {
  Start();
  EXPECT_EQ(Post(kExport, "{\"file\": \"signed_set\"}").status, 204);
  // An EC certificate as a PKCS#12 file; a missing passphrase is an error
  // answer, not a download; the passphrase is never logged.
  Json::Value ec = CreateParams("p12.example");
  ec["key_type"] = "ec256";
  ec["ca_key_type"] = "ec384";
  const std::string id = CreateCertificate(ec);
  const std::string request = "{\"file\": \"archive\", \"id\": \"" + id + "\", \"format\": \"pkcs12\"";
  CurlReply r = Post(kExport, request + ", \"passphrase\": \"over https\"}");
  ASSERT_EQ(r.status, 200) << r.body;
  for (const char* header : {"attachment; filename=\"p12.example.p12\"", "application/x-pkcs12"}) {
    EXPECT_NE(r.headers.find(header), std::string::npos) << r.headers;
  }
  WriteFile(root_.Path("/download.p12"), r.body);
  ZEPH::test::CommandResult info = ZEPH::test::Run({"/usr/bin/openssl", "pkcs12", "-in", root_.Path("/download.p12"),
                                                    "-passin", "pass:over https", "-nokeys"});
  EXPECT_EQ(info.status, 0) << info.err;
  EXPECT_NE(info.out.find("subject=C = DE, ST = Berlin, L = Berlin, O = Zeph, OU = IT, CN = p12.example CA"),
            std::string::npos)
      << info.out;
  r = Post(kExport, request + "}");
  EXPECT_EQ(r.status, 200);
  EXPECT_EQ(Parse(r.body)["error"]["code"].asInt(), 5503) << r.body;
  EXPECT_EQ(server_->Log().find("over https"), std::string::npos);
}

// The Let's Encrypt settings as the page reads and changes them, then one
// certificate for a name and a wildcard from pebble, validated with DNS-01
// at a CA that demands external account binding.
TEST_F(WebapidTest, LetsEncryptSettingsAndAWildcardAgainstPebble) {
  if (!ZEPH::test::LegoInstalled() || !ZEPH::test::PebbleInstalled() || !ZEPH::test::ChallengeServerInstalled()) {
    GTEST_SKIP() << "lego, pebble or pebble-challtestsrv is not installed";
  }
  Start();
  const std::string settings = "/server/letsencrypt/settings";
  Json::Value view = Parse(Get(settings).body)["data"];
  EXPECT_EQ(view["directory"].asString(), "letsencrypt");
  EXPECT_EQ(view["challenge"].asString(), "http");

  // Without DNS-01 a wildcard is refused with the reason.
  Json::Value answer = Call("ZEPH.Core.Certificate.LetsEncrypt", "create",
                            Parse("{\"desc\": \"w\", \"domain_name\": \"*.zeph.test\"}"));
  EXPECT_EQ(answer["error"]["code"].asInt(), 5522) << answer;
  EXPECT_NE(answer["error"]["data"]["msg"].asString().find("DNS-01"), std::string::npos);

  const std::string dir = root_.Path("/pebble");
  ZEPH::test::MakeDirs(dir);
  ZEPH::test::ChallengeServer challenges(dir);
  std::string error;
  ASSERT_TRUE(challenges.Start(&error)) << error;
  ZEPH::test::PebbleOptions options;
  options.dns_server = challenges.DnsAddress();
  options.require_eab = true;
  ZEPH::test::Pebble pebble(dir, options);
  ASSERT_TRUE(pebble.Start(&error)) << error;

  Json::Value update = challenges.ToolSettings();
  update["directory_url"] = pebble.DirectoryUrl();
  update["ca_bundle_pem"] = ReadFile(pebble.ca_file());
  update["eab_kid"] = ZEPH::test::kEabKid;
  update["eab_hmac_key"] = ZEPH::test::kEabHmacKey;
  update["timeout_s"] = 90;
  // Refused as a whole, with the setting named: nothing saved.
  Json::Value bad = update;
  bad["ca_bundle_pem"] = ReadFile(root_.Path(kWebCertDir + "/privkey.pem"));
  CurlReply r = Post(settings, ZEPH::JsonCompact(bad));
  EXPECT_EQ(r.status, 400);
  EXPECT_EQ(Parse(r.body)["error"]["data"]["setting"].asString(), "ca_bundle_pem") << r.body;
  EXPECT_FALSE(Exists(root_.Path("/usr/zeph/etc/letsencrypt/config.json")));
  r = Post(settings, ZEPH::JsonCompact(update));
  ASSERT_EQ(r.status, 200) << r.body;
  view = Parse(r.body)["data"];
  EXPECT_EQ(view["challenge"].asString(), "dns");
  EXPECT_TRUE(view["eab_hmac_key_is_set"].asBool());
  EXPECT_EQ(view["ca_bundle_subjects"].size(), 1u);
  r = Get(settings);
  for (const std::string& secret : {std::string(ZEPH::test::kEabHmacKey), challenges.hook()}) {
    EXPECT_EQ(r.body.find(secret), std::string::npos) << secret;
    EXPECT_EQ(server_->Log().find(secret), std::string::npos) << secret;
  }
  EXPECT_NE(Get("/server/letsencrypt/dns-providers").body.find("\"exec\""), std::string::npos);
  EXPECT_NE(Get("/server/letsencrypt/dns-providers/cloudflare").body.find("CF_DNS_API_TOKEN"), std::string::npos);
  EXPECT_EQ(Get("/server/letsencrypt/dns-providers/nosuch").status, 404);

  answer = Call("ZEPH.Core.Certificate.LetsEncrypt", "create",
                Parse("{\"desc\": \"w\", \"domain_name\": \"nas.zeph.test,*.zeph.test\", "
                      "\"email\": \"admin@zeph.test\"}"));
  ASSERT_TRUE(answer["success"].asBool()) << answer << server_->Log();
  const std::string id = answer["data"]["id"].asString();
  bool found = false;
  const Json::Value list = Call("ZEPH.Core.Certificate.CRT", "list");
  for (const Json::Value& c : list["data"]["certificates"]) {
    if (c["id"].asString() != id) continue;
    found = true;
    EXPECT_EQ(ZEPH::JsonCompact(c["sub_alt_name"]), "[\"nas.zeph.test\",\"*.zeph.test\"]");
    EXPECT_TRUE(c["renewable"].asBool());
  }
  EXPECT_TRUE(found);
}

}  // namespace
