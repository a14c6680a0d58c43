#include "acme/settings.h"

#include <errno.h>
#include <fcntl.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <set>

#include "acme/base64url.h"
#include "acme/dns_providers.h"
#include "module/common/ssl_ptr.h"
#include "zeph/fd_io.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_lock.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace acme {
namespace {

constexpr int kLockSeconds = 10;
constexpr size_t kMaxResolvers = 8;
constexpr size_t kMaxValueBytes = 4096;
constexpr size_t kMinHmacKeyBytes = 16;
const char* const kKeyTypes[] = {"rsa2048", "rsa4096", "rsa8192", "ec256",
                                 "ec384"};

bool AllOf(const std::string& s, const char* allowed_extra) {
  for (char c : s) {
    const bool alnum = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                       (c >= '0' && c <= '9');
    if (!alnum && strchr(allowed_extra, c) == nullptr) return false;
  }
  return true;
}

// "[host]:port" as lego's --http.port takes it; the host part may be empty.
bool IsListenAddress(const std::string& address) {
  const size_t colon = address.rfind(':');
  if (colon == std::string::npos) return false;
  const std::string port = address.substr(colon + 1);
  if (port.empty() || port.size() > 5 || !AllOf(port, "")) return false;
  const long n = strtol(port.c_str(), nullptr, 10);
  return n >= 1 && n <= 65535 && AllOf(address.substr(0, colon), ".-:[]");
}

bool IsEnvironmentName(const std::string& name) {
  return !name.empty() && !(name[0] >= '0' && name[0] <= '9') &&
         AllOf(name, "_");
}

bool IsPrintableWord(const std::string& s) {
  for (unsigned char c : s) {
    if (c <= 0x20 || c >= 0x7f || c == '"' || c == '\\') return false;
  }
  return true;
}

bool Fail(SettingsError* error, const std::string& setting,
          const std::string& message) {
  error->setting = setting;
  error->message = message;
  return false;
}

bool ReadText(const Json::Value& root, const char* name, std::string* out,
              SettingsError* error) {
  if (!root.isMember(name)) return true;
  const Json::Value& v = root[name];
  if (!v.isString() || v.asString().empty()) {
    return Fail(error, name,
                std::string("\"") + name + "\" must be a non-empty string");
  }
  *out = v.asString();
  return true;
}

bool IsKeyType(const std::string& type) {
  for (const char* k : kKeyTypes) {
    if (type == k) return true;
  }
  return false;
}

// Checks that need no file: the members between themselves.
bool CheckValues(const Settings& s, SettingsError* error) {
  if (s.directory_url.compare(0, 8, "https://") != 0 ||
      s.directory_url.size() == 8 || !IsPrintableWord(s.directory_url)) {
    return Fail(error, "directory_url",
                "\"directory_url\" must be an https:// URL");
  }
  if (s.eab_kid.empty() != s.eab_hmac_key.empty()) {
    return Fail(error, s.eab_kid.empty() ? "eab_kid" : "eab_hmac_key",
                "external account binding needs both \"eab_kid\" and "
                "\"eab_hmac_key\"");
  }
  if (!s.eab_kid.empty() && (s.eab_kid.size() > 256 || !IsPrintableWord(s.eab_kid))) {
    return Fail(error, "eab_kid",
                "\"eab_kid\" must be a key id of printable characters");
  }
  std::string key;
  if (!s.eab_hmac_key.empty() &&
      (!Base64UrlDecode(s.eab_hmac_key, &key) || key.size() < kMinHmacKeyBytes)) {
    return Fail(error, "eab_hmac_key",
                "\"eab_hmac_key\" must be the CA's HMAC key in base64url "
                "(at least 16 bytes)");
  }
  if (!IsListenAddress(s.http_address)) {
    return Fail(error, "http_address", "\"http_address\" must be [host]:port");
  }
  if (!s.dns_provider.empty() && !IsProviderCode(s.dns_provider)) {
    return Fail(error, "dns_provider", "\"dns_provider\" is not a provider name");
  }
  if (s.dns_resolvers.size() > kMaxResolvers) {
    return Fail(error, "dns_resolvers", "at most 8 \"dns_resolvers\"");
  }
  for (const std::string& r : s.dns_resolvers) {
    if (!IsListenAddress(r) || r[0] == ':') {
      return Fail(error, "dns_resolvers",
                  "\"dns_resolvers\" must be host:port entries, not " + r);
    }
  }
  for (const auto& kv : s.environment) {
    if (!IsEnvironmentName(kv.first) ||
        kv.second.find('\0') != std::string::npos ||
        kv.second.size() > kMaxValueBytes) {
      return Fail(error, "environment",
                  "\"environment\" member " + kv.first +
                      " must be a variable name with a string value");
    }
  }
  if (!IsKeyType(s.key_type)) {
    return Fail(error, "key_type", "unknown \"key_type\" " + s.key_type);
  }
  if (s.timeout_s < 1 || s.timeout_s > 3600) {
    return Fail(error, "timeout_s",
                "\"timeout_s\" must be an integer from 1 to 3600");
  }
  return true;
}

bool CheckFiles(const Settings& s, const std::string& dir, SettingsError* error) {
  const std::string bundle = CaBundlePath(s, dir);
  if (!bundle.empty() && access(bundle.c_str(), R_OK) != 0) {
    return Fail(error, "ca_bundle",
                "\"ca_bundle\" " + bundle + " cannot be read: " + strerror(errno));
  }
  return true;
}

// Makes `path` hold exactly `content` with `mode`: a new file beside it,
// synced, renamed over it. A reader sees the old file or the new one.
bool WriteAtomically(const std::string& path, const std::string& content,
                     mode_t mode) {
  std::string temp = path + ".XXXXXX";
  UniqueFd fd(mkostemp(&temp[0], O_CLOEXEC));
  if (!fd) return false;
  const bool ok = fchmod(fd.get(), mode) == 0 &&
                  WriteAll(fd.get(), content) && fsync(fd.get()) == 0 &&
                  close(fd.release()) == 0 &&
                  rename(temp.c_str(), path.c_str()) == 0;
  if (!ok) {
    const int saved = errno;
    unlink(temp.c_str());
    errno = saved;
  }
  return ok;
}

// Checks of an update that look at the machine: the webroot exists, lego
// knows the provider.
bool CheckMachine(const Settings& s, SettingsError* error) {
  struct stat st;
  if (!s.http_webroot.empty() &&
      (s.http_webroot[0] != '/' || stat(s.http_webroot.c_str(), &st) != 0 ||
       !S_ISDIR(st.st_mode))) {
    return Fail(error, "http_webroot",
                "\"http_webroot\" must be the absolute path of a directory");
  }
  if (s.dns_provider == "manual") {
    return Fail(error, "dns_provider",
                "the \"manual\" DNS provider waits for a person at the console");
  }
  std::vector<std::string> known;
  if (!s.dns_provider.empty() && DnsProviders(&known) &&
      std::find(known.begin(), known.end(), s.dns_provider) == known.end()) {
    return Fail(error, "dns_provider",
                "lego knows no DNS provider \"" + s.dns_provider + "\"");
  }
  for (const auto& kv : s.environment) {
    if (kv.first.compare(0, 5, "LEGO_") == 0) {
      return Fail(error, "environment",
                  kv.first + " is set by the tool itself, not in \"environment\"");
    }
  }
  return true;
}

Json::Value Texts(const std::vector<std::string>& items) {
  Json::Value out(Json::arrayValue);
  for (const std::string& i : items) out.append(i);
  return out;
}

std::string Rfc2253(X509_NAME* name) {
  ssl::BioPtr mem(BIO_new(BIO_s_mem()));
  if (!mem || X509_NAME_print_ex(mem.get(), name, 0, XN_FLAG_RFC2253) < 0) return "";
  char* data = nullptr;
  const long n = BIO_get_mem_data(mem.get(), &data);
  return n > 0 ? std::string(data, static_cast<size_t>(n)) : "";
}

// The update's text member `name` into `out`; "" is allowed (clears).
bool UpdateText(const Json::Value& update, const char* name, std::string* out,
                SettingsError* error) {
  if (!update.isMember(name)) return true;
  if (!update[name].isString()) {
    return Fail(error, name, std::string("\"") + name + "\" must be a string");
  }
  *out = update[name].asString();
  return true;
}

}  // namespace

