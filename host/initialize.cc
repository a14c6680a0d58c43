#include "host/initialize.h"

#include "host/provision.h"
#include "zeph/api.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_file.h"
#include "zeph/root.h"

namespace ZEPH {

bool InitializeRoot(const LoadedModule& module, std::string* error) {
  if (!ProvisionRoot(error)) return false;
  const std::string info = RootPath("/usr/zeph/etc/certificate/_archive/INFO");
  if (QLIBCFileExist(info.c_str())) return true;
  const ZEPH_API_TABLE* reset = module.Find("ZEPH.Core.Certificate", 1, "reset");
  if (reset == nullptr) {
    *error = "the module has no reset method";
    return false;
  }
  APIRequest request;
  APIResponse response;
  reset->handler(&request, &response);
  if (response.outcome() == APIResponse::Outcome::kError) {
    *error = "the first default certificate could not be made (error " +
             std::to_string(response.error_code()) + ", " +
             JsonCompact(response.data()) + ")";
    return false;
  }
  return true;
}

}  // namespace ZEPH
