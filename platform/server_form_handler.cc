#include "zeph/server_form_handler.h"

#include "zeph/qlibc_lock.h"
#include "zeph/root.h"

ServerFormHandler::ServerFormHandler(bool need_auth, const char* lock_name)
    : need_auth_(need_auth), lock_name_(lock_name != nullptr ? lock_name : "") {}

ServerFormHandler::~ServerFormHandler() {
  if (lock_fd_ >= 0) QLIBCFileUnlockByFile(lock_fd_);
}

bool ServerFormHandler::Process(ZEPH::APIRequest* request,
                                ZEPH::APIResponse* response) {
  if (need_auth_ && !Authenticate(request)) {
    response->SetError(5501, Json::Value());
    return false;
  }
  const Json::Value action = request->GetParam("action", Json::Value());
  const bool apply = action.isString() && action.asString() == "apply";
  if (!(apply ? ExLock() : ShLock())) {
    response->SetError(5501, Json::Value());
    return false;
  }
  if (apply) {
    HandleApplyAction(request, response);
  } else {
    HandleLoadAction(request, response);
  }
  return true;
}

void ServerFormHandler::HandleLoadAction(ZEPH::APIRequest* /*request*/,
                                         ZEPH::APIResponse* response) {
  response->SetError(5501, Json::Value());
}

void ServerFormHandler::HandleApplyAction(ZEPH::APIRequest* /*request*/,
                                          ZEPH::APIResponse* response) {
  response->SetError(5501, Json::Value());
}

bool ServerFormHandler::Authenticate(ZEPH::APIRequest* /*request*/) {
  return true;
}

bool ServerFormHandler::ExLock() { return Lock(QLIBC_LOCK_EXCLUSIVE); }

bool ServerFormHandler::ShLock() { return Lock(QLIBC_LOCK_SHARED); }

bool ServerFormHandler::Lock(int mode) {
  if (lock_name_.empty()) return true;
  if (lock_fd_ >= 0) {
    QLIBCFileUnlockByFile(lock_fd_);
    lock_fd_ = -1;
  }
  const std::string path = ZEPH::RootPath("/tmp/" + lock_name_ + ".lock");
  int fd = -1;
  if (!QLIBCFileLockTimeByFile(path.c_str(), mode, 30, &fd)) return false;
  lock_fd_ = fd;
  return true;
}