Challenge ChallengeOf(const Settings& settings) {
  if (!settings.dns_provider.empty()) return Challenge::kDns;
  if (!settings.http_webroot.empty()) return Challenge::kWebroot;
  return Challenge::kHttp;
}

std::string CaBundlePath(const Settings& settings, const std::string& dir) {
  if (settings.ca_bundle.empty() || settings.ca_bundle[0] == '/') {
    return settings.ca_bundle;
  }
  return dir + "/" + settings.ca_bundle;
}

bool SettingsFromJson(const Json::Value& root, Settings* out,
                      SettingsError* error) {
  if (!root.isObject()) return Fail(error, "", "not a JSON object");
  Settings s;
  if (!ReadText(root, "directory_url", &s.directory_url, error) ||
      !ReadText(root, "ca_bundle", &s.ca_bundle, error) ||
      !ReadText(root, "eab_kid", &s.eab_kid, error) ||
      !ReadText(root, "eab_hmac_key", &s.eab_hmac_key, error) ||
      !ReadText(root, "http_address", &s.http_address, error) ||
      !ReadText(root, "http_webroot", &s.http_webroot, error) ||
      !ReadText(root, "dns_provider", &s.dns_provider, error) ||
      !ReadText(root, "key_type", &s.key_type, error)) {
    return false;
  }
  if (root.isMember("dns_resolvers")) {
    const Json::Value& r = root["dns_resolvers"];
    if (!r.isArray()) {
      return Fail(error, "dns_resolvers", "\"dns_resolvers\" must be a list");
    }
    for (const Json::Value& entry : r) {
      if (!entry.isString()) {
        return Fail(error, "dns_resolvers",
                    "\"dns_resolvers\" must be a list of host:port texts");
      }
      s.dns_resolvers.push_back(entry.asString());
    }
  }
  if (root.isMember("dns_disable_cp")) {
    if (!root["dns_disable_cp"].isBool()) {
      return Fail(error, "dns_disable_cp", "\"dns_disable_cp\" must be true or false");
    }
    s.dns_disable_cp = root["dns_disable_cp"].asBool();
  }
  if (root.isMember("timeout_s")) {
    const Json::Value& t = root["timeout_s"];
    if (!t.isInt()) {
      return Fail(error, "timeout_s",
                  "\"timeout_s\" must be an integer from 1 to 3600");
    }
    s.timeout_s = t.asInt();
  }
  if (root.isMember("environment")) {
    const Json::Value& env = root["environment"];
    if (!env.isObject()) {
      return Fail(error, "environment", "\"environment\" must be an object");
    }
    for (const std::string& name : env.getMemberNames()) {
      if (!env[name].isString()) {
        return Fail(error, "environment",
                    "\"environment\" member " + name +
                        " must be a variable name with a string value");
      }
      s.environment[name] = env[name].asString();
    }
  }
  if (!CheckValues(s, error)) return false;
  *out = s;
  return true;
}

