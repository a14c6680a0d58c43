// zeph-webapid end to end with the real module, over curl and a small OpenSSL client: the
// server's own duties, its refusals and its stand against hostile clients.
#include <arpa/inet.h>
#include <ctype.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <openssl/ssl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include "test_support.h"
#include "tools/zeph_letsencrypt/pebble_test_support.h"
#include "webapid_test_support.h"
#include "zeph/json_file.h"
#include "zeph/unique_fd.h"

namespace {

using ZEPH::test::CurlReply;
using ZEPH::test::Exists;
using ZEPH::test::MakeDirs;
using ZEPH::test::PemFingerprint;
using ZEPH::test::ReadFile;
using ZEPH::test::ServerProcess;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;
constexpr auto npos = std::string::npos;

const std::string kArchive = "/usr/zeph/etc/certificate/_archive";
const std::string kWebCertDir = "/usr/zeph/etc/certificate/system/default";
const std::string kList = "/api/ZEPH.Core.Certificate.CRT/1/list";
const std::string kImport = "/api/ZEPH.Core.Certificate/1/import";
const std::string kExport = "/api/ZEPH.Core.Certificate/1/export";

// Plain TCP to 127.0.0.1:port; reads and writes time out rather than hang the test.
ZEPH::UniqueFd ConnectTcp(int port) {
  ZEPH::UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct timeval tv = {30, 0};
  struct sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (!fd || setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv)) != 0 ||
      setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) != 0 ||
      connect(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0) {
    fd.reset();
  }
  return fd;
}

bool ProcessGone(pid_t pid) {  // or a zombie nobody waits for
  const std::string stat = ReadFile("/proc/" + std::to_string(pid) + "/stat");
  const size_t close = stat.rfind(')');  // the state follows the name
  return close == npos || stat.compare(close + 2, 1, "Z") == 0;
}

// The first number of a field of /proc/<pid>/status ("Uid:"); -1 if none.
long StatusField(pid_t pid, const std::string& field) {
  const std::string status = ReadFile("/proc/" + std::to_string(pid) + "/status");
  const size_t at = status.find("\n" + field);
  return at == npos ? -1 : atol(status.c_str() + at + 1 + field.size());
}

// `root` and every process below it, parents before their children.
std::vector<pid_t> ProcessTree(pid_t root) {
  std::vector<pid_t> tree;
  if (root > 0) tree.push_back(root);
  for (size_t i = 0; i < tree.size(); ++i) {
    std::istringstream children(
        ZEPH::test::Run({"/usr/bin/pgrep", "-P", std::to_string(tree[i])}).out);
    for (pid_t pid; children >> pid;) tree.push_back(pid);
  }
  return tree;
}

struct HttpReply {
  int status = 0;  // 0: no reply (the connection failed or closed)
  std::string headers, body;
};

// TLS to 127.0.0.1:port accepting any certificate. `max_version` and `ciphers` (TLS 1.2) limit
// the offer and lift the default security level; 0, "": no limit.
class TlsConnection {
 public:
  explicit TlsConnection(int port, int max_version = 0, const std::string& ciphers = "")
      : ctx_(SSL_CTX_new(TLS_client_method()), SSL_CTX_free), fd_(ConnectTcp(port)) {
    if (!ctx_ || !fd_) return;
    SSL_CTX_set_verify(ctx_.get(), SSL_VERIFY_NONE, nullptr);
    if (max_version != 0 || !ciphers.empty()) {
      SSL_CTX_set_security_level(ctx_.get(), 0);
      SSL_CTX_set_min_proto_version(ctx_.get(), 0);
    }
    if (max_version != 0) SSL_CTX_set_max_proto_version(ctx_.get(), max_version);
    if (!ciphers.empty() && SSL_CTX_set_cipher_list(ctx_.get(), ciphers.c_str()) != 1) return;
    std::unique_ptr<SSL, decltype(&SSL_free)> ssl(SSL_new(ctx_.get()), SSL_free);
    if (ssl && SSL_set_fd(ssl.get(), fd_.get()) == 1 &&
        SSL_set_tlsext_host_name(ssl.get(), "localhost") == 1 && SSL_connect(ssl.get()) == 1) {
      ssl_ = std::move(ssl);
    }
  }
  bool ok() const { return ssl_ != nullptr; }  // the handshake completed
  std::string LeafFingerprint() const {
    if (!ssl_) return "";
    std::unique_ptr<X509, decltype(&X509_free)> cert(SSL_get1_peer_certificate(ssl_.get()),
                                                     X509_free);
    return ZEPH::test::CertFingerprint(cert.get());
  }
  bool Send(const std::string& raw) {
    for (size_t done = 0; ssl_ && done < raw.size();) {
      const int n = SSL_write(ssl_.get(), raw.data() + done, static_cast<int>(raw.size() - done));
      if (n <= 0) return false;
      done += static_cast<size_t>(n);
    }
    return ssl_ != nullptr;
  }
  HttpReply Receive() {  // one answer: headers and a Content-Length body
    HttpReply reply;
    size_t end;
    while ((end = pending_.find("\r\n\r\n")) == std::string::npos) {
      if (!Fill()) return reply;
    }
    reply.headers = pending_.substr(0, end + 2);
    pending_.erase(0, end + 4);
    if (reply.headers.compare(0, 9, "HTTP/1.1 ") == 0) reply.status = atoi(&reply.headers[9]);
    std::string lower = reply.headers;
    for (char& c : lower) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
    const size_t at = lower.find("\r\ncontent-length:");
    const size_t length = at == std::string::npos ? 0 : strtoul(&lower[at + 17], nullptr, 10);
    while (pending_.size() < length && Fill()) continue;
    reply.body = pending_.substr(0, length);
    pending_.erase(0, reply.body.size());
    return reply;
  }
  HttpReply Exchange(const std::string& raw) { return Send(raw) ? Receive() : HttpReply(); }
  bool ClosedByPeer() { return !Fill(); }

