// zephcert end to end with the real module; every form of import via zephcert and upload.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "host/import_preparation.h"
#include "server/webapid_test_support.h"
#include "test_support.h"
#include "tools/zeph_letsencrypt/pebble_test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::CommandResult;
using ZEPH::test::Exists;
using ZEPH::test::kArchive;
using ZEPH::test::kCertApi;
using ZEPH::test::kCrt;
using ZEPH::test::kCsr;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using Names = std::set<std::string>;


// zephcert with `args`, as the user `wrap` switches to; `input` is its standard input.
CommandResult Zephcert(std::vector<std::string> args, const std::string* input = nullptr,
                       const std::vector<std::string>& wrap = {}) {
  args.insert(args.begin(), ZEPH::test::BinDir() + "/zephcert");
  args.insert(args.begin(), wrap.begin(), wrap.end());
  return input ? ZEPH::test::Run(args, *input) : ZEPH::test::Run(args);
}
Json::Value ParseAnswer(const std::string& text) {
  Json::Value answer;
  EXPECT_TRUE(ZEPH::JsonParse(text, answer)) << text;
  return answer;
}
// JSON written with single quotes.
Json::Value Params(std::string text) {
  std::replace(text.begin(), text.end(), '\'', '"');
  return ParseAnswer(text);
}
// init provisions a root and keeps what is there. A call answers one line of JSON (status 1
// for a failure); one zephcert cannot make is refused with status 2, nothing on standard output.
TEST(Zephcert, InitAndCalls) {
  TempRoot root;
  const std::string r = root.Path("/appliance"), archive = r + kArchive;
  const CommandResult init = Zephcert({"init", "--root", r});
  ASSERT_EQ(init.status, 0) << init.err;
  for (const char* d : {"/usr/zeph/etc/ssl", "/usr/zeph/bin", "/usr/zeph/sbin", "/var/log/zeph",
                        "/usr/local/etc/certificate", "/usr/zeph/share/certificate.d",
                        "/usr/libexec/certificate.d", "/tmp"}) EXPECT_TRUE(Exists(r + d)) << d;
  Json::Value services;
  ASSERT_TRUE(ZEPH::JsonFromFile(services, archive + "/SERVICES"));
  ASSERT_EQ(services.size(), 1u) << services;
  EXPECT_EQ(services[0]["subscriber"].asString() + "/" + services[0]["service"].asString() +
            (services[0]["isPkg"].asBool() ? " pkg" : ""), "system/default");
  EXPECT_EQ(ReadFile(r + "/usr/zeph/etc/features.conf"), "support_self_sign_cert=yes\n");
  const std::string id = ReadFile(archive + "/DEFAULT");
  ASSERT_EQ(id.size(), 7u);
  EXPECT_EQ(ReadFile(r + "/usr/zeph/etc/certificate/system/default/cert.pem"),
            ReadFile(archive + "/" + id.substr(0, 6) + "/cert.pem"));
  struct Row {
    std::vector<std::string> args;
    int status;
    int code;
    bool usage = false;  // refused with the usage text, not one "zephcert: " line
  };
  const Row rows[] = {
      {{"--root", r, "call", kCsr, "renew", "{\"id\": 5}"}, 1, 5503},
      {{"--root", r, "call", kCertApi, "import", "{\"desc\": \"d\", \"key_tmp\": \"/k\"}"}, 1, 5510},
      {{"--root", r, "call", "X", "y"}, 2, 0},
      {{"--root", r, "call", "ZEPH.Core.Nothing", "list"}, 2, 0},
      {{"--root", r, "call", kCrt, "nothing"}, 2, 0},
      {{"--root", r, "call", kCrt, "list", "--version", "2"}, 2, 0},
      {{"--root", r, "call", kCrt, "list", "{\"id\":"}, 2, 0},
      {{"--root", r, "call", kCrt, "list", "[1]"}, 2, 0},
      {{"--root", r, "call", kCrt, "list", "--module", root.Path("/missing.so")}, 2, 0},
      {{"--root", root.Path("/missing"), "call", kCrt, "list"}, 2, 0},
      {{"--root", archive + "/DEFAULT/sub", "init"}, 2, 0},
      {{"call", kCrt}, 2, 0, true},
      {{"--bogus"}, 2, 0, true},
      {{}, 2, 0, true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::PrintToString(row.args));
    const CommandResult result = Zephcert(row.args);
    EXPECT_EQ(result.status, row.status);
    if (row.status == 2) {
      EXPECT_EQ(result.out, "");
      EXPECT_FALSE(result.err.empty());
      EXPECT_TRUE(row.usage || (result.err.find('\n') == result.err.size() - 1 &&
                                result.err.rfind("zephcert: ", 0) == 0)) << result.err;
      continue;
    }
    EXPECT_EQ(result.out.find('\n'), result.out.size() - 1);
    const Json::Value answer = ParseAnswer(result.out);
    EXPECT_FALSE(answer["success"].asBool());
    EXPECT_EQ(answer["error"]["code"].asInt(), row.code);
    EXPECT_TRUE(answer["error"].isMember("data") && answer["error"]["data"].isNull()) << answer;
  }
  EXPECT_FALSE(Exists(root.Path("/missing")));
  ZEPH::test::WriteFile(archive + "/SERVICES", "[]\n");
  ZEPH::test::WriteFile(archive + "/INFO", "{}\n");
  ASSERT_EQ(Zephcert({"--root", r, "init"}).status, 0);
  EXPECT_EQ(ReadFile(archive + "/SERVICES"), "[]\n");
  EXPECT_EQ(ReadFile(archive + "/INFO"), "{}\n");
}
// Key material: a root, two intermediates, a leaf for up.example and every form of them.
// Arguments: the directory and this host's name. "issue NAME ISSUER EXT DAYS [KEY]" makes
// NAME.pem for a new key NAME.key (or KEY).
const char kMaterial[] = R"(cd "$1"; host=$2 o=/usr/bin/openssl p=pass:s3cret
printf 'basicConstraints=critical,CA:TRUE\nkeyUsage=keyCertSign,cRLSign\n' > ca.ext
echo subjectAltName=DNS:up.example > leaf.ext; echo "subjectAltName=DNS:$host" > host.ext
key() { $o genpkey -algorithm EC -pkeyopt ec_paramgen_curve:P-256 -out "$1"; }
issue() { k=${5:-$1.key}; [ -n "$5" ] || key "$k"; $o req -new -key "$k" -out $1.csr -subj /CN=$1
  $o x509 -req -in "$1.csr" -CA "$2.pem" -CAkey "$2.key" -CAcreateserial -days "$4" \
    -extfile "$3" -out "$1.pem"; }
