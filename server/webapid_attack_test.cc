// zeph-webapid and its nginx against hostile clients on 127.0.0.1: each
// attack is bounded in size and time, and the whole process tree (the
// server, nginx's master and workers) must stay under 64 MiB resident
// while it runs and keep answering an authorised call.
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "test_support.h"
#include "tls_test_support.h"
#include "webapid_test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::Curl;
using ZEPH::test::CurlReply;
using ZEPH::test::ReadFile;
using ZEPH::test::ServerProcess;
using ZEPH::test::TempRoot;
using ZEPH::test::TlsConnection;
using ZEPH::test::WriteFile;

constexpr long kTreeLimitKiB = 64 * 1024;
constexpr char kList[] = "/api/ZEPH.Core.Certificate.CRT/1/list";
constexpr char kImport[] = "/api/ZEPH.Core.Certificate/1/import";

std::string Repeat(const std::string& piece, size_t times) {
  std::string out;
  out.reserve(piece.size() * times);
  for (size_t i = 0; i < times; ++i) out += piece;
  return out;
}

// Headers of an import whose body, `length` bytes, has only begun.
std::string UploadHead(const std::string& token, size_t length) {
  return "POST " + std::string(kImport) + " HTTP/1.1\r\nHost: x\r\n"
         "Authorization: Bearer " + token + "\r\n"
         "Content-Type: multipart/form-data; boundary=BOUND\r\n"
         "Content-Length: " + std::to_string(length) + "\r\n\r\n"
         "--BOUND\r\nContent-Disposition: form-data; name=\"key\"; "
         "filename=\"k.pem\"\r\n\r\n";
}

class WebapidAttackTest : public ::testing::Test {
 protected:
  // The server closes connections it gives up on while they still send.
  void SetUp() override { signal(SIGPIPE, SIG_IGN); }
  // A page whose script is large, so that ranges over it would cost.
  void StartWithLargePage() {
    const std::string web = root_.Path("/web");
    ZEPH::test::MakeDirs(web);
    for (const char* file : {"index.html", "api.js", "style.css"}) {
      WriteFile(web + "/" + file, "x");
    }
    WriteFile(web + "/app.js", std::string(4 << 20, 'a'));
    Start({"--web", web});
  }
  void Start(const std::vector<std::string>& extra = {},
             const std::vector<std::string>& wrapper = {}) {
    server_.reset(new ServerProcess(root_.dir(), extra, wrapper));
    ASSERT_TRUE(server_->listening()) << server_->Log();
    token_ = server_->Token();
  }
  void TearDown() override {
    if (server_ && server_->Alive()) {
      EXPECT_EQ(server_->Stop(), 0);
    }
  }
  // An authorised list, with a client that gives up after 10 s.
  CurlReply List() {
    return Curl(server_->port(), kList,
                {"--max-time", "10", "-X", "POST", "-H",
                 "Content-Type: application/json", "--data-binary", "{}"},
                token_, root_.dir());
  }
  void ExpectListAnswered(const std::string& during) {
    CurlReply r = List();
    ASSERT_EQ(r.status, 200) << during << ": " << r.error;
    Json::Value answer;
    ASSERT_TRUE(ZEPH::JsonParse(r.body, answer)) << r.body;
    EXPECT_TRUE(answer["success"].asBool()) << during << ": " << r.body;
  }
  // Sends `head`, then `piece` up to `times` times (or until the server
  // stops reading), noting the tree's memory every few pieces.
  void Stream(const std::string& head, const std::string& piece, size_t times,
              const std::string& tail = "") {
    TlsConnection tls(server_->port());
    ASSERT_TRUE(tls.ok());
    bool open = tls.Send(head);
    for (size_t i = 0; open && i < times; ++i) {
      open = tls.Send(piece);
      if (i % 16 == 0) Sample();
    }
    if (open) {
      tls.Send(tail);
    }
    Sample();
  }
  // The server, nginx's master and its worker, once the worker runs (the
  // server is told nginx runs before its master started a worker).
  std::vector<pid_t> Tree() {
    std::vector<pid_t> tree = server_->Tree();
    for (int i = 0; i < 100 && tree.size() < 3; ++i) {
      usleep(50 * 1000);
      tree = server_->Tree();
    }
    return tree;
  }
  void Sample() {
    const long kib = server_->TreeRssKiB();
    if (kib > peak_kib_) peak_kib_ = kib;
  }

  TempRoot root_;
  std::unique_ptr<ServerProcess> server_;
  std::string token_;
  long peak_kib_ = 0;
};

