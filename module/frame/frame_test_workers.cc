// Recording stand-ins for the workers, linked only into frame_test: the
// frame's contract is which worker it hands a request to, and when it does
// not. Each stand-in notes its name and answers success.
#include <string>

#include "module/methods/workers.h"
#include "module/upload/sslca_form_handler.h"

std::string g_called_worker;

#define RECORDING_WORKER(name)                                         \
  void name(ZEPH::APIRequest*, ZEPH::APIResponse* response) {          \
    g_called_worker = #name;                                           \
    response->SetSuccess(Json::Value(#name));                          \
  }

RECORDING_WORKER(handleResetAction)
RECORDING_WORKER(handleCSRAction)
RECORDING_WORKER(handleRenewAction)
RECORDING_WORKER(handleSignCSRAction)
RECORDING_WORKER(handleCRTAction)
RECORDING_WORKER(handleRecreateCRTAction)
RECORDING_WORKER(handleCRTSet)
RECORDING_WORKER(handleCRTDelete)
RECORDING_WORKER(handleCRTList)
RECORDING_WORKER(handleLECreate)
RECORDING_WORKER(handleLERenew)
RECORDING_WORKER(handleLEAccountList)
RECORDING_WORKER(handleServiceSet)

SSLCAFormHandler::SSLCAFormHandler() : ServerFormHandler(false, nullptr) {}
SSLCAFormHandler::~SSLCAFormHandler() = default;
void SSLCAFormHandler::HandleLoadAction(ZEPH::APIRequest*, ZEPH::APIResponse*) {}
void SSLCAFormHandler::HandleApplyAction(ZEPH::APIRequest*, ZEPH::APIResponse*) {}
void SSLCAFormHandler::ProcessJsonReq(ZEPH::APIRequest*, ZEPH::APIResponse* r) {
  g_called_worker = "ProcessJsonReq";
  r->SetSuccess(Json::Value("ProcessJsonReq"));
}
void SSLCAFormHandler::DownloadAction(ZEPH::APIRequest*, ZEPH::APIResponse* r) {
  g_called_worker = "DownloadAction";
  r->SetSuccess(Json::Value("DownloadAction"));
}
