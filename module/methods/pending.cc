// Workers whose methods are not built yet. Each answers the general failure
// 5501 and says so in the log, so that every row of the method table can be
// called and its parameter rules exercised. A worker's real implementation
// replaces its entry here.
#include "module/common/log.h"
#include "module/methods/workers.h"

namespace {

void NotAvailable(const char* worker, ZEPH::APIResponse* response) {
  CERT_LOG("%s is not available yet", worker);
  response->SetError(5501, Json::Value());
}

}  // namespace

#define ZEPH_PENDING_WORKER(name)                                          \
  void name(ZEPH::APIRequest* /*request*/, ZEPH::APIResponse* response) { \
    NotAvailable(#name, response);                                         \
  }

ZEPH_PENDING_WORKER(handleResetAction)
ZEPH_PENDING_WORKER(handleRecreateCRTAction)
ZEPH_PENDING_WORKER(handleCRTDelete)
ZEPH_PENDING_WORKER(handleLECreate)
ZEPH_PENDING_WORKER(handleLERenew)
ZEPH_PENDING_WORKER(handleLEAccountList)
