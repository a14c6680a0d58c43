// The configuration of zeph-letsencrypt and the places it keeps its state.
//
// The settings themselves ("<root>/usr/zeph/etc/letsencrypt/config.json",
// their members, defaults and checks) are the shared ones of
// acme/settings.h, which the server offers to the administration page.
//
// Thread-safety: plain values; LoadConfig only reads.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_CONFIG_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_CONFIG_H_

#include <string>

#include "acme/dns_providers.h"
#include "acme/settings.h"
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
constexpr const char* kLegoProgram = acme::kLegoProgram;

using Config = acme::Settings;

// Reads the configuration file at `path` into `config`, with "ca_bundle"
// made the path the tool opens. A missing file leaves the defaults and
// succeeds. Error 108 with a message naming the file and the problem when
// the file cannot be read, is not a JSON object, or a member has the wrong
// type or an unusable value (a "ca_bundle" that cannot be read counts:
// lego would crash on it).
Outcome LoadConfig(const std::string& path, Config* config);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_CONFIG_H_
