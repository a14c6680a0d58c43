// What the fuzz targets share: one private appliance root per process,
// made on first use below $TMPDIR (or /tmp), provisioned like a fresh
// appliance, named in ZEPH_ROOT with the module's log in ZEPH_LOG_FILE and
// removed when the process exits normally (a crash leaves it behind for
// inspection); file helpers; and one call of a method handler.
#ifndef ZEPH_FUZZ_FUZZ_SUPPORT_H_
#define ZEPH_FUZZ_FUZZ_SUPPORT_H_

#include <json/json.h>
#include <stddef.h>
#include <stdint.h>

#include <string>

#include "zeph/api.h"

namespace ZEPH {
namespace fuzz {

const std::string& Root();
// Puts back the archive every target starts from, made on first use: two
// certificates, "fuzzAA" (the default, bound to the web administration
// service, not deletable by users) and "fuzzBB" (bound to nothing), and
// INFO, DEFAULT and SERVICES.
void RestoreArchive();
std::string ArchivePath(const std::string& rest = "");
const std::string& WebServiceText();  // the web service's JSON object

// Aborts with `what` on standard error: a broken harness, or an answer
// no reader expects, must not pass for a quiet fuzz run. The file helpers
// die on failure, which is the harness's fault, not the input's.
[[noreturn]] void Die(const std::string& what);
void WriteFile(const std::string& path, const uint8_t* data, size_t size);  // mode 0600
void WriteFile(const std::string& path, const std::string& text);
void MakeDirs(const std::string& path);
bool ReadFile(const std::string& path, std::string* text);  // false: unreadable

// Calls `handler` with `params`; dies unless it wrote exactly one outcome.
APIResponse CallOnce(void (*handler)(APIRequest*, APIResponse*), const Json::Value& params,
                     const std::string& what);

}  // namespace fuzz
}  // namespace ZEPH

#endif  // ZEPH_FUZZ_FUZZ_SUPPORT_H_
