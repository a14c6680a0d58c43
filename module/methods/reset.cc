// ZEPH.Core.Certificate "reset": back to one fresh default certificate.
#include <errno.h>
#include <stdio.h>
#include <unistd.h>

#include <string>

#include "module/archive/cert_id.h"
#include "module/archive/dir_ops.h"
#include "module/archive/info.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/deploy/deploy.h"
#include "module/methods/action_log.h"
#include "module/methods/letsencrypt.h"
#include "module/methods/properties.h"
#include "module/methods/reset.h"
#include "module/methods/workers.h"
#include "module/mkcert/cert_set.h"
#include "module/mkcert/generation_lock.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_file.h"
#include "zeph/root.h"

namespace {

// Reads a catalogue file that must exist and parse.
bool ReadJsonFile(const std::string& path, Json::Value& value) {
  return QLIBCFileExist(path.c_str()) && ZEPH::JsonFromFile(value, path);
}

// Sets a broken or missing INFO aside as INFO.broken, or deletes it. False
// only when it can neither be moved nor deleted.
bool SetBrokenInfoAside() {
  const std::string info = ZEPH::RootPath(ZEPH::cert::kInfoFile);
  const std::string broken = ZEPH::RootPath(ZEPH::cert::kInfoBrokenFile);
  if (rename(info.c_str(), broken.c_str()) == 0) return true;
  if (unlink(info.c_str()) == 0 || errno == ENOENT) return true;
  CERT_LOG("Failed to clean up cert info (%m)");
  return false;
}

// genDefaultCrt under the generation lock.
bool MakeDefaultSet(const std::string& dir) {
  ZEPH::cert::GenerationLock lock(
      ZEPH::cert::GenerationLock::Use::kCertificateSet);
  return lock.Lock() && genDefaultCrt(dir) == 0;
}

// Steps 1 to 8 of the reset; `result` is what the answer carries.
bool Reset(ZEPH::APIResponse* response, Json::Value& result) {
  Json::Value services;
  if (!ReadJsonFile(ZEPH::RootPath(ZEPH::cert::kServicesFile), services)) {
    CERT_LOG("Failed to read register services, it may missed or broken");
    return false;
  }
  Json::Value info;
  const bool info_read = ReadJsonFile(ZEPH::RootPath(ZEPH::cert::kInfoFile), info);
  if (!info_read) {
    CERT_LOG("Failed to read cert info, it may missed or broken");
    if (!SetBrokenInfoAside()) return false;
  }
  std::string dir, made_id;
  if (!ZEPH::cert::MakeCrtDir(dir, made_id)) {
    CERT_LOG("Failed to create a temp directory.");
    return false;
  }
  const std::string id = GetCrtId(dir);
  if (!MakeDefaultSet(dir)) {
    CERT_LOG("Failed to generate default certificate");
    return false;
  }
  if (!SetCrtProperty(id, "", true)) {
    CERT_LOG("Failed to set %s to default cert", id.c_str());
    return false;
  }
  Json::Value failed(Json::arrayValue);
  if (info_read) {
    failed = softReset(info);
  } else if (!DeployDefCrt(services, CRT_ACTION_RESET, id)) {
    // Nothing to enumerate: the registry's services all go to the new
    // default; the old directories stay in the archive.
    CERT_LOG("Failed to set services to default cert");
    LogAction(CERT_ACTION_RESET, false, "", "", "");
    return false;
  }
  response->SetHttpdRestart(true);
  result["restart_httpd"] = true;
  result["err_ids"] = failed;
  return failed.empty();
}

}  // namespace

Json::Value softReset(const Json::Value& info) {
  Json::Value failed(Json::arrayValue);
  if (!info.isObject()) return failed;
  for (const std::string& id : info.getMemberNames()) {
    const Json::Value& entry = info[id];
    const Json::Value deletable =
        entry.isObject() ? entry.get("user_deletable", true) : Json::Value(true);
    if (deletable.isConvertibleTo(Json::booleanValue) && !deletable.asBool()) {
      CERT_LOG("%s can not reset by user", ZEPH::JsonCompact(entry).c_str());
      continue;
    }
    Json::Value services = entry.isObject() ? entry["services"] : Json::Value();
    if (!DeployDefCrt(services, CRT_ACTION_FALLBACK, id)) {
      CERT_LOG("Failed to set services of %s to default cert", id.c_str());
      LogAction(CERT_ACTION_RESET, false, id, "", "");
      failed.append(id);
      continue;
    }
    if (!DropCertInfo(id)) {
      CERT_LOG("Failed to remove cert info of %s", id.c_str());
      LogAction(CERT_ACTION_RESET, false, id, "", "");
      failed.append(id);
      continue;
    }
    // A damaged catalogue may hold a name that is no archive directory
    // ("../..", say): it leaves the catalogue, but nothing is revoked or
    // removed in its name.
    if (!IsCrtIdName(id)) {
      CERT_LOG("%s is not a valid cert id", id.c_str());
      continue;
    }
    RunLetsEncrypt("revoke", "-c", id.c_str());
    const std::string dir = ZEPH::cert::CrtDir(id);
    if (!RemoveDir(dir)) CERT_LOG("Failed to remove %s", dir.c_str());
  }
  return failed;
}

void handleResetAction(ZEPH::APIRequest* /*request*/,
                       ZEPH::APIResponse* response) {
  Json::Value result(Json::objectValue);
  const bool ok = Reset(response, result);
  LogAction(CERT_ACTION_RESET, ok, "", "", "");
  if (ok) {
    response->SetSuccess(result);
  } else {
    response->SetError(5501, result);
  }
}
