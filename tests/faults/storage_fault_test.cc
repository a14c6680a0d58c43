// Faults of the storage below the archive, made real in a private mount
// namespace so that the test's own mounts stay as they are:
//
// - a full disk: /usr/zeph/etc on a small tmpfs that a filler file leaves
//   with 0, 4 KiB, 8 KiB, ... free, until each method gets through;
// - a read-only archive.
//
// A method that fails there answers its error code, leaves INFO and
// DEFAULT as they were, and loses no certificate; nothing is left in a
// ".temp" or ".bak" directory, and the web service keeps a complete set
// of one certificate's files. A first deployment to a service on the full
// disk leaves it the complete set or no files at all.
//
// And locks held by stuck processes make changes give up after their wait
// instead of hanging.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <signal.h>
#include <spawn.h>
#include <sys/statvfs.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <filesystem>
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
using ZEPH::test::kCertFiles;
using ZEPH::test::ReadFile;
using ZEPH::test::WriteFile;

const char kEtc[] = "/usr/zeph/etc";
const char kWebDir[] = "/usr/zeph/etc/certificate/system/default";
const char kCrt[] = "ZEPH.Core.Certificate.CRT";
const char kService[] = "ZEPH.Core.Certificate.Service";
// The tmpfs that stands for the disk: the tree is ~150 KiB.
const char kDiskSize[] = "2m";
// Beyond this much free room every method is expected to get through.
const off_t kMaxRoom = 256 * 1024;
const off_t kPage = 4096;

// A process that sets something up, makes the file `ready`, and then
// holds on (to a lock, to a mount namespace) until its standard input
// closes or it is killed.
class Holder {
 public:
  Holder() = default;
  Holder(const Holder&) = delete;
  Holder& operator=(const Holder&) = delete;
  ~Holder() { Stop(); }

  // Starts `argv` with its output in `log`; true once `ready` exists, false
  // when the process ended before or did not get there in 30 s.
  bool Start(std::vector<std::string> argv, const std::string& ready,
             const std::string& log) {
    int in[2];
    if (pipe2(in, O_CLOEXEC) != 0) return false;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, in[0], 0);
    posix_spawn_file_actions_addopen(&actions, 1, log.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0644);
    posix_spawn_file_actions_adddup2(&actions, 1, 2);
    std::vector<char*> args;
    for (std::string& a : argv) args.push_back(&a[0]);
    args.push_back(nullptr);
    const int rc = posix_spawn(&pid_, args[0], &actions, nullptr, args.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    close(in[0]);
    in_ = in[1];
    if (rc != 0) {
      pid_ = -1;
      Stop();
      return false;
    }
    for (int i = 0; i < 3000; ++i) {
      if (Exists(ready)) return true;
      if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
        pid_ = -1;
        Stop();
        return false;
      }
      usleep(10000);
    }
    Stop();
    return false;
  }

  void Stop() {
    if (in_ >= 0) close(in_);
    in_ = -1;
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    pid_ = -1;
  }

  pid_t pid() const { return pid_; }

 private:
  pid_t pid_ = -1;
  int in_ = -1;
};

// Name -> content of the files in `dir`.
std::map<std::string, std::string> FilesOf(const std::string& dir) {
  std::map<std::string, std::string> files;
  std::error_code ec;
  for (const auto& entry : std::filesystem::directory_iterator(dir, ec)) {
    files[entry.path().filename()] = ReadFile(entry.path());
  }
  return files;
}

// Whether `text` is whole PEM: a BEGIN line first, an END line last.
bool IsPem(const std::string& text) {
  const std::string end = "-----\n";
  return text.compare(0, 11, "-----BEGIN ") == 0 && text.size() > end.size() &&
         text.compare(text.size() - end.size(), end.size(), end) == 0 &&
         text.find("-----END ") != std::string::npos;
}

class StorageFaults : public ArchiveFixture {
 protected:
  // Whether a tool's complaint is the system's refusal (EPERM, EACCES).
  static bool NotAllowed(const std::string& complaint) {
    return complaint.find("not permitted") != std::string::npos ||
           complaint.find("ermission denied") != std::string::npos;
  }

