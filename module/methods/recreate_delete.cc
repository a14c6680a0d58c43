// ZEPH.Core.Certificate.CRT "recreate" and "delete".
#include <string>

#include "module/archive/cert_id.h"
#include "module/archive/dir_ops.h"
#include "module/archive/info.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/deploy/deploy.h"
#include "module/deploy/service.h"
#include "module/methods/action_log.h"
#include "module/methods/letsencrypt.h"
#include "module/methods/workers.h"
#include "zeph/qlibc_exec.h"
#include "zeph/root.h"

namespace {

constexpr int kSuccess = 5502;
constexpr int kGeneralFailure = 5501;
constexpr int kInvalidParams = 5503;

int Recreate(const std::string& id, const std::string& dir,
             const std::string& work_dir, ZEPH::APIResponse* response,
             Json::Value& result) {
  if (!IsCrtIdValid(id)) {
    CERT_LOG("Invalid crt id [%s].", id.c_str());
    return kInvalidParams;
  }
  if (!CleanDir(work_dir, 0700)) {
    CERT_LOG("Failed to clean %s", work_dir.c_str());
    return kGeneralFailure;
  }
  // The tool takes the archive directory's name, not its path.
  const std::string tool_arg = id + ".temp";
  const std::string tool = ZEPH::RootPath(ZEPH::cert::kMkcertTool);
  if (QLIBCExec(tool.c_str(), tool_arg.c_str(), nullptr, nullptr, nullptr) != 0) {
    CERT_LOG("Failed to mkcert for %s", work_dir.c_str());
    return kGeneralFailure;
  }
  if (!MoveDir(work_dir, dir)) {
    CERT_LOG("Failed to move %s to %s", work_dir.c_str(), dir.c_str());
    return kGeneralFailure;
  }
  bool restart = false;
  if (!UpdateCertToService(id, restart)) {
    CERT_LOG("Failed to update cert for %s", id.c_str());
    return kGeneralFailure;
  }
  response->SetHttpdRestart(restart);
  result["restart_httpd"] = restart;
  return kSuccess;
}

}  // namespace

void handleRecreateCRTAction(ZEPH::APIRequest* request,
                             ZEPH::APIResponse* response) {
  const Json::Value id_value = request->GetParam("id", "");
  const std::string id = id_value.isString() ? id_value.asString() : "";
  const std::string dir = ZEPH::cert::CrtDir(id);
  const std::string work_dir = dir + ".temp";
  Json::Value result(Json::objectValue);
  const int code = Recreate(id, dir, work_dir, response, result);
  LogAction(CERT_ACTION_RECREATE, code == kSuccess, id, "", "");
  if (code == kSuccess) {
    response->SetSuccess(result);
    return;
  }
  // An invalid id may hold "../": the directory its name points at is not
  // ours to remove.
  if (code != kInvalidParams && !RemoveDir(work_dir)) {
    CERT_LOG("Failed to remove %s", work_dir.c_str());
  }
  response->SetError(code, Json::Value());
}

void handleCRTDelete(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  const std::string default_id = GetDefCrtId();
  Json::Value result(Json::objectValue);
  result["restart_httpd"] = false;
  if (default_id.empty()) {
    response->SetError(kGeneralFailure, result);
    return;
  }
  const Json::Value ids = request->GetParam("ids", Json::Value(Json::arrayValue));
  Json::Value failed(Json::arrayValue);
  bool restart = false;
  for (Json::ArrayIndex i = 0; ids.isArray() && i < ids.size(); ++i) {
    const Json::Value& entry = ids[i];
    const std::string id =
        entry.isConvertibleTo(Json::stringValue) ? entry.asString() : "";
    // The default certificate is never deleted this way, and not reported.
    if (id == default_id) continue;
    const std::string name = GetCrtSubjectCN(id);
    Json::Value services;
    if (!GetServiceList(id, services) ||
        !DeployDefCrt(services, CRT_ACTION_FALLBACK, id) || !DropCertInfo(id)) {
      failed.append(id);
      continue;
    }
    // Revoked whether or not it came from Let's Encrypt; the tool refuses
    // certificates it did not issue, and that refusal only costs a log line.
    RunLetsEncrypt("revoke", "-c", id.c_str());
    if (!restart) restart = ServicesContainORN(services);
    if (RemoveDir(ZEPH::cert::CrtDir(id))) {
      // The certificate is gone: its display name was looked up before.
      LogAction(CERT_ACTION_DELETE, true, "", name, "");
    } else {
      failed.append(id);
    }
  }
  if (restart) {
    response->SetHttpdRestart(true);
    result["restart_httpd"] = true;
  }
  if (failed.empty()) {
    response->SetSuccess(result);
    return;
  }
  result["err_ids"] = failed;
  for (const Json::Value& id : failed) {
    LogAction(CERT_ACTION_DELETE, false, id.asString(), "", "");
  }
  response->SetError(kGeneralFailure, result);
}
