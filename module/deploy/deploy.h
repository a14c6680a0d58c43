// Deployment of certificates into the directories of the services that use
// them.
//
// Deploying certificate <id> to a service copies "cert.pem", "privkey.pem",
// "fullchain.pem" (required) and "chain.pem", "zeph-ca-cert.pem" (when the
// archive holds them) from "<archive>/<id>" into the service directory
//   "/usr/zeph/etc/certificate/<subscriber>/<service>"   (system service)
//   "/usr/local/etc/certificate/<subscriber>/<service>"  (package service)
// by staging them in "<service dir>.temp" and moving that into place with
// MoveDir, under the per-service lock "/tmp/certificate_<subscriber>_
// <service>.lock" (exclusive, 60 s). Deployed files are mode 0400, owned by
// the service's "owner" user and its group; a new service directory is mode
// 0755. A failed copy leaves the service directory as it was.
//
// After the copy the service's hook is run with the service name as its one
// argument: "/usr/zeph/share/certificate.d/<subscriber>", else
// "/usr/libexec/certificate.d/<subscriber>" (system); "/usr/local/share/
// certificate.d/<subscriber>", else "/usr/local/libexec/certificate.d/
// <subscriber>" (package). A service without a hook needs none.
//
// The per-service lock and the INFO lock are never held together.
// All paths are taken below ZEPH_ROOT (zeph/root.h).
//
// Thread-safety: all functions are safe from any thread and process; the
// lock files do the serialising.
#ifndef ZEPH_MODULE_DEPLOY_DEPLOY_H_
#define ZEPH_MODULE_DEPLOY_DEPLOY_H_

#include <json/json.h>
#include <stdint.h>

#include <string>

#include "zeph/export.h"

// Deployment actions; the values index rgCRTActionInfo.
enum CRT_ACTION : int32_t {
  // Deploy, move the binding from the old certificate to the new, run the
  // hook. Services falling back to the default certificate.
  CRT_ACTION_FALLBACK = 0,
  // As FALLBACK. Services assigned by the user.
  CRT_ACTION_SET = 1,
  // Deploy and run the hook; INFO is left alone.
  CRT_ACTION_UPDATE = 2,
  // Redeploy the certificate the service is bound to now (the given one if
  // it is bound to none) and rebind it; no hook.
  CRT_ACTION_SYNC = 3,
  // As FALLBACK. Services of a reset store.
  CRT_ACTION_RESET = 4,
};

// What an action does. The layout is fixed for the components that read
// the exported table: a 32-bit enumeration, two 32-bit flags, an 8-bit
// boolean.
struct CRT_ACTION_INFO {
  CRT_ACTION action;     // the row's own action; equals its index
  int32_t keepTarget;    // 1: do not add the service to the target's entry
  int32_t keepPrevious;  // 1: do not remove it from the previous entry
  bool runHook;          // run the service's hook after the INFO update
};

// Number of rows of rgCRTActionInfo: one per CRT_ACTION.
constexpr int kCrtActionCount = 5;

extern "C" {

// The descriptor of each CRT_ACTION, in value order. When both keep flags
// of a row are 1 the INFO file is not opened at all. Looked up with dlsym by
// other components of the appliance.
extern ZEPH_EXPORT const CRT_ACTION_INFO rgCRTActionInfo[kCrtActionCount];

}  // extern "C"

// Binds every service object of the array `services` to certificate `id`
// and deploys it; `old_id` names the certificate they were bound to before
// (empty: none). Elements are handled in order, each on its own: a failing
// element makes the result false and the next one is handled; nothing done
// for earlier elements is undone. For each element:
//   - it must pass CheckServiceFormat ("service object is error.") and its
//     current binding must be readable with GetServiceCertID ("Failed to
//     check service exist for <json>");
//   - CRT_ACTION_SYNC with a current binding deploys and rebinds that
//     certificate instead of `id`;
//   - the files are deployed ("Failed to set cert [<id>] for [<json>]");
//   - unless both keep flags of the action are 1, INFO is updated under the
//     INFO lock (exclusive, 30 s): the service is removed from the previous
//     entry and moved to the end of the target's "services" array, never
//     listed twice. A failure here ("Failed to update cert info for [<json>]
//     from <previous> to <target>") leaves the files deployed;
//   - the hook is run when the action says so ("Failed to reload [<json>]").
// Afterwards, whatever happened, the relay daemon "zephrelayd" is reloaded
// ("Reload zephrelayd failed." when that fails; the result is not changed).
// Returns false at once, before any element, when `id` is not a valid
// certificate or `services` is not an array ("Invalid params
// (cert_id/services)") or `action` is out of range ("Wrong rgCRTActionInfo."
// and "Invalid params (action)"). An empty array returns true.
ZEPH_EXPORT bool DeployCrt(const std::string& id, const Json::Value& services,
                           const std::string& old_id, CRT_ACTION action);

// DeployCrt with the default certificate (GetDefCrtId) as target. False,
// without a log line of its own, when there is no default certificate.
ZEPH_EXPORT bool DeployDefCrt(Json::Value& services, CRT_ACTION action,
                              const std::string& old_id);

// The id named by the first line of "<archive>/DEFAULT" (at most 15
// characters, the line end cut off), or empty when the file cannot be
// opened or is empty. When the named archive directory does not exist,
// "[<dir>] doesn't exist." is logged and the result is empty.
ZEPH_EXPORT std::string GetDefCrtId();

// Redeploys certificate `id` to every service bound to it in INFO (after
// its files changed in the archive) and runs their hooks; INFO is not
// touched and the stored service objects are not validated. A failing
// service makes the result false ("Failed to set cert [<id>] for [<json>]",
// its hook is not run; or "Failed to reload for [<json>]") and the next is
// handled; "zephrelayd" is reloaded afterwards ("Failed to reload
// zephrelayd" only logs). `restart_httpd` becomes whether the web
// administration interface is among the services, whatever the result.
// False at once, `restart_httpd` unchanged, when the services cannot be
// listed ("Failed to get service list of <id>").
ZEPH_EXPORT bool UpdateCertToService(const std::string& id,
                                     bool& restart_httpd);

#endif  // ZEPH_MODULE_DEPLOY_DEPLOY_H_
