// SSLCAFormHandler: import of an uploaded certificate set into the
// certificate archive and export of a certificate set as a ZIP download.
//
// Made on the stack by the import and export wrappers for one request. It
// adds no data members to ServerFormHandler; Process, ExLock, ShLock and
// Authenticate are inherited unchanged, HandleLoadAction and
// HandleApplyAction do nothing.
//
// Result codes of the import (the module's API codes; 5502 is the internal
// "no error" value and is never sent):
//   5501 general failure (work directory, request file unreadable)
//   5503 "id" given but not a valid certificate id
//   5510 certificate unreadable for its information
//   5511 private key unreadable
//   5512 intermediate certificate unreadable for its information
//   5514 certificate and key do not match
//   5515 copying into the work directory or building the full chain failed
//   5517 intermediate certificates and certificate do not form a chain
//   5518 the private key is a DSA key
//
// All paths are taken below ZEPH_ROOT (zeph/root.h); the uploaded files are
// used as given.
//
// Thread-safety: the class keeps no state; any number of objects may work
// at once in several threads and processes. Two imports that replace the
// same certificate at the same time share its work directory and must not
// overlap; exports are serialised by a lock file (see DownloadAction).
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

  // ZEPH.Core.Certificate "import". Parameters (all optional here; the
  // wrapper demands "desc", "key_tmp" and "cert_tmp"):
  //   "key_tmp", "cert_tmp", "inter_cert_tmp": paths of the uploaded
  //       private key, certificate and intermediate certificate(s);
  //   "id": empty for a new certificate, else the id whose files are
  //       replaced; "desc": its description;
  //   "as_default" (default false), "user_deletable" (default true):
  //       booleans, also accepted as the texts "true"/"false", "1"/"0",
  //       "yes"/"no".
  // The files are checked (checkCAContent, then readable as certificates),
  // copied into "<target>.temp" as "privkey.pem", "cert.pem" and, when the
  // request has "inter_cert_tmp", "chain.pem", "fullchain.pem" is built from
  // them (all mode 0400), and the work directory is moved onto the target:
  // a new archive directory, or the existing certificate's. The description
  // and flags are recorded in INFO; a replaced certificate is redeployed to
  // its services.
  // Answers success {"id": id} for a new certificate, {"id": id,
  // "restart_httpd": bool} for a replaced one (and SetHttpdRestart). When
  // the files were checked but could not be moved into place, or a replaced
  // certificate could not be redeployed, it answers success with an empty
  // object: the failure is only logged. Any other failure answers its code
  // with a JSON null and leaves no new directory behind; an existing
  // certificate is never touched by a failed import. The uploaded files are
  // never moved or removed; the match check strips a leading UTF-8
  // byte-order mark from the certificate and key files in place. The action
  // is recorded in the action log.
  void ProcessJsonReq(ZEPH::APIRequest* request, ZEPH::APIResponse* response);

  // ZEPH.Core.Certificate "export". By the parameter "file":
  //   "archive": the files of certificate "id": "zeph-ca-cert.pem" and
  //       "zeph-ca-privkey.pem" when the feature "support_self_sign_cert" is
  //       on, then "privkey.pem", "cert.pem", "chain.pem";
  //   "csr_set": the key and request last made by the CSR methods
  //       (".gen/server.csr", ".gen/server.key"), removed once handed
  //       out; only when both are there and the request was made with
  //       the key, else nothing;
  //   "signed_set": the certificate last signed (".gen/server.crt"),
  //       removed once handed out;
  //   anything else: nothing.
  // With "format": "pkcs12" (and "file": "archive", "id") the download is
  // instead one PKCS#12 file of the certificate's key, its certificate and
  // the certificates above it ("chain.pem", else the set's own
  // "zeph-ca-cert.pem"), protected with "passphrase" (required: one line,
  // 1 to 1023 bytes; never logged or put on a command line), AES-256/PBKDF2
  // or, with "legacy": true, 3DES/SHA1 (module/upload/pkcs12.h). It is
  // offered as "<common name>.p12" with "content-type"
  // "application/x-pkcs12" and removed from the disk once handed out.
  // Unlike the ZIP export it answers errors: 5503 for unusable parameters
  // (another "format" than "zip" or "pkcs12", another "file", a bad id,
  // passphrase or "legacy"), 5501 when the set has no key or certificate or
  // the file cannot be made or handed out. "format": "zip" is the ZIP
  // export.
  // Files that do not exist are left out. The archive is
  // "/usr/zeph/etc/ssl/.gen/archive.zip" (mode 0400), offered as
  // "archive.zip" with the header "content-disposition" through
  // ZEPH::APIDownload, and the response's own output is switched off.
  // Neither SetSuccess nor SetError is called: a failure is only logged and
  // produces no download. Exports take the lock file
  // "/tmp/zephcertificate_export.lock" (exclusive, 60 s) from packing to
  // hand-out, so that one export never hands out or removes the archive of
  // another; for "csr_set" and "signed_set" they then take the generation
  // lock (module/mkcert/generation_lock.h) too, so that no generation
  // replaces the files while they are packed and removed.
  void DownloadAction(ZEPH::APIRequest* request, ZEPH::APIResponse* response);

  // Packs those of the `count` files of `files` that exist (in that order)
  // into a new ZIP archive at `archivePath` with "/usr/bin/7z", after
  // removing any earlier file of that name, and makes it mode 0400.
  // 0 on success (also when only the chmod failed, which is logged); -1
  // when the old archive cannot be removed, none of the files exists
  // ("No file will be compress"), the tool fails (a partial archive is
  // removed), or the arguments are unusable (null path, negative count).
  static int CreateArchive(const char** files, const char* archivePath,
                           int count);

  // 5502 when `keyPath` holds a readable PEM private key that is not DSA
  // (RSA, EC and every other type pass); 5518 for a DSA key; 5511 when the
  // file cannot be opened or holds no readable key (an encrypted key counts
  // as unreadable: no pass phrase is asked for).
  static int checkPrivateKey(const std::string& keyPath);

  // The content checks of an import, in order: the private key
  // (checkPrivateKey, its code), then, when `interPath` is not empty, that
  // the certificates of `certPath` and `interPath` form a chain (5517), then
  // that the certificate belongs to the key (5514; also when the
  // certificate cannot be read). 5502 when all pass. Null paths count as
  // empty. Strips a leading byte-order mark from the certificate and key
  // files in place.
  static int checkCAContent(const char* certPath, const char* keyPath,
                            const char* interPath);

  // 5502 when the file at `csr_path` holds a readable PEM certificate
  // request; 5501 when it cannot be opened or read.
  static int checkCSRFormat(const std::string& csr_path);
};

#endif  // ZEPH_MODULE_UPLOAD_SSLCA_FORM_HANDLER_H_