 private:
  bool Fill() {
    char buf[16384];
    const int n = ssl_ ? SSL_read(ssl_.get(), buf, sizeof(buf)) : 0;
    if (n > 0) pending_.append(buf, static_cast<size_t>(n));
    return n > 0;
  }

  std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)> ctx_;
  ZEPH::UniqueFd fd_;
  std::unique_ptr<SSL, decltype(&SSL_free)> ssl_{nullptr, SSL_free};
  std::string pending_;
};

Json::Value Parse(const std::string& text) {
  Json::Value value;
  EXPECT_TRUE(ZEPH::JsonParse(text, value)) << text;
  return value;
}

Json::Value CreateParams(const std::string& common_name) {
  Json::Value p = Parse(R"({"country": "DE", "state": "Berlin", "city": "Berlin",
                           "organization": "Zeph", "department": "IT", "email": "a@example.com"})");
  for (const std::string& field : p.getMemberNames()) p["ca_" + field] = p[field];
  p["common_name"] = p["desc"] = common_name;
  p["ca_common_name"] = common_name + " CA";
  return p;
}

std::string RawPost(const std::string& path, const std::string& token, const std::string& rest) {
  return "POST " + path + " HTTP/1.1\r\nHost: x\r\nAuthorization: Bearer " + token + "\r\n" + rest;
}

std::vector<std::string> PostArgs(const std::string& body,
                                  const std::string& type = "application/json",
                                  const std::string& header = "") {
  std::vector<std::string> args = {"-X", "POST", "-H", "Content-Type: " + type, "--data-binary",
                                   body};
  if (!header.empty()) args.insert(args.end(), {"-H", header});
  return args;
}

class WebapidTest : public ::testing::Test {
 protected:
  void SetUp() override { signal(SIGPIPE, SIG_IGN); }  // closed while a client still sends
  void TearDown() override {  // a clean stop (under the sanitizers leaks show here)
    if (server_ && server_->Alive()) {
      EXPECT_EQ(server_->Stop(), 0) << server_->Log();
    }
  }
  void Provision() {
    MakeDirs(root_.Path(kArchive));
    WriteFile(root_.Path(kArchive + "/INFO"), "{}\n");
    ASSERT_TRUE(ZEPH::test::MakeCertSet(root_.Path(kWebCertDir), "start.example"));
  }
  void Start(const std::vector<std::string>& extra = {},
             const std::vector<std::string>& wrapper = {}) {
    if (!Exists(root_.Path(kArchive + "/INFO"))) Provision();
    server_.reset(new ServerProcess(root_.dir(), extra, wrapper));
    ASSERT_TRUE(server_->listening()) << server_->Log();
    token_ = server_->Token();
    ASSERT_FALSE(token_.empty());
  }
  CurlReply Curl(const std::string& path, const std::vector<std::string>& args = {},
                 bool with_token = true) {
    return ZEPH::test::Curl(server_->port(), path, args, with_token ? token_ : "", root_.dir());
  }
  Json::Value Call(const std::string& api, const std::string& method,
                   const Json::Value& params = Json::Value(Json::objectValue)) {
    CurlReply r = Curl("/api/ZEPH.Core.Certificate" + api + "/1/" + method,
                       PostArgs(ZEPH::JsonCompact(params)));
    EXPECT_EQ(r.status, 200) << api << " " << method << ": " << r.body << r.error;
    return Parse(r.body);
  }
  std::string CreateCertificate(const std::string& common_name) {
    Json::Value answer = Call(".CRT", "create", CreateParams(common_name));
    EXPECT_TRUE(answer["success"].asBool()) << answer;
    return answer["data"]["id"].asString();
  }
  std::string CertFingerprint(const std::string& id) {
    return PemFingerprint(root_.Path(kArchive + "/" + id + "/cert.pem"));
  }
  Json::Value BindWebService(const std::string& id, const std::string& old_id) {
    Json::Value services;
    EXPECT_TRUE(ZEPH::JsonFromFile(services, root_.Path(kArchive + "/SERVICES")));
    return Parse("{\"settings\": [{\"service\": " + ZEPH::JsonCompact(services[0]) +
                 ", \"id\": \"" + id + "\", \"old_id\": \"" + old_id + "\"}]}");
  }
  // The same process still answers, no upload is left behind.
  void ExpectServingAndClean() {
    ASSERT_TRUE(server_->Alive()) << server_->Log();
    CurlReply r = Curl("/server/health");
    ASSERT_EQ(r.status, 200) << r.error;
    EXPECT_EQ(Parse(r.body)["data"]["pid"].asInt64(), server_->pid());
    for (const std::string& name : ZEPH::test::DirEntries(root_.Path("/tmp"))) {
      EXPECT_NE(name.compare(0, 20, "zeph-webapid-upload."), 0) << name;
    }
  }
  CurlReply List() {
    return Curl(kList, {"--max-time", "10", "-H", "Content-Type: application/json", "-d", "{}"});
  }
  void ExpectListAnswered(const std::string& during) {
    CurlReply r = List();
    ASSERT_EQ(r.status, 200) << during << ": " << r.error;
    EXPECT_TRUE(Parse(r.body)["success"].asBool()) << during << ": " << r.body;
  }
  // `head`, then `piece` up to `times` times while the server reads, sampling the memory.
  void Stream(const std::string& head, const std::string& piece, size_t times,
              const std::string& tail) {
    TlsConnection tls(server_->port());
    bool open = tls.Send(head);
    ASSERT_TRUE(open);
    for (size_t i = 0; open && i < times; ++i) {
      open = tls.Send(piece);
      if (i % 16 == 0) Sample();
    }
    if (open) tls.Send(tail);
    Sample();
  }
  // The server, nginx's master and its worker, once the worker runs.
  std::vector<pid_t> Tree() {
    std::vector<pid_t> tree = ProcessTree(server_->pid());
    for (int i = 0; i < 100 && tree.size() < 3; ++i) {
      usleep(50 * 1000);
      tree = ProcessTree(server_->pid());
    }
    return tree;
  }
  void Sample() {  // the resident memory of the whole tree
    long kib = 0;
    for (pid_t pid : ProcessTree(server_->pid())) kib += std::max(0L, StatusField(pid, "VmRSS:"));
    peak_kib_ = std::max(peak_kib_, kib);
  }

