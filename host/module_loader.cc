#include "host/module_loader.h"

#include <dlfcn.h>
#include <limits.h>
#include <unistd.h>

#include <string>

namespace ZEPH {

std::unique_ptr<LoadedModule> LoadedModule::Open(const std::string& path,
                                                 std::string* error) {
  void* handle = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (handle == nullptr) {
    const char* why = dlerror();
    *error = "cannot load module " + path + ": " + (why ? why : "unknown error");
    return nullptr;
  }
  auto get_table = reinterpret_cast<ZEPH_GET_API_TABLE>(
      dlsym(handle, ZEPH_GET_API_TABLE_SYMBOL));
  const ZEPH_API_TABLE* table = get_table != nullptr ? get_table() : nullptr;
  if (table == nullptr) {
    *error = "module " + path + " has no method table";
    dlclose(handle);
    return nullptr;
  }
  return std::unique_ptr<LoadedModule>(new LoadedModule(handle, table));
}

LoadedModule::~LoadedModule() { dlclose(handle_); }

const ZEPH_API_TABLE* LoadedModule::Find(const std::string& api, int version,
                                         const std::string& method) const {
  for (const ZEPH_API_TABLE* row = table_; row->api != nullptr; ++row) {
    if (api == row->api && version == row->version && method == row->method) {
      return row;
    }
  }
  return nullptr;
}

bool LoadedModule::HasApi(const std::string& api) const {
  for (const ZEPH_API_TABLE* row = table_; row->api != nullptr; ++row) {
    if (api == row->api) return true;
  }
  return false;
}

std::string ExecutableDir() {
  char buf[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof(buf) - 1);
  if (n <= 0) return ".";
  std::string exe(buf, static_cast<size_t>(n));
  size_t slash = exe.rfind('/');
  return slash == std::string::npos || slash == 0 ? "/" : exe.substr(0, slash);
}

std::string DefaultCertificateModulePath() {
  static const char kName[] = "ZEPH.Core.Certificate.so";
  const std::string dir = ExecutableDir();
  const std::string candidates[] = {dir + "/" + kName,
                                    dir + "/../lib/zeph/" + kName};
  for (const std::string& c : candidates) {
    if (access(c.c_str(), R_OK) == 0) return c;
  }
  return candidates[0];
}

}  // namespace ZEPH
