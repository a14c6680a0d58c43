// Command line of zeph-webapid.
//
//   zeph-webapid [--root DIR] [--listen ADDR:PORT] [--module PATH] [--web DIR]
//
// Thread-safety: plain functions on their arguments.
#ifndef ZEPH_SERVER_OPTIONS_H_
#define ZEPH_SERVER_OPTIONS_H_

#include <string>
#include <vector>

namespace ZEPH {
namespace webapid {

// The port the server listens on when --listen names none.
constexpr int kDefaultPort = 8443;
constexpr char kDefaultAddress[] = "127.0.0.1";

struct Options {
  std::string root;  // --root; empty: keep the environment's ZEPH_ROOT
  bool has_root = false;
  std::string address = kDefaultAddress;
  int port = kDefaultPort;  // 0: any free port (the chosen one is logged)
  std::string module;       // --module; empty: the default module path
  std::string web_dir;      // --web; empty: the installed page
  bool help = false;        // --help: print the usage and exit
};

// Parses argv. False with a one-line reason in `error` on an unknown option,
// a missing value, a positional argument or a malformed --listen.
bool ParseOptions(const std::vector<std::string>& args, Options* options,
                  std::string* error);

// Splits "ADDR:PORT" into its parts. ADDR may be an IPv4 address, a host
// name or an IPv6 address in brackets ("[::1]:8443"); PORT is 0 to 65535.
// ":PORT" alone keeps `address` as it is. False on anything else.
bool ParseListen(const std::string& text, std::string* address, int* port);

extern const char kUsage[];

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_OPTIONS_H_