  // Runs `script` (a shell script, "$1" the root) in a new private mount
  // namespace, and the calls from here on in it. Leaves `why` empty when
  // that worked; says in `why` why not when the machine does not allow it.
  void EnterPrivateMounts(const std::string& script, std::string& why) {
    if (!Exists("/usr/bin/unshare") || !Exists("/usr/bin/nsenter")) {
      why = "needs unshare and nsenter (util-linux) for a private mount namespace";
      return;
    }
    const std::string ready = root_.Path("/mounts-ready");
    const std::string log = root_.Path("/mounts-log");
    if (!holder_.Start({"/usr/bin/unshare", "--mount", "--propagation", "private",
                        "/bin/sh", "-c",
                        "set -e\n" + script + "\ntouch \"$1/mounts-ready\"\nread line",
                        "sh", root_.dir()},
                       ready, log)) {
      const std::string out = ReadFile(log);
      ASSERT_TRUE(NotAllowed(out)) << "setting up the mounts failed: " << out;
      why = "this machine allows no private mount namespace with its own mounts: " + out;
      return;
    }
    const std::string pid = std::to_string(holder_.pid());
    enter_ = {"/usr/bin/nsenter", "--mount=/proc/" + pid + "/ns/mnt", "--"};
    view_ = "/proc/" + pid + "/root";
    CommandResult r = ZEPH::test::Run({enter_[0], enter_[1], "/bin/true"});
    if (r.status != 0) {
      ASSERT_TRUE(NotAllowed(r.err)) << "entering the mount namespace failed: " << r.err;
      why = "this machine does not let the test enter its mount namespace: " + r.err;
      return;
    }
    // The test's own view is untouched.
    EXPECT_EQ(ReadFile("/proc/self/mountinfo").find(root_.dir()), std::string::npos)
        << ReadFile("/proc/self/mountinfo");
  }

