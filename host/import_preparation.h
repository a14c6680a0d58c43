// The preparation of an import's uploads: what administrators bring turned
// into the plain PEM files the module's import expects, or refused with a
// reason they can act on.
//
// The module's import takes a PEM key ("key_tmp"), a PEM certificate
// ("cert_tmp") and optionally PEM intermediates ("inter_cert_tmp"), and
// answers its codes (5510 ... 5518) without saying what was wrong. Hosts
// (the server and zephcert) run PrepareImport on the parameters first:
//   - every file may be PEM (any blocks in any order, byte-order mark,
//     CRLF), DER, PKCS#7 or PKCS#12 (upload_contents.h); a PKCS#12 bundle
//     may also come as "pkcs12_tmp", and "passphrase" opens it or an
//     encrypted key;
//   - the key is the key file's; without a key file, one found in the
//     certificate file (the combined form of some servers), a PKCS#12
//     bundle or the intermediate file;
//   - the certificate is the one that belongs to the key; every other
//     certificate given anywhere joins the intermediates;
//   - the intermediates lose duplicates, the certificate itself and
//     self-signed roots, and are ordered from the one that signed the
//     certificate upward; one that does not belong to that chain is
//     refused (5517);
//   - a private key never ends up in a certificate file.
// The module then gets new files in `dir`: "key.pem", "cert.pem" and, when
// there are intermediates, "inter_cert.pem" ("inter_cert_tmp" is dropped
// when there are none); "pkcs12_tmp" and "passphrase" never reach it.
//
// Refusals carry the code the module uses for the file at fault (5510 the
// certificate or PKCS#12 file, 5511 the key, 5512 the intermediates, 5514
// a key that belongs to none of the certificates, 5517 a broken chain,
// 5518 a DSA key) and a note: a machine-readable reason and a sentence.
// A certificate that has expired, is not valid yet, or whose names do not
// include the appliance's host name is imported; the notes say so.
//
// Parameters the module must judge itself are left alone: a file parameter
// that is not a string, is empty or names nothing readable makes the
// preparation step aside (the module answers its own code); only
// "passphrase" is taken out in any case.
//
// Thread-safety: safe from any thread; `dir` belongs to the caller's call.
#ifndef ZEPH_HOST_IMPORT_PREPARATION_H_
#define ZEPH_HOST_IMPORT_PREPARATION_H_

#include <json/json.h>

#include <string>
#include <vector>

#include "host/upload_dir.h"

namespace ZEPH {

struct UploadNote {
  std::string reason;   // machine-readable, e.g. "request_not_certificate"
  std::string message;  // one sentence for the administrator
};

struct PreparedImport {
  bool refused = false;
  int code = 0;  // when refused: the module's code for the problem
  UploadNote refusal;
  std::vector<UploadNote> warnings;
};

// Whether (api, method) is the module's import.
bool IsImportCall(const std::string& api, const std::string& method);

// Prepares the files of an import's `params` (see above), rewriting the
// parameters to the prepared files in `dir`. `host_name` is the
// appliance's name that the certificate should carry.
PreparedImport PrepareImport(Json::Value& params, UploadDir& dir,
                             const std::string& host_name);

// The appliance's host name (gethostname(2)).
std::string ApplianceHostName();

// {"reason": ..., "message": ...}
Json::Value NoteJson(const UploadNote& note);

// Adds "warnings": [notes] to the data of a successful answer (made an
// object when it is not one); nothing when there are none.
void AddWarnings(const std::vector<UploadNote>& warnings, Json::Value& data);

}  // namespace ZEPH

#endif  // ZEPH_HOST_IMPORT_PREPARATION_H_