  TempRoot root_;
  std::unique_ptr<ServerProcess> server_;
  std::string token_;
  long peak_kib_ = 0;
};

TEST_F(WebapidTest, StartRefusalsSayWhyAndLeaveTheRootAlone) {
  // A root with certificates but none for the web service is never reset.
  MakeDirs(root_.Path(kArchive));
  WriteFile(root_.Path(kArchive + "/INFO"), "{\"abcdef\": {}}\n");
  struct Case { std::vector<std::string> extra; int status; const char* logged; };
  const Case cases[] = {{{}, 1, "bind a certificate to the web administration service"},
                        {{"--listen", "nowhere"}, 2, "usage: zeph-webapid"},
                        {{"--module", root_.Path("/missing.so")}, 1, "cannot load module"}};
  for (const Case& c : cases) {
    ServerProcess server(root_.dir(), c.extra);
    EXPECT_EQ(server.Wait(), c.status) << c.logged;
    EXPECT_NE(server.Log().find(c.logged), npos) << server.Log();
    EXPECT_EQ(ReadFile(root_.Path(kArchive + "/INFO")), "{\"abcdef\": {}}\n");
    ASSERT_TRUE(ZEPH::test::MakeCertSet(root_.Path(kWebCertDir), "start.example"));
  }
}

