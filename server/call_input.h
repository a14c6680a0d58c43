// The parameters of one API call, taken from the HTTP request body.
//
// Two forms are accepted:
//   - a JSON object (Content-Type application/json, or an empty body);
//   - multipart/form-data with an optional part "params" holding the JSON
//     object and file parts "key", "cert", "inter_cert", "csr" and "pkcs12"
//     (host/upload_dir.h: kUploadParts).
// Each file part is stored in a private upload directory (host/upload_dir.h:
// mode 0700, made below `upload_parent` on the first file part; files mode
// 0600 named after the part, never after the client's file name) and
// handed to the method as
// the parameter "<part>_tmp" with the file's path. When the parameters do
// not name "<part>" itself, it is set to the client's file name for the
// part (or the part's name when the client gave none).
//
// A client never names a server-side path: parameters "key_tmp",
// "cert_tmp", "inter_cert_tmp", "csr_tmp" and "pkcs12_tmp" in the JSON are
// refused (400).
// Limits: a JSON body or "params" part over 1 MiB is refused with 413 (nginx
// bounds JSON bodies, but cannot look into the parts of an upload); the
// body is still read to its end, since nginx is still sending it, up to
// kMaxBodyBytes, the upload limit nginx applies, beyond which reading stops.
//
// The upload directory and everything in it (also files the call's
// preparation or method added) is removed when the CallInput is destroyed,
// whatever happened.
//
// Thread-safety: one CallInput belongs to one request on one thread.
#ifndef ZEPH_SERVER_CALL_INPUT_H_
#define ZEPH_SERVER_CALL_INPUT_H_

#include <json/json.h>

#include <stddef.h>

#include <map>
#include <string>

#include "host/upload_dir.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {

struct CallError {
  int status = 0;       // HTTP status
  std::string message;  // one line for the client and the log
};

class CallInput {
 public:
  static constexpr size_t kMaxJsonBytes = 1 << 20;
  // The most a request body may hold at all: nginx's limit for uploads.
  static constexpr size_t kMaxBodyBytes = 8 << 20;

  explicit CallInput(std::string upload_parent);
  CallInput(const CallInput&) = delete;
  CallInput& operator=(const CallInput&) = delete;

  // A JSON body, in pieces. False when reading should stop (the body went
  // past kMaxBodyBytes).
  bool AddJson(const char* data, size_t size);

  // A multipart body: BeginPart for each part's headers, then AddPartData
  // with its bytes. False when reading should stop.
  bool BeginPart(const std::string& name, const std::string& filename);
  bool AddPartData(const char* data, size_t size);

  // Records an error found outside (a bad content type, say); the first
  // error recorded is the one reported.
  void Fail(int status, const std::string& message);

  // After the whole body: the parameters for the method. False with the
  // error to answer otherwise.
  bool Finish(Json::Value* params, CallError* error);

  // The upload directory, empty before the first file part.
  const std::string& upload_dir() const { return upload_dir_.path(); }
  // The call's private directory, for files made from the uploads.
  UploadDir& uploads() { return upload_dir_; }

 private:
  enum class Mode { kNone, kJson, kMultipart };
  struct Upload {
    std::string path;
    std::string filename;
  };

  bool Count(size_t size);
  bool OpenUpload(const std::string& name);

  Mode mode_ = Mode::kNone;
  size_t total_ = 0;
  CallError error_;

  std::string json_;  // the JSON body or the "params" part
  bool have_params_part_ = false;

  std::string part_;  // the part being read
  bool part_is_params_ = false;
  size_t part_size_ = 0;
  UniqueFd part_fd_;

  UploadDir upload_dir_;
  std::map<std::string, Upload> uploads_;  // by part name
};

// Whether `name` is one of the parameters only the server may set.
bool IsServerOnlyParam(const std::string& name);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_CALL_INPUT_H_
