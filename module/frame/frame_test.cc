#include <gtest/gtest.h>

#include <string>

#include "module/frame/table.h"
#include "zeph/json_file.h"

extern std::string g_called_worker;

namespace {

// Each call of the fifteen rows, in order: the worker it reaches or the code it is refused with.
TEST(Wrappers, CheckRulesBeforeCallingTheirWorker) {
  const std::string csr =
      "\"country\": \"TW\", \"state\": \"\", \"city\": \"Taipel\", \"organization\": \"o\", "
      "\"department\": \"d\", \"common_name\": \"nas\", \"email\": \"\"";
  const std::string crt =
      "{\"ca_country\": \"TW\", \"ca_state\": \"\", \"ca_city\": \"c\", \"ca_organization\": "
      "\"o\", \"ca_department\": \"d\", \"ca_common_name\": \"CA\", \"ca_email\": \"\", " + csr;
  const std::string import = "{\"desc\": \"d\", \"key_tmp\": \"/k\", \"cert_tmp\": \"/c\"";
  const std::string sign = "{\"id\": \"a\", \"days\": 30, \"csr\": \"c\"";
  const struct {
    const char* api;  // after "ZEPH.Core.Certificate."
    const char* method;
    std::string params;
    const char* worker;  // nullptr: refused with `code`
    int code;
  } kCalls[] = {
      {"", "reset", "{\"x\": 1}", "handleResetAction", 0},
      {"", "export", "{\"file\": \"csr_set\"}", "DownloadAction", 0},
      {"", "export", "{\"file\": \"archive\"}", nullptr, 5503},
      {"", "export", "{\"file\": \"archive\", \"id\": \"a\"}", "DownloadAction", 0},
      {"", "export", "{\"file\": \"archive\", \"id\": 5}", nullptr, 5503},
      {"", "export", "{}", nullptr, 5503},
      {"", "import", import + "}", "ProcessJsonReq", 0},
      {"", "import", import + ", \"inter_cert_tmp\": \"/i\", \"id\": \"a\", "
                        "\"as_default\": \"true\"}", "ProcessJsonReq", 0},
      {"", "import", import + ", \"as_default\": true}", nullptr, 5511},
      {"", "import", "{\"key_tmp\": \"/k\", \"cert_tmp\": \"/c\"}", nullptr, 5511},
      {"", "import", "{\"desc\": \"d\", \"cert_tmp\": \"/c\"}", nullptr, 5511},
      {"", "import", import + ", \"id\": 3}", nullptr, 5511},
      {"", "import", "{\"desc\": \"d\", \"key_tmp\": \"/k\"}", nullptr, 5510},
      {"", "import", "{\"desc\": \"d\", \"key_tmp\": \"/k\", \"cert_tmp\": []}", nullptr, 5510},
      {"", "import", import + ", \"inter_cert_tmp\": null}", nullptr, 5512},
      {"CSR", "create", "{" + csr + "}", "handleCSRAction", 0},
      {"CSR", "create", "{\"country\": \"TW\"}", nullptr, 5503},
      {"CSR", "renew", "{\"id\": \"a\"}", "handleRenewAction", 0},
      {"CSR", "renew", "{\"id\": 5}", nullptr, 5503},
      {"CSR", "renew", "{\"id\": \"a\", \"country\": 886}", nullptr, 5503},
      {"CSR", "sign", sign + ", \"csr_tmp\": \"/t\"}", "handleSignCSRAction", 0},
      {"CSR", "sign", "{\"id\": \"a\", \"days\": \"30\", \"csr\": \"c\", \"csr_tmp\": \"/t\"}",
       nullptr, 5503},
      {"CSR", "sign", sign + ", \"csr_tmp\": \"/t\", \"alias\": 1}", nullptr, 5503},
      {"CSR", "sign", sign + "}", nullptr, 5503},
      {"CRT", "create", crt + ", \"desc\": \"\"}", "handleCRTAction", 0},
      {"CRT", "create", crt + ", \"desc\": \"\", \"as_default\": true, \"id\": \"a\"}",
       "handleCRTAction", 0},
      {"CRT", "create", crt + ", \"desc\": \"\", \"as_default\": \"true\"}", nullptr, 5503},
      {"CRT", "create", crt + "}", nullptr, 5503},
      {"CRT", "create", "{" + csr + ", \"desc\": \"\"}", nullptr, 5503},
      {"CRT", "recreate", "{\"id\": \"a\"}", "handleRecreateCRTAction", 0},
      {"CRT", "set", "{\"id\": \"a\", \"desc\": \"\"}", "handleCRTSet", 0},
      {"CRT", "delete", "{\"ids\": [\"a\", \"b\"]}", "handleCRTDelete", 0},
      {"CRT", "delete", "{\"ids\": \"a\"}", nullptr, 5503},
      {"CRT", "list", "{\"id\": 5}", "handleCRTList", 0},
      {"LetsEncrypt", "create", "{\"desc\": \"\", \"domain_name\": \"n\"}", "handleLECreate", 0},
      {"LetsEncrypt", "create", "{\"desc\": \"\", \"domain_name\": \"n\", \"email\": 1}", nullptr,
       5503},
      {"LetsEncrypt", "create", "{\"desc\": \"\"}", nullptr, 5503},
      {"LetsEncrypt", "renew", "{\"id\": \"a\"}", "handleLERenew", 0},
      {"LetsEncrypt", "renew", "{\"id\": null}", nullptr, 5503},
      {"LetsEncrypt.Account", "list", "{}", "handleLEAccountList", 0},
      {"Service", "set", "{\"settings\": [5, {}]}", "handleServiceSet", 0},
      {"Service", "set", "{}", nullptr, 5503},
  };
  const ZEPH_API_TABLE* const table = GetAPITable();
  const ZEPH_API_TABLE* row = table;
  for (const auto& c : kCalls) {
    const std::string api = std::string("ZEPH.Core.Certificate") + (*c.api ? "." : "") + c.api;
    SCOPED_TRACE(api + " " + c.method + " " + c.params);
    if (api != row->api || c.method != std::string(row->method)) ++row;
    ASSERT_NE(row->api, nullptr);
    ASSERT_EQ(std::string(row->api) + " " + row->method, api + " " + c.method);
    EXPECT_EQ(row->version, 1);
    ASSERT_NE(row->handler, nullptr);
    Json::Value params;
    ASSERT_TRUE(ZEPH::JsonParse(c.params, params));
    ZEPH::APIRequest request(params);
    ZEPH::APIResponse response;
    g_called_worker.clear();
    row->handler(&request, &response);
    EXPECT_EQ(response.outcome_count(), 1);
    EXPECT_EQ(g_called_worker, c.worker ? c.worker : "");
    const bool ok = response.outcome() == ZEPH::APIResponse::Outcome::kSuccess;
    EXPECT_EQ(ok ? 0 : response.error_code(), c.worker ? 0 : c.code);
    EXPECT_TRUE(ok || response.data().isNull());
  }
  EXPECT_EQ(row - table, 14);
  ++row;
  EXPECT_TRUE(!row->api && !row->method && !row->version && !row->handler);
}

}  // namespace
