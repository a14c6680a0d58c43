// zeph-letsencrypt: obtains, renews and revokes Let's Encrypt (ACME)
// certificates of the appliance's certificate archive with the lego client.
//
//   zeph-letsencrypt new-cert -d DOMAIN -m EMAIL -c NAME
//   zeph-letsencrypt renew -c ID
//   zeph-letsencrypt revoke -c ID
//   zeph-letsencrypt renew-due [--days N] [--module PATH]
//
// Options may come in any order, each once; "-m" may be empty (then the
// one account recorded for the configured ACME directory is used). What
// the commands do: commands.h and renew_due.h; the configuration file:
// config.h; the error numbers: outcome.h.
//
// Standard output carries exactly one JSON object, whatever happens:
// {"error": 0, ...} or {"error": N, "msg": "...", ...} (only renew-due
// adds members to an error, 111). Everything else (lego's own output,
// warnings) goes to standard error. Exit status 0 on success, 1 otherwise;
// the caller reads the JSON, not the status.
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <exception>
#include <map>
#include <string>

#include "tools/zeph_letsencrypt/commands.h"
#include "tools/zeph_letsencrypt/outcome.h"
#include "tools/zeph_letsencrypt/renew_due.h"
#include "zeph/json_file.h"
#include "zeph/unique_fd.h"

namespace {

using ZEPH::letsencrypt::Outcome;

constexpr char kUsage[] =
    "usage: zeph-letsencrypt new-cert -d DOMAIN -m EMAIL -c NAME | "
    "renew -c ID | revoke -c ID | renew-due [--days N] [--module PATH]";

Outcome BadCommandLine(const std::string& why) {
  return Outcome::Fail(ZEPH::letsencrypt::kBadCommandLine, why + "; " + kUsage);
}

// "--days N": a whole number of days, 0 to kMaxRenewDays.
bool ParseDays(const std::string& text, int* days) {
  if (text.empty() || text.size() > 5 ||
      text.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  const int n = std::stoi(text);
  if (n > ZEPH::letsencrypt::kMaxRenewDays) return false;
  *days = n;
  return true;
}

Outcome DispatchRenewDue(int argc, char** argv) {
  ZEPH::letsencrypt::RenewDueOptions options;
  std::map<std::string, std::string> given;
  for (int i = 2; i < argc; i += 2) {
    const std::string option = argv[i];
    if (option != "--days" && option != "--module") {
      return BadCommandLine("unexpected argument '" + option + "'");
    }
    if (i + 1 >= argc) return BadCommandLine("no value after " + option);
    if (!given.emplace(option, argv[i + 1]).second) {
      return BadCommandLine(option + " given twice");
    }
  }
  if (given.count("--days") != 0 && !ParseDays(given["--days"], &options.days)) {
    return BadCommandLine("--days wants a number of days from 0 to " +
                          std::to_string(ZEPH::letsencrypt::kMaxRenewDays));
  }
  if (given.count("--module") != 0) {
    options.module_path = given["--module"];
    if (options.module_path.empty()) return BadCommandLine("--module wants a path");
  }
  return ZEPH::letsencrypt::RenewDue(options);
}

Outcome Dispatch(int argc, char** argv) {
  if (argc < 2) return BadCommandLine("no command");
  const std::string command = argv[1];
  if (command == "renew-due") return DispatchRenewDue(argc, argv);
  std::string allowed;
  if (command == "new-cert") {
    allowed = "dmc";
  } else if (command == "renew" || command == "revoke") {
    allowed = "c";
  } else {
    return BadCommandLine("unknown command '" + command + "'");
  }
  std::map<char, std::string> options;
  for (int i = 2; i < argc; i += 2) {
    const std::string option = argv[i];
    if (option.size() != 2 || option[0] != '-' ||
        allowed.find(option[1]) == std::string::npos) {
      return BadCommandLine("unexpected argument '" + option + "'");
    }
    if (i + 1 >= argc) return BadCommandLine("no value after " + option);
    if (!options.emplace(option[1], argv[i + 1]).second) {
      return BadCommandLine(option + " given twice");
    }
  }
  for (char required : std::string(command == "new-cert" ? "dc" : "c")) {
    if (options.count(required) == 0) {
      return BadCommandLine(std::string("-") + required + " is missing");
    }
  }
  if (command == "new-cert") {
    return ZEPH::letsencrypt::NewCert(options['d'], options['m'], options['c']);
  }
  if (command == "renew") return ZEPH::letsencrypt::Renew(options['c']);
  return ZEPH::letsencrypt::Revoke(options['c']);
}

}  // namespace

int main(int argc, char** argv) {
  // The answer gets a private copy of standard output; descriptor 1 itself
  // goes to standard error, so that nothing else can reach the reader.
  ZEPH::UniqueFd answer_fd(fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 3));
  if (answer_fd) dup2(STDERR_FILENO, STDOUT_FILENO);
  signal(SIGPIPE, SIG_IGN);

  Outcome outcome;
  try {
    outcome = Dispatch(argc, argv);
  } catch (const std::exception& e) {
    outcome = Outcome::Fail(ZEPH::letsencrypt::kInternal,
                            std::string("unexpected failure: ") + e.what());
  } catch (...) {
    outcome = Outcome::Fail(ZEPH::letsencrypt::kInternal, "unexpected failure");
  }
  const std::string text = ZEPH::JsonCompact(outcome.ToJson()) + "\n";
  const int fd = answer_fd ? answer_fd.get() : STDOUT_FILENO;
  size_t done = 0;
  while (done < text.size()) {
    const ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    done += static_cast<size_t>(n);
  }
  return outcome.ok() ? 0 : 1;
}