  // Fills the disk under /usr/zeph/etc so that `room` bytes stay free.
  void Fill(off_t room) {
    const std::string filler = View(std::string(kEtc) + "/filler");
    unlink(filler.c_str());
    const int fd = open(filler.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << filler;
    const std::string block(kPage, '\0');
    off_t size = 0;
    ssize_t n;
    while ((n = write(fd, block.data(), block.size())) > 0) size += n;
    const int error = errno;
    const bool cut = size >= room && ftruncate(fd, size - room) == 0;
    close(fd);
    EXPECT_EQ(error, ENOSPC);
    ASSERT_TRUE(cut) << "filler of " << size << " bytes, " << room << " to free";
    struct statvfs disk;
    ASSERT_EQ(statvfs(View(kEtc).c_str(), &disk), 0);
    ASSERT_EQ(static_cast<off_t>(disk.f_bavail * disk.f_frsize), room);
  }

  struct State {
    Snapshot archive;
    std::string info;
    std::string default_file;
  };

  State TakeState() {
    State s;
    s.archive = Take();
    s.info = ReadFile(Archive("/INFO"));
    s.default_file = ReadFile(Archive("/DEFAULT"));
    return s;
  }

  // Whether the answer says the call failed: an error, or a failed setting.
  static bool Failed(const CommandResult& r, const Json::Value& answer,
                     const std::set<int>& codes, const std::string& what) {
    EXPECT_TRUE(r.status == 0 || r.status == 1) << what << r.err;
    EXPECT_TRUE(answer["success"].isBool()) << what;
    EXPECT_EQ(r.status == 0, answer["success"].asBool()) << what;
    if (!answer["success"].asBool()) {
      EXPECT_EQ(codes.count(answer["error"]["code"].asInt()), 1u) << what;
      return true;
    }
    return !answer["data"]["err_settings"].empty();
  }

  // What must hold after a call under a storage fault; when the call
  // `failed`, INFO and DEFAULT are as they were.
  void CheckUnharmed(const State& before, bool failed, const std::string& what) {
    ASSERT_NO_FATAL_FAILURE(CheckArchive(before.archive, {}, what));
    if (failed) {
      EXPECT_EQ(ReadFile(Archive("/INFO")), before.info) << what;
      EXPECT_EQ(ReadFile(Archive("/DEFAULT")), before.default_file) << what;
    }
    const Json::Value info = Info();
    // A certificate that came in under the fault is whole too.
    for (const std::string& id : info.getMemberNames()) {
      for (const char* file : kCertFiles) {
        EXPECT_TRUE(IsPem(ReadFile(Archive("/" + id + "/" + file))))
            << what << ": " << id << "/" << file << " is cut short";
      }
      EXPECT_EQ(ReadFile(Archive("/" + id + "/fullchain.pem"))
                    .find(ReadFile(Archive("/" + id + "/cert.pem"))),
                0u)
          << what << ": " << id << "/fullchain.pem does not begin with its certificate";
    }
    const std::string def = ReadFile(Archive("/DEFAULT"));
    EXPECT_TRUE(def.size() == 7 && def[6] == '\n' && info.isMember(def.substr(0, 6)))
        << what << ": DEFAULT is \"" << def << "\"";

    // Work and backup directories go with the call that made them. (A
    // leftover INFO.temp file is harmless: the next write replaces it.)
    for (const std::string& left : ZEPH::test::StagingLeftovers(View("/usr/zeph/etc/certificate"))) {
      ADD_FAILURE() << what << ": left " << left;
    }

    // The web service holds the whole set of one certificate.
    const std::map<std::string, std::string> web = FilesOf(View(kWebDir));
    const std::string deployed = web.count("cert.pem") ? web.at("cert.pem") : "";
    std::string serving;
    for (const std::string& id : info.getMemberNames()) {
      if (ReadFile(Archive("/" + id + "/cert.pem")) == deployed) serving = id;
    }
    ASSERT_FALSE(serving.empty()) << what << ": the web service has no certificate's files";
    for (const char* file : kCertFiles) {
      EXPECT_TRUE(web.count(file) &&
                  web.at(file) == ReadFile(Archive("/" + serving + "/" + file)))
          << what << ": web service " << file << " is not " << serving << "'s";
    }
  }

  // The web service's binding in INFO: its service object and certificate.
  std::string WebBinding(Json::Value& service) {
    const Json::Value info = Info();
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& s : info[id]["services"]) {
        if (s["subscriber"] == "system" && s["service"] == "default") {
          service = s;
          return id;
        }
      }
    }
    ADD_FAILURE() << "web service not bound: " << ZEPH::JsonCompact(info);
    return "";
  }

  // A Service "set" that moves the web service to another certificate
  // than the one it is on.
  Json::Value MoveWebService() {
    Json::Value service;
    const std::string from = WebBinding(service);
    std::string to;
    for (const std::string& id : Info().getMemberNames()) {
      if (id != from) to = id;
    }
    return Move(service, from, to);
  }

  // Upload files for an import: the key and certificate of `id`.
  Json::Value ImportParams(const std::string& id) {
    const std::string cert = root_.Path("/up-cert.pem");
    const std::string key = root_.Path("/up-key.pem");
    WriteFile(cert, ReadFile(Archive("/" + id + "/cert.pem")));
    WriteFile(key, ReadFile(Archive("/" + id + "/privkey.pem")));
    Json::Value p;
    p["desc"] = "imported";
    p["cert_tmp"] = cert;
    p["key_tmp"] = key;
    return p;
  }

  struct Method {
    std::string api;
    std::string method;
    std::function<Json::Value()> params;
    std::set<int> codes;  // the error codes it may answer
    // Whether a successful answer did the whole work; by default success
    // is enough.
    std::function<bool(const Json::Value& answer)> whole;
  };

  // For create and import: success may come with the catalogue entry
  // missing; the work is whole when INFO has the new id.
  std::function<bool(const Json::Value&)> Recorded() {
    return [this](const Json::Value& answer) {
      return Info().isMember(answer["data"]["id"].asString());
    };
  }

  Holder holder_;
  std::string other_;
};