TEST_F(WebapidTest, RefusedRequestsGetTheirStatusAndJsonErrorAndExportsAreDownloads) {
  Start();
  const std::string create = ZEPH::JsonCompact(CreateParams("intruder"));
  const std::string crt = "/api/ZEPH.Core.Certificate.CRT/1/", le = "/server/letsencrypt/";
  const std::pair<std::string, std::string> routes[] = {
      {"POST", crt + "create"}, {"POST", "/api"}, {"GET", crt + "list"}, {"PUT", crt + "list"},
      {"GET", "/server/health"}, {"GET", "/server/events"}, {"GET", le + "settings"},
      {"POST", le + "settings"}, {"GET", le + "dns-providers"}, {"GET", le + "dns-providers/exec"}};
  const std::string auths[] = {"", "Bearer " + std::string(token_.size(), 'f')};
  for (const auto& route : routes) {
    for (const std::string& auth : auths) {
      std::vector<std::string> args = {"-X", route.first, "--data-binary", create, "-H",
                                       "Content-Type: application/json"};
      if (!auth.empty()) args.insert(args.end(), {"-H", "Authorization: " + auth});
      CurlReply r = Curl(route.second, args, false);
      EXPECT_EQ(r.status, 401) << route.first << " " << route.second << " " << auth << r.error;
      EXPECT_EQ(Parse(r.body)["error"]["code"].asInt(), 401) << r.body;
    }
    EXPECT_EQ(Curl(route.second, {"-X", route.first}, false).status, 401) << "no body";
  }
  WriteFile(root_.Path("/key.pem"), "KEY");
  for (const auto& c : {std::make_pair("POST", kImport),
                        std::make_pair("PUT", std::string("/server/health"))}) {
    EXPECT_EQ(Curl(c.second, {"-X", c.first, "-F", "key=@" + root_.Path("/key.pem"), "-F",
                              "params={\"desc\":\"x\"}"}, false).status, 401) << c.second;
  }
  // Without the token no module code ran.
  EXPECT_EQ(ReadFile(root_.Path(kArchive + "/INFO")), "{}\n");
  EXPECT_FALSE(Exists(root_.Path("/var/log/zeph/events.jsonl")));
  WriteFile(root_.Path("/evil.pem"), "whatever");
  WriteFile(root_.Path("/params.json"), "{\"desc\":\"x\",\"cert_tmp\":\"/etc/passwd\"}");
  WriteFile(root_.Path("/big.json"), "{\"desc\":\"" + std::string((1 << 20) + 1, 'x') + "\"}");
  WriteFile(root_.Path("/huge.pem"), std::string((8 << 20) + 1, 'A'));
  const std::string big = "@" + root_.Path("/big.json"), api = "/api/ZEPH.Core.Certificate.";
  const std::string evil = "key=@" + root_.Path("/evil.pem"), json = ";type=application/json";
  const std::string signer = CreateCertificate("signer.example");
  const std::string key =
      ZEPH::JsonCompact(Json::Value(ReadFile(root_.Path(kWebCertDir + "/privkey.pem"))));
  // `message`: a part of the error's data; nullptr: no data.
  struct Case {
    std::string path; std::vector<std::string> args; int status, code; const char* message;
  };
  std::vector<Case> cases = {
      {kList, {}, 405, 405, ""},
      {"/server/nothing", {}, 404, 404, ""},
      {"/server/events?limit=0", {}, 400, 400, ""},
      {"/server/events?limit=x", {}, 400, 400, ""},
      {kImport, {"-F", "params=<" + root_.Path("/params.json"), "-F", evil}, 400, 400, "cert_tmp"},
      {kList, PostArgs("{}", "text/plain"), 415, 415, ""},
      {kList, PostArgs("{}", "multipart/form-data"), 400, 400, ""},
      {kList, PostArgs(big), 413, 413, ""},
      {kList, PostArgs(big, "application/json", "Expect:"), 413, 413, ""},
      {kList, PostArgs(big, "application/json", "Transfer-Encoding: chunked"), 413, 413, ""},
      {kImport, {"-F", "params={\"desc\":\"x\"}" + json, "-F", evil, "-F",
                 "cert=@" + root_.Path("/huge.pem")}, 413, 413, ""},  // a part over 8 MiB
      {kImport, {"-F", "params={\"desc\":\"bad\"}" + json, "-F", evil, "-F",
                 "cert=@" + root_.Path(kWebCertDir + "/cert.pem")}, 200, 5511, "unknown_format"},
      {api + "CSR/1/sign", {"-F", "params={\"id\":\"" + signer + "\",\"days\":30}" + json, "-F",
                            "csr=@" + root_.Path("/evil.pem")}, 200, 5501, nullptr},
      {"/server/letsencrypt/settings", PostArgs("{\"ca_bundle_pem\": " + key + "}"), 400, 400,
       "\"setting\":\"ca_bundle_pem\""},
      {kExport, PostArgs("{\"file\":\"archive\",\"id\":\"" + signer + "\",\"format\":\"pkcs12\"}"),
       200, 5503, nullptr},
      {kImport, {"-H", "Content-Length: 999999999999", "-H", "Expect:", "-X", "POST", "-H",
                 "Content-Type: multipart/form-data; boundary=x", "--data-binary", "--x--"},
       413, 413, ""},
  };
  for (const std::string& path : {std::string("/api/No.Such.API/1/list"), api + "CRT/2/list",
                                  kList + "/more", api + "CRT/one/list", api + "CRT/1/"}) {
    cases.push_back({path, PostArgs("{}"), 404, 404, ""});
  }
  for (const char* body : {"{", "[1]", "\"x\"", "{\"a\":1} trailing", "{\"a\":1,\"a\":2}"}) {
    cases.push_back({kList, PostArgs(body), 400, 400, ""});
  }
  for (const char* name : {"key_tmp", "cert_tmp", "inter_cert_tmp", "csr_tmp"}) {
    const std::string param = std::string("{\"desc\":\"x\",\"") + name + "\":\"";
    cases.push_back({kImport, PostArgs(param + root_.Path("/evil.pem") + "\"}"), 400, 400, name});
  }
  for (const char* id : {"5", "true", "null", "[\"a\"]", "{\"a\":1}", "1.5"}) {
    cases.push_back(
        {api + "CRT/1/recreate", PostArgs(std::string("{\"id\":") + id + "}"), 200, 5503, nullptr});
  }
  for (const auto& c : {std::make_pair("CRT/1/delete", "{\"ids\":[1,2]}"),
                        std::make_pair("Service/1/set", "{\"settings\":\"all\"}"),
                        std::make_pair("CRT/1/set", R"({"id":"abcdef","as_default":"yes"})")}) {
    cases.push_back({api + c.first, PostArgs(c.second), 200, 5503, nullptr});
  }
  for (const Case& c : cases) {
    CurlReply r = Curl(c.path, c.args);
    const std::string what = c.path + " " + (c.args.empty() ? "" : c.args.back()) + ": " + r.body;
    EXPECT_EQ(r.status, c.status) << what << r.error;
    const Json::Value error = Parse(r.body)["error"];
    EXPECT_EQ(error["code"].asInt(), c.code) << what;
    if (c.message == nullptr) {
      EXPECT_TRUE(error["data"].isNull()) << what;
    } else {
      EXPECT_NE(ZEPH::JsonCompact(error["data"]).find(c.message), npos) << what;
      EXPECT_FALSE(error["data"]["message"].asString().empty()) << what;
    }
  }
  EXPECT_EQ(ReadFile(root_.Path("/evil.pem")), "whatever");
  EXPECT_FALSE(Exists(root_.Path("/usr/zeph/etc/letsencrypt/config.json")));
  CurlReply r = Curl(kExport, PostArgs("{\"file\":\"archive\",\"id\":\"" + signer +
                                       "\",\"format\":\"pkcs12\",\"passphrase\":\"over https\"}"));
  EXPECT_NE(r.headers.find("application/x-pkcs12"), npos) << r.status << r.headers;
  EXPECT_EQ(Curl(kExport, PostArgs("{\"file\": \"signed_set\"}")).status, 204);
  EXPECT_EQ(Parse(Curl("/server/events?limit=1").body)["data"]["events"].size(), 1u);
  ExpectServingAndClean();
  EXPECT_EQ(server_->Stop(), 0);
  EXPECT_EQ(server_->Log().find("over https"), npos);  // the passphrase is never logged
}