Json::Value SettingsToJson(const Settings& s) {
  const Settings defaults;
  Json::Value out(Json::objectValue);
  auto text = [&out](const char* name, const std::string& value,
                     const std::string& fallback) {
    if (!value.empty() && value != fallback) out[name] = value;
  };
  text("directory_url", s.directory_url, defaults.directory_url);
  text("ca_bundle", s.ca_bundle, "");
  text("eab_kid", s.eab_kid, "");
  text("eab_hmac_key", s.eab_hmac_key, "");
  text("http_address", s.http_address, defaults.http_address);
  text("http_webroot", s.http_webroot, "");
  text("dns_provider", s.dns_provider, "");
  if (!s.dns_resolvers.empty()) out["dns_resolvers"] = Texts(s.dns_resolvers);
  if (s.dns_disable_cp) out["dns_disable_cp"] = true;
  if (!s.environment.empty()) {
    for (const auto& kv : s.environment) out["environment"][kv.first] = kv.second;
  }
  text("key_type", s.key_type, defaults.key_type);
  if (s.timeout_s != defaults.timeout_s) out["timeout_s"] = s.timeout_s;
  return out;
}

bool LoadSettings(const std::string& dir, Settings* out, SettingsError* error) {
  const std::string path = dir + "/" + kSettingsFile;
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) {
    if (errno == ENOENT) {
      *out = Settings();
      return true;
    }
    return Fail(error, "", std::string("cannot read: ") + strerror(errno));
  }
  std::string text;
  Json::Value root;
  if (!ReadAll(fd.get(), text)) {
    return Fail(error, "", std::string("cannot read: ") + strerror(errno));
  }
  if (!JsonParse(text, root) || !root.isObject()) {
    return Fail(error, "", "not a JSON object");
  }
  Settings s;
  if (!SettingsFromJson(root, &s, error) || !CheckFiles(s, dir, error)) {
    return false;
  }
  *out = s;
  return true;
}

