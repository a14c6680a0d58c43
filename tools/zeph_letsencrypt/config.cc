#include "tools/zeph_letsencrypt/config.h"

#include <errno.h>
#include <string.h>
#include <unistd.h>

#include "tools/zeph_letsencrypt/files.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

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

std::string DirOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? "." : path.substr(0, slash);
}

Outcome Bad(const std::string& path, const std::string& why) {
  return Outcome::Fail(kBadConfig, path + ": " + why);
}

// The member `name` as a non-empty string into `out`; absent leaves `out`.
bool ReadString(const Json::Value& root, const char* name, std::string* out,
                std::string* why) {
  if (!root.isMember(name)) return true;
  const Json::Value& v = root[name];
  if (!v.isString() || v.asString().empty()) {
    *why = std::string("\"") + name + "\" must be a non-empty string";
    return false;
  }
  *out = v.asString();
  return true;
}

}  // namespace

Outcome LoadConfig(const std::string& path, Config* config) {
  std::string text;
  if (!ReadWhole(path, &text)) {
    if (errno == ENOENT) return Outcome();
    return Bad(path, std::string("cannot read: ") + strerror(errno));
  }
  Json::Value root;
  if (!JsonParse(text, root) || !root.isObject()) {
    return Bad(path, "not a JSON object");
  }
  std::string why;
  if (!ReadString(root, "directory_url", &config->directory_url, &why) ||
      !ReadString(root, "ca_bundle", &config->ca_bundle, &why) ||
      !ReadString(root, "http_address", &config->http_address, &why) ||
      !ReadString(root, "http_webroot", &config->http_webroot, &why) ||
      !ReadString(root, "dns_provider", &config->dns_provider, &why) ||
      !ReadString(root, "key_type", &config->key_type, &why)) {
    return Bad(path, why);
  }
  if (config->directory_url.compare(0, 8, "https://") != 0 ||
      config->directory_url.size() == 8) {
    return Bad(path, "\"directory_url\" must be an https:// URL");
  }
  if (!IsListenAddress(config->http_address)) {
    return Bad(path, "\"http_address\" must be [host]:port");
  }
  if (!AllOf(config->dns_provider, "._-")) {
    return Bad(path, "\"dns_provider\" is not a provider name");
  }
  const char* key_types[] = {"rsa2048", "rsa4096", "rsa8192", "ec256", "ec384"};
  bool known_key = false;
  for (const char* k : key_types) known_key = known_key || config->key_type == k;
  if (!known_key) return Bad(path, "unknown \"key_type\" " + config->key_type);

  if (root.isMember("timeout_s")) {
    const Json::Value& t = root["timeout_s"];
    if (!t.isInt() || t.asInt() < 1 || t.asInt() > 3600) {
      return Bad(path, "\"timeout_s\" must be an integer from 1 to 3600");
    }
    config->timeout_s = t.asInt();
  }
  if (root.isMember("environment")) {
    const Json::Value& env = root["environment"];
    if (!env.isObject()) return Bad(path, "\"environment\" must be an object");
    for (const std::string& name : env.getMemberNames()) {
      if (!IsEnvironmentName(name) || !env[name].isString()) {
        return Bad(path, "\"environment\" member " + name +
                             " must be a variable name with a string value");
      }
      config->environment[name] = env[name].asString();
    }
  }
  if (!config->ca_bundle.empty()) {
    if (config->ca_bundle[0] != '/') {
      config->ca_bundle = DirOf(path) + "/" + config->ca_bundle;
    }
    if (access(config->ca_bundle.c_str(), R_OK) != 0) {
      return Bad(path, "\"ca_bundle\" " + config->ca_bundle +
                           " cannot be read: " + strerror(errno));
    }
  }
  return Outcome();
}

}  // namespace letsencrypt
}  // namespace ZEPH