TEST_F(WebapidTest, OnlyStrongTlsOnlyThePagesOwnFilesAndGarbageLeavesTheServerServing) {
  const std::string web = root_.Path("/web");
  MakeDirs(web + "/test/node_modules/x");
  for (const char* file : {"/index.html", "/app.js", "/style.css"}) WriteFile(web + file, file);
  for (const char* secret : {"/CMakeLists.txt", "/test/node_modules/x/index.html", "/../s.txt"}) {
    WriteFile(web + secret, "SECRET");
  }
  WriteFile(root_.Path("/big.json"), std::string((1 << 20) + 1, ' '));
  Start({"--web", web});
  // The highest version offered, the TLS 1.2 suites, whether it connects.
  const std::tuple<int, const char*, bool> tls_cases[] = {
      {0, "", true},
      {TLS1_2_VERSION, "ECDHE-ECDSA-AES128-GCM-SHA256:ECDHE-RSA-AES128-GCM-SHA256", true},
      {TLS1_2_VERSION, "ECDHE-ECDSA-CHACHA20-POLY1305:ECDHE-RSA-CHACHA20-POLY1305", true},
      {TLS1_2_VERSION, "AES128-GCM-SHA256:AES256-GCM-SHA384", false},  // static RSA
      {TLS1_2_VERSION, "AES128-SHA:AES256-SHA", false},
      {TLS1_2_VERSION, "ECDHE-ECDSA-AES128-SHA:ECDHE-RSA-AES128-SHA", false},  // CBC-SHA1
      {TLS1_2_VERSION, "ECDHE-ECDSA-AES128-SHA256:ECDHE-RSA-AES128-SHA256", false},
      {TLS1_2_VERSION, "DHE-RSA-AES128-GCM-SHA256", false},
      {TLS1_1_VERSION, "", false},
  };
  for (const auto& c : tls_cases) {
    EXPECT_EQ(TlsConnection(server_->port(), std::get<0>(c), std::get<1>(c)).ok(), std::get<2>(c))
        << std::get<0>(c) << " " << std::get<1>(c);
  }
  // Not TLS (read to the server's close), nothing, a handshake that stops.
  const std::pair<std::string, bool> raw[] = {
      {"GET / HTTP/1.1\r\nHost: x\r\n\r\n\x16\x03\x01\xff\xff garbage", true},
      {"", false}, {std::string("\x16\x03\x01\x00\x05\x01\x00", 7), false}};
  for (const auto& c : raw) {
    ZEPH::UniqueFd fd = ConnectTcp(server_->port());
    ASSERT_TRUE(fd);
    ASSERT_EQ(write(fd.get(), c.first.data(), c.first.size()),
              static_cast<ssize_t>(c.first.size()));
    char buf[256];
    while (c.second && read(fd.get(), buf, sizeof(buf)) > 0) continue;
  }
  // Garbage in TLS; a multipart body without its final boundary, whose client goes away (0),
  // or whose part headers never end.
  const std::string head =
      RawPost(kImport, token_, "Content-Type: multipart/form-data; boundary=BOUND\r\n");
  const std::string part =
      "--BOUND\r\nContent-Disposition: form-data; name=\"key\"; filename=\"k.pem\"\r\n\r\n" +
      std::string(50000, 'k') + "\r\n";
  const std::string broken = "--BOUND\r\nContent-Disposition: form-data; name=\"key\"\r\n";
  const std::pair<std::string, int> bodies[] = {
      {"\x01\x02 NONSENSE \xff\r\n\r\n", 400},
      {head + "Content-Length: " + std::to_string(part.size()) + "\r\n\r\n" + part, 400},
      {head + "Content-Length: 900000\r\n\r\n" + part, 0},
      {head + "Content-Length: " + std::to_string(broken.size()) + "\r\n\r\n" + broken, 400},
  };
  for (const auto& c : bodies) {
    TlsConnection tls(server_->port());
    ASSERT_TRUE(tls.Send(c.first));
    if (c.second != 0) {
      EXPECT_EQ(tls.Receive().status, c.second) << c.first.substr(0, 40);
    }
  }
  // The start of the Content-Type; the whole body ("": any).
  struct Case {
    std::string path; std::vector<std::string> args; int status; const char *type, *body, *cache;
  };
  const char* const kJson = "application/json";
  const std::string auth = "Authorization: Bearer " + token_;
  const Case cases[] = {
      {"/", {"--http2"}, 200, "text/html", "/index.html", "no-cache"},
      {"/app.js", {"--http1.1"}, 200, "text/javascript", "/app.js", "no-cache"},
      {"/style.css", {}, 200, "text/css", "/style.css", "no-cache"},
      {"/api.js", {}, 404, kJson, "", "no-cache"},
      {"/CMakeLists.txt", {}, 404, kJson, "", "no-store"},
      {"/test/node_modules/x/index.html", {}, 404, kJson, "", "no-store"},
      {"/app.js%00.html", {}, 400, kJson, "", "no-store"},
      {"/app.js/", {}, 404, kJson, "", "no-store"},
      {"/../s.txt", {}, 400, kJson, "", "no-store"},
      {"/%2e%2e/s.txt", {}, 400, kJson, "", "no-store"},
      {"/..%2fs.txt", {}, 400, kJson, "", "no-store"},
      {"/test/%2e%2e/%2e%2e/s.txt", {}, 400, kJson, "", "no-store"},
      {"/server/health", {"-H", auth}, 200, kJson, "", "no-store"},
      {"/server/health", {}, 401, kJson, "", "no-store"},
      {kList, {"-H", auth, "-X", "POST", "--data-binary", "@" + root_.Path("/big.json")}, 413,
       kJson, "", "no-store"},
  };
  for (Case c : cases) {
    c.args.push_back("--path-as-is");
    CurlReply r = Curl(c.path, c.args, false);
    EXPECT_EQ(r.status, c.status) << c.path;
    std::string headers = r.headers;
    for (char& ch : headers) ch = static_cast<char>(tolower(static_cast<unsigned char>(ch)));
    for (const std::string& header :
         {std::string("content-type: ") + c.type, std::string("cache-control: ") + c.cache,
          std::string("strict-transport-security: max-age="),
          std::string("content-security-policy: default-src 'self'; frame-ancestors 'none'"),
          std::string("x-content-type-options: nosniff"),
          std::string("referrer-policy: no-referrer")}) {
      EXPECT_NE(headers.find(header), npos) << c.path << ": " << header << "\n" << r.headers;
    }
    EXPECT_TRUE(*c.body == '\0' || r.body == c.body) << c.path << ": " << r.body;
    EXPECT_EQ(r.body.find("SECRET"), npos) << c.path;
    EXPECT_TRUE(c.args[0] != "--http2" || r.headers.compare(0, 6, "HTTP/2") == 0) << r.headers;
  }
  ExpectServingAndClean();
}

