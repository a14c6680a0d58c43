#include "tools/zeph_letsencrypt/config.h"

namespace ZEPH {
namespace letsencrypt {

Outcome LoadConfig(const std::string& path, Config* config) {
  const size_t slash = path.rfind('/');
  const std::string dir = slash == std::string::npos ? "." : path.substr(0, slash);
  acme::SettingsError error;
  if (!acme::LoadSettings(dir, config, &error)) {
    return Outcome::Fail(kBadConfig, path + ": " + error.message);
  }
  config->ca_bundle = acme::CaBundlePath(*config, dir);
  return Outcome();
}

}  // namespace letsencrypt
}  // namespace ZEPH
