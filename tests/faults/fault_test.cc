// Injected faults: each method is run through zephcert with the fault shim
// preloaded, failing one rename, write, open, process start or chown at
// the 1st, 2nd, ... occurrence until the method gets through without
// meeting the fault. Whatever fails, the method answers (an error code or
// success), the catalogue stays readable with no service bound twice, and
// every certificate the archive had before keeps its files.
//
// And a lock held by a stuck process makes a method give up after its
// wait instead of hanging.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <map>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "faults/fault_support.h"
#include "test_support.h"
#include "zeph/json_file.h"

extern char** environ;

namespace {

using ZEPH::test::ArchiveFixture;
using ZEPH::test::CommandResult;
using ZEPH::test::Exists;
using ZEPH::test::kArchive;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;

// Beyond this many occurrences a method is not expected to go.
const int kMaxOccurrence = 60;

std::string Shim() { return ZEPH::test::BinDir() + "/libzeph_fault_shim.so"; }

struct Outcome {
  int status = -1;
  Json::Value answer;
  std::string out;
};

class Faults : public ArchiveFixture {
 protected:
  void SetUp() override {
    ASSERT_EQ(Zephcert({"init"}).status, 0);
    other_ = Create(false);
    ASSERT_EQ(other_.size(), 6u);
  }

  // Runs one method with `call` failing at occurrence `at`; whether the
  // fault fired.
  bool RunWithFault(const std::string& call, int at, const std::string& match,
                    const std::string& api, const std::string& method,
                    const Json::Value& params, Outcome& outcome) {
    const std::string report = root_.Path("/fault-report");
    unlink(report.c_str());
    std::vector<std::string> env_strings = {
        "LD_PRELOAD=" + Shim(), "ZEPH_FAULT_CALL=" + call,
        "ZEPH_FAULT_AT=" + std::to_string(at), "ZEPH_FAULT_MATCH=" + match,
        "ZEPH_FAULT_REPORT=" + report,
        // A sanitizer build wants its runtime first; the shim comes first.
        "ASAN_OPTIONS=verify_asan_link_order=0"};
    for (char** e = environ; *e != nullptr; ++e) env_strings.push_back(*e);
    std::vector<char*> envp;
    for (std::string& s : env_strings) envp.push_back(&s[0]);
    envp.push_back(nullptr);
    const std::string out_path = root_.Path("/fault-out");
    std::vector<std::string> argv = {ZEPH::test::BinDir() + "/zephcert", "--root",
                                     root_.dir(), "call", api, method,
                                     ZEPH::JsonCompact(params)};
    std::vector<char*> args;
    for (std::string& a : argv) args.push_back(&a[0]);
    args.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, out_path.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0644);
    pid_t pid;
    int rc = posix_spawn(&pid, args[0], &actions, nullptr, args.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    EXPECT_EQ(rc, 0);
    int status = 0;
    if (rc == 0) waitpid(pid, &status, 0);
    outcome.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    outcome.out = ReadFile(out_path);
    outcome.answer = Json::Value();
    ZEPH::JsonParse(outcome.out, outcome.answer);
    return Exists(report);
  }