TEST_F(WebapidTest, CallsRunSideBySideAndNewHandshakesGetANewlyBoundCertificate) {
  Start();
  const std::string started_with = PemFingerprint(root_.Path(kWebCertDir + "/cert.pem"));
  const std::string id = CreateCertificate("handover.example");
  const std::string other = CreateCertificate("other.example");
  const size_t entries = ZEPH::test::DirEntries(root_.Path(kArchive)).size();
  TlsConnection before(server_->port());
  const std::string body = ZEPH::JsonCompact(CreateParams("in-flight.example"));
  ASSERT_TRUE(before.Send(RawPost("/api/ZEPH.Core.Certificate.CRT/1/create", token_,
                                  "Content-Type: application/json\r\nContent-Length: " +
                                      std::to_string(body.size()) + "\r\n\r\n" + body)));
  auto started = [&] { return ZEPH::test::DirEntries(root_.Path(kArchive)).size() > entries; };
  for (int i = 0; i < 3000 && !started(); ++i) usleep(10 * 1000);
  ASSERT_TRUE(started());  // the create made its certificate's directory
  Call(".CRT", "list");  // answered while the create runs
  ASSERT_TRUE(Call(".Service", "set", BindWebService(id, ""))["data"]["restart_httpd"].asBool());
  TlsConnection after(server_->port());
  EXPECT_EQ(after.LeafFingerprint(), CertFingerprint(id));
  EXPECT_EQ(Parse(Curl("/server/health").body)["data"]["certificate"]["sha256"].asString(),
            CertFingerprint(id));
  HttpReply reply = before.Receive();
  EXPECT_TRUE(Parse(reply.body)["success"].asBool()) << reply.status << reply.body;
  EXPECT_EQ(before.LeafFingerprint(), started_with);
  // Another program binds another certificate: the server takes it up by itself.
  ZEPH::test::CommandResult r = ZEPH::test::Run(
      {ZEPH::test::BinDir() + "/zephcert", "--root", root_.dir(), "call",
       "ZEPH.Core.Certificate.Service", "set", ZEPH::JsonCompact(BindWebService(other, id))});
  ASSERT_EQ(r.status, 0) << r.out << r.err;
  std::string presented;
  for (int i = 0; i < 100 && presented != CertFingerprint(other); ++i) {
    usleep(50 * 1000);
    presented = TlsConnection(server_->port()).LeafFingerprint();
  }
  EXPECT_EQ(presented, CertFingerprint(other));
  ExpectServingAndClean();  // the same process all along
}

