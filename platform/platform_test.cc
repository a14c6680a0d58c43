#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include "test_support.h"
#include "zeph/api.h"
#include "zeph/json_file.h"
#include "zeph/log.h"
#include "zeph/parameter_checker.h"
#include "zeph/qlibc_error.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_file.h"
#include "zeph/qlibc_lock.h"
#include "zeph/qlibc_string.h"
#include "zeph/qlibc_support.h"
#include "zeph/root.h"
#include "zeph/server_form_handler.h"
#include "zeph/system.h"
#include "zeph/unique_fd.h"

namespace {

using ZEPH::test::Exists;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;

Json::Value Parse(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(ZEPH::JsonParse(text, v)) << text;
  return v;
}

struct RecordingSink : ZEPH::DownloadSink {
  bool Deliver(const ZEPH::HeaderList& headers, const std::string& path) override {
    headers_ = headers;
    path_ = path;
    return true;
  }
  ZEPH::HeaderList headers_;
  std::string path_;
};

struct FormHandler : ServerFormHandler {
  FormHandler() : ServerFormHandler(true, "formtest") {}
  void HandleLoadAction(ZEPH::APIRequest*, ZEPH::APIResponse* r) override { r->SetSuccess("load"); }
  void HandleApplyAction(ZEPH::APIRequest*, ZEPH::APIResponse* r) override {
    r->SetSuccess("apply");
  }
};

std::string ReadAndClose(FILE* f, int* status) {
  std::string out;
  char buf[256];
  for (size_t n; (n = fread(buf, 1, sizeof(buf), f)) > 0;) out.append(buf, n);
  *status = QLIBCPclose(f);
  return out;
}

int Lock(const std::string& path, int mode, int seconds) {
  int fd = -7;
  return QLIBCFileLockTimeByFile(path.c_str(), mode, seconds, &fd) ? fd : -1;
}

Json::Value Rule(int type, bool necessary) {
  return Parse("{\"field\": {\"p\": {\"type\": " + std::to_string(type) +
               ", \"necessary\": " + (necessary ? "true" : "false") + "}}}");
}

class PlatformTest : public ::testing::Test {
 protected:
  TempRoot root;
};

TEST_F(PlatformTest, LogLinesAndThePerThreadLastError) {
  ZEPH::log::Write(LOG_ERR, "utils", 42, "Failed to remove %s [%d]", "/x", 2);
  QLIBCErrSet(QLIBC_ERR_NOT_FOUND, "/src/platform/qlibc_file.cc", 17);
  ZEPH::log::WriteWithLibError(LOG_ERR, "mkcert", 7, "Broken [%s].", "/INFO");
  errno = ENOENT;
  ZEPH_LOG(LOG_DEBUG, "certificate", "Failed to open %s (%m)", "/p");
  const int line = __LINE__ - 1;
  EXPECT_EQ(errno, ENOENT);
  const std::string big(5000, 'x');
  ZEPH::log::Write(LOG_ERR, "utils", 1, "%s", big.c_str());
  EXPECT_EQ(root.Log(), "utils:42 Failed to remove /x [2]\n"
                        "mkcert:7 Broken [/INFO].[0x0002 qlibc_file.cc:17]\n"
                        "certificate:" + std::to_string(line) + " Failed to open /p (No such "
                        "file or directory)\nutils:1 " + big + "\n");
  QLIBCErrSet(QLIBC_ERR_IO, "main.cc", 1);
  int other = -1;
  std::thread([&] { other = QLIBCErrGet(); }).join();
  EXPECT_TRUE(other == QLIBC_ERR_NONE && QLIBCErrGet() == QLIBC_ERR_IO);
  EXPECT_STREQ(QLIBCErrorGetFile(), "main.cc");
}

TEST_F(PlatformTest, LocksExcludeHoldersAndGiveUpAfterTheirWait) {
  // Every lock opens the file anew: holders in one process exclude each other like processes.
  const std::string path = root.Path("/tmp/test.lock");
  const int writer = Lock(path, QLIBC_LOCK_EXCLUSIVE, 0);
  ASSERT_GE(writer, 0);
  for (int mode : {QLIBC_LOCK_SHARED, QLIBC_LOCK_EXCLUSIVE}) {
    EXPECT_EQ(Lock(path, mode, 1), -1);
    EXPECT_EQ(QLIBCErrGet(), QLIBC_ERR_TIMEOUT);
  }
  std::thread holder([writer] { usleep(300 * 1000); QLIBCFileUnlockByFile(writer); });
  const int waiter = Lock(path, QLIBC_LOCK_EXCLUSIVE, 10);
  holder.join();
  ASSERT_GE(waiter, 0);
  EXPECT_NE(QLIBCFileUnlockByFile(waiter), 0);
  const int reader = Lock(path, QLIBC_LOCK_SHARED, 0), second = Lock(path, QLIBC_LOCK_SHARED, 0);
  ASSERT_TRUE(reader >= 0 && second >= 0);
  EXPECT_EQ(Lock(path, QLIBC_LOCK_EXCLUSIVE, 0), -1);
  EXPECT_TRUE(QLIBCFileUnlockByFile(reader) && QLIBCFileUnlockByFile(second));
  int fd = -1;
  EXPECT_FALSE(QLIBCFileLockTimeByFile(nullptr, 1, 1, &fd) ||
               QLIBCFileLockTimeByFile(path.c_str(), 2, 1, &fd) ||
               QLIBCFileLockTimeByFile(path.c_str(), 1, 1, nullptr));
  EXPECT_EQ(Lock(root.Path("/missing/x.lock"), 1, 0), -1);  // no directory is made
  EXPECT_EQ(QLIBCErrGet(), QLIBC_ERR_NOT_FOUND);
  EXPECT_EQ(QLIBCFileUnlockByFile(-1), 0);
}

TEST_F(PlatformTest, RootPathsDirectoriesAndUsers) {
  EXPECT_EQ(ZEPH::RootPath("relative"), "relative");
  setenv("ZEPH_ROOT", (root.dir() + "//").c_str(), 1);
  EXPECT_EQ(ZEPH::RootPath("/tmp/x.lock"), root.dir() + "/tmp/x.lock");
  for (const char* real : {"", "/"}) {
    setenv("ZEPH_ROOT", real, 1);
    EXPECT_EQ(ZEPH::RootPath("/tmp/x.lock"), "/tmp/x.lock");
    EXPECT_EQ(ZEPH::RootDir(), "");
  }
  unsetenv("ZEPH_ROOT");
  EXPECT_EQ(ZEPH::RootPath("/usr/zeph"), "/usr/zeph");
  setenv("ZEPH_ROOT", root.dir().c_str(), 1);
  const struct { const char* path; int parents_mode; mode_t mode, umask; const char* parent;
                 mode_t parent_mode; } made[] = {
      {"/a/b/c", 0, 0700, 022, "/a", 0755}, {"/a/b/c", 0, 0755, 022, "/a/b/c", 0700},
      {"/wide", 0, 0755, 077, "/wide", 0755}, {"/p/q", 1, 0711, 022, "/p", 0711}};
  for (const auto& m : made) {
    umask(m.umask);
    ASSERT_EQ(ZEPHFSMkdirP(root.Path(m.path).c_str(), nullptr, 1, m.parents_mode, 0, m.mode), 0);
    EXPECT_EQ(ModeOf(root.Path(m.parent)), m.parent_mode) << m.path;
  }
  umask(022);
  WriteFile(root.Path("/file"), "x");
  for (const auto& bad : {std::make_pair("/file", 1), std::make_pair("/file/sub", 1),
                          std::make_pair("/no/parents", 0)}) {
    EXPECT_EQ(ZEPHFSMkdirP(root.Path(bad.first).c_str(), nullptr, bad.second, 0, 0, 0755), -1);
  }
  EXPECT_FALSE(Exists(root.Path("/no")));
  EXPECT_EQ(ZEPHFSMkdirP("", nullptr, 1, 0, 0, 0755), -1);
  EXPECT_EQ(ZEPHFSMkdirP(root.Path("/r").c_str(), nullptr, 1, 0, 7, 0755), -1);
  EXPECT_EQ(ZEPHFSMkdirP(root.Path("/o").c_str(), "no-such-user-zeph", 1, 0, 0, 0755), -1);
  uid_t uid = 99, gid = 99;
  ASSERT_EQ(ZEPHUserGetUGID("root", &uid, &gid), 0);
  EXPECT_EQ(uid + gid, 0u);
  for (const char* user : {"no-such-user-zeph", "", static_cast<const char*>(nullptr)}) {
    EXPECT_EQ(ZEPHUserGetUGID(user, &uid, &gid), -1);
  }
  EXPECT_FALSE(ZEPHSystemdReload("zephrelayd"));  // never the host's under a private root
}

TEST_F(PlatformTest, EventsAreWholeLinesAndFeatureSwitchesTakeTheLastLine) {
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([t] {
      const std::string text(200, static_cast<char>('a' + t));
      for (int i = 0; i < 50; ++i) {
        ASSERT_EQ(ZEPHLogSet1(1, t, 0x12B00003u, text.c_str(), "id", nullptr, "x"), 0);
      }
    });
  }
  for (auto& th : threads) th.join();
  const std::string log = ReadFile(root.Path("/var/log/zeph/events.jsonl"));
  size_t lines = 0, start = 0;
  for (size_t nl; (nl = log.find('\n', start)) != std::string::npos; start = nl + 1, ++lines) {
    const Json::Value event = Parse(log.substr(start, nl - start));
    EXPECT_EQ(event["text1"].asString().size(), 200u);
    EXPECT_EQ(event["text3"], "");
  }
  EXPECT_EQ(lines, 400u);
  EXPECT_EQ(QLIBCSupportGet("support_self_sign_cert"), 0);
  ZEPH::test::MakeDirs(root.Path("/usr/zeph/etc"));
  WriteFile(root.Path("/usr/zeph/etc/features.conf"),
            "# features\nsupport_self_sign_cert = yes\nother=no\nflip=yes\nflip=no\n"
            "support_self_sign_cert_extra=yes\n");
  EXPECT_EQ(QLIBCSupportGet("support_self_sign_cert"), 1);
  for (const char* off : {"other", "flip", "missing", "", static_cast<const char*>(nullptr)}) {
    EXPECT_EQ(QLIBCSupportGet(off), 0) << (off ? off : "null");
  }
}

