// Loading an API module the way the web API server does: dlopen of the
// shared object, GetAPITable, then a lookup of the row for
// (API name, version, method). Nothing but the table is looked up by name.
//
// Thread-safety: a loaded module may be used from any thread; Find only
// reads the module's constant table.
#ifndef ZEPH_HOST_MODULE_LOADER_H_
#define ZEPH_HOST_MODULE_LOADER_H_

#include <memory>
#include <string>

#include "zeph/api_table.h"

namespace ZEPH {

class LoadedModule {
 public:
  // Opens the module at `path`. Null with a one-line reason in `error` when
  // the file cannot be loaded or has no GetAPITable.
  static std::unique_ptr<LoadedModule> Open(const std::string& path,
                                            std::string* error);
  ~LoadedModule();
  LoadedModule(const LoadedModule&) = delete;
  LoadedModule& operator=(const LoadedModule&) = delete;

  // The row for (api, version, method), or null.
  const ZEPH_API_TABLE* Find(const std::string& api, int version,
                             const std::string& method) const;
  // Whether any row serves `api`.
  bool HasApi(const std::string& api) const;
  const ZEPH_API_TABLE* table() const { return table_; }

 private:
  LoadedModule(void* handle, const ZEPH_API_TABLE* table)
      : handle_(handle), table_(table) {}

  void* handle_;
  const ZEPH_API_TABLE* table_;
};

// Where the certificate module is found for an executable: beside the
// running executable (the build tree), else in ../lib/zeph relative to it
// (an installed tree). Returns the first that exists, or the first
// candidate when neither does.
std::string DefaultCertificateModulePath();

// Directory of the running executable, without a trailing slash.
std::string ExecutableDir();

}  // namespace ZEPH

#endif  // ZEPH_HOST_MODULE_LOADER_H_
