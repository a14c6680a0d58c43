#include "module/archive/cert_id.h"

#include <limits.h>
#include <stdlib.h>
#include <string.h>

#include <vector>

#include "module/common/log.h"
#include "module/common/paths.h"
#include "zeph/qlibc_file.h"
#include "zeph/root.h"

namespace ZEPH {
namespace cert {

std::string ArchiveDir() { return RootPath(kArchiveDir); }

std::string CrtDir(const std::string& id) { return ArchiveDir() + "/" + id; }

bool MakeCrtDir(std::string& path, std::string& id) {
  const std::string templ = ArchiveDir() + "/XXXXXX";
  // mkdtemp rewrites the template in place: it needs a writable buffer.
  std::vector<char> buf(templ.begin(), templ.end());
  buf.push_back('\0');
  if (mkdtemp(buf.data()) == nullptr) return false;
  std::string made(buf.data());
  std::string made_id = GetCrtId(made);
  path.swap(made);
  id.swap(made_id);
  return true;
}

}  // namespace cert
}  // namespace ZEPH

namespace {

// realpath(3) into a string; false when the path does not resolve.
bool Resolve(const std::string& path, std::string& resolved) {
  char buf[PATH_MAX];
  if (realpath(path.c_str(), buf) == nullptr) return false;
  resolved = buf;
  return true;
}

// Whether `path` is longer than `prefix` and starts with it.
bool StrictlyBelow(const std::string& path, const std::string& prefix) {
  return path.size() > prefix.size() &&
         path.compare(0, prefix.size(), prefix) == 0;
}

bool ConfinedToCertRoot(bool local, const std::string& base,
                        const std::string& name) {
  // The root keeps its trailing slash, so "certificateX" beside it does not
  // pass for a path inside it.
  const std::string root = ZEPH::RootPath(local ? ZEPH::cert::kLocalCertRoot
                                                : ZEPH::cert::kSystemCertRoot);
  if (base.empty()) return false;
  std::string resolved_base;
  if (!Resolve(root + base, resolved_base) ||
      !StrictlyBelow(resolved_base, root)) {
    return false;
  }
  if (name.empty()) return true;
  std::string resolved;
  return Resolve(resolved_base + "/" + name, resolved) &&
         StrictlyBelow(resolved, resolved_base);
}

}  // namespace

std::string GetCrtId(const std::string& path) {
  const std::string prefix = ZEPH::cert::ArchiveDir() + "/";
  if (path.empty() || path.compare(0, prefix.size(), prefix) != 0 ||
      !QLIBCFileCheckDir(path.c_str())) {
    return std::string();
  }
  // The search starts one past the prefix, so the first character of the
  // id is always taken, even a slash.
  const size_t slash = path.find('/', prefix.size() + 1);
  if (slash == std::string::npos) return path.substr(prefix.size());
  return path.substr(prefix.size(), slash - prefix.size());
}

bool IsCrtIdName(const std::string& id) {
  // A NUL byte would cut the path short where the C library sees it:
  // "\0abc" names the archive itself.
  return !id.empty() &&
         id.find_first_of(std::string("/.\0", 3)) == std::string::npos;
}

bool IsCrtIdValid(const std::string& id) {
  if (!IsCrtIdName(id)) return false;
  const std::string dir = ZEPH::cert::CrtDir(id);
  if (!QLIBCFileCheckDir(dir.c_str())) return false;
  for (const char* file : {"privkey.pem", "cert.pem", "fullchain.pem"}) {
    const std::string path = dir + "/" + file;
    if (!QLIBCFileExist(path.c_str())) {
      UTILS_LOG("Lack of necessary files in cert dir [%s]", dir.c_str());
      return false;
    }
  }
  return true;
}

bool IsCrtPathValid(bool local, const std::string& base,
                    const std::string& name) {
  // Called through dlsym, possibly from C: nothing may escape as an
  // exception.
  try {
    return ConfinedToCertRoot(local, base, name);
  } catch (...) {
    return false;
  }
}