TEST_F(PlatformTest, ParametersStringListsAddressesAndRequests) {
  const struct { int type; std::vector<const char*> fit, misfit; } types[] = {
      {4, {"\"text\"", "\"\""}, {"5", "true", "null", "[\"a\"]"}},
      {5, {"true", "false"}, {"\"true\"", "1"}},
      {8, {"[]", "[\"a\", \"b\"]"}, {"[\"a\", 1]", "\"a\"", "{}"}},
      {13, {"[]", "[{\"a\": 1}]", "[5, {}]"}, {"{}", "\"x\""}},  // elements are the worker's
      {15, {"5", "-3", "0"}, {"5.0", "5.5", "\"5\"", "4294967296", "true"}},
      {99, {}, {"\"text\""}},
  };
  for (const auto& c : types) {
    for (bool fits : {true, false}) {
      for (const char* value : fits ? c.fit : c.misfit) {
        ZEPH::APIRequest request(Parse(std::string("{\"p\": ") + value + "}"));
        EXPECT_EQ(ParameterChecker::check(&request, Rule(c.type, true)), fits) << c.type << value;
      }
    }
  }
  ZEPH::APIRequest empty;
  EXPECT_FALSE(ParameterChecker::check(&empty, Rule(4, true)));
  EXPECT_TRUE(ParameterChecker::check(&empty, Rule(4, false)));
  Json::Value rules = Rule(4, true);
  rules["field"]["q"] = Parse("{\"type\": 5, \"necessary\": false}");
  ZEPH::APIRequest ok(Parse("{\"p\": \"x\", \"extra\": 1}"));
  EXPECT_TRUE(ParameterChecker::check(&ok, rules));
  ZEPH::APIRequest bad(Parse("{\"p\": \"x\", \"q\": \"yes\"}"));
  EXPECT_FALSE(ParameterChecker::check(&bad, rules));
  for (const char* r : {"null", "{}", "{\"field\": []}", "{\"field\": {\"p\": 4}}",
                        "{\"field\": {\"p\": {\"type\": \"4\", \"necessary\": true}}}",
                        "{\"field\": {\"p\": {\"type\": 4, \"necessary\": 1}}}"}) {
    EXPECT_FALSE(ParameterChecker::check(&ok, Parse(r))) << r;
  }
  EXPECT_FALSE(ParameterChecker::check(nullptr, rules));
  using V = std::vector<std::string>;
  const std::pair<const char*, V> splits[] = {
      {";nas1;;10.0.0.1", {"", "nas1", "", "10.0.0.1"}}, {"", {""}}, {"a;", {"a", ""}},
      {"a;b;c;d;e", {"a", "b", "c", "d", "e"}}};
  for (const auto& c : splits) {
    ZEPH::UniqueSzList list(QLIBCSzListAlloc(2));  // grows past its capacity
    ASSERT_EQ(QLIBCStrSep(c.first, ";", list.get()), 0);
    V pieces;
    for (int i = 0; i < list->count; ++i) pieces.push_back(QLIBCSzListGet(list.get(), i));
    EXPECT_EQ(pieces, c.second) << c.first;
    EXPECT_EQ(QLIBCSzListGet(list.get(), list->count), nullptr);
    EXPECT_EQ(QLIBCSzListGet(list.get(), -1), nullptr);
  }
  ZEPH::UniqueSzList list(QLIBCSzListAlloc(1));
  EXPECT_TRUE(QLIBCStrSep(nullptr, ";", list.get()) == -1 && QLIBCStrSep("a", ";", nullptr) == -1);
  EXPECT_EQ(QLIBCSzListAlloc(0), nullptr);
  for (const char* ip : {"10.0.0.5", "::1", "::ffff:10.0.0.1"}) EXPECT_EQ(BlQLIBIsIpAddr(ip), 1);
  for (const char* name :
       {"nas1", "", "10.0.0.256", "10.0.0.5 ", "fe80::1%eth0", static_cast<const char*>(nullptr)}) {
    EXPECT_EQ(BlQLIBIsIpAddr(name), 0) << (name ? name : "null");
  }
  ZEPH::APIRequest request(Parse("{\"id\": \"Ab3xYz\"}")), not_object(Json::Value(5));
  EXPECT_EQ(request.GetParam("desc", "fallback").asString(), "fallback");
  EXPECT_FALSE(request.HasParam("desc") || not_object.HasParam("id"));
  EXPECT_EQ(not_object.GetParam("id", 7).asInt(), 7);
  ZEPH::APIResponse response;  // the last outcome counts
  response.SetError(5503, Json::Value());
  response.SetSuccess("x");
  EXPECT_TRUE(response.outcome() == ZEPH::APIResponse::Outcome::kSuccess &&
              response.outcome_count() == 2);
}

