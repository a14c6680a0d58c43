// SSLCAFormHandler: import of an uploaded certificate set and export of a
// certificate set as a download.
//
// Made on the stack by the import and export wrappers for one request. It
// adds no data members to ServerFormHandler; Process, ExLock, ShLock and
// Authenticate are inherited unchanged, HandleLoadAction and
// HandleApplyAction do nothing.
#ifndef ZEPH_MODULE_UPLOAD_SSLCA_FORM_HANDLER_H_
#define ZEPH_MODULE_UPLOAD_SSLCA_FORM_HANDLER_H_

#include <string>

#include "zeph/api.h"
#include "zeph/export.h"
#include "zeph/server_form_handler.h"

class ZEPH_EXPORT SSLCAFormHandler : public ServerFormHandler {
 public:
  // Calls ServerFormHandler(false, nullptr): no authentication of its own,
  // no lock file.
  SSLCAFormHandler();
  ~SSLCAFormHandler() override;

  void HandleLoadAction(ZEPH::APIRequest* request,
                        ZEPH::APIResponse* response) override;
  void HandleApplyAction(ZEPH::APIRequest* request,
                         ZEPH::APIResponse* response) override;

  // ZEPH.Core.Certificate "import": checks the uploaded key, certificate and
  // intermediate files and stores them as a certificate of the archive.
  void ProcessJsonReq(ZEPH::APIRequest* request, ZEPH::APIResponse* response);
  // ZEPH.Core.Certificate "export": answers a certificate set as a file.
  void DownloadAction(ZEPH::APIRequest* request, ZEPH::APIResponse* response);

  // 5502 when the file at `csr_path` holds a readable PEM certificate
  // request; 5501 when it cannot be opened or read.
  static int checkCSRFormat(const std::string& csr_path);
};

#endif  // ZEPH_MODULE_UPLOAD_SSLCA_FORM_HANDLER_H_
