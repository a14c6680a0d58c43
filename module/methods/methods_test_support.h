// A private, provisioned appliance root and calls through the real method table.
#ifndef ZEPH_MODULE_METHODS_METHODS_TEST_SUPPORT_H_
#define ZEPH_MODULE_METHODS_METHODS_TEST_SUPPORT_H_

#include <json/json.h>

#include <string>
#include <vector>

#include "test_support.h"
#include "zeph/api.h"

namespace ZEPH {
namespace test {

struct CallResult {
  APIResponse response;
  bool ok() const { return response.outcome() == APIResponse::Outcome::kSuccess; }
  int code() const { return response.error_code(); }
  const Json::Value& data() const { return response.data(); }
};

class ApplianceRoot : public TempRoot {
 public:
  ApplianceRoot();  // provisions the root as zephcert init does
  // Calls (api, method) of the method table with `params` (JSON text or value).
  CallResult Call(const std::string& api, const std::string& method,
                  const std::string& params = "{}") const;
  CallResult Call(const std::string& api, const std::string& method, const char* params) const {
    return Call(api, method, std::string(params));
  }
  CallResult Call(const std::string& api, const std::string& method,
                  const Json::Value& params) const;
  std::vector<Json::Value> Events() const;  // the event log, oldest first
  std::string Archive(const std::string& rest = "") const {
    return Path("/usr/zeph/etc/certificate/_archive") + rest;
  }
  Json::Value Info() const;
  Json::Value WebService() const;  // the web administration service from SERVICES
  // Creates a certificate through "CRT create" with 1024-bit keys and `extra`
  // parameters; returns its id ("" on failure).
  std::string CreateCertificate(const std::string& common_name,
                                const Json::Value& extra = Json::Value()) const;
};

// Subject parameters of "CRT create" for a server named `common_name`.
Json::Value CreateParams(const std::string& common_name);

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_MODULE_METHODS_METHODS_TEST_SUPPORT_H_