TEST_F(WebapidAttackTest, EachAttackLeavesTheTreeSmallAndServing) {
  StartWithLargePage();
  // 300 MB of zeros, gzip'ed to a few hundred KB.
  const std::string bomb = root_.Path("/bomb.gz");
  ASSERT_EQ(ZEPH::test::Run({"/bin/sh", "-c",
                             "head -c 300000000 /dev/zero | gzip -9 > " + bomb})
                .status,
            0);
  const std::string mib(1 << 20, 'a');
  struct Attack {
    const char* name;
    std::function<void()> run;
  };
  const Attack attacks[] = {
      {"a chunked body of 200 MB to a page path",
       [&] {
         Stream("POST / HTTP/1.1\r\nHost: x\r\nTransfer-Encoding: chunked\r\n\r\n",
                "100000\r\n" + mib + "\r\n", 200, "0\r\n\r\n");
       }},
      {"a chunked body of 200 MB to the API without a token",
       [&] {
         Stream("POST " + std::string(kList) +
                    " HTTP/1.1\r\nHost: x\r\nTransfer-Encoding: chunked\r\n\r\n",
                "100000\r\n" + mib + "\r\n", 200, "0\r\n\r\n");
       }},
      {"four gzip bodies that unpack to 300 MB each",
       [&] {
         for (int i = 0; i < 4; ++i) {
           CurlReply r = Curl(server_->port(), kList,
                              {"-X", "POST", "-H", "Content-Encoding: gzip",
                               "-H", "Content-Type: application/json",
                               "--data-binary", "@" + bomb},
                              token_, root_.dir());
           EXPECT_EQ(r.status, 415) << r.body;
           Sample();
         }
       }},
      {"2,700 ranges of the script",
       [&] {
         CurlReply r = Curl(
             server_->port(), "/app.js",
             {"-H", "Range: bytes=" + Repeat("0-19999,", 2699) + "0-19999"},
             "", root_.dir());
         EXPECT_LE(r.body.size(), size_t{4} << 20) << r.status;
         Sample();
       }},
      {"100 ranges over the whole script",
       [&] {
         CurlReply r = Curl(server_->port(), "/app.js",
                            {"-H", "Range: bytes=" + Repeat("0-,", 99) + "0-"},
                            "", root_.dir());
         EXPECT_EQ(r.status, 200);
         EXPECT_EQ(r.body.size(), size_t{4} << 20);
         Sample();
       }},
      {"a request line of 200 MB",
       [&] { Stream("GET /", mib, 200, " HTTP/1.1\r\nHost: x\r\n\r\n"); }},
      {"20 MB of headers",
       [&] {
         Stream("GET /server/health HTTP/1.1\r\nHost: x\r\n",
                Repeat("X-Pad: " + std::string(100, 'b') + "\r\n", 10000), 2,
                "\r\n");
       }},
  };
  for (const Attack& attack : attacks) {
    peak_kib_ = 0;
    attack.run();
    Sample();
    EXPECT_LT(peak_kib_, kTreeLimitKiB) << attack.name;
    ExpectListAnswered(attack.name);
  }
}

TEST_F(WebapidAttackTest, TheBodyOfARefusedRequestIsNeverTakenForAnother) {
  Start();
  // A body over the limit whose first bytes are a request of their own.
  const std::string smuggled =
      "GET /server/health HTTP/1.1\r\nHost: x\r\nAuthorization: Bearer " +
      token_ + "\r\n\r\n";
  for (const std::string& framing :
       {std::string("Content-Length: 2000000\r\nConnection: close\r\n"),
        std::string("Content-Length: 2000000\r\n")}) {
    TlsConnection tls(server_->port());
    ASSERT_TRUE(tls.ok());
    ZEPH::test::HttpReply reply = tls.Exchange(
        "POST " + std::string(kList) + " HTTP/1.1\r\nHost: x\r\n"
        "Authorization: Bearer " + token_ + "\r\n"
        "Content-Type: application/json\r\n" + framing + "\r\n" + smuggled);
    EXPECT_EQ(reply.status, 413) << framing;
    // Nothing more is answered on the connection: it is closed.
    EXPECT_TRUE(tls.ClosedByPeer()) << framing;
  }
}

