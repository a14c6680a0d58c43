#include "module/upload/pkcs12.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <vector>

#include "module/common/log.h"
#include "module/common/paths.h"
#include "zeph/fd_io.h"
#include "zeph/qlibc_exec.h"
#include "zeph/spawn.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace cert {
namespace {

// Runs `args` with `input` as its whole standard input and waits; the
// exit status, or -1 when it could not be run or was killed.
int RunWithInput(std::vector<std::string> args, const std::string& input) {
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) return -1;
  UniqueFd read_end(ends[0]);
  UniqueFd write_end(ends[1]);
  // The input is short (kMaxPassphraseBytes): the pipe takes it whole, so
  // it is written before the tool starts and the tool sees its end.
  if (!WriteAll(write_end.get(), input.data(), input.size())) return -1;
  write_end.reset();

  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  ChildOptions child;
  child.options = QLIBC_EXEC_NULL_STDOUT | QLIBC_EXEC_NULL_STDERR;
  child.stdin_fd = read_end.get();
  const pid_t pid = Spawn(argv[0], argv.data(), child);
  if (pid < 0) return -1;
  read_end.reset();
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return -1;
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace

bool IsUsablePassphrase(const std::string& passphrase) {
  return !passphrase.empty() && passphrase.size() <= kMaxPassphraseBytes &&
         passphrase.find_first_of(std::string("\r\n\0", 3)) ==
             std::string::npos;
}

int MakePkcs12(const Pkcs12Input& input, const std::string& passphrase,
               bool legacy, const std::string& out_path) {
  if (!IsUsablePassphrase(passphrase) || out_path.empty()) {
    UPLOAD_LOG("MakePkcs12: invalid parameters");
    return -1;
  }
  // An earlier file is mode 0400, which openssl cannot write over unless
  // it runs as root.
  if (unlink(out_path.c_str()) != 0 && errno != ENOENT) {
    UPLOAD_LOG("Failed to remove %s [%d]", out_path.c_str(), errno);
    return -1;
  }
  std::vector<std::string> args = {kOpenssl, "pkcs12", "-export",
                                   "-in", input.cert_path,
                                   "-inkey", input.key_path};
  if (!input.chain_path.empty()) {
    args.insert(args.end(), {"-certfile", input.chain_path});
  }
  args.insert(args.end(), {"-name", input.friendly_name, "-passout", "stdin",
                           "-out", out_path});
  if (legacy) {
    args.insert(args.end(), {"-keypbe", "PBE-SHA1-3DES", "-certpbe",
                             "PBE-SHA1-3DES", "-macalg", "sha1"});
  }
  if (RunWithInput(args, passphrase + "\n") != 0) {
    UPLOAD_LOG("openssl pkcs12 failed for %s", input.cert_path.c_str());
    unlink(out_path.c_str());  // a partial file is never handed out
    return -1;
  }
  if (chmod(out_path.c_str(), 0400) != 0) {
    UPLOAD_LOG("Failed to chmod: [%s]", out_path.c_str());
  }
  return 0;
}

}  // namespace cert
}  // namespace ZEPH
