// ZEPH.Core.Certificate.CRT "create": a self-signed certificate set with its
// own authority, made new or in place of an existing certificate's set.
#include <string>

#include "module/archive/cert_id.h"
#include "module/archive/dir_ops.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/deploy/deploy.h"
#include "module/methods/action_log.h"
#include "module/methods/csr.h"
#include "module/methods/properties.h"
#include "module/methods/workers.h"
#include "module/mkcert/cert_set.h"
#include "module/mkcert/generation_lock.h"
#include "zeph/root.h"

namespace {

constexpr int kSuccess = 5502;
constexpr int kGeneralFailure = 5501;
constexpr int kInvalidParams = 5503;
constexpr int kDefaultKeyLength = 4096;

// A key length parameter; its default arrives as the text "4096".
int KeyLengthParam(ZEPH::APIRequest* request, const char* name) {
  const Json::Value v = request->GetParam(name, std::to_string(kDefaultKeyLength));
  if (v.isInt()) return v.asInt();
  if (v.isString()) {
    try {
      size_t used = 0;
      const int n = std::stoi(v.asString(), &used);
      if (used == v.asString().size()) return n;
    } catch (const std::exception&) {
    }
  }
  return kDefaultKeyLength;
}

std::string TextParam(ZEPH::APIRequest* request, const char* name) {
  const Json::Value v = request->GetParam(name, "");
  return v.isString() ? v.asString() : "";
}

// The key types of the two keys: "rsa" (the default), "ec256" or "ec384".
struct KeyTypes {
  ZEPH::cert::KeyType server = ZEPH::cert::KeyType::kRsa;
  ZEPH::cert::KeyType ca = ZEPH::cert::KeyType::kRsa;
};

struct CreateResult {
  int code = kGeneralFailure;
  bool replace = false;
  std::string id;
  std::string work_dir;
  Json::Value data{Json::objectValue};
};

// Makes the authority and then the server set in `work_dir`, holding the
// generation lock throughout. kSuccess, or the code to answer.
int MakeSet(ZEPH::APIRequest* request, const KeyTypes& types,
            int ca_key_length, int key_length, const std::string& alt_names,
            const std::string& work_dir) {
  ZEPH::cert::GenerationLock lock(
      ZEPH::cert::GenerationLock::Use::kCertificateSet);
  if (!lock.Lock()) return kGeneralFailure;
  _tag_CSR_ARGUMENT ca_subject;
  if (fillCSRInfo(request, &ca_subject, true) == -1) {
    CERT_LOG("fill argument from json failed");
    return kGeneralFailure;
  }
  const int ca_rc =
      genCASetOfType(&ca_subject, types.ca, ca_key_length, work_dir);
  if (ca_rc != 0) {
    CERT_LOG("Generate CA key & crt failed");
    return ca_rc == -2 ? kInvalidParams : kGeneralFailure;
  }
  _tag_CSR_ARGUMENT subject;
  if (fillCSRInfo(request, &subject, false) == -1) {
    CERT_LOG("fill argument from json failed");
    return kGeneralFailure;
  }
  if (genCertSetOfType(&subject, types.server, key_length, alt_names,
                       work_dir) != 0) {
    CERT_LOG("Failed to generate cert set");
    return kGeneralFailure;
  }
  return kSuccess;
}

// Steps up to the answer; `r` says how far it got.
void Create(ZEPH::APIRequest* request, ZEPH::APIResponse* response,
            CreateResult& r) {
  const int key_length = KeyLengthParam(request, "key_length");
  const int ca_key_length = KeyLengthParam(request, "ca_key_length");
  const Json::Value as_default_value = request->GetParam("as_default", false);
  const bool as_default = as_default_value.isBool() && as_default_value.asBool();
  const std::string given_id = TextParam(request, "id");
  const std::string desc = TextParam(request, "desc");
  const std::string common_name = TextParam(request, "common_name");
  const std::string alias = TextParam(request, "alias");
  // The alias text, then the common name, always joined by one ";".
  const std::string alt_names = alias + ";" + common_name;
  KeyTypes types;
  if (!KeyTypeParam(request, "key_type", &types.server) ||
      !KeyTypeParam(request, "ca_key_type", &types.ca)) {
    r.code = kInvalidParams;
    return;
  }

  std::string target;
  if (!given_id.empty()) {
    if (!IsCrtIdValid(given_id)) {
      CERT_LOG("%s is not a valid cert id", given_id.c_str());
      r.code = kInvalidParams;
      return;
    }
    r.replace = true;
    r.id = given_id;
    target = ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + given_id;
  } else {
    std::string made_id;
    if (!ZEPH::cert::MakeCrtDir(target, made_id)) {
      CERT_LOG("Failed to create a temp directory.");
      return;
    }
    r.id = GetCrtId(target);
  }

  r.work_dir = target + ".temp";
  if (!CleanDir(r.work_dir, 0700)) {
    CERT_LOG("Failed to clean %s", r.work_dir.c_str());
    return;
  }
  r.code = MakeSet(request, types, ca_key_length, key_length, alt_names,
                   r.work_dir);
  if (r.code != kSuccess) return;
  r.code = kGeneralFailure;
  if (!MoveDir(r.work_dir, target)) {
    CERT_LOG("Failed to move %s to %s", r.work_dir.c_str(), target.c_str());
    return;
  }
  // The set is in place; a failure to record its properties does not undo
  // it, the certificate is listed with whatever its record says.
  if (!SetCrtProperty(r.id, desc, as_default)) {
    CERT_LOG("Failed to SetCrtProperty. [%s][%s][%s]", r.id.c_str(),
             desc.c_str(), as_default ? "default" : "default not set");
  }
  if (r.replace) {
    bool restart_httpd = false;
    if (!UpdateCertToService(r.id, restart_httpd)) {
      CERT_LOG("Failed to update cert for %s", r.id.c_str());
      return;
    }
    response->SetHttpdRestart(restart_httpd);
    r.data["restart_httpd"] = restart_httpd;
  }
  r.data["id"] = r.id;
  r.code = kSuccess;
}

}  // namespace

void handleCRTAction(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  CreateResult r;
  Create(request, response, r);
  LogAction(r.replace ? CERT_ACTION_REPLACE : CERT_ACTION_CREATE,
            r.code == kSuccess, r.id, "", "");
  if (r.code == kSuccess) {
    response->SetSuccess(r.data);
    return;
  }
  if (!RemoveDir(r.work_dir)) {
    CERT_LOG("Failed to remove %s", r.work_dir.c_str());
  }
  response->SetError(r.code, Json::Value());
}
