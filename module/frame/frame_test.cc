#include <gtest/gtest.h>

#include <string>

#include "module/frame/table.h"
#include "zeph/json_file.h"

extern std::string g_called_worker;

namespace {

struct Row {
  const char* api;
  const char* method;
  const char* worker;
};

const Row kRows[] = {
    {"ZEPH.Core.Certificate", "reset", "handleResetAction"},
    {"ZEPH.Core.Certificate", "export", "DownloadAction"},
    {"ZEPH.Core.Certificate", "import", "ProcessJsonReq"},
    {"ZEPH.Core.Certificate.CSR", "create", "handleCSRAction"},
    {"ZEPH.Core.Certificate.CSR", "renew", "handleRenewAction"},
    {"ZEPH.Core.Certificate.CSR", "sign", "handleSignCSRAction"},
    {"ZEPH.Core.Certificate.CRT", "create", "handleCRTAction"},
    {"ZEPH.Core.Certificate.CRT", "recreate", "handleRecreateCRTAction"},
    {"ZEPH.Core.Certificate.CRT", "set", "handleCRTSet"},
    {"ZEPH.Core.Certificate.CRT", "delete", "handleCRTDelete"},
    {"ZEPH.Core.Certificate.CRT", "list", "handleCRTList"},
    {"ZEPH.Core.Certificate.LetsEncrypt", "create", "handleLECreate"},
    {"ZEPH.Core.Certificate.LetsEncrypt", "renew", "handleLERenew"},
    {"ZEPH.Core.Certificate.LetsEncrypt.Account", "list", "handleLEAccountList"},
    {"ZEPH.Core.Certificate.Service", "set", "handleServiceSet"},
};

const ZEPH_API_TABLE* Find(const std::string& api, const std::string& method) {
  for (const ZEPH_API_TABLE* row = GetAPITable(); row->api; ++row) {
    if (api == row->api && method == row->method) return row;
  }
  return nullptr;
}

TEST(MethodTable, FifteenRowsInOrderThenZero) {
  const ZEPH_API_TABLE* table = GetAPITable();
  ASSERT_EQ(table, gTable);
  size_t i = 0;
  for (; table[i].api != nullptr; ++i) {
    ASSERT_LT(i, std::size(kRows));
    EXPECT_STREQ(table[i].api, kRows[i].api) << i;
    EXPECT_STREQ(table[i].method, kRows[i].method) << i;
    EXPECT_EQ(table[i].version, 1);
    EXPECT_NE(table[i].handler, nullptr);
  }
  EXPECT_EQ(i, 15u);
  EXPECT_EQ(table[i].version, 0);
  EXPECT_EQ(table[i].method, nullptr);
  EXPECT_EQ(table[i].handler, nullptr);
}

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
      // Rows without rules take anything.
      {"ZEPH.Core.Certificate", "reset", "{\"x\": 1}", "handleResetAction", 0},
      {"ZEPH.Core.Certificate.CRT", "list", "{\"id\": 5}", "handleCRTList", 0},
      {"ZEPH.Core.Certificate.LetsEncrypt.Account", "list", "{}", "handleLEAccountList", 0},
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
      // LetsEncrypt.
      {"ZEPH.Core.Certificate.LetsEncrypt", "create", "{\"desc\": \"\", \"domain_name\": \"nas.example\"}", "handleLECreate", 0},
      {"ZEPH.Core.Certificate.LetsEncrypt", "create", "{\"desc\": \"\", \"domain_name\": \"n\", \"email\": 1}", nullptr, 5503},
      {"ZEPH.Core.Certificate.LetsEncrypt", "create", "{\"desc\": \"\"}", nullptr, 5503},
      {"ZEPH.Core.Certificate.LetsEncrypt", "renew", "{\"id\": \"a\"}", "handleLERenew", 0},
      {"ZEPH.Core.Certificate.LetsEncrypt", "renew", "{\"id\": null}", nullptr, 5503},
      // Service: the elements of "settings" are the worker's to judge.
      {"ZEPH.Core.Certificate.Service", "set", "{\"settings\": [5, {}]}", "handleServiceSet", 0},
      {"ZEPH.Core.Certificate.Service", "set", "{\"settings\": {}}", nullptr, 5503},
      {"ZEPH.Core.Certificate.Service", "set", "{}", nullptr, 5503},
  };

  for (const auto& c : calls) {
    SCOPED_TRACE(std::string(c.api) + " " + c.method + " " + c.params);
    const ZEPH_API_TABLE* row = Find(c.api, c.method);
    ASSERT_NE(row, nullptr);
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
}

}  // namespace