ca() { key "$1.key"; $o req -x509 -key "$1.key" -out "$1.pem" -days 30 -subj "/CN=$2" \
  -addext basicConstraints=critical,CA:TRUE -addext keyUsage=keyCertSign,cRLSign; }
ca root Root; ca other 'Other Root'
issue inter1 root ca.ext 30; issue inter2 inter1 ca.ext 30; issue leaf inter2 leaf.ext 30
issue expired inter2 leaf.ext -1 leaf.key; issue host inter2 host.ext 30 leaf.key
issue stray other ca.ext 30
$o req -new -key leaf.key -out leaf.csr -subj /CN=up.example
cat inter2.pem inter1.pem > chain.pem; cat leaf.pem chain.pem > fullchain.pem
cat inter1.pem inter2.pem > reversed.pem; cat leaf.key leaf.pem > combined.pem
{ printf '\357\273\277'; cat chain.pem; } > bom.pem; sed 's/$/\r/' leaf.pem > crlf.pem; : > empty
$o x509 -in leaf.pem -outform DER -out leaf.der; $o x509 -in leaf.pem -trustout -out trusted.pem
$o crl2pkcs7 -nocrl -certfile fullchain.pem -out full.p7b
$o crl2pkcs7 -nocrl -certfile fullchain.pem -outform DER -out full.p7b.der
$o pkey -in leaf.key -outform DER -out leaf.key.der
$o pkcs8 -topk8 -in leaf.key -v2 aes-256-cbc -passout $p -out leaf.key.p8
$o ec -in leaf.key -aes256 -passout $p -out leaf.key.trad
$o pkcs12 -export -inkey leaf.key -in leaf.pem -certfile chain.pem -passout $p -out full.p12
$o pkcs12 -export -legacy -inkey leaf.key -in leaf.pem -certfile chain.pem -passout $p \
  -out legacy.p12
