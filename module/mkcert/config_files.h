// OpenSSL configuration files for key requests and certificate extensions.
//
// The openssl command-line tool takes the subject of a request from a
// request configuration and the X.509v3 extensions of a certificate from an
// extension file. The writers below produce those files byte for byte as
// the rest of the appliance expects them; each file is written anew, whole
// (fopen "w", the process's default file mode), and left in place.
//
// Every writer returns 0 on success and -1 on failure, logging one
// diagnostic line (source "mkcert"). A failure after the file was opened
// can leave it partly written. Paths are used as given: callers pass paths
// already below the root prefix.
//
// Thread-safety: the functions keep no state and may run in several
// threads, but two writers of the same path overwrite each other; the fixed
// configuration paths of the appliance are shared without a lock.
#ifndef ZEPH_MODULE_MKCERT_CONFIG_FILES_H_
#define ZEPH_MODULE_MKCERT_CONFIG_FILES_H_

#include <string>

#include "module/mkcert/csr_argument.h"
#include "zeph/export.h"
#include "zeph/qlibc_string.h"

// Makes the directory that holds `path`, with its parents ("/bin/mkdir -p").
// An empty path is refused. 0 when the directory exists afterwards.
ZEPH_EXPORT int makeParentDir(const std::string& path);

// Writes the extension file of the appliance's certificate authority:
// basicConstraints CA:true with path length 0, an sslCA certificate type
// and a comment. The parent directory is made when missing.
ZEPH_EXPORT int generateCACNF(const char* path);

namespace ZEPH {
namespace cert {

// The keyUsage line of a server extension file.
enum class ServerKeyUsage {
  // "critical, digitalSignature, keyEncipherment": the appliance's line,
  // for RSA keys and for every request it signs.
  kSignatureAndEncipherment,
  // "critical, digitalSignature": for the EC server keys of the sets the
  // appliance makes itself; an EC key cannot encipher keys, and RFC 5480
  // does not allow the bit on it.
  kSignatureOnly,
};

}  // namespace cert
}  // namespace ZEPH

// Writes the extension file of a server certificate (server and client
// authentication, digitalSignature and keyEncipherment, critical), followed
// by one quoted subjectAltName line with an "IP:" entry for every IP
// address of `aliases` and a "DNS:" entry for every other non-empty entry,
// in list order. Empty entries are skipped; when none remains, the line is
// left out. REQUIRES: aliases is not null (refused with a log line if it is).
ZEPH_EXPORT int generateServerCNF(const char* path, QLIBSZLIST* aliases);

// The same file with the keyUsage line of `usage`; with
// kSignatureAndEncipherment it is byte for byte the file above.
ZEPH_EXPORT int generateServerCNF(const char* path, QLIBSZLIST* aliases,
                                  ZEPH::cert::ServerKeyUsage usage);

// Writes the request configuration at `cfgPath`: the [ req ] section and a
// [ req_DN ] section with one line for each non-empty field of `subject`,
// the value in single quotes, written as it is (no escaping). Keys are
// padded with blanks to 32 columns. The "default_bits" line always says
// 1024: the key is made beforehand and handed to the tool, so the line has
// no effect. A value holding a line break is refused ("modifyCsrCfg sanity
// failed."): it would add lines of its own to the file.
ZEPH_EXPORT int modifyCsrCfg(const std::string& cfgPath,
                             _tag_CSR_ARGUMENT* subject);

#endif  // ZEPH_MODULE_MKCERT_CONFIG_FILES_H_
