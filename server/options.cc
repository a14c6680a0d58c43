#include "server/options.h"

#include <stdlib.h>

namespace ZEPH {
namespace webapid {

const char kUsage[] =
    "usage: zeph-webapid [--root DIR] [--listen ADDR:PORT] [--module PATH] "
    "[--web DIR]\n";

bool ParseListen(const std::string& text, std::string* address, int* port) {
  const size_t colon = text.rfind(':');
  if (colon == std::string::npos) return false;
  std::string host = text.substr(0, colon);
  const std::string digits = text.substr(colon + 1);
  if (digits.empty() || digits.size() > 5 ||
      digits.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  const long value = strtol(digits.c_str(), nullptr, 10);
  if (value > 65535) return false;
  if (!host.empty() && host.front() == '[') {
    if (host.size() < 3 || host.back() != ']') return false;
    host = host.substr(1, host.size() - 2);
  } else if (host.find(':') != std::string::npos) {
    return false;  // a bare IPv6 address is ambiguous; it needs brackets
  }
  if (!host.empty()) *address = host;
  *port = static_cast<int>(value);
  return true;
}

bool ParseOptions(const std::vector<std::string>& args, Options* options,
                  std::string* error) {
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    auto value = [&](std::string* out) {
      if (i + 1 >= args.size()) {
        *error = arg + " needs a value";
        return false;
      }
      *out = args[++i];
      return true;
    };
    if (arg == "--root") {
      if (!value(&options->root)) return false;
      if (options->root.empty()) {
        *error = "--root needs a directory";
        return false;
      }
      options->has_root = true;
    } else if (arg == "--module") {
      if (!value(&options->module)) return false;
    } else if (arg == "--web") {
      if (!value(&options->web_dir)) return false;
    } else if (arg == "--listen") {
      std::string listen;
      if (!value(&listen)) return false;
      if (!ParseListen(listen, &options->address, &options->port)) {
        *error = "--listen takes ADDR:PORT, not " + listen;
        return false;
      }
    } else if (arg == "--help" || arg == "-h") {
      options->help = true;
    } else if (arg.compare(0, 1, "-") == 0) {
      *error = "unknown option " + arg;
      return false;
    } else {
      *error = "unexpected argument " + arg;
      return false;
    }
  }
  return true;
}

}  // namespace webapid
}  // namespace ZEPH
