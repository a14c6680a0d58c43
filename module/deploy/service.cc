#include "module/deploy/service.h"

#include "module/archive/cert_id.h"
#include "module/archive/file_lock.h"
#include "module/archive/info.h"
#include "module/common/log.h"
#include "zeph/json_file.h"

namespace {

// One row of the service object's schema; the table ends with a null key.
struct ServiceKeyRule {
  const char* key;
  Json::ValueType type;
  bool required;
};

const ServiceKeyRule kServiceKeyRules[] = {
    {"display_name", Json::stringValue, true},
    {"display_name_i18n", Json::stringValue, false},
    {"subscriber", Json::stringValue, true},
    {"service", Json::stringValue, true},
    {"isPkg", Json::booleanValue, true},
    {"owner", Json::stringValue, true},
    {nullptr, Json::nullValue, false},
};

bool IsWebAdministration(const Json::Value& service) {
  return service["subscriber"].asString() == "system" &&
         service["service"].asString() == "default";
}

}  // namespace

namespace ZEPH {
namespace cert {

bool SameService(const Json::Value& a, const Json::Value& b) {
  if (!a.isObject() || !b.isObject()) return false;
  const Json::Value& a_subscriber = a["subscriber"];
  const Json::Value& a_service = a["service"];
  const Json::Value& b_subscriber = b["subscriber"];
  const Json::Value& b_service = b["service"];
  return a_subscriber.isString() && a_service.isString() &&
         b_subscriber.isString() && b_service.isString() &&
         a_subscriber.asString() == b_subscriber.asString() &&
         a_service.asString() == b_service.asString();
}

bool ServiceNamesAreSafe(const Json::Value& service) {
  // Subscriber and service name a directory, a hook and a lock file: each
  // must stay one path component, or a request could deploy over (and
  // remove) any directory the module can reach. A NUL byte would cut the
  // path short where the C library sees it ("x\0" names the parent).
  for (const char* key : {"subscriber", "service"}) {
    const Json::Value& value = service.isObject() ? service[key] : Json::Value();
    const std::string name = value.isString() ? value.asString() : std::string();
    if (name.empty() || name == "." || name == ".." ||
        name.find_first_of(std::string("/\0", 2)) != std::string::npos) {
      UTILS_LOG("Invalid service name [%s]", name.c_str());
      return false;
    }
  }
  return true;
}

}  // namespace cert
}  // namespace ZEPH

bool CheckServiceFormat(const Json::Value& service) {
  for (const ServiceKeyRule* rule = kServiceKeyRules; rule->key != nullptr;
       ++rule) {
    const bool present = service.isObject() && service.isMember(rule->key);
    if (!present) {
      if (!rule->required) continue;
      UTILS_LOG("Lack of necesary key. [%s]", rule->key);
      return false;
    }
    const Json::Value& value = service[rule->key];
    if (value.type() != rule->type) return false;
    if (value.isString() && value.asString().empty()) return false;
  }
  return ZEPH::cert::ServiceNamesAreSafe(service);
}

bool ServicesContainORN(const Json::Value& services) {
  if (!services.isArray()) return false;
  for (const Json::Value& service : services) {
    if (!CheckServiceFormat(service)) {
      UTILS_LOG("service object is error.");
      continue;
    }
    if (IsWebAdministration(service)) return true;
  }
  return false;
}

bool GetServiceCertID(const Json::Value& service, std::string& id) {
  if (!CheckServiceFormat(service)) {
    UTILS_LOG("Invalid input format [%s]", ZEPH::JsonCompact(service).c_str());
    return false;
  }
  const std::string lock_path = ZEPH::cert::InfoLockPath();
  ZEPH::cert::ScopedFileLock lock;
  if (!lock.Lock(lock_path, ZEPH::cert::kInfoLockServiceLookup.mode,
                 ZEPH::cert::kInfoLockServiceLookup.seconds)) {
    UTILS_LOG("Failed to lock [%s]", lock_path.c_str());
    return false;
  }
  Json::Value info;
  if (!ZEPH::cert::ReadCertInfo(info, false)) {
    UTILS_LOG_LIBERR("Broken [%s].", ZEPH::cert::InfoPath().c_str());
    return false;
  }
  bool found = false;
  // getMemberNames is sorted: the first match in id order wins.
  for (const std::string& cert_id : info.getMemberNames()) {
    const Json::Value& entry = info[cert_id];
    if (!entry.isObject() || !entry["services"].isArray()) continue;
    for (const Json::Value& bound : entry["services"]) {
      if (ZEPH::cert::SameService(bound, service)) {
        id = cert_id;
        found = true;
        break;
      }
    }
    if (found) break;
  }
  if (!lock.Unlock()) UTILS_LOG("Failed to unlock %s", lock_path.c_str());
  return true;
}

bool GetServiceList(const std::string& id, Json::Value& services) {
  if (!IsCrtIdValid(id)) return false;
  Json::Value info;
  if (ZEPH::cert::ReadCertInfo(info, false) && info[id].isObject() &&
      info[id]["services"].isArray()) {
    services = info[id]["services"];
    return true;
  }
  UTILS_LOG_LIBERR("Broken [%s].", ZEPH::cert::InfoPath().c_str());
  return false;
}
