// Private copies of the files a call hands the module.
//
// The module's upload parameters ("key_tmp", "cert_tmp", "inter_cert_tmp"
// and "csr_tmp", and the hosts' "pkcs12_tmp") name files that it reads and may change in place: the
// import strips a byte-order mark from the certificate and key files. A
// host therefore never hands it a file it was given, only a private copy:
// the server stores uploaded parts, zephcert copies the files named on its
// command line.
//
// UploadDir is the private directory of one call: made on first use with
// mkdtemp(3) below a parent directory (mode 0700, so only the process's
// user reaches it), its files made anew with mode 0600, and the directory
// with everything in it removed when the object goes, whatever the call
// left there.
//
// Thread-safety: one object belongs to one call on one thread.
#ifndef ZEPH_HOST_UPLOAD_DIR_H_
#define ZEPH_HOST_UPLOAD_DIR_H_

#include <json/json.h>

#include <string>

#include "zeph/unique_fd.h"

namespace ZEPH {

// The file parameters of a call, without their "_tmp": the module's, and
// "pkcs12" of an import, which the hosts turn into the module's.
extern const char* const kUploadParts[5];

class UploadDir {
 public:
  // The directory will be `parent`/`prefix`.XXXXXX.
  UploadDir(std::string parent, std::string prefix);
  ~UploadDir();
  UploadDir(const UploadDir&) = delete;
  UploadDir& operator=(const UploadDir&) = delete;

  // Makes the directory when it does not exist yet. False with a one-line
  // reason in `error` when it cannot be made.
  bool Make(std::string* error);

  // Makes the directory when it does not exist yet and creates the new file
  // `name` in it for writing (mode 0600, never through a link). The
  // descriptor, with the file's path in `path`; an invalid descriptor with
  // a one-line reason in `error` when either cannot be made.
  UniqueFd Create(const std::string& name, std::string* path,
                  std::string* error);

  // The directory, or empty before the first file.
  const std::string& path() const { return path_; }

 private:
  void Remove();

  const std::string parent_;
  const std::string prefix_;
  std::string path_;
};

// Replaces every upload parameter of `params` ("<part>_tmp") that names a
// readable file by the path of a copy of it in `dir`. Parameters that are
// not a string, are empty or name nothing readable are left as they are,
// for the module to answer them as it does. False with a one-line reason
// in `error` when a readable file cannot be copied.
bool CopyUploadParams(Json::Value& params, UploadDir& dir, std::string* error);

}  // namespace ZEPH

#endif  // ZEPH_HOST_UPLOAD_DIR_H_