$o dsaparam -genkey -out dsa.key 1024
{ printf '\357\273\277'; cat leaf.pem; } > bomleaf.pem; chmod a+r *; chmod 444 bomleaf.pem)";

struct Case {
  const char* files;      // "parameter=material ..."
  bool passphrase;
  int code;               // 0: imported
  const char* reason;     // a refusal's, or an import's warning besides "host_name_not_covered"
  const char* fullchain;  // the common names of an import's fullchain.pem
};
// How a test reaches the module: zephcert as the tests' user, as an ordinary user owning the
// root (a developer trying the product out), or the server.
enum class Via { kZephcert, kOrdinaryUser, kServer };

std::string ViaName(const ::testing::TestParamInfo<Via>& p) {
  return std::vector<std::string>{"Zephcert", "OrdinaryUser", "Server"}[static_cast<int>(p.param)];
}
class ZephcertWorkflow : public ::testing::TestWithParam<Via> {
 protected:
  static void SetUpTestSuite() {
    material_root_ = new TempRoot;
    const CommandResult r = ZEPH::test::Run(
        {"/bin/sh", "-ec", kMaterial, "sh", material_root_->dir(), ZEPH::ApplianceHostName()});
    ASSERT_EQ(r.status, 0) << r.err;
  }
  static void TearDownTestSuite() { delete material_root_; }
  static std::string Material(const std::string& name) { return material_root_->Path("/" + name); }
  void SetUp() override {
    if (GetParam() == Via::kServer) {
      server_ = std::make_unique<ZEPH::test::ServerProcess>(root_.dir());
      ASSERT_TRUE(server_->listening()) << server_->Log();
      return;
    }
    if (GetParam() == Via::kOrdinaryUser && geteuid() == 0) {
      ASSERT_EQ(ZEPH::test::Run({"/bin/chown", "-R", "nobody:nogroup", root_.dir()}).status, 0);
      wrap_ = {"/usr/bin/setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups"};
    }
    ASSERT_EQ(Run({"init"}).status, 0);
  }
  CommandResult Run(std::vector<std::string> args, const std::string* input = nullptr) {
    args.insert(args.begin(), {"--root", root_.dir()});
    return Zephcert(args, input, wrap_);
  }
  // zephcert's answer, its exit status checked against it.
  static Json::Value Answer(const CommandResult& r) {
    Json::Value answer = ParseAnswer(r.out);
    EXPECT_EQ(r.status, answer["success"].asBool() ? 0 : 1) << r.out << r.err;
    return answer;
  }
  // Calls a method; with `secret`, the parameters go in on standard input.
  Json::Value Call(const std::string& api, const std::string& method, const Json::Value& params,
                   const std::string& output = "", bool secret = false) {
    const std::string text = ZEPH::JsonCompact(params);
    std::vector<std::string> args = {"call", api, method, secret ? "-" : text};
    if (!output.empty()) args.insert(args.end(), {"--output", output});
    return Answer(Run(args, secret ? &text : nullptr));
  }
  Json::Value Ok(const std::string& api, const std::string& method, const Json::Value& params) {
    Json::Value answer = Call(api, method, params);
    EXPECT_TRUE(answer["success"].asBool()) << api << " " << method << ": " << answer;
    return answer;
  }
  // The entry of certificate `id` in "CRT list"; null when it is not listed.
  Json::Value Listed(const std::string& id) {
    const Json::Value list = Ok(kCrt, "list", Json::objectValue);
    for (const Json::Value& c : list["data"]["certificates"]) {
      if (c["id"].asString() == id) return c;
    }
    return Json::nullValue;
  }
  // The member names of the export of `params`.
  Names Exported(const std::string& params) {
    const std::string zip = root_.Path("/export.zip");
    unlink(zip.c_str());
    const Json::Value answer = Call(kCertApi, "export", Params(params), zip);
    EXPECT_EQ(answer["download"]["bytes"].asUInt64(), ReadFile(zip).size());
    return ZEPH::test::ZipMembers(zip);
  }
  Json::Value Import(const Case& c) {
    Json::Value params = Params("{'desc': 'imported'}");
    if (c.passphrase) params["passphrase"] = "s3cret";
    const std::string params_file = root_.Path("/params.json");
    std::vector<std::string> form = {"-F", "params=<" + params_file + ";type=application/json"};
    std::istringstream files(c.files);
    for (std::string file; files >> file;) {
      const size_t eq = file.find('=');
      const std::string name = file.substr(0, eq), path = Material(file.substr(eq + 1));
      if (server_) form.insert(form.end(), {"-F", name + "=@" + path});
      if (!server_) params[name + "_tmp"] = path;
    }
    if (!server_) return Call(kCertApi, "import", params);
    ZEPH::test::WriteFile(params_file, ZEPH::JsonCompact(params));
    const ZEPH::test::CurlReply r = ZEPH::test::Curl(
        server_->port(), "/api/ZEPH.Core.Certificate/1/import", form, server_->Token(),
        root_.dir());
    EXPECT_EQ(r.status, 200) << r.error;
    return ParseAnswer(r.body);
  }
  static TempRoot* material_root_;
  TempRoot root_;
  std::vector<std::string> wrap_;
  std::unique_ptr<ZEPH::test::ServerProcess> server_;
};
TempRoot* ZephcertWorkflow::material_root_ = nullptr;
std::string Subject(const std::string& cn) {
  return "'country': 'TW', 'state': '', 'city': 'Taipel', 'organization': 'Zeph', "
         "'department': '', 'email': '', 'common_name': '" + cn + "'";
}
// "CRT create" of `cn` by a new authority `ca`, with the members `extra`.
Json::Value CreateParams(const std::string& cn, const std::string& ca, const std::string& extra) {
  return Params("{" + Subject(cn) + ", 'ca_country': 'TW', 'ca_state': '', 'ca_city': '', "
                "'ca_organization': 'Zeph', 'ca_department': '', 'ca_common_name': '" + ca +
                "', 'ca_email': '', " + extra + "}");
}
// Every method, in the order an administrator meets them, products checked where they land.
TEST_P(ZephcertWorkflow, EveryMethodEndToEnd) {
  const std::string archive = root_.Path(kArchive);
  const std::string id = Ok(kCrt, "create", CreateParams("cli.example", "cli CA",
      "'desc': 'from the shell', 'as_default': true, 'key_length': 1024, "
      "'ca_key_length': 1024"))["data"]["id"].asString();
  ASSERT_EQ(id.size(), 6u);
  const std::string ec_id = Ok(kCrt, "create", CreateParams("ec.example", "ec CA",
      "'desc': 'ec', 'key_type': 'ec384', 'ca_key_type': 'ec256'"))["data"]["id"].asString();
  const std::string p12 = root_.Path("/ec.p12");
  Call(kCertApi, "export", Params("{'file': 'archive', 'id': '" + ec_id +
       "', 'format': 'pkcs12', 'passphrase': 's3cret', 'legacy': true}"), p12, true);
  EXPECT_EQ(ZEPH::test::Run({"/usr/bin/openssl", "pkcs12", "-info", "-noout", "-in", p12,
                             "-passin", "pass:s3cret"}).status, 0);
  const Json::Value cli = Listed(id);
  EXPECT_TRUE(cli["is_default"].asBool() && !cli["is_ecc"].asBool()) << cli;
  EXPECT_TRUE(Listed(ec_id)["is_ecc"].asBool());
  Json::Value services, settings;
  ASSERT_TRUE(ZEPH::JsonFromFile(services, archive + "/SERVICES"));
  settings["settings"][0] = Params("{'id': '" + id + "', 'old_id': ''}");
  settings["settings"][0]["service"] = services[0];
  const Json::Value a = Ok("ZEPH.Core.Certificate.Service", "set", settings);
  EXPECT_TRUE(a["data"]["restart_httpd"].asBool() && a["httpd_restart"].asBool()) << a;
  EXPECT_EQ(ReadFile(root_.Path("/usr/zeph/etc/certificate/system/default/fullchain.pem")),
            ReadFile(archive + "/" + id + "/fullchain.pem"));
  Ok(kCrt, "set", Params("{'id': '" + id + "', 'desc': 'renamed'}"));
  Ok(kCsr, "create", Params("{" + Subject("req.example") + ", 'key_length': 1024}"));
  Ok(kCsr, "renew", Params("{'id': '" + id + "'}"));
  EXPECT_EQ(Exported("{'file': 'csr_set'}"), (Names{"server.csr", "server.key"}));
  // The module strips the byte-order mark of its private copy, never of the caller's file.
  const std::string cert = ReadFile(Material("bomleaf.pem"));
  Ok(kCsr, "sign", Params("{'id': '" + id + "', 'days': 30, 'csr': 'leaf.csr', 'csr_tmp': '" +
                          Material("leaf.csr") + "', 'alias': 'up.example'}"));
  EXPECT_EQ(Exported("{'file': 'signed_set'}"), Names{"server.crt"});
  const std::string imported = Ok(kCertApi, "import", Params("{'desc': 'imported', 'key_tmp': '" +
      Material("leaf.key") + "', 'cert_tmp': '" + Material("bomleaf.pem") +
      "', 'inter_cert_tmp': '" + Material("root.pem") + "'}"))["data"]["id"].asString();
  EXPECT_EQ(ReadFile(Material("bomleaf.pem")), cert);
  EXPECT_EQ(Exported("{'file': 'archive', 'id': '" + imported + "'}"),
            (Names{"privkey.pem", "cert.pem"}));
  EXPECT_EQ("\xEF\xBB\xBF" + ReadFile(archive + "/" + imported + "/cert.pem"), cert);
  EXPECT_TRUE(Ok(kCrt, "recreate", Params("{'id': '" + id + "'}"))["data"]["restart_httpd"]
                  .asBool());
  Ok(kCrt, "delete", Params("{'ids': ['" + imported + "']}"));
  EXPECT_FALSE(Exists(archive + "/" + imported));
  Ok(kCertApi, "reset", Json::objectValue);
  for (const std::string& name : ZEPH::test::DirEntries(root_.Path("/tmp"))) {
    EXPECT_EQ(name.find("zephcert-upload"), std::string::npos) << name;
  }
}
// The Let's Encrypt settings, secrets in on standard input and never out; then one
// certificate for a name and a wildcard from pebble (DNS-01, external account binding).
TEST_P(ZephcertWorkflow, LetsEncryptSettingsAndSeveralNamesAgainstPebble) {
  if (!ZEPH::test::LegoInstalled() || !ZEPH::test::PebbleInstalled() ||
      !ZEPH::test::ChallengeServerInstalled()) {
    GTEST_SKIP() << "lego, pebble or pebble-challtestsrv is not installed";
  }
  const std::string dir = root_.Path("/pebble");
  ZEPH::test::MakeDirs(dir);
  ZEPH::test::ChallengeServer challenges(dir);
  std::string error;
  ASSERT_TRUE(challenges.Start(&error)) << error;
  ZEPH::test::PebbleOptions options;
  options.dns_server = challenges.DnsAddress();
  options.require_eab = true;
  ZEPH::test::Pebble pebble(dir, options);
  ASSERT_TRUE(pebble.Start(&error)) << error;
  ZEPH::test::Run({"/bin/chmod", "-R", "a+rX", dir});  // for the ordinary user
  // Changes the settings by `update`; null reads them.
  auto settings = [this](const Json::Value& update) {
    const std::string text = ZEPH::JsonCompact(update);
    return Answer(update.isNull() ? Run({"letsencrypt-settings"})
                                  : Run({"letsencrypt-settings", "-"}, &text));
  };
  Json::Value update = challenges.ToolSettings();
  update["directory_url"] = pebble.DirectoryUrl();
  update["ca_bundle_pem"] = ReadFile(pebble.ca_file());
  update["eab_kid"] = ZEPH::test::kEabKid;
  update["eab_hmac_key"] = ZEPH::test::kEabHmacKey;
  update["timeout_s"] = 90;
  Json::Value a = settings(update);
  ASSERT_TRUE(a["success"].asBool()) << a;
  const std::string config = root_.Path("/usr/zeph/etc/letsencrypt/config.json");
  EXPECT_EQ(ZEPH::test::ModeOf(config), 0600u);
  const std::string saved = ReadFile(config);
  a = settings(Params("{'eab_kid': ''}"));
  EXPECT_EQ(a["error"]["setting"].asString(), "eab_kid") << a;
  EXPECT_EQ(ReadFile(config), saved);
  a = settings(Json::nullValue);
  EXPECT_EQ(a["data"]["dns_provider"].asString(), "exec");
  for (const std::string& secret : {std::string(ZEPH::test::kEabHmacKey), challenges.hook()}) {
    EXPECT_EQ(ZEPH::JsonCompact(a).find(secret), std::string::npos) << secret;
  }
  const std::string le = "ZEPH.Core.Certificate.LetsEncrypt";
  const std::string id = Ok(le, "create", Params("{'desc': 'le', 'domain_name': "
      "'nas.zeph.test,*.zeph.test', 'email': 'admin@zeph.test'}"))["data"]["id"].asString();
  const char names[] = "[\"nas.zeph.test\",\"*.zeph.test\"]";
  EXPECT_EQ(ZEPH::JsonCompact(Listed(id)["sub_alt_name"]), names);
  Ok(le, "renew", Params("{'id': '" + id + "'}"));
  EXPECT_EQ(ZEPH::JsonCompact(Listed(id)["sub_alt_name"]), names);
}