Json::Value PublicView(const Settings& s, const std::string& dir) {
  const Settings defaults;
  Json::Value v(Json::objectValue);
  v["directory_url"] = s.directory_url;
  v["directory"] = s.directory_url == kLetsEncryptDirectory ? "letsencrypt"
                   : s.directory_url == kLetsEncryptStagingDirectory
                       ? "letsencrypt_staging"
                       : "custom";
  v["known_directories"]["letsencrypt"] = kLetsEncryptDirectory;
  v["known_directories"]["letsencrypt_staging"] = kLetsEncryptStagingDirectory;
  std::vector<std::string> subjects;
  const std::string bundle = CaBundlePath(s, dir);
  std::string pem;
  UniqueFd fd(bundle.empty() ? -1 : open(bundle.c_str(), O_RDONLY | O_CLOEXEC));
  std::string why;
  if (fd && ReadAll(fd.get(), pem)) CheckCaBundle(pem, &subjects, &why);
  v["ca_bundle_is_set"] = !s.ca_bundle.empty();
  v["ca_bundle_subjects"] = Texts(subjects);
  v["eab_kid"] = s.eab_kid;
  v["eab_hmac_key_is_set"] = !s.eab_hmac_key.empty();
  switch (ChallengeOf(s)) {
    case Challenge::kDns: v["challenge"] = "dns"; break;
    case Challenge::kWebroot: v["challenge"] = "webroot"; break;
    case Challenge::kHttp: v["challenge"] = "http"; break;
  }
  v["http_address"] = s.http_address;
  v["http_webroot"] = s.http_webroot;
  v["dns_provider"] = s.dns_provider;
  v["dns_resolvers"] = Texts(s.dns_resolvers);
  v["dns_disable_cp"] = s.dns_disable_cp;
  std::vector<std::string> names;
  for (const auto& kv : s.environment) names.push_back(kv.first);
  v["environment_names"] = Texts(names);  // a std::map: sorted
  v["key_type"] = s.key_type;
  v["timeout_s"] = s.timeout_s;
  return v;
}

bool CheckCaBundle(const std::string& pem, std::vector<std::string>* subjects,
                   std::string* why) {
  ssl::BioPtr bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  if (!bio) {
    *why = "out of memory";
    return false;
  }
  std::vector<std::string> names;
  for (;;) {
    char* name = nullptr;
    char* header = nullptr;
    unsigned char* data = nullptr;
    long len = 0;
    if (PEM_read_bio(bio.get(), &name, &header, &data, &len) != 1) break;
    ssl::OpensslChars owned_name(name);
    ssl::OpensslChars owned_header(header);
    ssl::OpensslBytes owned_data(data);
    if (strcmp(name, PEM_STRING_X509) != 0) {
      ERR_clear_error();
      *why = std::string("the bundle holds a ") + name +
             ", not only certificates";
      return false;
    }
    const unsigned char* p = data;
    ssl::X509Ptr cert(d2i_X509(nullptr, &p, len));
    if (!cert || p != data + len) {
      ERR_clear_error();
      *why = "a certificate of the bundle cannot be read";
      return false;
    }
    names.push_back(Rfc2253(X509_get_subject_name(cert.get())));
  }
  ERR_clear_error();  // the end of the input
  if (names.empty()) {
    *why = "no PEM certificate in the bundle";
    return false;
  }
  if (subjects != nullptr) *subjects = names;
  return true;
}

