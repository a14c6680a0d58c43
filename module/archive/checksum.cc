#include "module/archive/checksum.h"

#include <errno.h>
#include <limits.h>
#include <openssl/pem.h>
#include <openssl/sha.h>
#include <stdlib.h>
#include <string.h>

#include <iomanip>
#include <sstream>
#include <string>

#include "module/archive/cert_id.h"
#include "module/archive/info.h"
#include "module/archive/ssl_errors.h"
#include "module/common/log.h"
#include "module/common/ssl_ptr.h"
#include "zeph/json_file.h"
#include "zeph/unique_fd.h"

namespace {

// strerror_r (GNU form, which may return a static string instead of
// filling `buf`): strerror itself is not reentrant.
std::string ErrnoText(int err) {
  char buf[256];
  return strerror_r(err, buf, sizeof(buf));
}

Json::Value MemberOf(const Json::Value& object, const char* key) {
  return object.isObject() ? object[key] : Json::Value();
}

// The SHA-256 of the DER form of the first certificate in `id`'s cert.pem,
// as 64 lowercase hexadecimal digits. Logs and returns false on failure.
bool CertChecksum(const std::string& id, std::string& checksum) {
  const std::string path = ZEPH::cert::CrtDir(id) + "/cert.pem";
  char resolved[PATH_MAX];
  if (realpath(path.c_str(), resolved) == nullptr) {
    const int err = errno;
    UTILS_LOG("Realpath %s failed. %s", path.c_str(), ErrnoText(err).c_str());
    return false;
  }
  // A cert.pem that is (or lies behind) a symbolic link leading elsewhere
  // is not the archive's certificate.
  if (strncmp(resolved, path.c_str(), strlen(resolved)) != 0) {
    UTILS_LOG("Invalid path for %s, %s.", path.c_str(), resolved);
    return false;
  }
  ZEPH::UniqueFile file(fopen(resolved, "re"));
  if (!file) {
    const int err = errno;
    UTILS_LOG("Open %s failed. %s", resolved, ErrnoText(err).c_str());
    return false;
  }
  ZEPH::ssl::X509Ptr cert(PEM_read_X509(file.get(), nullptr, nullptr, nullptr));
  if (!cert) {
    log_ssl_errors("Read X509 failed.");
    return false;
  }
  unsigned char* der_raw = nullptr;
  const int der_size = i2d_X509(cert.get(), &der_raw);
  ZEPH::ssl::OpensslBytes der(der_raw);
  if (der_size < 0) {
    log_ssl_errors("PEM to DER failed.");
    return false;
  }
  SHA256_CTX ctx;
  unsigned char digest[SHA256_DIGEST_LENGTH];
  if (SHA256_Init(&ctx) != 1) {
    log_ssl_errors("SHA256 init failed.");
    return false;
  }
  if (SHA256_Update(&ctx, der.get(), static_cast<size_t>(der_size)) != 1) {
    log_ssl_errors("SHA256 update failed.");
    return false;
  }
  if (SHA256_Final(digest, &ctx) != 1) {
    log_ssl_errors("SHA256 final failed.");
    return false;
  }
  std::ostringstream hex;
  hex << std::hex << std::setfill('0');
  for (unsigned char byte : digest) {
    hex << std::setw(2) << static_cast<int>(byte);
  }
  checksum = hex.str();
  return true;
}

bool AppendChecksums(Json::Value& list) {
  const std::string info_path = ZEPH::cert::InfoPath();
  Json::Value info;
  if (!ZEPH::JsonFromFile(info, info_path) || !info.isObject()) {
    const int err = errno;
    UTILS_LOG("Open %s failed. %s", info_path.c_str(), ErrnoText(err).c_str());
    return false;
  }
  for (const std::string& id : info.getMemberNames()) {
    const Json::Value& entry = info[id];
    if (!entry.isObject() || !entry.isMember("services") ||
        !entry["services"].isArray()) {
      UTILS_LOG("Incorrect format for %s", info_path.c_str());
      return false;
    }
    for (const Json::Value& service : entry["services"]) {
      Json::Value element(Json::objectValue);
      element["service"] = MemberOf(service, "service");
      element["subscriber"] = MemberOf(service, "subscriber");
      // Computed again for every service: each element stands on its own.
      std::string checksum;
      if (!CertChecksum(id, checksum)) return false;
      element["checksum"] = checksum;
      list.append(element);
    }
  }
  return true;
}

}  // namespace

bool GenCrtChecksum(Json::Value& list) {
  // Called through dlsym, possibly from C: nothing may escape as an
  // exception (jsoncpp throws on misuse, e.g. a `list` that is an object).
  try {
    return AppendChecksums(list);
  } catch (...) {
    return false;
  }
}
