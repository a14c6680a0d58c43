// The configuration of zeph-letsencrypt and the places it keeps its state.
//
// "<root>/usr/zeph/etc/letsencrypt/config.json" is a JSON object whose
// members are all optional:
//
//   "directory_url"  the ACME directory (https only); default Let's
//                    Encrypt's production directory
//   "ca_bundle"      PEM file of extra roots to trust for the ACME server
//                    (lego's LEGO_CA_CERTIFICATES); a relative path is taken
//                    from the configuration file's directory
//   "http_address"   where lego's HTTP-01 solver listens, "[host]:port";
//                    default ":80"
//   "http_webroot"   instead of listening, write the HTTP-01 answers below
//                    this directory, which a web server already serves
//   "dns_provider"   solve DNS-01 with this lego DNS provider instead of
//                    HTTP-01 (its credentials come from "environment")
//   "environment"    object of extra environment variables for lego, e.g.
//                    the DNS provider's credentials
//   "key_type"       key of the certificates: "rsa2048" (default), "rsa4096",
//                    "rsa8192", "ec256", "ec384"
//   "timeout_s"      bound on one ACME run in seconds (1 to 3600), default
//                    120; lego is stopped after it
//
// Thread-safety: plain values; LoadConfig only reads.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_CONFIG_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_CONFIG_H_

#include <map>
#include <string>

#include "tools/zeph_letsencrypt/outcome.h"

namespace ZEPH {
namespace letsencrypt {

// Appliance paths (pass them through ZEPH::RootPath).
constexpr char kStateDir[] = "/usr/zeph/etc/letsencrypt";
constexpr char kConfigFile[] = "/usr/zeph/etc/letsencrypt/config.json";
// Account records the module lists: account/<name>/info.json.
constexpr char kAccountDir[] = "/usr/zeph/etc/letsencrypt/account";
// lego's own data directory: its accounts and their keys.
constexpr char kLegoDir[] = "/usr/zeph/etc/letsencrypt/lego";
// Private working directories of single runs.
constexpr char kWorkDir[] = "/usr/zeph/etc/letsencrypt/work";
// Held while lego runs, so that two runs never register the same account
// into lego's data directory at once.
constexpr char kLockFile[] = "/usr/zeph/etc/letsencrypt/.lock";

// The ACME client: the machine's own, never below the root prefix.
constexpr char kLegoProgram[] = "/usr/bin/lego";

constexpr char kProductionDirectory[] =
    "https://acme-v02.api.letsencrypt.org/directory";

struct Config {
  std::string directory_url = kProductionDirectory;
  std::string ca_bundle;  // empty: the system's roots only
  std::string http_address = ":80";
  std::string http_webroot;
  std::string dns_provider;
  std::map<std::string, std::string> environment;
  std::string key_type = "rsa2048";
  int timeout_s = 120;
};

// Reads the configuration file at `path` into `config`. A missing file
// leaves the defaults and succeeds. Error 108 with a message naming the
// problem when the file cannot be read, is not a JSON object, or a member
// has the wrong type or an unusable value (a "ca_bundle" that cannot be
// read counts: lego would crash on it).
Outcome LoadConfig(const std::string& path, Config* config);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_CONFIG_H_