TEST_F(StorageFaults, FullDisk) {
  ASSERT_EQ(Zephcert({"init"}).status, 0);
  other_ = Create(false);
  ASSERT_EQ(other_.size(), 6u);
  // The tmpfs starts with a copy of the tree it stands in for.
  ZEPH::test::MakeDirs(root_.Path("/disk"));
  std::string why;
  ASSERT_NO_FATAL_FAILURE(EnterPrivateMounts(
      std::string("mount -t tmpfs -o size=") + kDiskSize + ",mode=0755 zephtest-disk \"$1/disk\"\n"
          "cp -a \"$1" + kEtc + "/.\" \"$1/disk/\"\n"
          "mount --bind \"$1/disk\" \"$1" + kEtc + "\"",
      why));
  if (!why.empty()) GTEST_SKIP() << why;
  struct statvfs disk;
  ASSERT_EQ(statvfs(View(kEtc).c_str(), &disk), 0);
  ASSERT_LT(disk.f_blocks * disk.f_frsize, 3u * 1024 * 1024) << "not on the small disk";

  const std::vector<Method> methods = {
      {kCrt, "create", [] { return CreateParams(true); }, {5501}, Recorded()},
      {"ZEPH.Core.Certificate", "import", [&] { return ImportParams(other_); },
       {5501, 5515}, Recorded()},
      {kCrt, "set",
       [&] {
         Json::Value p;
         p["id"] = other_;
         p["desc"] = "changed on a full disk";
         p["as_default"] = true;
         return p;
       },
       {5501}, nullptr},
      {kService, "set", [&] { return MoveWebService(); }, {}, nullptr},
  };
  for (const Method& m : methods) {
    bool through = false;
    for (off_t room = 0; room <= kMaxRoom && !through; room += kPage) {
      const Json::Value params = m.params();
      ASSERT_NO_FATAL_FAILURE(Fill(room));
      const std::string what = m.api + " " + m.method + " with " + std::to_string(room) +
                               " bytes free";
      const State before = TakeState();
      Json::Value answer;
      const CommandResult r = Call(m.api, m.method, params, answer);
      const bool failed = Failed(r, answer, m.codes, what + ": " + r.out);
      // Whatever the method writes needs room.
      if (room == 0) {
        EXPECT_TRUE(failed) << what << ": " << r.out;
      }
      CheckUnharmed(before, failed, what + ": " + r.out);
      if (HasFailure()) return;
      through = !failed && (!m.whole || m.whole(answer));
    }
    EXPECT_TRUE(through) << m.api << " " << m.method << " never got through";
  }
  if (HasFailure()) return;

  // A first deployment to a service: it has no directory yet, so there is
  // no backup to fall back on. Its directory ends up with the whole set of
  // the certificate's files or with none, never with a file cut short; a
  // setting that did not get through is listed as failed.
  Json::Value service;
  WebBinding(service);
  service["display_name"] = "Fault service";
  service["subscriber"] = "zephtest";
  service["service"] = "first";
  const Json::Value params = Move(service, "", other_);
  const std::string subscriber_dir = View(std::string(kEtc) + "/certificate/zephtest");
  std::map<std::string, std::string> archived;
  for (const char* file :
       {"cert.pem", "privkey.pem", "fullchain.pem", "chain.pem", "zeph-ca-cert.pem"}) {
    const std::string path = Archive("/" + other_ + "/" + file);
    if (Exists(path)) archived[file] = ReadFile(path);
  }
  ASSERT_EQ(archived.count("fullchain.pem"), 1u);
  bool through = false;
  for (off_t room = 0; room <= kMaxRoom && !through; room += kPage) {
    std::error_code ec;
    std::filesystem::remove_all(subscriber_dir, ec);
    ASSERT_FALSE(ec) << ec.message();
    ASSERT_NO_FATAL_FAILURE(Fill(room));
    const std::string what = "first deployment with " + std::to_string(room) + " bytes free";
    const State before = TakeState();
    Json::Value answer;
    const CommandResult r = Call(kService, "set", params, answer);
    const bool failed = Failed(r, answer, {}, what + ": " + r.out);
    if (room == 0) {
      EXPECT_TRUE(failed) << what << ": " << r.out;
    }
    CheckUnharmed(before, failed, what + ": " + r.out);
    const std::map<std::string, std::string> deployed = FilesOf(subscriber_dir + "/first");
    if (!deployed.empty()) {
      for (const auto& file : archived) {
        const auto it = deployed.find(file.first);
        EXPECT_TRUE(it != deployed.end() && it->second == file.second)
            << what << ": the service's " << file.first << " has "
            << (it == deployed.end() ? 0 : it->second.size()) << " of " << file.second.size()
            << " bytes";
      }
      EXPECT_EQ(deployed.size(), archived.size()) << what;
    }
    const Json::Value info = Info();
    bool bound = false;
    for (const Json::Value& s : info[other_]["services"]) {
      bound = bound || s == service;
    }
    if (deployed.empty() || !bound) {
      EXPECT_EQ(answer["data"]["err_settings"], params["settings"])
          << what << ": files " << (deployed.empty() ? "not " : "") << "deployed, "
          << (bound ? "" : "not ") << "bound: " << r.out;
    }
    if (HasFailure()) return;
    through = !failed && bound && !deployed.empty();
  }
  EXPECT_TRUE(through) << "the first deployment never got through";
}

