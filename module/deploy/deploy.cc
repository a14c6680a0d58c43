#include "module/deploy/deploy.h"

#include <stddef.h>
#include <stdio.h>
#include <string.h>

#include "module/archive/cert_id.h"
#include "module/archive/dir_ops.h"
#include "module/archive/file_lock.h"
#include "module/archive/info.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/deploy/service.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_error.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_file.h"
#include "zeph/qlibc_lock.h"
#include "zeph/root.h"
#include "zeph/system.h"
#include "zeph/unique_fd.h"

// Other components read the table by layout; keep it exactly as declared.
static_assert(sizeof(CRT_ACTION) == 4, "CRT_ACTION is 32 bits wide");
static_assert(sizeof(bool) == 1, "runHook is 8 bits wide");
static_assert(offsetof(CRT_ACTION_INFO, keepTarget) == 4, "layout");
static_assert(offsetof(CRT_ACTION_INFO, keepPrevious) == 8, "layout");
static_assert(offsetof(CRT_ACTION_INFO, runHook) == 12, "layout");

const CRT_ACTION_INFO rgCRTActionInfo[kCrtActionCount] = {
    {CRT_ACTION_FALLBACK, 0, 0, true},
    {CRT_ACTION_SET, 0, 0, true},
    {CRT_ACTION_UPDATE, 1, 1, true},
    {CRT_ACTION_SYNC, 0, 0, false},
    {CRT_ACTION_RESET, 0, 0, true},
};

