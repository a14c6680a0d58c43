// The settings of the ACME (Let's Encrypt) tool, shared by the tool that
// uses them (zeph-letsencrypt), the server that offers them to the
// administration page (zeph-webapid) and zephcert.
//
// They live in the tool's state directory ("<root>/usr/zeph/etc/letsencrypt"),
// in "config.json": one JSON object whose members are all optional
// (defaults below), the file an administrator may also edit by hand:
//
//   "directory_url"   ACME directory (https), default Let's Encrypt's
//   "ca_bundle"       PEM file of roots to trust for the ACME server's TLS,
//                     relative to the state directory unless absolute
//   "eab_kid", "eab_hmac_key"
//                     external account binding: key id and HMAC key
//                     (base64url) for CAs that demand it; both or neither
//   "http_address"    where the HTTP-01 solver listens, default ":80"
//   "http_webroot"    answer HTTP-01 by writing below this directory
//   "dns_provider"    solve DNS-01 with this lego DNS provider
//   "dns_resolvers"   ["host:port", ...]: resolvers for lego's checks
//   "dns_disable_cp"  true: do not wait for every authoritative name
//                     server, only for the resolvers
//   "environment"     {"NAME": "value"}: variables for lego, the DNS
//                     provider's credentials above all
//   "key_type"        rsa2048 (default), rsa4096, rsa8192, ec256, ec384
//   "timeout_s"       bound on one ACME run, 1 to 3600, default 120
//
// The challenge is DNS-01 when "dns_provider" is set, else HTTP-01 through
// "http_webroot" when that is set, else HTTP-01 on "http_address".
//
// Secrets: "eab_hmac_key" and every value of "environment". They are kept
// in the settings file, which is written with mode 0600 and replaced
// whole (a new file, synced, renamed over the old one); the view for the
// page (PublicView) says only whether they are set. Nothing here logs.
//
// Thread-safety: no state. UpdateSettings serialises writers of one state
// directory (threads and processes) with a lock file of its own; readers
// need no lock, since the file is replaced in one rename.
#ifndef ZEPH_ACME_SETTINGS_H_
#define ZEPH_ACME_SETTINGS_H_

#include <json/json.h>

#include <map>
#include <string>
#include <vector>

namespace ZEPH {
namespace acme {

constexpr char kLetsEncryptDirectory[] =
    "https://acme-v02.api.letsencrypt.org/directory";
constexpr char kLetsEncryptStagingDirectory[] =
    "https://acme-staging-v02.api.letsencrypt.org/directory";

// File names in the state directory.
constexpr char kSettingsFile[] = "config.json";
constexpr char kCaBundleFile[] = "ca_bundle.pem";  // an uploaded bundle
constexpr char kSettingsLockFile[] = ".settings.lock";

struct Settings {
  std::string directory_url = kLetsEncryptDirectory;
  std::string ca_bundle;  // as written; empty: the system's roots only
  std::string eab_kid;
  std::string eab_hmac_key;
  std::string http_address = ":80";
  std::string http_webroot;
  std::string dns_provider;
  std::vector<std::string> dns_resolvers;
  bool dns_disable_cp = false;
  std::map<std::string, std::string> environment;
  std::string key_type = "rsa2048";
  int timeout_s = 120;
};

enum class Challenge { kHttp, kWebroot, kDns };
Challenge ChallengeOf(const Settings& settings);

// A setting that was refused: its name ("" for the document as a whole)
// and why, in one sentence an administrator can act on.
struct SettingsError {
  std::string setting;
  std::string message;
};

// The path of "ca_bundle" as the tool opens it: as written when absolute,
// else below `dir`. Empty when no bundle is set.
std::string CaBundlePath(const Settings& settings, const std::string& dir);

// Reads the settings object `root` (the file's form) into `out`, starting
// from the defaults. Refuses a member of the wrong type or with a value
// that cannot work; files are not looked at (LoadSettings does). Unknown
// members are ignored (a hand-edited file may carry notes; an update does
// not keep them).
bool SettingsFromJson(const Json::Value& root, Settings* out,
                      SettingsError* error);

// The file's form of `settings`, secrets included; members at their
// defaults are left out.
Json::Value SettingsToJson(const Settings& settings);

// Reads "<dir>/config.json". A missing file gives the defaults. False with
// the reason when the file cannot be read, is not a JSON object, or
// SettingsFromJson refuses it.
bool LoadSettings(const std::string& dir, Settings* out, SettingsError* error);

// What the page may see of `settings`: every member of the file's form but
// the secrets, which appear as "eab_hmac_key_is_set" and
// "environment_names" (the names of the variables set, sorted), plus
//   "challenge": "http", "webroot" or "dns";
//   "directory": "letsencrypt", "letsencrypt_staging" or "custom";
//   "known_directories": {"letsencrypt": URL, "letsencrypt_staging": URL};
//   "ca_bundle_is_set" and "ca_bundle_subjects" (the subjects of its
//   certificates, RFC 2253) instead of "ca_bundle".
Json::Value PublicView(const Settings& settings, const std::string& dir);

// Whether `pem` is a bundle of certificates: one or more PEM blocks, each a
// readable CERTIFICATE (no keys, no requests). Their subjects into
// `subjects` when given.
bool CheckCaBundle(const std::string& pem, std::vector<std::string>* subjects,
                   std::string* why);

// Changes the settings of state directory `dir` as `update` says and saves
// them; the new settings into `saved`. `update` is a JSON object whose
// members are all optional, each replacing the setting of that name:
//   "directory_url", "eab_kid", "eab_hmac_key", "http_address",
//   "http_webroot", "dns_provider", "dns_resolvers", "dns_disable_cp",
//   "key_type", "timeout_s" as in the file ("" clears a text);
//   "challenge": "http" (clears "http_webroot" and "dns_provider"),
//     "webroot" (clears "dns_provider"; needs "http_webroot"), "dns"
//     (needs "dns_provider");
//   "ca_bundle_pem": the text of a PEM bundle of certificates, stored as
//     "<dir>/ca_bundle.pem"; "" removes the bundle;
//   "environment": {"NAME": "value" to set, null to remove}; variables not
//     named are kept, unless "dns_provider" changes to another provider,
//     whose credentials start from those given here.
// The result is checked as a whole before anything is written: an unknown
// member, a value of the wrong type or one that cannot work (a URL that is
// not https, a webroot that is no absolute directory, a DNS provider lego
// does not know or the interactive "manual", half an account binding, an
// HMAC key that is not base64url, a variable name of lego's own "LEGO_*")
// refuses the whole update with the reason and leaves every file as it was.
// Writers are serialised with "<dir>/.settings.lock" (waiting at most 10 s).
bool UpdateSettings(const std::string& dir, const Json::Value& update,
                    Settings* saved, SettingsError* error);

}  // namespace acme
}  // namespace ZEPH

#endif  // ZEPH_ACME_SETTINGS_H_
