#include "module/frame/wrappers.h"

#include <exception>

#include "module/common/log.h"
#include "module/frame/rules.h"
#include "module/methods/workers.h"
#include "module/upload/sslca_form_handler.h"

namespace {

using ZEPH::APIRequest;
using ZEPH::APIResponse;
using ZEPH::frame::CheckRules;
using ZEPH::frame::ParamRule;
using Worker = void (*)(APIRequest*, APIResponse*);

constexpr int kInvalidParams = 5503;
constexpr int kGeneralFailure = 5501;
constexpr int kImportKeyError = 5511;
constexpr int kImportCertError = 5510;
constexpr int kImportInterError = 5512;

constexpr int S = PARAM_TYPE_STRING;
constexpr int B = PARAM_TYPE_BOOL;

// Runs `body`, turning anything it throws into a general failure, so that
// no exception crosses into the server.
template <typename Body>
void Guarded(const char* method, APIResponse* response, Body body) {
  try {
    body();
    return;
  } catch (const std::exception& e) {
    CERT_LOG("%s failed: %s", method, e.what());
  } catch (...) {
    CERT_LOG("%s failed: unknown exception", method);
  }
  if (response->outcome() == APIResponse::Outcome::kNone) {
    response->SetError(kGeneralFailure, Json::Value());
  }
}

// The common wrapper: check the rules, then call the worker, or answer
// 5503 with a JSON null.
void CheckThenRun(const char* method, APIRequest* request,
                  APIResponse* response, std::initializer_list<ParamRule> rules,
                  Worker worker) {
  Guarded(method, response, [&] {
    if (!CheckRules(request, rules)) {
      response->SetError(kInvalidParams, Json::Value());
      return;
    }
    worker(request, response);
  });
}

}  // namespace

extern "C" {

void doCertificateReset_v1(APIRequest* request, APIResponse* response) {
  Guarded("reset", response, [&] { handleResetAction(request, response); });
}

void doCertificateExport_v1(APIRequest* request, APIResponse* response) {
  Guarded("export", response, [&] {
    SSLCAFormHandler handler;
    if (!CheckRules(request, {{"file", S, true}})) {
      response->SetError(kInvalidParams, Json::Value());
      return;
    }
    const Json::Value file = request->GetParam("file", Json::Value());
    if (file.asString() == "archive" &&
        !CheckRules(request, {{"id", S, true}})) {
      response->SetError(kInvalidParams, Json::Value());
      return;
    }
    handler.DownloadAction(request, response);
  });
}

void doCertificateImport_v1(APIRequest* request, APIResponse* response) {
  Guarded("import", response, [&] {
    SSLCAFormHandler handler;
    if (!CheckRules(request, {{"id", S, false},
                              {"desc", S, true},
                              {"as_default", S, false},
                              {"key_tmp", S, true}})) {
      response->SetError(kImportKeyError, Json::Value());
      return;
    }
    if (!CheckRules(request, {{"cert_tmp", S, true}})) {
      response->SetError(kImportCertError, Json::Value());
      return;
    }
    if (!CheckRules(request, {{"inter_cert_tmp", S, false}})) {
      response->SetError(kImportInterError, Json::Value());
      return;
    }
    handler.ProcessJsonReq(request, response);
  });
}

void doCertificateCreateCSR_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("CSR create", request, response,
               {{"country", S, true},
                {"state", S, true},
                {"city", S, true},
                {"organization", S, true},
                {"department", S, true},
                {"common_name", S, true},
                {"email", S, true}},
               handleCSRAction);
}

void doCertificateRenew_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("CSR renew", request, response,
               {{"id", S, true}, {"country", S, false}}, handleRenewAction);
}

void doCertificateSign_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("CSR sign", request, response,
               {{"id", S, true},
                {"alias", S, false},
                {"days", PARAM_TYPE_INT, true},
                {"csr", S, true},
                {"csr_tmp", S, true}},
               handleSignCSRAction);
}

void doCertificateCreateCRT_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("CRT create", request, response,
               {{"ca_country", S, true},
                {"ca_state", S, true},
                {"ca_city", S, true},
                {"ca_organization", S, true},
                {"ca_department", S, true},
                {"ca_common_name", S, true},
                {"ca_email", S, true},
                {"country", S, true},
                {"state", S, true},
                {"city", S, true},
                {"organization", S, true},
                {"department", S, true},
                {"common_name", S, true},
                {"email", S, true},
                {"id", S, false},
                {"desc", S, true},
                {"as_default", B, false}},
               handleCRTAction);
}

void doCertificateRecreateCRT_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("CRT recreate", request, response, {{"id", S, true}},
               handleRecreateCRTAction);
}

void doCertificateSetCRT_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("CRT set", request, response,
               {{"id", S, true}, {"desc", S, true}, {"as_default", B, false}},
               handleCRTSet);
}

void doCertificateDeleteCRT_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("CRT delete", request, response,
               {{"ids", PARAM_TYPE_STRING_ARRAY, true}}, handleCRTDelete);
}

void doCertificateListCRT_v1(APIRequest* request, APIResponse* response) {
  Guarded("CRT list", response, [&] { handleCRTList(request, response); });
}

void doCertificateCreateLE_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("LetsEncrypt create", request, response,
               {{"id", S, false},
                {"desc", S, true},
                {"as_default", B, false},
                {"domain_name", S, true},
                {"email", S, false}},
               handleLECreate);
}

void doCertificateRenewLE_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("LetsEncrypt renew", request, response, {{"id", S, true}},
               handleLERenew);
}

void doCertificateListLEAccount_v1(APIRequest* request, APIResponse* response) {
  Guarded("LetsEncrypt.Account list", response,
          [&] { handleLEAccountList(request, response); });
}

void doCertificateSetService_v1(APIRequest* request, APIResponse* response) {
  CheckThenRun("Service set", request, response,
               {{"settings", PARAM_TYPE_OBJECT_ARRAY, true}}, handleServiceSet);
}

}  // extern "C"
