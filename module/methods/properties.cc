// Certificate properties, and the "CRT set" and "Service set" methods.
#include "module/methods/properties.h"

#include "module/archive/cert_id.h"
#include "module/archive/file_lock.h"
#include "module/archive/info.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/deploy/deploy.h"
#include "module/deploy/service.h"
#include "module/methods/action_log.h"
#include "module/methods/workers.h"
#include "zeph/json_file.h"
#include "zeph/qlibc.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

// `user_deletable` null: keep the record's value (a new record gets true).
bool WriteProperties(const std::string& id, const std::string& desc,
                     bool as_default, const bool* user_deletable) {
  const std::string lock_path = ZEPH::cert::InfoLockPath();
  const std::string info_path = ZEPH::cert::InfoPath();
  ZEPH::cert::ScopedFileLock lock;
  const ZEPH::cert::InfoLockUse use = ZEPH::cert::kInfoLockSetProperty;
  if (!lock.Lock(lock_path, use.mode, use.seconds)) {
    CERT_LOG("Lock list file [%s] failed", lock_path.c_str());
    return false;
  }
  // Checked again under the lock: a delete that dropped the record in the
  // meantime has also taken the directory out of use, and the record must
  // not come back for it.
  bool ok = IsCrtIdValid(id);
  Json::Value info;
  // A missing catalogue is an empty one: the first record creates it.
  if (ok && !ZEPH::cert::ReadCertInfo(info, true)) {
    CERT_LOG("Broken [%s]", info_path.c_str());
    ok = false;
  }
  if (ok) {
    Json::Value record;
    if (info.isMember(id) && info[id].isObject()) {
      record = info[id];
    } else {
      record = Json::Value(Json::objectValue);
      record["services"] = Json::Value(Json::arrayValue);
      if (user_deletable == nullptr) record["user_deletable"] = true;
    }
    record["desc"] = desc;
    if (user_deletable != nullptr) record["user_deletable"] = *user_deletable;
    info[id] = record;
    if (!WriteCertInfo(info)) {
      CERT_LOG("Failed to write [%s]", info_path.c_str());
      ok = false;
    }
  }
  if (ok && as_default) {
    const std::string default_path = ZEPH::RootPath(ZEPH::cert::kDefaultFile);
    ZEPH::UniqueFile file(fopen(default_path.c_str(), "we"));
    if (!file || fputs(id.c_str(), file.get()) < 0 ||
        fputs("\n", file.get()) < 0 || fflush(file.get()) != 0) {
      CERT_LOG("Failed to set [%s] to default", id.c_str());
      ok = false;
    }
  }
  if (!lock.Unlock()) {
    CERT_LOG("Failed to unlock %s", lock_path.c_str());
  }
  return ok;
}

bool SetProperties(const std::string& id, const std::string& desc,
                   bool as_default, const bool* user_deletable) {
  const bool ok =
      IsCrtIdValid(id) && WriteProperties(id, desc, as_default, user_deletable);
  if (as_default) LogAction(CERT_ACTION_SET_DEFAULT, ok, id, "", "");
  return ok;
}

std::string TextParam(ZEPH::APIRequest* request, const char* name) {
  const Json::Value v = request->GetParam(name, "");
  return v.isString() ? v.asString() : "";
}

// A setting of "Service set": {"service": {...}, "id": "...", "old_id": "..."}.
bool IsValidSetting(const Json::Value& setting) {
  return setting.isObject() && setting.isMember("service") &&
         setting.isMember("old_id") && setting.isMember("id") &&
         setting["service"].isObject() && setting["old_id"].isString() &&
         setting["id"].isString();
}

std::string DisplayName(const Json::Value& service) {
  const Json::Value& name = service["display_name"];
  return name.isString() ? name.asString() : "";
}

}  // namespace

bool SetCrtProperty(const std::string& id, const std::string& desc,
                    bool as_default) {
  return SetProperties(id, desc, as_default, nullptr);
}

bool SetCrtProperty(const std::string& id, const std::string& desc,
                    bool as_default, bool user_deletable) {
  return SetProperties(id, desc, as_default, &user_deletable);
}

void handleCRTSet(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  const Json::Value as_default = request->GetParam("as_default", false);
  if (SetCrtProperty(TextParam(request, "id"), TextParam(request, "desc"),
                     as_default.isBool() && as_default.asBool())) {
    response->SetSuccess(Json::Value());
  } else {
    response->SetError(5501, Json::Value());
  }
}

void handleServiceSet(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  const Json::Value settings =
      request->GetParam("settings", Json::Value(Json::arrayValue));
  Json::Value result(Json::objectValue);
  result["restart_httpd"] = false;
  Json::Value failed(Json::arrayValue);
  bool restart = false;

  for (Json::ArrayIndex i = 0; settings.isArray() && i < settings.size(); ++i) {
    const Json::Value& setting = settings[i];
    if (!IsValidSetting(setting)) {
      CERT_LOG("Failed to ValidSettingObj[%d]", static_cast<int>(i));
      failed.append(setting);
      continue;
    }
    const Json::Value& service = setting["service"];
    const std::string id = setting["id"].asString();
    Json::Value one(Json::arrayValue);
    one.append(service);
    if (DeployCrt(id, one, setting["old_id"].asString(), CRT_ACTION_SET)) {
      LogAction(CERT_ACTION_SERVICE_SET, true, id, "", DisplayName(service));
      if (!restart) restart = ServicesContainORN(one);
    } else {
      failed.append(setting);
      LogAction(CERT_ACTION_SERVICE_SET, false, id, "", DisplayName(service));
    }
  }
  if (!failed.empty()) result["err_settings"] = failed;
  if (restart) {
    response->SetHttpdRestart(true);
    result["restart_httpd"] = true;
  }
  response->SetSuccess(result);
}