TEST_F(StorageFaults, ReadOnlyArchive) {
  ASSERT_EQ(Zephcert({"init"}).status, 0);
  other_ = Create(false);
  ASSERT_EQ(other_.size(), 6u);
  // The web service on a certificate that is not the default, so that its
  // deletion has to move the service.
  const std::string serving = Create(false);
  ASSERT_EQ(serving.size(), 6u);
  Json::Value service;
  const std::string def = WebBinding(service);
  Json::Value answer;
  Call(kService, "set", Move(service, def, serving), answer);
  ASSERT_TRUE(answer["success"].asBool()) << ZEPH::JsonCompact(answer);
  ASSERT_FALSE(answer["data"].isMember("err_settings")) << ZEPH::JsonCompact(answer);

  const std::string archive = std::string("\"$1") + ZEPH::test::kArchive + "\"";
  std::string why;
  ASSERT_NO_FATAL_FAILURE(EnterPrivateMounts(
      "mount --bind " + archive + " " + archive + "\n" +
          "mount -o remount,bind,ro " + archive,
      why));
  if (!why.empty()) GTEST_SKIP() << why;
  struct statvfs disk;
  ASSERT_EQ(statvfs(Archive("").c_str(), &disk), 0);
  ASSERT_TRUE(disk.f_flag & ST_RDONLY) << "the archive is not read-only";

  Json::Value ids;
  ids.append(other_);
  ids.append(serving);
  const std::vector<Method> methods = {
      {kCrt, "create", [] { return CreateParams(true); }, {5501}, nullptr},
      {"ZEPH.Core.Certificate", "import", [&] { return ImportParams(other_); }, {5501},
       nullptr},
      {kCrt, "set",
       [&] {
         Json::Value p;
         p["id"] = other_;
         p["desc"] = "changed on a read-only archive";
         p["as_default"] = true;
         return p;
       },
       {5501}, nullptr},
      {kService, "set", [&] { return MoveWebService(); }, {}, nullptr},
      {kCrt, "delete",
       [&] {
         Json::Value p;
         p["ids"] = ids;
         return p;
       },
       {5501}, nullptr},
      {"ZEPH.Core.Certificate", "reset", [] { return Json::Value(Json::objectValue); },
       {5501}, nullptr},
  };
  for (const Method& m : methods) {
    const Json::Value params = m.params();
    const std::string what = m.api + " " + m.method + " on a read-only archive";
    const State before = TakeState();
    const CommandResult r = Call(m.api, m.method, params, answer);
    EXPECT_TRUE(Failed(r, answer, m.codes, what + ": " + r.out)) << what << ": " << r.out;
    CheckUnharmed(before, true, what + ": " + r.out);
    if (m.method == "delete") {
      EXPECT_EQ(answer["error"]["data"]["err_ids"], ids) << r.out;
    }
    if (m.api == kService) {
      EXPECT_EQ(answer["data"]["err_settings"], params["settings"]) << r.out;
    }
    if (HasFailure()) return;
  }
}

class StuckLock : public StorageFaults {};

