#include "module/archive/c_names.h"

#include "module/archive/cert_id.h"
#include "module/archive/checksum.h"
#include "module/archive/expiry.h"

bool GenCrtChecksumByCName(Json::Value& list) { return GenCrtChecksum(list); }

bool isPemExpireByCName(const std::string& path, int days) {
  return isPemExpire(path, days);
}

bool IsCrtPathValidByCName(bool local, const std::string& base,
                           const std::string& name) {
  return IsCrtPathValid(local, base, name);
}
