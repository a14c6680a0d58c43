// What the fuzz targets share: a provisioned appliance root per process (ZEPH_ROOT, with the
// log in ZEPH_LOG_FILE) removed at a normal exit, kept after a crash; file helpers; one call.
#ifndef ZEPH_FUZZ_FUZZ_SUPPORT_H_
#define ZEPH_FUZZ_FUZZ_SUPPORT_H_

#include <json/json.h>
#include <stddef.h>
#include <stdint.h>

#include <string>

#include "zeph/api.h"

namespace ZEPH::fuzz {

const std::string& Root();
// Puts back the archive: "fuzzAA" (default, bound to the web service, not deletable) and
// "fuzzBB" (unbound), with INFO, DEFAULT and SERVICES.
void RestoreArchive();
std::string ArchivePath(const std::string& rest = "");
const std::string& WebServiceText();  // the web service's JSON object
// Aborts with `what`: a broken harness or an unexpected answer. The file helpers die on failure.
[[noreturn]] void Die(const std::string& what);
void WriteFile(const std::string& path, const uint8_t* data, size_t size);  // mode 0600
void WriteFile(const std::string& path, const std::string& text);
void MakeDirs(const std::string& path);
bool ReadFile(const std::string& path, std::string* text);  // false: unreadable
// Calls `handler` with `params`; dies unless it wrote exactly one outcome.
APIResponse CallOnce(void (*handler)(APIRequest*, APIResponse*), const Json::Value& params,
                     const std::string& what);

}  // namespace ZEPH::fuzz

#endif  // ZEPH_FUZZ_FUZZ_SUPPORT_H_