// A process that took a lock and never lets go: a change that needs it
// gives up after its wait instead of hanging, answers as it does for that
// failure, logs why and leaves the catalogue and the web service's files
// as they were; once the lock is free the same call goes through.
TEST_F(StuckLock, ChangesGiveUpAfterTheirWait) {
  ASSERT_EQ(Zephcert({"init"}).status, 0);
  const std::string second = Create(false);
  ASSERT_EQ(second.size(), 6u);
  Json::Value web;
  const std::string first = WebBinding(web);
  ASSERT_NE(first, second);
  const std::string info_lock = root_.Path("/tmp/zephcertificate_info.lock");
  const std::string web_lock = root_.Path("/tmp/certificate_system_default.lock");
  Json::Value rename;
  rename["id"] = second;
  rename["desc"] = "never";
  struct Row {
    std::string lock;
    const char* api;
    const char* method;
    Json::Value params;
    int code;         // the error answered, or 0: success with the setting failed
    std::string log;  // what the log says
  };
  const std::vector<Row> rows = {
      // INFO's lock: a property change waits 10 s, a binding's look-up 30 s.
      {info_lock, kCrt, "set", rename, 5501, "Lock list file ["},
      {info_lock, kService, "set", Move(web, first, first), 0,
       "Failed to check service exist for "},
      // The web service's copy lock: a binding waits 60 s.
      {web_lock, kService, "set", Move(web, first, second), 0,
       "Failed to lock [" + web_lock + "]"},
  };
  const std::map<std::string, std::string> deployed = FilesOf(View(kWebDir));
  const std::string info_before = ReadFile(Archive("/INFO"));
  // A binding looks its service up under INFO's lock first: one lock at a
  // time, its rows at once.
  for (const std::string& lock : {info_lock, web_lock}) {
    Holder holder;
    // The shell takes the lock on its descriptor 9 and keeps it while it
    // waits on its input.
    ASSERT_TRUE(holder.Start(
        {"/bin/sh", "-c", "exec 9>\"$1\" && /usr/bin/flock -x 9 && touch \"$2\" && read line",
         "sh", lock, lock + ".held"},
        lock + ".held", lock + ".log"))
        << ReadFile(lock + ".log");
    std::vector<CommandResult> results(rows.size());
    std::vector<std::thread> calls;
    for (size_t i = 0; i < rows.size(); ++i) {
      if (rows[i].lock != lock) continue;
      calls.emplace_back([&, i] {
        results[i] = Zephcert({"call", rows[i].api, rows[i].method,
                               ZEPH::JsonCompact(rows[i].params)});
      });
    }
    for (std::thread& t : calls) t.join();
    holder.Stop();
    for (size_t i = 0; i < rows.size(); ++i) {
      const Row& row = rows[i];
      if (row.lock != lock) continue;
      SCOPED_TRACE(std::string(row.api) + " " + row.method + ": " + results[i].out);
      Json::Value answer;
      ASSERT_TRUE(ZEPH::JsonParse(results[i].out, answer)) << results[i].err;
      if (row.code != 0) {
        EXPECT_EQ(answer["error"]["code"].asInt(), row.code);
      } else {
        EXPECT_EQ(answer["data"]["err_settings"], row.params["settings"]);
        EXPECT_EQ(answer["data"]["restart_httpd"], false);
      }
      EXPECT_TRUE(root_.LogContains(row.log)) << root_.Log();
    }
  }
  EXPECT_EQ(FilesOf(View(kWebDir)), deployed);
  EXPECT_FALSE(Exists(View(kWebDir) + ".temp"));
  EXPECT_EQ(ReadFile(Archive("/INFO")), info_before);

  for (const Row& row : rows) {
    Json::Value answer;
    Call(row.api, row.method, row.params, answer);
    EXPECT_TRUE(answer["success"].asBool()) << row.method << ": " << answer;
    EXPECT_FALSE(answer["data"].isMember("err_settings")) << answer;
  }
  EXPECT_EQ(Info()[second]["desc"].asString(), "never");
  EXPECT_EQ(FilesOf(View(kWebDir)).at("cert.pem"), ReadFile(Archive("/" + second + "/cert.pem")));
}

}  // namespace
