#include "module/upload/sslca_form_handler.h"

#include <openssl/err.h>
#include <openssl/pem.h>

#include "module/common/log.h"
#include "module/common/ssl_ptr.h"

SSLCAFormHandler::SSLCAFormHandler() : ServerFormHandler(false, nullptr) {}

SSLCAFormHandler::~SSLCAFormHandler() = default;

void SSLCAFormHandler::HandleLoadAction(ZEPH::APIRequest* /*request*/,
                                        ZEPH::APIResponse* /*response*/) {}

void SSLCAFormHandler::HandleApplyAction(ZEPH::APIRequest* /*request*/,
                                         ZEPH::APIResponse* /*response*/) {}

int SSLCAFormHandler::checkCSRFormat(const std::string& csr_path) {
  ZEPH::ssl::BioPtr bio(BIO_new_file(csr_path.c_str(), "r"));
  if (!bio) {
    ERR_clear_error();
    UPLOAD_LOG("Failed to BIO_new_file. [%s]", csr_path.c_str());
    return 5501;
  }
  ZEPH::ssl::X509ReqPtr request(
      PEM_read_bio_X509_REQ(bio.get(), nullptr, nullptr, nullptr));
  if (!request) {
    ERR_clear_error();
    UPLOAD_LOG("Failed to read csr from %s", csr_path.c_str());
    return 5501;
  }
  return 5502;
}
