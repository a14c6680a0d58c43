#include "module/archive/info.h"

#include <errno.h>
#include <stdio.h>
#include <unistd.h>

#include "module/archive/cert_id.h"
#include "module/archive/file_lock.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_file.h"
#include "zeph/root.h"

namespace ZEPH {
namespace cert {

std::string InfoPath() { return RootPath(kInfoFile); }
std::string InfoTempPath() { return RootPath(kInfoTempFile); }
std::string InfoLockPath() { return RootPath(kInfoLockFile); }

bool ReadCertInfo(Json::Value& info, bool absent_is_empty) {
  const std::string path = InfoPath();
  if (!QLIBCFileExist(path.c_str())) {
    if (!absent_is_empty) return false;
    info = Json::Value(Json::objectValue);
    return true;
  }
  Json::Value parsed;
  if (!JsonFromFile(parsed, path) || !parsed.isObject()) return false;
  info.swap(parsed);
  return true;
}

}  // namespace cert
}  // namespace ZEPH

using ZEPH::cert::InfoLockPath;
using ZEPH::cert::InfoPath;
using ZEPH::cert::InfoTempPath;

bool WriteCertInfo(const Json::Value& info) {
  const std::string temp = InfoTempPath();
  const std::string path = InfoPath();
  const Json::Value copy(info);
  if (!ZEPH::JsonToFile(copy, temp, true)) {
    UTILS_LOG("Failed to write [%s] to [%s].", ZEPH::JsonCompact(copy).c_str(),
              temp.c_str());
    return false;
  }
  // rename(2) replaces INFO atomically: lock-free readers see either the
  // old file or the complete new one.
  if (rename(temp.c_str(), path.c_str()) != 0) {
    UTILS_LOG("Failed to move %s to %s", temp.c_str(), path.c_str());
    return false;
  }
  return true;
}

namespace {

// Takes "fullchain.pem" out of the directory of a certificate whose entry
// is being dropped, while the INFO lock is still held: the directory then
// no longer counts as a certificate (IsCrtIdValid), so a concurrent
// SetCrtProperty cannot bring the entry back in the time until the caller
// removes the directory (a delete first revokes the certificate, which
// needs its "cert.pem").
void RetireCrtDir(const std::string& id) {
  if (!IsCrtIdName(id)) return;
  const std::string path = ZEPH::cert::CrtDir(id) + "/fullchain.pem";
  if (unlink(path.c_str()) != 0 && errno != ENOENT) {
    UTILS_LOG("Failed to remove %s [%d]", path.c_str(), errno);
  }
}

}  // namespace

bool DropCertInfo(const std::string& id) {
  const std::string lock_path = InfoLockPath();
  const std::string path = InfoPath();
  ZEPH::cert::ScopedFileLock lock;
  if (!lock.Lock(lock_path, ZEPH::cert::kInfoLockDrop.mode,
                 ZEPH::cert::kInfoLockDrop.seconds)) {
    UTILS_LOG("Lock list file [%s] failed", lock_path.c_str());
    return false;
  }
  Json::Value info(Json::objectValue);
  if (!ZEPH::cert::ReadCertInfo(info, false)) {
    UTILS_LOG_LIBERR("Broken [%s].", path.c_str());
    return false;
  }
  if (!info.isMember(id)) {
    RetireCrtDir(id);
    return true;
  }
  const Json::Value& entry = info[id];
  if (!entry.isObject() || !entry.isMember("services") ||
      !entry["services"].isArray() || !entry["services"].empty()) {
    UTILS_LOG("Wrong info: [%s]", id.c_str());
    return false;
  }
  // By its bytes: removeMember(std::string) stops at a NUL in the key.
  info.removeMember(id.data(), id.data() + id.size(), nullptr);
  if (!WriteCertInfo(info)) {
    UTILS_LOG("Failed to write [%s].", path.c_str());
    return false;
  }
  RetireCrtDir(id);
  // The scope releases the lock; DropCertInfo reports nothing about it.
  return true;
}