// A name and a wildcard from pebble with DNS-01 and external account binding.
TEST_F(WebapidTest, LetsEncryptSettingsAndAWildcardAgainstPebble) {
  if (!ZEPH::test::LegoInstalled() || !ZEPH::test::PebbleInstalled() ||
      !ZEPH::test::ChallengeServerInstalled()) {
    GTEST_SKIP() << "lego, pebble or pebble-challtestsrv is not installed";
  }
  Start();
  const std::string settings = "/server/letsencrypt/settings";
  Json::Value answer =
      Call(".LetsEncrypt", "create", Parse("{\"desc\": \"w\", \"domain_name\": \"*.zeph.test\"}"));
  EXPECT_EQ(answer["error"]["code"].asInt(), 5522) << answer;
  EXPECT_NE(answer["error"]["data"]["msg"].asString().find("DNS-01"), npos);
  const std::string dir = root_.Path("/pebble");
  MakeDirs(dir);
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
  CurlReply r = Curl(settings, PostArgs(ZEPH::JsonCompact(update)));
  ASSERT_EQ(r.status, 200) << r.body;
  r = Curl(settings);
  for (const std::string& secret : {std::string(ZEPH::test::kEabHmacKey), challenges.hook()}) {
    EXPECT_EQ(r.body.find(secret), npos) << secret;
    EXPECT_EQ(server_->Log().find(secret), npos) << secret;
  }
  const std::string providers = "/server/letsencrypt/dns-providers";
  EXPECT_NE(Curl(providers).body.find("\"exec\""), npos);
  EXPECT_NE(Curl(providers + "/cloudflare").body.find("CF_DNS_API_TOKEN"), npos);
  EXPECT_EQ(Curl(providers + "/nosuch").status, 404);
  answer = Call(".LetsEncrypt", "create",
                Parse("{\"desc\": \"w\", \"domain_name\": \"nas.zeph.test,*.zeph.test\", "
                      "\"email\": \"admin@zeph.test\"}"));
  ASSERT_TRUE(answer["success"].asBool()) << answer << server_->Log();
  const Json::Value list = Call(".CRT", "list");
  std::string listed;
  for (const Json::Value& c : list["data"]["certificates"]) {
    if (c["id"] == answer["data"]["id"]) {
      listed += ZEPH::JsonCompact(c["sub_alt_name"]) + ZEPH::JsonCompact(c["renewable"]);
    }
  }
  EXPECT_EQ(listed, "[\"nas.zeph.test\",\"*.zeph.test\"]true");
}

// The resident limit of the whole process tree during an attack, far below what any attack
// would take if held in memory (AddressSanitizer adds some 20 MiB).
#if defined(__SANITIZE_ADDRESS__)
constexpr long kTreeLimitKiB = 128 * 1024;
#else
constexpr long kTreeLimitKiB = 64 * 1024;
#endif

std::string Repeat(const std::string& piece, size_t times) {
  std::string out;
  out.reserve(piece.size() * times);
  for (size_t i = 0; i < times; ++i) out += piece;
  return out;
}

std::string UploadHead(const std::string& token, size_t length) {
  return RawPost(kImport, token,
                 "Content-Type: multipart/form-data; boundary=BOUND\r\nContent-Length: " +
                     std::to_string(length) +
                     "\r\n\r\n--BOUND\r\nContent-Disposition: form-data; name=\"key\"; "
                     "filename=\"k.pem\"\r\n\r\n");
}

TEST_F(WebapidTest, EachAttackLeavesTheTreeSmallAndServing) {
  // A large script, so that ranges over it would cost.
  const std::string web = root_.Path("/web");
  MakeDirs(web);
  for (const char* file : {"index.html", "api.js", "style.css"}) WriteFile(web + "/" + file, "x");
  WriteFile(web + "/app.js", std::string(4 << 20, 'a'));
  Start({"--web", web});
  const std::string bomb = root_.Path("/bomb.gz");
  const std::string make_bomb = "head -c 300000000 /dev/zero | gzip -9 > " + bomb;
  ASSERT_EQ(ZEPH::test::Run({"/bin/sh", "-c", make_bomb}).status, 0);
  const std::string mib(1 << 20, 'a'), mib_chunk = "100000\r\n" + mib + "\r\n";
  const std::string chunked = " HTTP/1.1\r\nHost: x\r\nTransfer-Encoding: chunked\r\n\r\n";
  const std::pair<const char*, std::function<void()>> attacks[] = {
      {"a chunked body of 200 MB to a page path",
       [&] { Stream("POST /" + chunked, mib_chunk, 200, "0\r\n\r\n"); }},
      {"a chunked body of 200 MB to the API without a token",
       [&] { Stream("POST " + kList + chunked, mib_chunk, 200, "0\r\n\r\n"); }},
      {"four gzip bodies that unpack to 300 MB each",
       [&] {
         const auto args = PostArgs("@" + bomb, "application/json", "Content-Encoding: gzip");
         for (int i = 0; i < 4; ++i, Sample()) EXPECT_EQ(Curl(kList, args).status, 415);
       }},
      {"2,700 ranges of the script",
       [&] {
         const std::string ranges = Repeat("0-19999,", 2699) + "0-19999";
         CurlReply r = Curl("/app.js", {"-H", "Range: bytes=" + ranges}, false);
         EXPECT_LE(r.body.size(), size_t{4} << 20) << r.status;
       }},
      {"100 ranges over the whole script",
       [&] {
         CurlReply r = Curl("/app.js", {"-H", "Range: bytes=" + Repeat("0-,", 99) + "0-"}, false);
         EXPECT_EQ(std::to_string(r.status) + " " + std::to_string(r.body.size()), "200 4194304");
       }},
      {"a request line of 200 MB",
       [&] { Stream("GET /", mib, 200, " HTTP/1.1\r\nHost: x\r\n\r\n"); }},
      {"20 MB of headers",
       [&] {
         const std::string pad = Repeat("X-Pad: " + std::string(100, 'b') + "\r\n", 10000);
         Stream("GET /server/health HTTP/1.1\r\nHost: x\r\n", pad, 2, "\r\n");
       }},
  };
  for (const auto& attack : attacks) {
    peak_kib_ = 0;
    attack.second();
    Sample();
    EXPECT_LT(peak_kib_, kTreeLimitKiB) << attack.first;
    ExpectListAnswered(attack.first);
  }
}