  // Runs `method` under every occurrence of every injectable call.
  // `prepare` runs before each attempt and gives the parameters and the
  // ids the method may remove; `codes` are the error codes it may answer.
  void Sweep(const std::string& api, const std::string& method,
             const std::function<Json::Value(std::set<std::string>&)>& prepare,
             const std::set<int>& codes) {
    const std::string tree = root_.dir() + "/usr/zeph";
    const std::vector<std::pair<std::string, std::string>> calls = {
        {"rename", tree}, {"write", tree}, {"open", tree}, {"posix_spawn", ""},
        {"chown", ""}};
    for (const auto& call : calls) {
      int at = 1;
      for (; at <= kMaxOccurrence; ++at) {
        std::set<std::string> gone;
        const Json::Value params = prepare(gone);
        const Snapshot before = Take();
        Outcome outcome;
        const bool fired =
            RunWithFault(call.first, at, call.second, api, method, params, outcome);
        const std::string what = method + " with " + call.first + " failing at " +
                                 std::to_string(at) + ": " + outcome.out;
        ASSERT_TRUE(outcome.status == 0 || outcome.status == 1) << what;
        ASSERT_TRUE(outcome.answer["success"].isBool()) << what;
        EXPECT_EQ(outcome.status == 0, outcome.answer["success"].asBool()) << what;
        if (!outcome.answer["success"].asBool()) {
          EXPECT_EQ(codes.count(outcome.answer["error"]["code"].asInt()), 1u) << what;
        }
        CheckArchive(before, gone, what);
        if (HasFailure()) return;
        if (fired) ++fired_[call.first];
        if (!fired) {
          // Got through untouched: the sweep of this call is complete.
          EXPECT_TRUE(outcome.answer["success"].asBool()) << what;
          break;
        }
      }
      EXPECT_LE(at, kMaxOccurrence) << method << ": " << call.first;
    }
    // Every method rewrites INFO at least: a new file opened, written and
    // renamed into place.
    for (const char* call : {"rename", "write", "open"}) {
      EXPECT_GT(fired_[call], 0) << method << ": " << call;
    }
  }