TEST_F(WebapidAttackTest, IdleConnectionsAndSlowBodiesDoNotHoldAnAuthorisedCall) {
  Start();
  std::vector<ZEPH::UniqueFd> idle;
  for (int i = 0; i < 500; ++i) {
    idle.push_back(ZEPH::test::ConnectTcp(server_->port()));
    ASSERT_TRUE(idle.back()) << i;
  }
  std::vector<std::unique_ptr<TlsConnection>> slow;
  for (int i = 0; i < 16; ++i) {
    slow.emplace_back(new TlsConnection(server_->port()));
    ASSERT_TRUE(slow.back()->ok());
    ASSERT_TRUE(slow.back()->Send(UploadHead(token_, 1 << 20) + "-----BEGIN"));
  }
  ExpectListAnswered("500 idle connections and 16 slow bodies");
  for (auto& s : slow) ASSERT_TRUE(s->Send(" PRIVATE KEY"));  // still trickling
  ExpectListAnswered("the slow bodies going on");
  Sample();
  EXPECT_LT(peak_kib_, kTreeLimitKiB);

  // One address holds at most 32 requests at once.
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

TEST_F(WebapidAttackTest, SigtermStopsEverythingWithinFiveSecondsDuringAnUpload) {
  Start();
  const std::vector<pid_t> tree = Tree();
  ASSERT_GE(tree.size(), 3u);  // the server, nginx's master and a worker
  TlsConnection upload(server_->port());
  ASSERT_TRUE(upload.ok());
  ASSERT_TRUE(upload.Send(UploadHead(token_, 4 << 20) + std::string(100000, 'k')));
  usleep(200 * 1000);
  kill(server_->pid(), SIGTERM);
  bool gone = false;
  for (int i = 0; i < 50 && !gone; ++i) {
    usleep(100 * 1000);
    gone = !server_->Alive();
    for (pid_t pid : tree) gone = gone && ZEPH::test::ProcessGone(pid);
  }
  EXPECT_TRUE(gone) << server_->Log();
  if (!gone) {
    for (pid_t pid : tree) kill(pid, SIGKILL);
  }
  EXPECT_EQ(server_->Wait(), 0) << server_->Log();
}

TEST_F(WebapidAttackTest, AnUploadCutShortBySigkillIsGoneAfterARestart) {
  Start();
  const std::string marker = "UPLOADED-KEY-MARKER-" + std::to_string(getpid());
  TlsConnection upload(server_->port());
  ASSERT_TRUE(upload.ok());
  ASSERT_TRUE(upload.Send(UploadHead(token_, 4 << 20) +
                          Repeat(marker + "\n", 20000)));
  usleep(500 * 1000);
  // Everything killed at once, as a power cut or an OOM kill would.
  for (pid_t pid : Tree()) kill(pid, SIGKILL);
  server_->Wait();
  // What a call killed while its method ran leaves: the uploaded parts,
  // whole, where the method reads them.
  const std::string left = root_.Path("/tmp/zeph-webapid-upload.Killed");
  ZEPH::test::MakeDirs(left);
  WriteFile(left + "/key", marker, 0600);
  const std::string grep = "grep -rl " + marker + " " + root_.dir() + "/usr " +
                           root_.dir() + "/run " + root_.dir() + "/tmp";
  Start();
  EXPECT_EQ(ZEPH::test::Run({"/bin/sh", "-c", grep}).out, "");
  ExpectListAnswered("after the restart");
}

TEST_F(WebapidAttackTest, AnNginxThatDiesIsStartedAgain) {
  Start();
  const std::vector<pid_t> tree = Tree();
  ASSERT_GE(tree.size(), 3u);
  kill(tree[1], SIGKILL);  // nginx's master; its worker goes with it
  bool back = false;
  for (int i = 0; i < 100 && !back; ++i) {
    usleep(100 * 1000);
    const std::vector<pid_t> now = server_->Tree();
    back = now.size() >= 3 && now[1] != tree[1];
  }
  ASSERT_TRUE(back) << server_->Log();
  EXPECT_TRUE(ZEPH::test::ProcessGone(tree[2]));
  ExpectListAnswered("after nginx was started again");
  EXPECT_NE(server_->Log().find("nginx ended"), std::string::npos);
}

// Started as root, only zeph-webapid (which runs the module) and nginx's
// master keep root; started by another user, everything runs as that user.
TEST_F(WebapidAttackTest, NginxWorkersRunUnprivileged) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to try both";
  struct Case {
    const char* who;
    std::vector<std::string> wrapper;
    long server_uid, worker_uid;
  };
  const long nobody = 65534;
  const long www_data =
      atol(ZEPH::test::Run({"/usr/bin/id", "-u", "www-data"}).out.c_str());
  const Case cases[] = {
      {"root", {}, 0, www_data},
      {"nobody",
       {"/usr/bin/setpriv", "--reuid=nobody", "--regid=nogroup",
        "--clear-groups"},
       nobody, nobody},
  };
  for (const Case& c : cases) {
    ASSERT_EQ(ZEPH::test::Run({"/bin/chown", "-R",
                               std::to_string(c.server_uid), root_.dir()})
                  .status,
              0);
    Start({}, c.wrapper);
    const std::vector<pid_t> tree = Tree();
    ASSERT_GE(tree.size(), 3u) << c.who;
    // The wrapper execs the server: the first process is the server.
    EXPECT_EQ(ZEPH::test::ProcessUid(tree[0]), c.server_uid) << c.who;
    EXPECT_EQ(ZEPH::test::ProcessUid(tree[1]), c.server_uid) << c.who;
    for (size_t i = 2; i < tree.size(); ++i) {
      EXPECT_EQ(ZEPH::test::ProcessUid(tree[i]), c.worker_uid) << c.who;
    }
    ExpectListAnswered(c.who);
    EXPECT_EQ(server_->Stop(), 0) << server_->Log();
  }
}

}  // namespace