namespace {

// Option word of the hook runs: wait for the hook; stdin, stdout and stderr
// on /dev/null; a session of its own with default signal handling; no
// inherited descriptors.
constexpr int kHookExecOptions = 0x1BB;
static_assert(kHookExecOptions ==
                  (QLIBC_EXEC_WAIT | QLIBC_EXEC_CLOSE_FDS |
                   QLIBC_EXEC_NULL_STDIN | QLIBC_EXEC_NULL_STDOUT |
                   QLIBC_EXEC_NULL_STDERR | QLIBC_EXEC_RESET_SIGNALS |
                   QLIBC_EXEC_NEW_SESSION),
              "hook options");

constexpr char kRelayDaemon[] = "zephrelayd";

// The files deployed into a service directory, in copying order.
struct DeployedFile {
  const char* name;
  bool required;
};
const DeployedFile kDeployedFiles[] = {
    {"cert.pem", true},
    {"privkey.pem", true},
    {"fullchain.pem", true},
    {"chain.pem", false},
    {"zeph-ca-cert.pem", false},
};

// The paths of one service, prefixed.
struct ServicePaths {
  std::string dir;
  std::string staging;
  std::string lock;
  std::string hook_share;
  std::string hook_libexec;
};

// Members of a service object. UpdateCertToService hands over objects from
// INFO without validating them, so a wrong type must not throw: it reads as
// empty (or false) and fails further on (an empty owner is no user).
std::string StringMember(const Json::Value& service, const char* key) {
  if (!service.isObject() || !service[key].isString()) return std::string();
  return service[key].asString();
}

bool BoolMember(const Json::Value& service, const char* key) {
  return service.isObject() && service[key].isBool() && service[key].asBool();
}

ServicePaths PathsOf(const Json::Value& service) {
  const bool package = BoolMember(service, "isPkg");
  const std::string subscriber = StringMember(service, "subscriber");
  const std::string name = StringMember(service, "service");
  ServicePaths paths;
  paths.dir =
      ZEPH::RootPath(std::string("/usr/") + (package ? "local" : "zeph") +
                     "/etc/certificate/" + subscriber + "/" + name);
  paths.staging = paths.dir + ".temp";
  paths.lock =
      ZEPH::RootPath("/tmp/certificate_" + subscriber + "_" + name + ".lock");
  if (package) {
    paths.hook_share =
        ZEPH::RootPath("/usr/local/share/certificate.d/" + subscriber);
    paths.hook_libexec =
        ZEPH::RootPath("/usr/local/libexec/certificate.d/" + subscriber);
  } else {
    paths.hook_share =
        ZEPH::RootPath("/usr/zeph/share/certificate.d/" + subscriber);
    paths.hook_libexec =
        ZEPH::RootPath("/usr/libexec/certificate.d/" + subscriber);
  }
  return paths;
}

// Stages the files of `source` in `staging` (made afresh) and moves them
// onto `dir`. Logs and returns false on failure.
bool StageAndMove(const std::string& source, const ServicePaths& paths,
                  uid_t uid, gid_t gid) {
  if (!CleanDir(paths.staging, 0755)) {
    UTILS_LOG("Failed to clean %s", paths.staging.c_str());
    return false;
  }
  for (const DeployedFile& file : kDeployedFiles) {
    if (!file.required) {
      const std::string path = source + "/" + file.name;
      if (!QLIBCFileExist(path.c_str())) continue;
    }
    if (!CopyCertFile(source, paths.staging, file.name, uid, gid)) {
      UTILS_LOG("Failed to copy cert files from %s to %s", source.c_str(),
                paths.staging.c_str());
      return false;
    }
  }
  if (!MoveDir(paths.staging, paths.dir)) {
    UTILS_LOG("Failed to move %s to %s", paths.staging.c_str(),
              paths.dir.c_str());
    return false;
  }
  return true;
}

// Deploys the files of certificate `id` into the service's directory under
// the per-service lock.
bool CopyCertToService(const std::string& id, const Json::Value& service) {
  // Objects read back from INFO reach here unchecked: a damaged catalogue
  // must not lead the copy out of the service directories.
  if (!ZEPH::cert::ServiceNamesAreSafe(service)) return false;
  const std::string owner = StringMember(service, "owner");
  const std::string source = ZEPH::cert::CrtDir(id);
  const ServicePaths paths = PathsOf(service);

  uid_t uid = 0;
  gid_t gid = 0;
  if (ZEPHUserGetUGID(owner.c_str(), &uid, &gid) < 0) {
    UTILS_LOG_LIBERR("Failed to ZEPHUserGetUGID [%s].", owner.c_str());
    return false;
  }
  if (!QLIBCFileCheckDir(source.c_str())) {
    UTILS_LOG_LIBERR("[%s] doesn't exist.", source.c_str());
    return false;
  }
  ZEPH::cert::ScopedFileLock lock;
  if (!lock.Lock(paths.lock, QLIBC_LOCK_EXCLUSIVE, 60)) {
    UTILS_LOG("Failed to lock [%s]", paths.lock.c_str());
    return false;
  }
  const bool ok = StageAndMove(source, paths, uid, gid);
  // The staging directory never outlives a failed attempt.
  if (!ok && !RemoveDir(paths.staging)) {
    UTILS_LOG("Failed to remove %s", paths.staging.c_str());
  }
  if (!lock.Unlock()) UTILS_LOG("Failed to unlock %s", paths.lock.c_str());
  return ok;
}

// Runs the service's hook with the service name as its one argument and
// waits for it. 0 on success and when the service has no hook; the
// negative result of QLIBCExecl when the hook could not be run. The hook's
// exit status is its own business.
int RunServiceHook(const Json::Value& service) {
  const std::string name = StringMember(service, "service");
  const ServicePaths paths = PathsOf(service);
  const std::string* hook = nullptr;
  if (QLIBCFileExist(paths.hook_share.c_str())) {
    hook = &paths.hook_share;
  } else if (QLIBCFileExist(paths.hook_libexec.c_str())) {
    hook = &paths.hook_libexec;
  } else {
    return 0;
  }
  const int rc =
      QLIBCExecl(hook->c_str(), kHookExecOptions, name.c_str(), nullptr);
  if (rc >= 0) return 0;
  UTILS_LOG_LIBERR("Failed to [%s][%s].", hook->c_str(), name.c_str());
  return rc;
}

// Drops from the array `services` every object denoting the same service
// as `service`, keeping the order of the others; appends `service` last
// when `append` is true.
Json::Value Rebound(const Json::Value& services, const Json::Value& service,
                    bool append) {
  Json::Value kept(Json::arrayValue);
  for (const Json::Value& bound : services) {
    if (!ZEPH::cert::SameService(bound, service)) kept.append(bound);
  }
  if (append) kept.append(service);
  return kept;
}

// Whether INFO holds an entry `id` with a "services" array.
bool HasServicesArray(const Json::Value& info, const std::string& id) {
  return info.isMember(id) && info[id].isObject() &&
         info[id].isMember("services") && info[id]["services"].isArray();
}

// The INFO step of DeployCrt for one element: moves the binding of
// `service` from `previous` to `target` as the action's row says, under the
// INFO lock. Logs and returns false on failure; the lock is released on
// every path.
bool UpdateBinding(const Json::Value& service, const std::string& previous,
                   const std::string& target, const CRT_ACTION_INFO& row) {
  if (!IsCrtIdValid(target)) {
    UTILS_LOG("Invalid input of [%s]", target.c_str());
    return false;
  }
  const std::string lock_path = ZEPH::cert::InfoLockPath();
  const std::string info_path = ZEPH::cert::InfoPath();
  ZEPH::cert::ScopedFileLock lock;
  if (!lock.Lock(lock_path, ZEPH::cert::kInfoLockDeploy.mode,
                 ZEPH::cert::kInfoLockDeploy.seconds)) {
    UTILS_LOG("Lock list file [%s] failed", lock_path.c_str());
    return false;
  }
  Json::Value info;
  if (!ZEPH::cert::ReadCertInfo(info, false)) {
    UTILS_LOG_LIBERR("Broken [%s].", info_path.c_str());
    return false;
  }
  if (!row.keepPrevious && !previous.empty()) {
    if (!HasServicesArray(info, previous)) {
      UTILS_LOG_LIBERR("Broken [%s][%s].", info_path.c_str(), previous.c_str());
      return false;
    }
    Json::Value& services = info[previous]["services"];
    services = Rebound(services, service, false);
  }
  if (!row.keepTarget) {
    if (!HasServicesArray(info, target)) {
      UTILS_LOG_LIBERR("Broken [%s][%s].", info_path.c_str(), target.c_str());
      return false;
    }
    // Removing before appending moves a service that is bound again to the
    // same certificate to the end instead of listing it twice.
    Json::Value& services = info[target]["services"];
    services = Rebound(services, service, true);
    // `previous` is what the caller saw before; another request may have
    // moved the service since. Whatever entry holds it now loses it, so a
    // service is never bound to two certificates.
    for (const std::string& other : info.getMemberNames()) {
      if (other != target && HasServicesArray(info, other)) {
        info[other]["services"] = Rebound(info[other]["services"], service, false);
      }
    }
  }
  if (!WriteCertInfo(info)) {
    UTILS_LOG("Failed to write [%s].", info_path.c_str());
    return false;
  }
  if (!lock.Unlock()) UTILS_LOG("Failed to unlock %s", lock_path.c_str());
  return true;
}

bool DeployOne(const std::string& id, const Json::Value& service,
               const std::string& old_id, const CRT_ACTION_INFO& row) {
  std::string target = id;
  std::string previous = old_id;
  if (!CheckServiceFormat(service)) {
    UTILS_LOG("service object is error.");
    return false;
  }
  const std::string text = ZEPH::JsonCompact(service);
  std::string current;
  if (!GetServiceCertID(service, current)) {
    UTILS_LOG("Failed to check service exist for %s", text.c_str());
    return false;
  }
  // A sync refreshes whatever the service is bound to now.
  if (row.action == CRT_ACTION_SYNC && !current.empty()) {
    target = current;
    previous = current;
  }
  if (!CopyCertToService(target, service)) {
    UTILS_LOG("Failed to set cert [%s] for [%s]", target.c_str(), text.c_str());
    return false;
  }
  if (!(row.keepTarget && row.keepPrevious) &&
      !UpdateBinding(service, previous, target, row)) {
    UTILS_LOG("Failed to update cert info for [%s] from %s to %s", text.c_str(),
              previous.c_str(), target.c_str());
    return false;
  }
  if (row.runHook && RunServiceHook(service) != 0) {
    UTILS_LOG("Failed to reload [%s]", text.c_str());
    return false;
  }
  return true;
}

bool ValidAction(CRT_ACTION action) {
  const int index = static_cast<int>(action);
  return index >= 0 && index < kCrtActionCount &&
         rgCRTActionInfo[index].action == action;
}

}  // namespace

