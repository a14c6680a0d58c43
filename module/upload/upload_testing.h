// Fixtures of the import and export tests: key material made with the
// system's openssl, upload files, calls of the export row with a download
// sink, and the member list of a ZIP archive.
#ifndef ZEPH_MODULE_UPLOAD_UPLOAD_TESTING_H_
#define ZEPH_MODULE_UPLOAD_UPLOAD_TESTING_H_

#include <json/json.h>

#include <set>
#include <string>

#include "module/methods/methods_test_support.h"
#include "zeph/api.h"

namespace ZEPH {
namespace test {

enum class KeyKind { kRsa, kEc, kEd25519, kDsa };

// A PEM private key of `kind` at `path`. Records a failure when openssl
// fails.
void MakeKey(KeyKind kind, const std::string& path);
// A self-signed certificate for the key at `key` with subject CN=`cn`.
void MakeSelfSigned(const std::string& key, const std::string& cn,
                    const std::string& out);
// A certificate for the key at `key`, CN=`cn`, issued by the authority
// `ca_cert`/`ca_key`.
void MakeIssued(const std::string& key, const std::string& cn,
                const std::string& ca_cert, const std::string& ca_key,
                const std::string& out);

// What an export call produced.
struct ExportResult {
  APIResponse response;
  bool delivered = false;
  HeaderList headers;
  std::string copy;  // the delivered bytes, copied at delivery
};

// Calls the export row of the method table with `params`, collecting the
// download as the web server would.
ExportResult CallExport(const Json::Value& params);

// Writes the delivered bytes of `r` to `path` (for the archive tools).
void SaveDownload(const ExportResult& r, const std::string& path);

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_MODULE_UPLOAD_UPLOAD_TESTING_H_
