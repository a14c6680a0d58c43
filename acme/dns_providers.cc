#include "acme/dns_providers.h"

#include <ctype.h>
#include <errno.h>
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include "zeph/fd_io.h"
#include "zeph/qlibc_exec.h"
#include "zeph/spawn.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace acme {
namespace {

// Runs lego with `args`; its standard output into `out`, its standard error
// discarded. The exit status, or -1 when it could not be run.
int RunLego(const std::vector<std::string>& args, std::string* out) {
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) return -1;
  UniqueFd read_end(ends[0]);
  UniqueFd write_end(ends[1]);
  std::vector<std::string> strings = {kLegoProgram};
  strings.insert(strings.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& s : strings) argv.push_back(&s[0]);
  argv.push_back(nullptr);
  ChildOptions child;
  child.options = QLIBC_EXEC_NULL_STDIN | QLIBC_EXEC_NULL_STDERR;
  child.stdout_fd = write_end.get();
  const pid_t pid = Spawn(kLegoProgram, argv.data(), child);
  if (pid < 0) return -1;
  write_end.reset();
  ReadAll(read_end.get(), *out);
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return -1;
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

std::string Trim(const std::string& s) {
  const size_t b = s.find_first_not_of(" \t\r\n");
  if (b == std::string::npos) return "";
  const size_t e = s.find_last_not_of(" \t\r\n");
  return s.substr(b, e - b + 1);
}

}  // namespace

bool IsProviderCode(const std::string& code) {
  if (code.empty() || !isalnum(static_cast<unsigned char>(code[0]))) return false;
  for (unsigned char c : code) {
    if (!isalnum(c) && c != '.' && c != '-' && c != '_') return false;
  }
  return true;
}

bool DnsProviders(std::vector<std::string>* codes) {
  std::string out;
  if (RunLego({"dnshelp"}, &out) != 0) return false;
  // "All DNS codes:" and then one line of codes separated by ", ".
  const size_t at = out.find("All DNS codes:");
  if (at == std::string::npos) return false;
  const size_t start = out.find('\n', at);
  const size_t end = out.find('\n', start + 1);
  if (start == std::string::npos) return false;
  const std::string line = out.substr(start + 1, end - start - 1);
  codes->clear();
  size_t pos = 0;
  while (pos <= line.size()) {
    const size_t comma = line.find(',', pos);
    const std::string code = Trim(line.substr(pos, comma - pos));
    if (!code.empty()) codes->push_back(code);
    if (comma == std::string::npos) break;
    pos = comma + 1;
  }
  return !codes->empty();
}

bool DnsProviderHelp(const std::string& code, Json::Value* help) {
  if (!IsProviderCode(code)) return false;
  std::string out;
  if (RunLego({"dnshelp", "-c", code}, &out) != 0) return false;
  Json::Value h(Json::objectValue);
  h["code"] = code;
  h["name"] = "";
  h["credentials"] = Json::Value(Json::arrayValue);
  h["additional"] = Json::Value(Json::arrayValue);
  // "Configuration for NAME." then sections "Credentials:" and
  // "Additional Configuration:" of lines '  - "VAR":   description'.
  const char* section = nullptr;
  size_t pos = 0;
  while (pos < out.size()) {
    const size_t nl = out.find('\n', pos);
    const std::string line = out.substr(pos, nl == std::string::npos ? std::string::npos : nl - pos);
    pos = nl == std::string::npos ? out.size() : nl + 1;
    if (line.compare(0, 18, "Configuration for ") == 0) {
      std::string name = Trim(line.substr(18));
      if (!name.empty() && name.back() == '.') name.pop_back();
      h["name"] = name;
    } else if (line == "Credentials:") {
      section = "credentials";
    } else if (line == "Additional Configuration:") {
      section = "additional";
    } else if (Trim(line).empty()) {
      section = nullptr;
    } else if (section != nullptr) {
      const size_t q1 = line.find('"');
      const size_t q2 = q1 == std::string::npos ? q1 : line.find('"', q1 + 1);
      if (q2 == std::string::npos) continue;
      Json::Value entry(Json::objectValue);
      entry["name"] = line.substr(q1 + 1, q2 - q1 - 1);
      const size_t colon = line.find(':', q2);
      entry["description"] =
          colon == std::string::npos ? "" : Trim(line.substr(colon + 1));
      h[section].append(entry);
    }
  }
  *help = h;
  return true;
}

}  // namespace acme
}  // namespace ZEPH