bool DeployCrt(const std::string& id, const Json::Value& services,
               const std::string& old_id, CRT_ACTION action) {
  if (!IsCrtIdValid(id) || !services.isArray()) {
    UTILS_LOG("Invalid params (cert_id/services)");
    return false;
  }
  if (!ValidAction(action)) {
    UTILS_LOG("Wrong rgCRTActionInfo.");
    UTILS_LOG("Invalid params (action)");
    return false;
  }
  const CRT_ACTION_INFO& row = rgCRTActionInfo[static_cast<int>(action)];
  bool result = true;
  for (const Json::Value& service : services) {
    if (!DeployOne(id, service, old_id, row)) result = false;
  }
  if (!ZEPHSystemdReload(kRelayDaemon)) {
    UTILS_LOG("Reload zephrelayd failed.");
  }
  return result;
}

bool DeployDefCrt(Json::Value& services, CRT_ACTION action,
                  const std::string& old_id) {
  const std::string id = GetDefCrtId();
  if (id.empty()) return false;
  return DeployCrt(id, services, old_id, action);
}

std::string GetDefCrtId() {
  const std::string path = ZEPH::RootPath(ZEPH::cert::kDefaultFile);
  ZEPH::UniqueFile file(fopen(path.c_str(), "re"));
  if (!file) return std::string();
  char line[16];
  if (QLIBCFgets(line, sizeof(line), file.get()) == nullptr) {
    return std::string();
  }
  char* newline = strrchr(line, '\n');
  if (newline != nullptr) *newline = '\0';
  if (!IsCrtIdName(line)) {
    UTILS_LOG("Invalid default cert id [%s]", line);
    return std::string();
  }
  const std::string dir = ZEPH::cert::CrtDir(line);
  if (!QLIBCFileCheckDir(dir.c_str())) {
    UTILS_LOG_LIBERR("[%s] doesn't exist.", dir.c_str());
    return std::string();
  }
  return line;
}

bool UpdateCertToService(const std::string& id, bool& restart_httpd) {
  Json::Value services;
  if (!GetServiceList(id, services)) {
    UTILS_LOG("Failed to get service list of %s", id.c_str());
    return false;
  }
  bool result = true;
  for (const Json::Value& service : services) {
    const std::string text = ZEPH::JsonCompact(service);
    if (!CopyCertToService(id, service)) {
      UTILS_LOG("Failed to set cert [%s] for [%s]", id.c_str(), text.c_str());
      result = false;
      continue;
    }
    if (RunServiceHook(service) != 0) {
      UTILS_LOG("Failed to reload for [%s]", text.c_str());
      result = false;
    }
  }
  if (!ZEPHSystemdReload(kRelayDaemon)) {
    UTILS_LOG("Failed to reload zephrelayd");
  }
  restart_httpd = ServicesContainORN(services);
  return result;
}