bool UpdateSettings(const std::string& dir, const Json::Value& update,
                    Settings* saved, SettingsError* error) {
  if (!update.isObject()) return Fail(error, "", "the settings must be a JSON object");
  static const std::set<std::string> kKnown = {
      "directory_url", "ca_bundle_pem", "eab_kid", "eab_hmac_key", "challenge",
      "http_address", "http_webroot", "dns_provider", "dns_resolvers",
      "dns_disable_cp", "environment", "key_type", "timeout_s"};
  for (const std::string& name : update.getMemberNames()) {
    if (kKnown.count(name) == 0) return Fail(error, name, "unknown setting \"" + name + "\"");
  }
  if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
    return Fail(error, "", "cannot make " + dir + ": " + strerror(errno));
  }
  int lock_fd = -1;
  const std::string lock_path = dir + "/" + kSettingsLockFile;
  if (!QLIBCFileLockTimeByFile(lock_path.c_str(), QLIBC_LOCK_EXCLUSIVE,
                               kLockSeconds, &lock_fd)) {
    return Fail(error, "", "another change of the settings is in progress");
  }
  struct Unlock {
    int fd;
    ~Unlock() { QLIBCFileUnlockByFile(fd); }
  } unlock{lock_fd};

  // The saved settings, read without looking at their files: an update
  // may be what repairs them (a bundle that went missing).
  Settings s;
  const std::string path = dir + "/" + kSettingsFile;
  Json::Value root(Json::objectValue);
  if (access(path.c_str(), F_OK) == 0 &&
      (!JsonFromFile(root, path) || !SettingsFromJson(root, &s, error))) {
    const std::string why = error->message.empty() ? "not a JSON object" : error->message;
    return Fail(error, "", path + " cannot be used (" + why +
                               "); correct or remove it");
  }
  const std::string old_provider = s.dns_provider;

  std::string text;
  if (!UpdateText(update, "directory_url", &s.directory_url, error) ||
      !UpdateText(update, "eab_kid", &s.eab_kid, error) ||
      !UpdateText(update, "eab_hmac_key", &s.eab_hmac_key, error) ||
      !UpdateText(update, "http_address", &s.http_address, error) ||
      !UpdateText(update, "http_webroot", &s.http_webroot, error) ||
      !UpdateText(update, "dns_provider", &s.dns_provider, error) ||
      !UpdateText(update, "key_type", &s.key_type, error)) {
    return false;
  }
  if (update.isMember("dns_resolvers") || update.isMember("dns_disable_cp") ||
      update.isMember("timeout_s")) {
    Json::Value partial(Json::objectValue);
    for (const char* name : {"dns_resolvers", "dns_disable_cp", "timeout_s"}) {
      if (update.isMember(name)) partial[name] = update[name];
    }
    Settings parsed;
    if (!SettingsFromJson(partial, &parsed, error)) return false;
    if (update.isMember("dns_resolvers")) s.dns_resolvers = parsed.dns_resolvers;
    if (update.isMember("dns_disable_cp")) s.dns_disable_cp = parsed.dns_disable_cp;
    if (update.isMember("timeout_s")) s.timeout_s = parsed.timeout_s;
  }
  if (s.dns_provider != old_provider && !old_provider.empty()) {
    s.environment.clear();  // the old provider's credentials
  }
  if (update.isMember("environment")) {
    const Json::Value& env = update["environment"];
    if (!env.isObject()) {
      return Fail(error, "environment", "\"environment\" must be an object");
    }
    for (const std::string& name : env.getMemberNames()) {
      if (env[name].isNull()) {
        s.environment.erase(name);
      } else if (env[name].isString()) {
        s.environment[name] = env[name].asString();
      } else {
        return Fail(error, "environment",
                    "\"environment\" member " + name + " must be a text or null");
      }
    }
  }
  if (update.isMember("challenge")) {
    const Json::Value& c = update["challenge"];
    const std::string challenge = c.isString() ? c.asString() : "";
    if (challenge == "http") {
      s.http_webroot.clear();
      s.dns_provider.clear();
    } else if (challenge == "webroot") {
      if (s.http_webroot.empty()) {
        return Fail(error, "http_webroot", "HTTP-01 through a webroot needs \"http_webroot\"");
      }
      s.dns_provider.clear();
    } else if (challenge == "dns") {
      if (s.dns_provider.empty()) {
        return Fail(error, "dns_provider", "DNS-01 needs a \"dns_provider\"");
      }
    } else {
      return Fail(error, "challenge",
                  "\"challenge\" must be \"http\", \"webroot\" or \"dns\"");
    }
  }
  // "" clears a text whose default is not empty: back to the default.
  const Settings defaults;
  if (s.directory_url.empty()) s.directory_url = defaults.directory_url;
  if (s.http_address.empty()) s.http_address = defaults.http_address;
  if (s.key_type.empty()) s.key_type = defaults.key_type;

  std::string bundle_pem;
  bool new_bundle = false;
  bool drop_bundle = false;
  if (update.isMember("ca_bundle_pem")) {
    if (!update["ca_bundle_pem"].isString()) {
      return Fail(error, "ca_bundle_pem", "\"ca_bundle_pem\" must be PEM text");
    }
    bundle_pem = update["ca_bundle_pem"].asString();
    std::string why;
    if (bundle_pem.empty()) {
      drop_bundle = s.ca_bundle == kCaBundleFile;
      s.ca_bundle.clear();
    } else if (!CheckCaBundle(bundle_pem, nullptr, &why)) {
      return Fail(error, "ca_bundle_pem", why);
    } else {
      new_bundle = true;
      s.ca_bundle = kCaBundleFile;
    }
  }
  if (!CheckValues(s, error) || !CheckMachine(s, error) ||
      (!new_bundle && !CheckFiles(s, dir, error))) {
    return false;
  }

  const std::string bundle_path = dir + "/" + kCaBundleFile;
  if (new_bundle && !WriteAtomically(bundle_path, bundle_pem, 0644)) {
    return Fail(error, "", "cannot write " + bundle_path + ": " + strerror(errno));
  }
  std::string file = SettingsToJson(s).toStyledString();
  if (!WriteAtomically(path, file, 0600)) {
    return Fail(error, "", "cannot write " + path + ": " + strerror(errno));
  }
  if (drop_bundle) unlink(bundle_path.c_str());
  *saved = s;
  return true;
}

}  // namespace acme
}  // namespace ZEPH
