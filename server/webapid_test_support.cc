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

namespace ZEPH {
namespace test {
namespace {

pid_t Spawn(const std::vector<std::string>& argv, const std::string& output) {
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  if (!output.empty()) {
    posix_spawn_file_actions_addopen(&actions, 2, output.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    posix_spawn_file_actions_adddup2(&actions, 2, 1);
  } else {
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
  }
  std::vector<char*> args;
  for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  pid_t pid = -1;
  if (posix_spawn(&pid, args[0], &actions, nullptr, args.data(), environ) != 0) pid = -1;
  posix_spawn_file_actions_destroy(&actions);
  return pid;
}

int StatusOf(int wait_status) { return WIFEXITED(wait_status) ? WEXITSTATUS(wait_status) : -1; }

std::vector<std::string> ServerArgv(const std::string& root, const std::vector<std::string>& extra,
                                    const std::vector<std::string>& wrapper) {
  std::vector<std::string> argv = wrapper;
  argv.insert(argv.end(), {BinDir() + "/zeph-webapid", "--root", root, "--listen", "127.0.0.1:0"});
  argv.insert(argv.end(), extra.begin(), extra.end());
  return argv;
}

// A new log file beside the root, which may not exist yet.
std::string LogPathBeside(const std::string& root) {
  static int counter = 0;
  return root + "-webapid-" + std::to_string(++counter) + ".log";
}

// /proc/<pid>/stat, from just after the closing parenthesis of the name;
// empty when the process is gone.
std::string StatAfterName(pid_t pid) {
  const std::string stat = ReadFile("/proc/" + std::to_string(pid) + "/stat");
  const size_t close = stat.rfind(')');
  return close == std::string::npos ? "" : stat.substr(close + 1);
}

// A field of /proc/<pid>/status ("Uid:", "VmRSS:"), its first number; -1
// when there is none.
long StatusField(pid_t pid, const std::string& field) {
  const std::string status = ReadFile("/proc/" + std::to_string(pid) + "/status");
  const size_t at = status.find("\n" + field);
  return at == std::string::npos ? -1 : atol(status.c_str() + at + 1 + field.size());
}

}  // namespace

ServerProcess::ServerProcess(const std::string& root, const std::vector<std::string>& extra,
                             const std::vector<std::string>& wrapper)
    : root_(root),
      log_path_(LogPathBeside(root)),
      child_(ServerArgv(root, extra, wrapper), log_path_) {
  // Start-up may include making the first certificate: wait for the
  // "listening" line or the end of the process, polling the log.
  static const char kListening[] = "listening on https://127.0.0.1:";
  for (int i = 0; i < 6000; ++i) {
    const std::string log = Log();
    const size_t at = log.find(kListening);
    if (at != std::string::npos) {
      port_ = atoi(log.c_str() + at + sizeof(kListening) - 1);
      return;
    }
    if (!child_.Running()) return;
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
  child_.Kill(SIGTERM);
  return child_.Wait();
}

std::vector<pid_t> ServerProcess::Tree() const {
  std::vector<pid_t> tree;
  if (child_.pid() <= 0) return tree;
  tree.push_back(child_.pid());
  std::vector<pid_t> all;
  for (const std::string& name : DirEntries("/proc")) {
    if (name.find_first_not_of("0123456789") == std::string::npos) all.push_back(atoi(name.c_str()));
  }
  // Parents come before their children in `tree`: one pass per level.
  for (size_t i = 0; i < tree.size(); ++i) {
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
  const std::string stem = scratch_dir + "/curl-" + std::to_string(getpid()) + "-" + std::to_string(++counter);
  std::vector<std::string> argv = {"/usr/bin/curl", "-sS", "-k", "--max-time", "300", "-o", stem + ".body",
                                   "-D", stem + ".headers", "-w", "%{http_code}"};
  if (!token.empty()) argv.insert(argv.end(), {"-H", "Authorization: Bearer " + token});
  argv.insert(argv.end(), args.begin(), args.end());
  argv.push_back("https://127.0.0.1:" + std::to_string(port) + path);
  const CommandResult r = Run(argv);
  CurlReply reply;
  reply.status = atoi(r.out.c_str());
  reply.error = r.err;
  reply.headers = ReadFile(stem + ".headers");
  reply.body = ReadFile(stem + ".body");
  unlink((stem + ".headers").c_str());
  unlink((stem + ".body").c_str());
  return reply;
}

Background::Background(const std::vector<std::string>& argv, const std::string& output)
    : pid_(Spawn(argv, output)) {}

bool Background::Running() {
  if (pid_ < 0) return false;
  int status = 0;
  if (waitpid(pid_, &status, WNOHANG) != pid_) return true;
  status_ = StatusOf(status);
  pid_ = -1;
  return false;
}

int Background::Wait() {
  if (pid_ > 0) {
    int status = 0;
    waitpid(pid_, &status, 0);
    status_ = StatusOf(status);
    pid_ = -1;
  }
  return status_;
}

void Background::Kill(int signal) {
  if (pid_ > 0) kill(pid_, signal);
}

}  // namespace test
}  // namespace ZEPH
