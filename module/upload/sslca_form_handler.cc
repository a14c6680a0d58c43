#include "module/upload/sslca_form_handler.h"

#include "module/common/log.h"

SSLCAFormHandler::SSLCAFormHandler() : ServerFormHandler(false, nullptr) {}

SSLCAFormHandler::~SSLCAFormHandler() = default;

void SSLCAFormHandler::HandleLoadAction(ZEPH::APIRequest* /*request*/,
                                        ZEPH::APIResponse* /*response*/) {}

void SSLCAFormHandler::HandleApplyAction(ZEPH::APIRequest* /*request*/,
                                         ZEPH::APIResponse* /*response*/) {}

// Import and export are not built yet: both answer the general failure.
void SSLCAFormHandler::ProcessJsonReq(ZEPH::APIRequest* /*request*/,
                                      ZEPH::APIResponse* response) {
  UPLOAD_LOG("%s is not available yet", "ProcessJsonReq");
  response->SetError(5501, Json::Value());
}

void SSLCAFormHandler::DownloadAction(ZEPH::APIRequest* /*request*/,
                                      ZEPH::APIResponse* response) {
  UPLOAD_LOG("%s is not available yet", "DownloadAction");
  response->SetError(5501, Json::Value());
}
