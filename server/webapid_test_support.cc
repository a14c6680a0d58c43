#include "webapid_test_support.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include "test_support.h"

extern char** environ;

namespace ZEPH {
namespace test {
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
