#include "module/archive/ssl_errors.h"

#include <openssl/bio.h>
#include <openssl/err.h>

#include "module/common/log.h"
#include "module/common/ssl_ptr.h"

void log_ssl_errors(const std::string& message) {
  // Clearing first is deliberate: the line is the caller's message with an
  // empty bracket, and the queue is left empty for the next operation.
  ERR_clear_error();
  ZEPH::ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio) {
    UTILS_LOG("Fatal Error. new bio failed.");
    return;
  }
  ERR_print_errors(bio.get());
  // A memory BIO's data is not NUL-terminated and may be empty (a null
  // pointer then): take it with its length.
  char* data = nullptr;
  const long size = BIO_get_mem_data(bio.get(), &data);
  const std::string queue = data != nullptr && size > 0
                                ? std::string(data, static_cast<size_t>(size))
                                : std::string();
  UTILS_LOG("%s [%s]", message.c_str(), queue.c_str());
}