TEST_F(PlatformTest, DownloadsGoToTheInnermostSinkAndFormsRunUnderTheirLock) {
  EXPECT_FALSE(ZEPH::APIDownload().Output("/x"));
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
  EXPECT_EQ(inner.headers_, (ZEPH::HeaderList{{"Content-Type", "application/zip"}}));
  EXPECT_TRUE(ZEPH::APIDownload().Output("/outer"));
  EXPECT_EQ(outer.path_, "/outer");
  for (const char* action : {"load", "apply"}) {
    FormHandler handler;
    ZEPH::APIRequest form(Parse(std::string("{\"action\": \"") + action + "\"}"));
    ZEPH::APIResponse answer;
    EXPECT_TRUE(handler.Process(&form, &answer));
    EXPECT_EQ(answer.data().asString(), action);
    EXPECT_TRUE(Exists(root.Path("/tmp/formtest.lock")));
  }
  ServerFormHandler base(false, nullptr);
  ZEPH::APIResponse answer;
  ZEPH::APIRequest no_action(Parse("{\"id\": \"Ab3xYz\"}"));
  base.Process(&no_action, &answer);
  EXPECT_EQ(answer.error_code(), 5501);
}

TEST_F(PlatformTest, ChildrenGetEachArgumentAsOneWordAndNoStrayDescriptor) {
  const std::string out_path = root.Path("/out");
  const char* out = out_path.c_str();
  EXPECT_EQ(QLIBCExec("/bin/sh", "-c", "exit 7", nullptr, nullptr), 7);
  EXPECT_EQ(QLIBCExec("/bin/sh", "-c", "kill -TERM $$", nullptr, nullptr), 128 + 15);
  QLIBCErrClear();
  EXPECT_LT(QLIBCExec("/nonexistent/tool", nullptr, nullptr, nullptr, nullptr), 0);
  EXPECT_EQ(QLIBCErrGet(), QLIBC_ERR_EXEC);
  EXPECT_LT(QLIBCExecl(nullptr, QLIBC_EXEC_WAIT, "x", nullptr), 0);
  const char* tricky = "a b;$(touch pwned)'\"*";
  ASSERT_EQ(QLIBCExec("/bin/sh", "-c", "printf '%s|' \"$@\" > \"$0\"", out, tricky), 0);
  EXPECT_EQ(ReadFile(out_path), std::string(tricky) + "|");
  EXPECT_FALSE(Exists("pwned"));
  ASSERT_EQ(QLIBCExec("/bin/sh", "-c", "echo $# > \"$0\"", out, nullptr), 0);
  EXPECT_EQ(ReadFile(out_path), "0\n");
  const char kIsStdoutNull[] =
      "if [ /dev/null -ef /proc/$$/fd/1 ]; then r=null; else r=other; fi; echo $r,$1 > \"$0\"";
  for (const auto& c : {std::make_pair(0xBB, "null"), std::make_pair(0x1BB, "null"),
                        std::make_pair(int{QLIBC_EXEC_WAIT}, "other")}) {
    ASSERT_EQ(QLIBCExecl("/bin/sh", c.first, "-c", kIsStdoutNull, out, "one two", nullptr), 0);
    EXPECT_EQ(ReadFile(out_path), std::string(c.second) + ",one two\n") << c.first;
  }
  // A descriptor opened without O_CLOEXEC still does not reach the child.
  int status = 0, leaky = fcntl(0, F_DUPFD, 100);
  ASSERT_GE(leaky, 100);
  FILE* child = QLIBCPopen("/bin/ls", "r", "/proc/self/fd", nullptr);
  ASSERT_NE(child, nullptr);
  EXPECT_EQ(ReadAndClose(child, &status), "0\n1\n2\n3\n");
  EXPECT_EQ(status, 0);
  close(leaky);
  child = QLIBCPopen("/bin/sh", "r", "-c", "echo partial; exit 3", nullptr);
  ASSERT_NE(child, nullptr);
  EXPECT_EQ(ReadAndClose(child, &status), "partial\n");
  EXPECT_EQ(status, -1);
  EXPECT_TRUE(QLIBCPopen("/nonexistent/tool", "r", "x", nullptr) == nullptr &&
              QLIBCPopen("/bin/echo", "w", "x", nullptr) == nullptr && QLIBCPclose(nullptr) == -1);
}