TEST_F(WebapidTest, NoRequestIsSmuggledAndIdleOrSlowClientsDoNotHoldAnAuthorisedCall) {
  Start();
  // A body over the limit that holds a request: the connection is closed.
  const std::string smuggled =
      "GET /server/health HTTP/1.1\r\nHost: x\r\nAuthorization: Bearer " + token_ + "\r\n\r\n";
  for (const std::string close : {"Connection: close\r\n", ""}) {
    TlsConnection tls(server_->port());
    const std::string head = "Content-Type: application/json\r\nContent-Length: 2000000\r\n";
    EXPECT_EQ(tls.Exchange(RawPost(kList, token_, head + close + "\r\n") + smuggled).status, 413)
        << close;
    EXPECT_TRUE(tls.ClosedByPeer()) << close;
  }
  std::vector<ZEPH::UniqueFd> idle;
  for (int i = 0; i < 500; ++i) {
    idle.push_back(ConnectTcp(server_->port()));
    ASSERT_TRUE(idle.back()) << i;
  }
  std::vector<std::unique_ptr<TlsConnection>> slow;
  for (int i = 0; i < 16; ++i) {
    slow.emplace_back(new TlsConnection(server_->port()));
    ASSERT_TRUE(slow.back()->Send(UploadHead(token_, 1 << 20) + "-----BEGIN"));
  }
  ExpectListAnswered("500 idle connections and 16 slow bodies");
  for (auto& s : slow) ASSERT_TRUE(s->Send(" PRIVATE KEY"));  // still trickling
  ExpectListAnswered("the slow bodies going on");
  Sample();
  EXPECT_LT(peak_kib_, kTreeLimitKiB);
  while (slow.size() < 32) {
    slow.emplace_back(new TlsConnection(server_->port()));
    ASSERT_TRUE(slow.back()->Send(UploadHead(token_, 1 << 20)));
  }
  usleep(200 * 1000);
  EXPECT_EQ(List().status, 429);
  slow.pop_back();
  usleep(200 * 1000);
  ExpectListAnswered("31 slow bodies");
}

TEST_F(WebapidTest, TheTreeSurvivesADeadNginxAndStopsOrIsKilledCleanly) {
  Start();
  std::vector<pid_t> tree = Tree();
  ASSERT_GE(tree.size(), 3u);  // the server, nginx's master and a worker
  kill(tree[1], SIGKILL);      // nginx's master; its worker goes with it
  bool back = false;
  for (int i = 0; i < 100 && !back; ++i) {
    usleep(100 * 1000);
    const std::vector<pid_t> now = ProcessTree(server_->pid());
    back = now.size() >= 3 && now[1] != tree[1];
  }
  ASSERT_TRUE(back) << server_->Log();
  EXPECT_TRUE(ProcessGone(tree[2]));
  ExpectListAnswered("after nginx was started again");
  tree = Tree();
  ASSERT_GE(tree.size(), 3u);
  TlsConnection upload(server_->port());
  ASSERT_TRUE(upload.Send(UploadHead(token_, 4 << 20) + std::string(100000, 'k')));
  usleep(200 * 1000);
  kill(server_->pid(), SIGTERM);
  bool gone = false;
  for (int i = 0; i < 50 && !gone; ++i) {
    usleep(100 * 1000);
    gone = !server_->Alive();
    for (pid_t pid : tree) gone = gone && ProcessGone(pid);
  }
  EXPECT_TRUE(gone) << server_->Log();
  for (pid_t pid : tree) {
    if (!gone) kill(pid, SIGKILL);
  }
  EXPECT_EQ(server_->Wait(), 0) << server_->Log();
  Start();
  const std::string marker = "UPLOADED-KEY-MARKER-" + std::to_string(getpid());
  TlsConnection killed(server_->port());
  ASSERT_TRUE(killed.Send(UploadHead(token_, 4 << 20) + Repeat(marker + "\n", 20000)));
  usleep(500 * 1000);
  for (pid_t pid : Tree()) kill(pid, SIGKILL);
  server_->Wait();
  // What a call killed while its method ran leaves behind.
  const std::string left = root_.Path("/tmp/zeph-webapid-upload.Killed");
  MakeDirs(left);
  WriteFile(left + "/key", marker, 0600);
  Start();
  EXPECT_EQ(ZEPH::test::Run({"/bin/grep", "-rl", marker, root_.Path("/usr"), root_.Path("/run"),
                             root_.Path("/tmp")}).out, "");
  ExpectListAnswered("after the restart");
}

TEST_F(WebapidTest, NginxWorkersRunUnprivileged) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to try both";
  const long www_data = atol(ZEPH::test::Run({"/usr/bin/id", "-u", "www-data"}).out.c_str());
  struct Case { const char* who; std::vector<std::string> wrapper; long server_uid, worker_uid; };
  const Case cases[] = {
      {"root", {}, 0, www_data},
      {"nobody", {"/usr/bin/setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups"},
       65534, 65534},
  };
  Provision();
  for (const Case& c : cases) {
    const std::string owner = std::to_string(c.server_uid);
    ASSERT_EQ(ZEPH::test::Run({"/bin/chown", "-R", owner, root_.dir()}).status, 0);
    Start({}, c.wrapper);
    const std::vector<pid_t> tree = Tree();
    ASSERT_GE(tree.size(), 3u) << c.who;
    for (size_t i = 0; i < tree.size(); ++i) {
      EXPECT_EQ(StatusField(tree[i], "Uid:"), i < 2 ? c.server_uid : c.worker_uid) << c.who << i;
    }
    ExpectListAnswered(c.who);
    EXPECT_EQ(server_->Stop(), 0) << server_->Log();
  }
}

}  // namespace
