#include "module/archive/expiry.h"

#include <openssl/err.h>
#include <openssl/pem.h>
#include <time.h>

#include "module/archive/cert_id.h"
#include "module/common/log.h"
#include "module/common/ssl_ptr.h"
#include "zeph/qlibc_file.h"
#include "zeph/unique_fd.h"

namespace {

bool ExpiresWithin(const std::string& path, int days) {
  time_t limit = time(nullptr) + static_cast<time_t>(days) * 86400;
  ZEPH::UniqueFile file(fopen(path.c_str(), "re"));
  if (!file) {
    UTILS_LOG("Failed to open %s (%m)", path.c_str());
    return false;
  }
  ZEPH::ssl::X509Ptr cert(PEM_read_X509(file.get(), nullptr, nullptr, nullptr));
  if (!cert) {
    UTILS_LOG("Failed to read %s (%m)", path.c_str());
    // Leave no stale error behind for the next OpenSSL user of the thread.
    ERR_clear_error();
    return false;
  }
  // -1: notAfter is earlier than the limit; 1: later; 0: comparison failed.
  if (X509_cmp_time(X509_get0_notAfter(cert.get()), &limit) < 0) return true;
  UTILS_LOG_DEBUG("%s will not expired at %lld", path.c_str(),
                  static_cast<long long>(limit));
  return false;
}

}  // namespace

bool isPemExpire(const std::string& path, int days) {
  // Called through dlsym, possibly from C: nothing may escape as an
  // exception.
  try {
    return ExpiresWithin(path, days);
  } catch (...) {
    return false;
  }
}

bool CertificateRenewable(const std::string& id) {
  const std::string path = ZEPH::cert::CrtDir(id) + "/renew.json";
  return QLIBCFileExist(path.c_str()) != 0;
}