INSTANTIATE_TEST_SUITE_P(Users, ZephcertWorkflow,
                         ::testing::Values(Via::kZephcert, Via::kOrdinaryUser), ViaName);
const Case kCases[] = {
    {"key=leaf.key cert=leaf.pem inter_cert=fullchain.pem", false, 0, "", "leaf inter2 inter1"},
    {"key=leaf.key cert=leaf.der", false, 0, "", "leaf"},
    {"key=leaf.key cert=full.p7b", false, 0, "", "leaf inter2 inter1"},
    {"key=leaf.key cert=full.p7b.der", false, 0, "", "leaf inter2 inter1"},
    {"key=leaf.key cert=trusted.pem", false, 0, "", "leaf"},
    {"key=leaf.key cert=crlf.pem", false, 0, "", "leaf"},
    {"key=leaf.key cert=leaf.csr", false, 5510, "request", ""},
    {"key=leaf.key cert=empty", false, 5510, "empty_file", ""},
    {"key=leaf.key cert=leaf.key", false, 5510, "key_not_certificate", ""},
    {"key=leaf.pem cert=leaf.pem", false, 5511, "certificate_not_key", ""},
    {"pkcs12=full.p12", true, 0, "", "leaf inter2 inter1"},
    {"pkcs12=legacy.p12", true, 0, "", "leaf inter2 inter1"},
    {"cert=full.p12", true, 0, "", "leaf inter2 inter1"},
    {"pkcs12=full.p12", false, 5510, "passphrase_required", ""},
    {"key=leaf.key.p8 cert=leaf.pem", true, 0, "", "leaf"},
    {"key=leaf.key.trad cert=leaf.pem", true, 0, "", "leaf"},
    {"key=leaf.key.p8 cert=leaf.pem", false, 5511, "key_encrypted", ""},
    {"key=leaf.key.der cert=leaf.pem", false, 0, "", "leaf"},
    {"cert=combined.pem", false, 0, "", "leaf"},
    {"key=leaf.key cert=combined.pem inter_cert=chain.pem", false, 0, "", "leaf inter2 inter1"},
    {"key=leaf.key cert=leaf.pem inter_cert=reversed.pem", false, 0, "", "leaf inter2 inter1"},
    {"key=leaf.key cert=fullchain.pem inter_cert=chain.pem", false, 0, "", "leaf inter2 inter1"},
    {"key=leaf.key cert=leaf.pem inter_cert=bom.pem", false, 0, "", "leaf inter2 inter1"},
    {"key=leaf.key cert=leaf.pem inter_cert=root.pem", false, 0, "", "leaf"},
    {"key=leaf.key cert=expired.pem", false, 0, "expired", "expired"},
    {"key=leaf.key cert=host.pem", false, 0, "", "host"},
    {"key=leaf.key cert=leaf.pem inter_cert=stray.pem", false, 5517, "chain_broken", ""},
    {"key=dsa.key cert=leaf.pem", false, 5518, "dsa_key", ""},
    {"key=other.key cert=leaf.pem", false, 5514, "key_mismatch", ""},
};
// The common names of the certificates of a PEM file, in order, separated by spaces.
std::string CommonNames(const std::string& pem_file) {
  return ZEPH::test::Run({"/bin/sh", "-c",
      "/usr/bin/openssl crl2pkcs7 -nocrl -certfile '" + pem_file + "' | /usr/bin/openssl "
      "pkcs7 -print_certs -noout | sed -n 's/^subject=CN = //p' | paste -sd' '"}).out;
}
// The two hosts that prepare an import: zephcert and the server.
class ImportUpload : public ZephcertWorkflow {};
// Every form is imported as a plain set (the certificate, its intermediates in order, no
// private key in any certificate file) or refused with a reason.
TEST_P(ImportUpload, EveryFormIsImportedPlainOrRefusedWithItsReason) {
  for (const Case& c : kCases) {
    SCOPED_TRACE(c.files);
    const Json::Value answer = Import(c);
    if (c.code != 0) {
      EXPECT_EQ(answer["error"]["code"].asInt(), c.code) << answer;
      EXPECT_EQ(answer["error"]["data"]["reason"].asString(), c.reason) << answer;
      EXPECT_FALSE(answer["error"]["data"]["message"].asString().empty());
      continue;
    }
    ASSERT_TRUE(answer["success"].asBool()) << answer;
    const std::string dir = root_.Path(kArchive) + "/" + answer["data"]["id"].asString();
    Names warned, expected_warnings;
    for (const Json::Value& w : answer["data"]["warnings"]) warned.insert(w["reason"].asString());
    if (std::string(c.fullchain) != "host") expected_warnings.insert("host_name_not_covered");
    if (*c.reason != '\0') expected_warnings.insert(c.reason);
    EXPECT_EQ(warned, expected_warnings) << answer;
    EXPECT_EQ(CommonNames(dir + "/fullchain.pem"), std::string(c.fullchain) + "\n");
    for (const char* file : {"cert.pem", "fullchain.pem", "chain.pem"}) {
      EXPECT_EQ(ReadFile(dir + "/" + file).find("PRIVATE KEY"), std::string::npos) << file;
    }
    EXPECT_EQ(Exists(dir + "/chain.pem"), std::string(c.fullchain).find(' ') != std::string::npos);
  }
}
INSTANTIATE_TEST_SUITE_P(Hosts, ImportUpload, ::testing::Values(Via::kZephcert, Via::kServer),
                         ViaName);

}  // namespace
