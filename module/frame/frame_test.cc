#include <gtest/gtest.h>

#include <string>

#include "module/frame/table.h"
#include "zeph/json_file.h"

extern std::string g_called_worker;

namespace {

// Each call names the row, the parameters, and either the worker that must
// get the request or the error code that must come back instead.
const char kCsrSubject[] =
    "\"country\": \"TW\", \"state\": \"\", \"city\": \"Taipel\", "
    "\"organization\": \"o\", \"department\": \"d\", \"common_name\": \"nas\", "
    "\"email\": \"\"";
const char kCaSubject[] =
    "\"ca_country\": \"TW\", \"ca_state\": \"\", \"ca_city\": \"c\", "
    "\"ca_organization\": \"o\", \"ca_department\": \"d\", "
    "\"ca_common_name\": \"CA\", \"ca_email\": \"\"";

std::string Obj(const std::string& members) { return "{" + members + "}"; }

TEST(Wrappers, CheckRulesBeforeCallingTheirWorker) {
  const std::string csr = kCsrSubject;
  const std::string crt = std::string(kCaSubject) + ", " + kCsrSubject;
  const std::string import_ok =
      "\"desc\": \"d\", \"key_tmp\": \"/k\", \"cert_tmp\": \"/c\"";

  const struct {
    const char* api;
    const char* method;
    std::string params;
    const char* worker;
    int code;
  } calls[] = {
      // Rows without rules (reset, CRT list, account list) take anything.
      {"ZEPH.Core.Certificate", "reset", "{\"x\": 1}", "handleResetAction", 0},
      // Export: "id" only matters for the archive.
      {"ZEPH.Core.Certificate", "export", "{\"file\": \"csr_set\"}", "DownloadAction", 0},
      {"ZEPH.Core.Certificate", "export", "{\"file\": \"archive\"}", nullptr, 5503},
      {"ZEPH.Core.Certificate", "export", "{\"file\": \"archive\", \"id\": \"a\"}", "DownloadAction", 0},
      {"ZEPH.Core.Certificate", "export", "{\"file\": \"archive\", \"id\": 5}", nullptr, 5503},
      {"ZEPH.Core.Certificate", "export", "{\"file\": 1}", nullptr, 5503},
      {"ZEPH.Core.Certificate", "export", "{}", nullptr, 5503},
      // Import: three checks with three codes.
      {"ZEPH.Core.Certificate", "import", Obj(import_ok), "ProcessJsonReq", 0},
      {"ZEPH.Core.Certificate", "import", Obj(import_ok + ", \"inter_cert_tmp\": \"/i\", \"id\": \"a\", \"as_default\": \"true\""), "ProcessJsonReq", 0},
      {"ZEPH.Core.Certificate", "import", Obj(import_ok + ", \"as_default\": true"), nullptr, 5511},
      {"ZEPH.Core.Certificate", "import", "{\"key_tmp\": \"/k\", \"cert_tmp\": \"/c\"}", nullptr, 5511},
      {"ZEPH.Core.Certificate", "import", "{\"desc\": \"d\", \"cert_tmp\": \"/c\"}", nullptr, 5511},
      {"ZEPH.Core.Certificate", "import", Obj(import_ok + ", \"id\": 3"), nullptr, 5511},
      {"ZEPH.Core.Certificate", "import", "{\"desc\": \"d\", \"key_tmp\": \"/k\"}", nullptr, 5510},
      {"ZEPH.Core.Certificate", "import", "{\"desc\": \"d\", \"key_tmp\": \"/k\", \"cert_tmp\": []}", nullptr, 5510},
      {"ZEPH.Core.Certificate", "import", Obj(import_ok + ", \"inter_cert_tmp\": null"), nullptr, 5512},
      // CSR.
      {"ZEPH.Core.Certificate.CSR", "create", Obj(csr), "handleCSRAction", 0},
      {"ZEPH.Core.Certificate.CSR", "create", "{\"country\": \"TW\"}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CSR", "renew", "{\"id\": \"a\"}", "handleRenewAction", 0},
      {"ZEPH.Core.Certificate.CSR", "renew", "{\"id\": 5}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CSR", "renew", "{\"id\": \"a\", \"country\": 886}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CSR", "sign", "{\"id\": \"a\", \"days\": 30, \"csr\": \"c\", \"csr_tmp\": \"/t\"}", "handleSignCSRAction", 0},
      {"ZEPH.Core.Certificate.CSR", "sign", "{\"id\": \"a\", \"days\": \"30\", \"csr\": \"c\", \"csr_tmp\": \"/t\"}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CSR", "sign", "{\"id\": \"a\", \"days\": 30, \"csr\": \"c\", \"csr_tmp\": \"/t\", \"alias\": 1}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CSR", "sign", "{\"id\": \"a\", \"days\": 30, \"csr\": \"c\"}", nullptr, 5503},
      // CRT.
      {"ZEPH.Core.Certificate.CRT", "create", Obj(crt + ", \"desc\": \"\""), "handleCRTAction", 0},
      {"ZEPH.Core.Certificate.CRT", "create", Obj(crt + ", \"desc\": \"\", \"as_default\": true, \"id\": \"a\""), "handleCRTAction", 0},
      {"ZEPH.Core.Certificate.CRT", "create", Obj(crt + ", \"desc\": \"\", \"as_default\": \"true\""), nullptr, 5503},
      {"ZEPH.Core.Certificate.CRT", "create", Obj(crt), nullptr, 5503},
      {"ZEPH.Core.Certificate.CRT", "create", Obj(csr + ", \"desc\": \"\""), nullptr, 5503},
      {"ZEPH.Core.Certificate.CRT", "recreate", "{\"id\": \"a\"}", "handleRecreateCRTAction", 0},
      {"ZEPH.Core.Certificate.CRT", "recreate", "{}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CRT", "set", "{\"id\": \"a\", \"desc\": \"\"}", "handleCRTSet", 0},
      {"ZEPH.Core.Certificate.CRT", "set", "{\"id\": \"a\", \"desc\": \"\", \"as_default\": 1}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CRT", "delete", "{\"ids\": [\"a\", \"b\"]}", "handleCRTDelete", 0},
      {"ZEPH.Core.Certificate.CRT", "delete", "{\"ids\": [\"a\", 2]}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CRT", "delete", "{\"ids\": \"a\"}", nullptr, 5503},
      {"ZEPH.Core.Certificate.CRT", "list", "{\"id\": 5}", "handleCRTList", 0},
      // LetsEncrypt.
      {"ZEPH.Core.Certificate.LetsEncrypt", "create", "{\"desc\": \"\", \"domain_name\": \"nas.example\"}", "handleLECreate", 0},
      {"ZEPH.Core.Certificate.LetsEncrypt", "create", "{\"desc\": \"\", \"domain_name\": \"n\", \"email\": 1}", nullptr, 5503},
      {"ZEPH.Core.Certificate.LetsEncrypt", "create", "{\"desc\": \"\"}", nullptr, 5503},
      {"ZEPH.Core.Certificate.LetsEncrypt", "renew", "{\"id\": \"a\"}", "handleLERenew", 0},
      {"ZEPH.Core.Certificate.LetsEncrypt", "renew", "{\"id\": null}", nullptr, 5503},
      {"ZEPH.Core.Certificate.LetsEncrypt.Account", "list", "{}", "handleLEAccountList", 0},
      // Service: the elements of "settings" are the worker's to judge.
      {"ZEPH.Core.Certificate.Service", "set", "{\"settings\": [5, {}]}", "handleServiceSet", 0},
      {"ZEPH.Core.Certificate.Service", "set", "{\"settings\": {}}", nullptr, 5503},
      {"ZEPH.Core.Certificate.Service", "set", "{}", nullptr, 5503},
  };

  // The calls name the fifteen rows in the table's order, each of version
  // 1 with a handler; a zero row ends the table.
  const ZEPH_API_TABLE* table = GetAPITable();
  ASSERT_EQ(table, gTable);
  const ZEPH_API_TABLE* row = table;
  for (const auto& c : calls) {
    SCOPED_TRACE(std::string(c.api) + " " + c.method + " " + c.params);
    if (c.api != std::string(row->api) || c.method != std::string(row->method)) ++row;
    ASSERT_NE(row->api, nullptr);
    ASSERT_STREQ(row->api, c.api);
    ASSERT_STREQ(row->method, c.method);
    EXPECT_EQ(row->version, 1);
    ASSERT_NE(row->handler, nullptr);
    Json::Value params;
    ASSERT_TRUE(ZEPH::JsonParse(c.params, params));
    ZEPH::APIRequest request(params);
    ZEPH::APIResponse response;
    g_called_worker.clear();
    row->handler(&request, &response);
    EXPECT_EQ(response.outcome_count(), 1);
    if (c.worker != nullptr) {
      EXPECT_EQ(g_called_worker, c.worker);
      EXPECT_EQ(response.outcome(), ZEPH::APIResponse::Outcome::kSuccess);
    } else {
      EXPECT_EQ(g_called_worker, "");
      EXPECT_EQ(response.outcome(), ZEPH::APIResponse::Outcome::kError);
      EXPECT_EQ(response.error_code(), c.code);
      EXPECT_TRUE(response.data().isNull());
    }
  }
  EXPECT_EQ(row - table, 14);
  ++row;
  EXPECT_EQ(row->api, nullptr);
  EXPECT_EQ(row->method, nullptr);
  EXPECT_EQ(row->version, 0);
  EXPECT_EQ(row->handler, nullptr);
}

}  // namespace