TEST_F(PlatformTest, FilesByteOrderMarksLinesAndJson) {
  const std::string file = root.Path("/f"), pem = root.Path("/pem");
  WriteFile(file, "x");
  ASSERT_EQ(symlink("/nonexistent", root.Path("/dangling").c_str()), 0);
  ASSERT_EQ(symlink(root.dir().c_str(), root.Path("/dirlink").c_str()), 0);
  const struct { std::string path; bool exists, is_dir; } cases[] = {
      {file, true, false}, {root.Path("/dirlink"), true, true},
      {root.Path("/dangling"), false, false}};
  for (const auto& c : cases) {
    EXPECT_EQ(QLIBCFileExist(c.path.c_str()), c.exists) << c.path;
    EXPECT_EQ(QLIBCFileCheckDir(c.path.c_str()), c.is_dir) << c.path;
  }
  EXPECT_FALSE(QLIBCFileExist(nullptr));
  const std::string bom = "\xEF\xBB\xBF", text = "-----BEGIN X-----\n";
  WriteFile(pem, bom + text + bom, 0640);
  struct stat before, after;
  ASSERT_EQ(stat(pem.c_str(), &before), 0);
  EXPECT_EQ(QLIBCFileUTF8BomStrip(pem.c_str()), 0);
  EXPECT_EQ(ReadFile(pem), text + bom);
  ASSERT_EQ(stat(pem.c_str(), &after), 0);
  EXPECT_EQ(before.st_ino, after.st_ino);
  EXPECT_EQ(after.st_mode & 0777, 0640u);
  for (const auto& c : {std::make_pair(text, text), std::make_pair(bom, std::string())}) {
    WriteFile(pem, c.first);
    EXPECT_EQ(QLIBCFileUTF8BomStrip(pem.c_str()), 0);
    EXPECT_EQ(ReadFile(pem), c.second);
  }
  EXPECT_TRUE(QLIBCFileUTF8BomStrip(root.Path("/missing").c_str()) == -1 &&
              QLIBCFileUTF8BomStrip(nullptr) == -1);
  WriteFile(file, "Ab3xYz\nsecond\n");
  ZEPH::UniqueFile f(fopen(file.c_str(), "re"));
  ASSERT_TRUE(f);
  char buf[16];
  for (const auto& c : {std::make_pair(16, "Ab3xYz\n"), std::make_pair(4, "sec"),
                        std::make_pair(16, "ond\n")}) {
    ASSERT_NE(QLIBCFgets(buf, c.first, f.get()), nullptr);
    EXPECT_STREQ(buf, c.second);
  }
  EXPECT_EQ(QLIBCFgets(buf, sizeof(buf), f.get()), nullptr);
  EXPECT_TRUE(!QLIBCFgets(buf, 1, f.get()) && !QLIBCFgets(nullptr, 16, f.get()));
  const Json::Value info = Parse("{\"Ab3xYz\": {\"desc\": \"caf\xC3\xA9 \\\"q\\\"\"}}");
  Json::Value back, value("unchanged");
  for (bool styled : {true, false}) {
    ASSERT_TRUE(ZEPH::JsonToFile(info, root.Path("/INFO"), styled));
    ASSERT_TRUE(ZEPH::JsonFromFile(back, root.Path("/INFO")));
    EXPECT_EQ(back, info);
  }
  EXPECT_FALSE(ZEPH::JsonToFile(info, root.Path("/missing/INFO"), true));
  EXPECT_FALSE(ZEPH::JsonFromFile(value, root.Path("/missing")));
  for (const char* json : {"", "{", "{\"a\": 1} trailing", "{\"a\": 1,}", "// comment\n{}"}) {
    WriteFile(root.Path("/bad"), json);
    EXPECT_FALSE(ZEPH::JsonFromFile(value, root.Path("/bad"))) << json;
    EXPECT_EQ(value, Json::Value("unchanged"));
  }
}

}  // namespace
