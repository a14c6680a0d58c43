// What the fuzz targets share: one private appliance root per process and
// small file helpers.
//
// The root is made on first use below $TMPDIR (or /tmp), provisioned like a
// fresh appliance (no certificates), named in ZEPH_ROOT with the module's
// log in ZEPH_LOG_FILE, and removed when the process exits normally. A
// crashing input leaves it behind for inspection.
#ifndef ZEPH_FUZZ_FUZZ_SUPPORT_H_
#define ZEPH_FUZZ_FUZZ_SUPPORT_H_

#include <stddef.h>
#include <stdint.h>

#include <string>

namespace ZEPH {
namespace fuzz {

// The root's directory; aborts the process when it cannot be made.
const std::string& Root();

// The archive every target starts from: two certificates, "fuzzAA" (the
// default, bound to the web administration service, not deletable by
// users) and "fuzzBB" (bound to nothing), with INFO, DEFAULT and SERVICES.
// Made on first use; later calls put back whatever an input changed: the
// three documents and both certificate directories.
void RestoreArchive();

// The archive directory below the root, and the web service's object.
std::string ArchivePath(const std::string& rest = "");
const std::string& WebServiceText();

// Writes `size` bytes to `path` (replacing it, mode 0600); aborts on
// failure, which is the harness's fault, not the input's.
void WriteFile(const std::string& path, const uint8_t* data, size_t size);
void WriteFile(const std::string& path, const std::string& text);

// The bytes of `path`; false when it cannot be read.
bool ReadFile(const std::string& path, std::string* text);

// A self-signed EC certificate set ("privkey.pem", "cert.pem",
// "fullchain.pem") for `cn` in `dir`, made with /usr/bin/openssl. Aborts
// when openssl fails.
void MakeCertSet(const std::string& dir, const std::string& cn);

// Runs `argv` (a path and its arguments) and waits; true when it exited 0.
bool RunQuietly(const char* const* argv);

// Aborts with `what` on standard error: a broken harness must not pass for
// a quiet fuzz run.
[[noreturn]] void Die(const std::string& what);

}  // namespace fuzz
}  // namespace ZEPH

#endif  // ZEPH_FUZZ_FUZZ_SUPPORT_H_
