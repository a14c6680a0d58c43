#include "webapid_test_support.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>

#include "test_support.h"

extern char** environ;
constexpr auto npos = std::string::npos;

namespace ZEPH {
namespace test {
namespace {

// /proc/<pid>/stat from just after the name; empty when the process is gone.
std::string StatAfterName(pid_t pid) {
  const std::string stat = ReadFile("/proc/" + std::to_string(pid) + "/stat");
  const size_t close = stat.rfind(')');
  return close == std::string::npos ? "" : stat.substr(close + 1);
}

// The first number of a field of /proc/<pid>/status ("Uid:"); -1 if none.
long StatusField(pid_t pid, const std::string& field) {
  const std::string status = ReadFile("/proc/" + std::to_string(pid) + "/status");
  const size_t at = status.find("\n" + field);
  return at == std::string::npos ? -1 : atol(status.c_str() + at + 1 + field.size());
}

}  // namespace

ServerProcess::ServerProcess(const std::string& root, const std::vector<std::string>& extra,
                             const std::vector<std::string>& wrapper)
    : root_(root) {
  static int counter = 0;  // the root may not exist yet: the log goes beside it
  log_path_ = root + "-webapid-" + std::to_string(++counter) + ".log";
  std::vector<std::string> argv = wrapper;
  argv.insert(argv.end(), {BinDir() + "/zeph-webapid", "--root", root, "--listen", "127.0.0.1:0"});
  argv.insert(argv.end(), extra.begin(), extra.end());
  std::vector<char*> args;
  for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  posix_spawn_file_actions_t actions;  // standard output and error to the log
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 2, log_path_.c_str(), O_WRONLY | O_CREAT | O_APPEND,
                                   0644);
  posix_spawn_file_actions_adddup2(&actions, 2, 1);
  if (posix_spawn(&pid_, args[0], &actions, nullptr, args.data(), environ) != 0) pid_ = -1;
  posix_spawn_file_actions_destroy(&actions);
  // Start-up may make the first certificate: poll the log for the "listening" line or the end.
  static const char kListening[] = "listening on https://127.0.0.1:";
  for (int i = 0; i < 6000 && Alive(); ++i) {
    const std::string log = Log();
    const size_t at = log.find(kListening);
    if (at != std::string::npos) {
      port_ = atoi(log.c_str() + at + sizeof(kListening) - 1);
      return;
    }
    usleep(20 * 1000);
  }
}

std::string ServerProcess::Log() const { return ReadFile(log_path_); }

std::string ServerProcess::Token() const {
  std::string token = ReadFile(root_ + "/usr/zeph/etc/webapid/token");
  while (!token.empty() && token.back() == '\n') token.pop_back();
  return token;
}

int ServerProcess::Stop() {
  if (pid_ > 0) kill(pid_, SIGTERM);
  return Wait();
}

int ServerProcess::Wait() {
  int status = 0;
  if (pid_ > 0 && waitpid(pid_, &status, 0) == pid_) {
    status_ = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  pid_ = -1;
  return status_;
}

bool ServerProcess::Alive() {
  int status = 0;
  if (pid_ < 0 || waitpid(pid_, &status, WNOHANG) != pid_) return pid_ >= 0;
  status_ = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  pid_ = -1;
  return false;
}

std::vector<pid_t> ServerProcess::Tree() const {
  std::vector<pid_t> tree, all;
  if (pid_ > 0) tree.push_back(pid_);
  for (const std::string& name : DirEntries("/proc")) {
    if (name.find_first_not_of("0123456789") == npos) all.push_back(atoi(name.c_str()));
  }
  for (size_t i = 0; i < tree.size(); ++i) {  // one pass per level
    for (pid_t pid : all) {
      const std::string stat = StatAfterName(pid);  // " S <parent> ..."
      if (stat.size() > 3 && atoi(stat.c_str() + 3) == tree[i]) tree.push_back(pid);
    }
  }
  return tree;
}

long ServerProcess::TreeRssKiB() const {
  long total = 0;
  for (pid_t pid : Tree()) total += std::max(0L, StatusField(pid, "VmRSS:"));
  return total;
}

long ProcessUid(pid_t pid) { return StatusField(pid, "Uid:"); }

bool ProcessGone(pid_t pid) {
  const std::string stat = StatAfterName(pid);
  return stat.empty() || stat.compare(1, 1, "Z") == 0;
}

CurlReply Curl(int port, const std::string& path, const std::vector<std::string>& args,
               const std::string& token, const std::string& scratch_dir) {
  static int counter = 0;
  const std::string stem =
      scratch_dir + "/curl-" + std::to_string(getpid()) + "-" + std::to_string(++counter);
  std::vector<std::string> argv = {"/usr/bin/curl", "-sS", "-k", "--max-time", "300", "-o",
                                   stem + ".body", "-D", stem + ".headers", "-w", "%{http_code}"};
  if (!token.empty()) argv.insert(argv.end(), {"-H", "Authorization: Bearer " + token});
  argv.insert(argv.end(), args.begin(), args.end());
  argv.push_back("https://127.0.0.1:" + std::to_string(port) + path);
  const CommandResult r = Run(argv);
  CurlReply reply{atoi(r.out.c_str()), ReadFile(stem + ".headers"), ReadFile(stem + ".body"),
                  r.err};
  unlink((stem + ".headers").c_str());
  unlink((stem + ".body").c_str());
  return reply;
}

}  // namespace test
}  // namespace ZEPH