  std::string other_;
  std::map<std::string, int> fired_;  // call -> faults that fired
};

TEST_F(Faults, Create) {
  Sweep("ZEPH.Core.Certificate.CRT", "create",
        [](std::set<std::string>&) { return CreateParams(true); }, {5501});
}

TEST_F(Faults, CreateReplacingACertificateInUse) {
  // Replace mode redeploys the web service's certificate.
  const std::string def = Info().getMemberNames()[0] == other_
                              ? Info().getMemberNames()[1]
                              : Info().getMemberNames()[0];
  replaced_.insert(def);
  Sweep("ZEPH.Core.Certificate.CRT", "create",
        [&](std::set<std::string>&) {
          Json::Value p = CreateParams(false);
          p["id"] = def;
          return p;
        },
        {5501});
}

TEST_F(Faults, Import) {
  const std::string cert = root_.Path("/up-cert.pem");
  const std::string key = root_.Path("/up-key.pem");
  Sweep("ZEPH.Core.Certificate", "import",
        [&](std::set<std::string>&) {
          WriteFile(cert, ReadFile(Archive("/" + other_ + "/cert.pem")));
          WriteFile(key, ReadFile(Archive("/" + other_ + "/privkey.pem")));
          Json::Value p;
          p["desc"] = "imported";
          p["cert_tmp"] = cert;
          p["key_tmp"] = key;
          return p;
        },
        {5501, 5510, 5511, 5515});
}

TEST_F(Faults, SetProperties) {
  Sweep("ZEPH.Core.Certificate.CRT", "set",
        [&](std::set<std::string>&) {
          Json::Value p;
          p["id"] = other_;
          p["desc"] = "changed";
          p["as_default"] = true;
          return p;
        },
        {5501});
}

TEST_F(Faults, ServiceSet) {
  Sweep("ZEPH.Core.Certificate.Service", "set",
        [&](std::set<std::string>&) {
          // Moves the web service to whichever certificate it is not on.
          const Json::Value info = Info();
          std::string from;
          Json::Value service;
          for (const std::string& id : info.getMemberNames()) {
            if (!info[id]["services"].empty()) {
              from = id;
              service = info[id]["services"][0];
            }
          }
          std::string to = other_;
          if (from == other_) {
            for (const std::string& id : info.getMemberNames()) {
              if (id != other_) to = id;
            }
          }
          Json::Value setting;
          setting["service"] = service;
          setting["id"] = to;
          setting["old_id"] = from;
          Json::Value p;
          p["settings"].append(setting);
          return p;
        },
        {5501});
}

TEST_F(Faults, Delete) {
  Sweep("ZEPH.Core.Certificate.CRT", "delete",
        [&](std::set<std::string>& gone) {
          const std::string id = Create(false);
          gone.insert(id);
          Json::Value p;
          p["ids"].append(id);
          return p;
        },
        {5501});
}

TEST_F(Faults, Reset) {
  Sweep("ZEPH.Core.Certificate", "reset",
        [&](std::set<std::string>& gone) {
          // Everything a user may delete may go.
          const Json::Value info = Info();
          for (const std::string& id : info.getMemberNames()) {
            if (info[id]["user_deletable"].asBool()) gone.insert(id);
          }
          return Json::Value(Json::objectValue);
        },
        {5501});
}

// A process that took the INFO lock and never lets go: a property change
// gives up after its wait of 10 s with the general failure, a service
// binding after the 30 s of its look-up with the setting among the failed
// ones; the catalogue and the service's files are unchanged.
TEST(StuckLock, ChangesTimeOut) {
  TempRoot root;
  const std::string bin = ZEPH::test::BinDir() + "/zephcert";
  ASSERT_EQ(ZEPH::test::Run({bin, "--root", root.dir(), "init"}).status, 0);
  const std::string info_path = root.Path(std::string(kArchive) + "/INFO");
  const std::string before = ReadFile(info_path);
  Json::Value info;
  ASSERT_TRUE(ZEPH::JsonParse(before, info));
  const std::string id = info.getMemberNames()[0];

  const std::string lock = root.Path("/tmp/zephcertificate_info.lock");
  const std::string ready = root.Path("/holding");
  // The shell takes the lock on its descriptor 9, which the sleep keeps.
  std::vector<std::string> argv = {
      "/bin/sh", "-c",
      "exec 9>'" + lock + "' && /usr/bin/flock -x 9 && touch '" + ready +
          "' && exec sleep 600"};
  std::vector<char*> args;
  for (std::string& a : argv) args.push_back(&a[0]);
  args.push_back(nullptr);
  pid_t holder;
  ASSERT_EQ(posix_spawn(&holder, args[0], nullptr, nullptr, args.data(), environ), 0);
  while (!Exists(ready)) usleep(10000);

  const std::string web_dir = root.Path("/usr/zeph/etc/certificate/system/default");
  const std::string deployed = ReadFile(web_dir + "/fullchain.pem");
  Json::Value services;
  ASSERT_TRUE(ZEPH::JsonFromFile(services, root.Path(std::string(kArchive) + "/SERVICES")));
  Json::Value setting;
  setting["service"] = services[0];
  setting["id"] = id;
  setting["old_id"] = id;
  Json::Value binding;
  binding["settings"].append(setting);

  CommandResult bind;
  std::thread binder([&] {
    bind = ZEPH::test::Run({bin, "--root", root.dir(), "call",
                            "ZEPH.Core.Certificate.Service", "set",
                            ZEPH::JsonCompact(binding)});
  });
  CommandResult r = ZEPH::test::Run(
      {bin, "--root", root.dir(), "call", "ZEPH.Core.Certificate.CRT", "set",
       "{\"id\": \"" + id + "\", \"desc\": \"never\"}"});
  binder.join();
  kill(holder, SIGKILL);
  waitpid(holder, nullptr, 0);
  EXPECT_EQ(r.status, 1) << r.out << r.err;
  Json::Value answer;
  ASSERT_TRUE(ZEPH::JsonParse(r.out, answer)) << r.out;
  EXPECT_EQ(answer["error"]["code"].asInt(), 5501);
  EXPECT_EQ(bind.status, 0) << bind.out << bind.err;
  ASSERT_TRUE(ZEPH::JsonParse(bind.out, answer)) << bind.out;
  EXPECT_EQ(answer["data"]["err_settings"], binding["settings"]) << bind.out;
  EXPECT_TRUE(root.LogContains("Lock list file [")) << root.Log();
  EXPECT_TRUE(root.LogContains("Failed to check service exist for ")) << root.Log();
  EXPECT_EQ(ReadFile(info_path), before);
  EXPECT_EQ(ReadFile(web_dir + "/fullchain.pem"), deployed);
}

}  // namespace
