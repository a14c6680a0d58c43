#include <gtest/gtest.h>

#include <string>

#include "module/frame/table.h"
#include "zeph/json_file.h"

extern std::string g_called_worker;

namespace {

const char kCert[] = "ZEPH.Core.Certificate";
const char kCsr[] = "ZEPH.Core.Certificate.CSR";
const char kCrt[] = "ZEPH.Core.Certificate.CRT";
const char kLe[] = "ZEPH.Core.Certificate.LetsEncrypt";
const char kAccount[] = "ZEPH.Core.Certificate.LetsEncrypt.Account";
const char kService[] = "ZEPH.Core.Certificate.Service";

// Each call names the row, the parameters, and either the worker that must
// get the request or the error code that must come back instead. The calls
// name the fifteen rows in the table's order. Parameters of a wrong JSON
// type for recreate, delete, CRT set and Service set are the server test's.
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
    const char* api;
    const char* method;
    std::string params;
    const char* worker;  // nullptr: refused with `code`
    int code;
  } kCalls[] = {
      // Rows without rules (reset, CRT list, account list) take anything.
      {kCert, "reset", "{\"x\": 1}", "handleResetAction", 0},
      // Export: "id" only matters for the archive.
      {kCert, "export", "{\"file\": \"csr_set\"}", "DownloadAction", 0},
      {kCert, "export", "{\"file\": \"archive\"}", nullptr, 5503},
      {kCert, "export", "{\"file\": \"archive\", \"id\": \"a\"}", "DownloadAction", 0},
      {kCert, "export", "{\"file\": \"archive\", \"id\": 5}", nullptr, 5503},
      {kCert, "export", "{\"file\": 1}", nullptr, 5503},
      {kCert, "export", "{}", nullptr, 5503},
      // Import: three checks with three codes.
      {kCert, "import", import + "}", "ProcessJsonReq", 0},
      {kCert, "import", import + ", \"inter_cert_tmp\": \"/i\", \"id\": \"a\", "
                        "\"as_default\": \"true\"}", "ProcessJsonReq", 0},
      {kCert, "import", import + ", \"as_default\": true}", nullptr, 5511},
      {kCert, "import", "{\"key_tmp\": \"/k\", \"cert_tmp\": \"/c\"}", nullptr, 5511},
      {kCert, "import", "{\"desc\": \"d\", \"cert_tmp\": \"/c\"}", nullptr, 5511},
      {kCert, "import", import + ", \"id\": 3}", nullptr, 5511},
      {kCert, "import", "{\"desc\": \"d\", \"key_tmp\": \"/k\"}", nullptr, 5510},
      {kCert, "import", "{\"desc\": \"d\", \"key_tmp\": \"/k\", \"cert_tmp\": []}", nullptr, 5510},
      {kCert, "import", import + ", \"inter_cert_tmp\": null}", nullptr, 5512},
      {kCsr, "create", "{" + csr + "}", "handleCSRAction", 0},
      {kCsr, "create", "{\"country\": \"TW\"}", nullptr, 5503},
      {kCsr, "renew", "{\"id\": \"a\"}", "handleRenewAction", 0},
      {kCsr, "renew", "{\"id\": 5}", nullptr, 5503},
      {kCsr, "renew", "{\"id\": \"a\", \"country\": 886}", nullptr, 5503},
      {kCsr, "sign", sign + ", \"csr_tmp\": \"/t\"}", "handleSignCSRAction", 0},
      {kCsr, "sign", "{\"id\": \"a\", \"days\": \"30\", \"csr\": \"c\", \"csr_tmp\": \"/t\"}",
       nullptr, 5503},
      {kCsr, "sign", sign + ", \"csr_tmp\": \"/t\", \"alias\": 1}", nullptr, 5503},
      {kCsr, "sign", sign + "}", nullptr, 5503},
      {kCrt, "create", crt + ", \"desc\": \"\"}", "handleCRTAction", 0},
      {kCrt, "create", crt + ", \"desc\": \"\", \"as_default\": true, \"id\": \"a\"}",
       "handleCRTAction", 0},
      {kCrt, "create", crt + ", \"desc\": \"\", \"as_default\": \"true\"}", nullptr, 5503},
      {kCrt, "create", crt + "}", nullptr, 5503},
      {kCrt, "create", "{" + csr + ", \"desc\": \"\"}", nullptr, 5503},
      {kCrt, "recreate", "{\"id\": \"a\"}", "handleRecreateCRTAction", 0},
      {kCrt, "set", "{\"id\": \"a\", \"desc\": \"\"}", "handleCRTSet", 0},
      {kCrt, "delete", "{\"ids\": [\"a\", \"b\"]}", "handleCRTDelete", 0},
      {kCrt, "delete", "{\"ids\": \"a\"}", nullptr, 5503},
      {kCrt, "list", "{\"id\": 5}", "handleCRTList", 0},
      {kLe, "create", "{\"desc\": \"\", \"domain_name\": \"nas.example\"}", "handleLECreate", 0},
      {kLe, "create", "{\"desc\": \"\", \"domain_name\": \"n\", \"email\": 1}", nullptr, 5503},
      {kLe, "create", "{\"desc\": \"\"}", nullptr, 5503},
      {kLe, "renew", "{\"id\": \"a\"}", "handleLERenew", 0},
      {kLe, "renew", "{\"id\": null}", nullptr, 5503},
      {kAccount, "list", "{}", "handleLEAccountList", 0},
      // Service: the elements of "settings" are the worker's to judge.
      {kService, "set", "{\"settings\": [5, {}]}", "handleServiceSet", 0},
      {kService, "set", "{}", nullptr, 5503},
  };
  const ZEPH_API_TABLE* const table = GetAPITable();
  const ZEPH_API_TABLE* row = table;
  for (const auto& c : kCalls) {
    SCOPED_TRACE(std::string(c.api) + " " + c.method + " " + c.params);
    if (c.api != std::string(row->api) || c.method != std::string(row->method)) ++row;
    ASSERT_NE(row->api, nullptr);
    ASSERT_EQ(std::string(row->api) + " " + row->method, std::string(c.api) + " " + c.method);
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
    if (c.worker != nullptr) {
      EXPECT_EQ(response.outcome(), ZEPH::APIResponse::Outcome::kSuccess);
    } else {
      EXPECT_EQ(response.outcome(), ZEPH::APIResponse::Outcome::kError);
      EXPECT_EQ(response.error_code(), c.code);
      EXPECT_TRUE(response.data().isNull());
    }
  }
  // Fifteen rows, then an all-zero row ends the table.
  EXPECT_EQ(row - table, 14);
  ++row;
  EXPECT_TRUE(!row->api && !row->method && !row->version && !row->handler);
}

}  // namespace
