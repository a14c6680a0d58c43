// What one uploaded file holds, whatever form an administrator brings it
// in.
//
// Certificates, keys and requests come as PEM (any blocks in any order,
// with or without a UTF-8 byte-order mark, CRLF or LF line ends, text
// around the blocks), DER, PKCS#7 (".p7b", PEM or DER) or PKCS#12 (".pfx",
// ".p12"). ReadUpload sorts what it finds into certificates and private
// keys, counts signing requests, and says what it could not open:
//   - PEM blocks "CERTIFICATE", "X509 CERTIFICATE", "TRUSTED CERTIFICATE",
//     "PKCS7", "CERTIFICATE REQUEST", "NEW CERTIFICATE REQUEST" and every
//     kind of private key ("PRIVATE KEY", "ENCRYPTED PRIVATE KEY",
//     "RSA PRIVATE KEY" ..., also with the traditional encryption headers);
//     other blocks are ignored;
//   - without PEM blocks, DER: a PKCS#12 bundle, a certificate, a PKCS#7
//     bundle, a request, a private key (PKCS#8, encrypted or not, or
//     traditional);
//   - an encrypted key or a PKCS#12 bundle is opened with `passphrase`.
//
// A PKCS#12 bundle is opened with the system's openssl, which also reads
// the older algorithms (RC2, single DES) that the library no longer reads
// by default; the passphrase reaches it through a file of mode 0600 in
// `scratch_dir`, never on its command line, and the file is removed at
// once.
//
// Thread-safety: safe from any thread; nothing is kept between calls.
#ifndef ZEPH_HOST_UPLOAD_CONTENTS_H_
#define ZEPH_HOST_UPLOAD_CONTENTS_H_

#include <string>
#include <vector>

#include "module/common/ssl_ptr.h"

namespace ZEPH {

struct UploadContents {
  enum class Format { kEmpty, kPem, kDer, kPkcs12, kUnknown };
  // Why an encrypted key or a PKCS#12 bundle stayed closed.
  enum class Lock { kNone, kNeedsPassphrase, kWrongPassphrase, kUnreadable };

  Format format = Format::kEmpty;
  std::vector<ssl::X509Ptr> certs;  // in file order
  std::vector<ssl::EvpPkeyPtr> keys;
  int requests = 0;  // certificate signing requests
  Lock lock = Lock::kNone;
};

// Reads `bytes`, the content of one uploaded file; see above. `passphrase`
// is used only when `has_passphrase`. `scratch_dir` is a private directory
// (mode 0700) for the PKCS#12 reader.
UploadContents ReadUpload(const std::string& bytes,
                          const std::string& passphrase, bool has_passphrase,
                          const std::string& scratch_dir);

}  // namespace ZEPH

#endif  // ZEPH_HOST_UPLOAD_CONTENTS_H_
