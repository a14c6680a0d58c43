// zeph-letsencrypt: lego's failures classified, its directory operations, and the tool as the
// module runs it in a provisioned root, with lego against a real pebble on 127.0.0.1 only.
#include <errno.h>
#include <gtest/gtest.h>
#include <openssl/pem.h>
#include <unistd.h>

#include <algorithm>
#include <map>

#include "module/common/ssl_ptr.h"
#include "module/methods/methods_test_support.h"
#include "pebble_test_support.h"
#include "tools/zeph_letsencrypt/classify.h"
#include "tools/zeph_letsencrypt/files.h"
#include "tools/zeph_letsencrypt/renew_due.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_lock.h"
#include "zeph/root.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

using End = LegoRun::End;
using test::Exists;
using test::ReadFile;
using test::WriteFile;

// `lines` as lego prints them, the first `stamped` with the date and time.
std::string Lines(std::initializer_list<std::string> lines, size_t stamped = 1) {
  std::string out;
  size_t n = 0;
  for (const std::string& l : lines)
    out += (n++ < stamped ? "2026/11/21 23:38:50 " : "") + l + "\n";
  return out;
}

std::string Problem(const std::string& type, const std::string& detail) {
  return "\tacme: error: 400 :: POST :: https://127.0.0.1:14000/x :: urn:ietf:params:acme:error:" +
         type + " :: " + detail;
}

TEST(ClassifyLegoRun, MapsLegosFailuresOntoTheToolsNumbersAndMessages) {
  constexpr Operation kGet = Operation::kObtain, kRevoke = Operation::kRevoke;
  const std::string obtain = "Could not obtain certificates:";
  const std::string info = "[INFO] [a.example] acme: Obtaining bundled SAN certificate";
  const std::string domains = "\terror: one or more domains had a problem:";
  const std::string revoke = "Error while revoking the certificate for domain a.example";
  const std::string client = "Could not create client: get directory at 'https://127.0.0.1:";
  const std::string token = "[t.example.com] [t.example.com] acme: error presenting token: could "
                            "not start HTTP server for challenge: listen tcp 127.0.0.1:5002: "
                            "bind: address already in use";
  const std::string already = Problem("alreadyRevoked", "Certificate has already been revoked.");
  struct Row {
    std::string output;
    Operation operation;
    int error;
    std::string part = "";   // of the message, which is never empty
    std::string exact = "";  // the whole message, "" for any
    End end = End::kExited;
    int status = 1;  // the exit status or signal; for kNotStarted the errno
  };
  const Row kRows[] = {
      {Lines({info, obtain, Problem("rateLimited", "too many")}, 2), kGet, kRateLimited},
      {Lines({obtain, Problem("malformed", "DNS identifier with a value containing '_'")}), kGet,
       kInvalidDomain},
      {Lines({obtain, Problem("rejectedIdentifier", "Cannot issue")}), kGet, kInvalidDomain},
      {Lines({"Could not complete registration", Problem("x", "bad")}), kGet, kAccountRefused},
      {Lines({obtain, Problem("invalidContact", "bad")}), kGet, kAccountRefused},
      {Lines({info, obtain, domains, Problem("connection", "connection refused")}, 2), kGet,
       kChallengeFailed},
      {Lines({"No key found for account a@b.example.",
              "[INFO] acme: Registering account for a@b.example", obtain, domains, token, ""}, 3),
       kGet, kChallengeFailed, "", obtain + " " + domains.substr(1) + " " + token},
      {Lines({client + "14999/dir': x509: certificate signed by unknown authority"}), kGet,
       kUnreachable},
      {Lines({client + "14999/nodir': 404 ::GET :: https://127.0.0.1:14999/nodir :: invalid "
                       "character 'p' after top-level value :: 404 page not found"}),
       kGet, kUnreachable},
      {Lines({obtain, Problem("serverInternal", "something broke")}), kGet, kAcmeFailed},
      {Lines({"panic: error reading LEGO_CA_CERTIFICATES=\"/nonexist\": open /nonexist: "
              "no such file or directory", "", "goroutine 1 [running]:"}, 0),
       kGet, kInternal},
      {Lines({"[INFO] one", "[INFO] two"}, 2), kGet, kAcmeFailed, "", "[INFO] two"},
      {"plain words\n", kGet, kAcmeFailed, "", "plain words"},
      {std::string(3000, 'x'), kGet, kAcmeFailed, "", std::string(1000, 'x')},
      {Lines({revoke, Problem("unauthorized", "not yours")}), kRevoke, kRevokeFailed},
      {Lines({client + "1/dir': dial tcp 127.0.0.1:1: connect: connection refused"}), kRevoke,
       kUnreachable},
      {Lines({"Trying to revoke certificate for domain a.example", revoke, already}, 2), kRevoke,
       kRevokeFailed, "", revoke + " " + already.substr(1)},
      {"", kGet, kInternal, "No such file", "", End::kNotStarted, ENOENT},
      {"", kRevoke, kTimedOut, "7 s", "", End::kTimedOut, 0},
      {"", kGet, kInternal, "", "", End::kSignaled, 9},
      {"", kGet, kAcmeFailed, "", "lego failed with status 3", End::kExited, 3},
      {"[INFO] fine\n", kGet, kOk, "", "", End::kExited, 0},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.output);
    LegoRun run;
    run.end = row.end;
    (row.end == End::kNotStarted ? run.start_errno : run.status) = row.status;
    run.output = row.output;
    const Outcome o = ClassifyLegoRun(run, row.operation, 7);
    EXPECT_EQ(o.error, row.error);
    EXPECT_EQ(o.msg.empty(), row.error == kOk) << o.msg;
    EXPECT_NE(o.msg.find(row.part), std::string::npos) << o.msg;
    EXPECT_TRUE(row.exact.empty() || o.msg == row.exact) << o.msg;
  }
}

TEST(Files, ExchangeRemoveAndWriteWhole) {
  test::TempRoot root;
  const std::string target = root.Path("/set"), staging = root.Path("/.set.renew");
  ASSERT_TRUE(MakeDir(target, 0700) && MakeDir(staging, 0700));
  WriteFile(target + "/cert.pem", "old", 0400);
  WriteFile(target + "/only-old", "x", 0400);
  WriteFile(staging + "/cert.pem", "new", 0400);
  ASSERT_TRUE(ExchangeDirs(staging, target));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "new");
  EXPECT_FALSE(Exists(target + "/only-old"));
  EXPECT_EQ(ReadFile(staging + "/cert.pem"), "old");
  ASSERT_TRUE(MakeDir(staging + "/certificates", 0700));
  ASSERT_EQ(symlink(target.c_str(), (staging + "/certificates/accounts").c_str()), 0);
  ASSERT_TRUE(RemoveTree(staging));
  EXPECT_FALSE(Exists(staging));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "new");
  EXPECT_TRUE(RemoveTree(staging));
  EXPECT_FALSE(ExchangeDirs(staging, target));
  EXPECT_FALSE(MakeDir(target + "/cert.pem", 0700));
  ASSERT_TRUE(WriteWhole(target + "/cert.pem", "newer", 0600));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "newer");
  EXPECT_EQ(test::ModeOf(target + "/cert.pem"), 0600u);
  EXPECT_FALSE(WriteWhole(root.Path("/missing/dir/file"), "x", 0600));
}

}  // namespace
}  // namespace letsencrypt

namespace test {
namespace {

using letsencrypt::CheckExpiry;
using letsencrypt::Expiry;
using ::testing::PrintToString;

const char kDomain[] = "nas.zeph.test";
const char kEmail[] = "admin@zeph.test";
const std::string kEtc = "/usr/zeph/etc/letsencrypt";
const std::vector<std::string> kSetFiles = {"cert.pem", "chain.pem", "fullchain.pem",
                                            "privkey.pem", "renew.json"};
const std::vector<std::string> kNone;
const Json::Value kEmpty(Json::arrayValue);

struct ToolAnswer {
  std::string out, err;
  Json::Value answer;  // the JSON object of `out`
  int error() const { return answer["error"].asInt(); }
  std::string msg() const { return answer["msg"].asString(); }
};

// Runs `program` (default: the built tool) and checks that it answers one line holding one
// JSON object with an integer "error", a string "msg" unless it is 0, and a status to match.
ToolAnswer RunTool(const std::vector<std::string>& args, const std::string& program = "") {
  std::vector<std::string> argv{program.empty() ? BinDir() + "/zeph-letsencrypt" : program};
  argv.insert(argv.end(), args.begin(), args.end());
  const CommandResult r = Run(argv);
  ToolAnswer a{r.out, r.err, Json::Value()};
  EXPECT_TRUE(!r.out.empty() && r.out.find('\n') == r.out.size() - 1) << r.out;
  if (!JsonParse(r.out, a.answer) || !a.answer.isObject() || !a.answer["error"].isInt()) {
    ADD_FAILURE() << "no answer object: " << r.out;
    JsonParse("{\"error\": -1}", a.answer);
  }
  const bool ok = a.error() == 0;
  EXPECT_EQ(a.answer.isMember("msg"), !ok) << r.out;
  EXPECT_TRUE(ok || a.answer["msg"].isString()) << r.out;
  EXPECT_EQ(r.status, ok ? 0 : 1) << r.out;
  return a;
}

void WriteToolConfig(const Json::Value& config) {
  MakeDirs(RootPath(kEtc));
  WriteFile(RootPath(kEtc + "/config.json"),
            config.isString() ? config.asString() : JsonCompact(config), 0600);
}

std::vector<std::string> NewCert(const std::string& domain, const std::string& id = "Ab12Cd.temp",
                                 const std::string& email = kEmail) {
  return {"new-cert", "-d", domain, "-m", email, "-c", id};
}

::testing::AssertionResult Failed(const ToolAnswer& a, int error, const std::string& part = "") {
  if (a.error() == error && a.msg().find(part) != std::string::npos)
    return ::testing::AssertionSuccess();
  return ::testing::AssertionFailure() << "error " << a.error() << " \"" << a.msg()
                                       << "\", expected " << error << " with \"" << part << "\"";
}

std::map<std::string, std::string> Snapshot(const std::string& dir) {
  std::map<std::string, std::string> files;
  for (const std::string& name : DirEntries(dir)) files[name] = ReadFile(dir + "/" + name);
  return files;
}

Json::Value ClosedServerConfig() {
  Json::Value c;
  c["directory_url"] = "https://127.0.0.1:" + std::to_string(FreePort()) + "/dir";
  c["http_address"] = "127.0.0.1:" + std::to_string(FreePort());
  return c;
}

// The serial number as openssl prints it, and the tool writes it into renew.json.
std::string Serial(const std::string& path) {
  const CommandResult r = Run({"/usr/bin/openssl", "x509", "-noout", "-serial", "-in", path});
  return r.status == 0 && r.out.size() > 8 ? r.out.substr(7, r.out.size() - 8) : "";
}

// The set for kDomain as the tool leaves it in `dir`: files, modes, chain, name and key.
void ExpectIssuedSet(const std::string& dir) {
  ASSERT_EQ(DirEntries(dir), kSetFiles);
  for (const std::string& file : kSetFiles)
    EXPECT_EQ(ModeOf(dir + "/" + file), file == "renew.json" ? 0600u : 0400u) << file;
  const auto set = Snapshot(dir);
  EXPECT_EQ(set.at("fullchain.pem"), set.at("cert.pem") + set.at("chain.pem"));
  EXPECT_TRUE(IssuedBy(set.at("cert.pem"), set.at("chain.pem")));
  EXPECT_NE(Run({"/usr/bin/openssl", "x509", "-noout", "-in", dir + "/cert.pem", "-checkhost",
                 kDomain}).out.find(" does match"), std::string::npos);
  EXPECT_TRUE(CertificateFitsKey(set.at("cert.pem"), set.at("privkey.pem")));
  EXPECT_EQ(KeyBits(set.at("privkey.pem")), 2048);  // the default key type, rsa2048
}

// renew-due of `program` (default: the built tool), through env with `env` if any.
ToolAnswer RenewDue(const std::vector<std::string>& options = {},
                    const std::vector<std::string>& env = {}, const std::string& program = "") {
  std::vector<std::string> args = env;
  if (!env.empty()) args.push_back(program.empty() ? BinDir() + "/zeph-letsencrypt" : program);
  args.push_back("renew-due");
  args.insert(args.end(), options.begin(), options.end());
  return RunTool(args, env.empty() ? program : "/usr/bin/env");
}

std::vector<std::string> Strings(const Json::Value& array) {
  std::vector<std::string> out;
  for (const Json::Value& v : array) out.push_back(v.asString());
  return out;
}

void ExpectRenewDue(const ToolAnswer& a, int error, const std::vector<std::string>& renewed,
                    const Json::Value& failed, int skipped) {
  EXPECT_EQ(a.error(), error) << a.msg() << "\n" << a.err;
  EXPECT_EQ(Strings(a.answer["renewed"]), renewed);
  EXPECT_EQ(a.answer["failed"], failed);
  EXPECT_EQ(a.answer["skipped"].asInt(), skipped);
}

// A self-signed certificate.pem for `cn` in `dir`, valid for `days` and a half from now.
void MakeCertificate(const std::string& dir, int days, const std::string& cn) {
  MakeDirs(dir);
  ssl::EvpPkeyPtr key(EVP_EC_gen("P-256"));
  ssl::X509Ptr cert(X509_new());
  ASSERT_TRUE(key && cert);
  X509_NAME* name = X509_get_subject_name(cert.get());
  X509_NAME_add_entry_by_NID(name, NID_commonName, MBSTRING_UTF8,
                             reinterpret_cast<const unsigned char*>(cn.c_str()), -1, -1, 0);
  X509_set_issuer_name(cert.get(), name);
  ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), 1);
  X509_gmtime_adj(X509_getm_notBefore(cert.get()), (days < 0 ? days - 30 : 0) * 86400L);
  X509_gmtime_adj(X509_getm_notAfter(cert.get()), days * 86400L + 43200);
  X509_set_pubkey(cert.get(), key.get());
  ASSERT_GT(X509_sign(cert.get(), key.get(), EVP_sha256()), 0);
  ssl::BioPtr out(BIO_new_file((dir + "/cert.pem").c_str(), "w"));
  ASSERT_TRUE(out);
  ASSERT_EQ(PEM_write_bio_X509(out.get(), cert.get()), 1);
}

// A renew.json for `domain` at a closed port of 127.0.0.1, and the configuration naming it.
void MakeRenewable(const std::string& dir, const std::string& domain) {
  static const std::string url = "\"https://127.0.0.1:" + std::to_string(FreePort()) + "/dir\"";
  WriteToolConfig(Json::Value("{\"directory_url\": " + url + "}"));
  WriteFile(dir + "/renew.json", "{\"domain\": \"" + domain + "\", \"email\": \"admin@zeph.test\", "
            "\"directory_url\": " + url + "}", 0600);
}

// renew-due refuses bad options, a missing or broken catalogue, an unloadable module and a
// second run, skips what is not renewable, not due or unreadable, and warns once a day; then
// what the tool's other commands refuse.
TEST(ZephLetsencryptTool, RefusesSkipsAndWarnsWithoutWritingAnything) {
  ApplianceRoot root;
  for (const std::vector<std::string>& options : std::vector<std::vector<std::string>>{
           {"--days"}, {"--days", "x"}, {"--days", "-1"}, {"--days", "36501"},
           {"--days", "1", "--days", "2"}, {"--module", ""}, {"-c", "Ab12Cd"}, {"extra"}}) {
    EXPECT_EQ(RenewDue(options).error(), 200) << PrintToString(options);
  }
  EXPECT_TRUE(Failed(RenewDue(), 112, root.Archive("/INFO")));
  for (const char* broken : {"not json", "[1]"}) {
    WriteFile(root.Archive("/INFO"), broken);
    EXPECT_TRUE(Failed(RenewDue(), 112, "not a JSON object")) << broken;
  }
  WriteFile(root.Archive("/INFO"), "{}");
  ExpectRenewDue(RenewDue(), 0, kNone, kEmpty, 0);
  const std::string built = BinDir() + "/ZEPH.Core.Certificate.so";
  const std::vector<std::string> nowhere = {"ZEPH_CERT_MODULE=" + root.Path("/nowhere.so")};
  EXPECT_TRUE(Failed(RenewDue({}, nowhere), 112, root.Path("/nowhere.so")));
  EXPECT_EQ(RenewDue({"--module", built}, nowhere).error(), 0);
  EXPECT_TRUE(Failed(RenewDue({"--module", BinDir() + "/libzephplatform.so"}, nowhere), 112,
                     "no method table"));
  // The root's copy of the tool finds no module beside it.
  const std::string copy = root.Path("/usr/zeph/sbin/zeph-letsencrypt");
  const std::vector<std::string> candidates = letsencrypt::CertificateModuleCandidates();
  ASSERT_EQ(candidates.size(), 3u);
  if (access(candidates[2].c_str(), R_OK) != 0) {  // else an installed module would be found
    ToolAnswer a = RenewDue({}, {"-u", "ZEPH_CERT_MODULE"}, copy);
    EXPECT_TRUE(Failed(a, 112, candidates[2]));
    EXPECT_TRUE(Failed(a, 112, root.Path("/usr/zeph/sbin/ZEPH.Core.Certificate.so")));
  }
  EXPECT_EQ(RenewDue({}, {"ZEPH_CERT_MODULE=" + built}, copy).error(), 0);
  int held = -1;
  ASSERT_TRUE(QLIBCFileLockTimeByFile(root.Path(kEtc + "/.renew-due.lock").c_str(),
                                      QLIBC_LOCK_EXCLUSIVE, 0, &held));
  ToolAnswer a = RenewDue();
  QLIBCFileUnlockByFile(held);
  EXPECT_TRUE(Failed(a, 112, "in progress"));
  const std::string plain = root.CreateCertificate("plain.test");
  const std::string marked = root.CreateCertificate("marked.test");
  const std::string broken = root.CreateCertificate("broken.test");
  ASSERT_FALSE(plain.empty() || marked.empty() || broken.empty());
  MakeRenewable(root.Archive("/" + marked), "marked.test");
  WriteFile(root.Archive("/" + broken + "/renew.json"), "{}", 0600);
  unlink(root.Archive("/" + broken + "/cert.pem").c_str());
  WriteFile(root.Archive("/" + broken + "/cert.pem"), "garbage", 0400);
  Json::Value info = root.Info();
  info["Gone99"] = info[plain];
  info["../x"] = info[plain];
  WriteFile(root.Archive("/INFO"), JsonCompact(info));
  const auto before = Snapshot(root.Archive("/" + marked));
  a = RenewDue();
  ExpectRenewDue(a, 0, kNone, kEmpty, 5);
  EXPECT_EQ(Snapshot(root.Archive("/" + marked)), before);
  // Certificates in use, not renewable, running out within 30 days: one warning a day.
  const struct {
    const char* id;
    int days;  // left; negative: expired that long ago
    bool renewable;
    std::vector<std::string> services;  // display names in INFO
  } kRows[] = {
      {"Self10", 10, false, {"Web administration"}}, {"Idle10", 10, false, {}},
      {"Acme10", 10, true, {"Web administration", "FTP"}},  // its renewal fails
      {"Gone03", -3, false, {"FTP"}}, {"Long90", 90, false, {"FTP"}}, {"Acme90", 90, true, {"FTP"}},
  };
  info = Json::Value(Json::objectValue);
  for (const auto& row : kRows) {
    const std::string dir = root.Archive(std::string("/") + row.id);
    MakeCertificate(dir, row.days, std::string(row.id) + ".test");
    if (row.renewable) MakeRenewable(dir, std::string(row.id) + ".test");
    Json::Value& entry = info[row.id];
    entry["desc"] = row.id;
    entry["services"] = kEmpty;
    for (const std::string& name : row.services)
      entry["services"].append(Json::Value())["display_name"] = name;
  }
  WriteFile(root.Archive("/INFO"), JsonCompact(info));
  // The expiry test: notAfter against now plus days, on the first certificate of a file.
  const std::string self10 = root.Archive("/Self10/cert.pem"), both = root.Path("/both.pem");
  EXPECT_EQ(CheckExpiry(self10, 9, nullptr), Expiry::kNotDue);
  EXPECT_EQ(CheckExpiry(self10, 11, nullptr), Expiry::kDue);
  WriteFile(both, ReadFile(root.Archive("/Long90/cert.pem")) + ReadFile(self10));
  EXPECT_EQ(CheckExpiry(both, 30, nullptr), Expiry::kNotDue);
  EXPECT_EQ(CheckExpiry(root.Path("/missing.pem"), 30, nullptr), Expiry::kUnreadable);
  auto warnings = [&root] {  // "name level/type services days-left" of each, sorted
    std::vector<std::string> out;
    for (const Json::Value& e : root.Events()) {
      if (e["message_id"].asUInt() != 0x12B00013u) continue;
      out.push_back(e["text1"].asString() + " " + JsonCompact(e["level"]) + "/" +
                    JsonCompact(e["type"]) + " " + e["text2"].asString() + " " +
                    e["text4"].asString());
    }
    std::sort(out.begin(), out.end());
    return out;
  };
  const std::vector<std::string> three = {"Acme10", "Gone03", "Self10"};
  a = RenewDue();
  EXPECT_EQ(a.error(), 111) << a.msg();  // Acme10 cannot be renewed
  EXPECT_EQ(Strings(a.answer["warned"]), three);
  EXPECT_EQ(warnings(), (std::vector<std::string>{"Acme10.test 2/1 Web administration, FTP 10",
                                                   "Gone03.test 2/1 FTP -3",
                                                   "Self10.test 2/1 Web administration 10"}));
  const std::string record_file = root.Path(kEtc + "/expiry-warnings.json");
  EXPECT_EQ(ModeOf(record_file), 0600u);
  // Once a day: a second run says nothing new; a warning of yesterday is repeated today.
  EXPECT_EQ(RenewDue().answer["warned"], kEmpty);
  Json::Value record;
  ASSERT_TRUE(JsonFromFile(record, record_file));
  record["Self10"] = "2000-01-01";
  WriteFile(record_file, JsonCompact(record), 0600);
  EXPECT_EQ(Strings(RenewDue().answer["warned"]), std::vector<std::string>{"Self10"});
  EXPECT_EQ(warnings().size(), 4u);
  // Without the module nothing renews, and the warnings come all the same.
  unlink(record_file.c_str());
  a = RenewDue({}, {"ZEPH_CERT_MODULE=" + root.Path("/nowhere.so")});
  EXPECT_EQ(a.error(), 112);
  EXPECT_EQ(Strings(a.answer["warned"]), three);
  // Bad arguments, names, e-mails, configurations, certificates it did not issue, another run,
  // no server and a silent one: refused or failed with their codes, nothing written.
  const std::string id = root.CreateCertificate("self.example");
  ASSERT_FALSE(id.empty());
  const std::vector<std::string> archive = DirEntries(root.Archive());
  const auto set = Snapshot(root.Archive("/" + id));
  struct Row {
    std::vector<std::string> args;
    int error;
    std::string msg;     // part of the message
    std::string config;  // the configuration file's text, "" for a closed server
  };
  std::vector<Row> rows;
  for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
           {}, {"frobnicate"}, {"new-cert", "-d", kDomain, "-m", kEmail},
           {"new-cert", "-d", kDomain, "-m", kEmail, "-c"},
           {"new-cert", "-d", kDomain, "-d", kDomain, "-m", kEmail, "-c", "Ab12Cd.temp"},
           NewCert(kDomain, "../escape"), NewCert(kDomain, ".."), {"renew"},
           {"renew", "-d", kDomain}, {"renew", "-c", "a/b"}, {"revoke", "-c", ""},
           {"revoke", "-c", "Ab12Cd", "extra"}, {"revoke", "--c", "Ab12Cd"}}) {
    rows.push_back({args, 200, "", ""});
  }
  for (const std::string& domain : std::vector<std::string>{
           "", std::string(64, 'a') + ".example", "-a.example", "a..example", "a_b.example",
           "exa mple.com", "example.com.", "*.", "a.*.example", "\xC3\xA9t\xC3\xA9.example",
           "a.example,", ",a.example", "a.example,b_c.example", " a.example"}) {
    rows.push_back({NewCert(domain), 102, "", ""});
  }
  rows.push_back({NewCert("*.zeph.test"), 102, "DNS-01", ""});
  rows.push_back({NewCert("nas.zeph.test,*.zeph.test"), 102, "DNS-01", ""});
  rows.push_back({NewCert(kDomain, "Ab12Cd.temp", ""), 101, "no e-mail", ""});
  rows.push_back({NewCert(kDomain, "X.temp", "a/b@x.example"), 101, "", ""});
  const std::string url = ClosedServerConfig()["directory_url"].asString();
  for (const std::string& config :
       {std::string("not json"), std::string("[1]"),
        std::string(R"({"directory_url": "http://127.0.0.1:1/dir"})"),
        R"({"timeout_s": 0, "directory_url": ")" + url + "\"}",
        R"({"ca_bundle": "missing.pem", "directory_url": ")" + url + "\"}",
        R"({"environment": {"T": 5}, "directory_url": ")" + url + "\"}"}) {
    rows.push_back({NewCert(kDomain), 108, "config.json", config});
  }
  for (const char* command : {"renew", "revoke"}) {
    rows.push_back({{command, "-c", id}, 106, "renew.json", ""});
    rows.push_back({{command, "-c", "NoSuch"}, 106, "", ""});
  }
  for (const Row& row : rows) {
    SCOPED_TRACE(row.config + PrintToString(row.args));
    WriteToolConfig(row.config.empty() ? ClosedServerConfig() : Json::Value(row.config));
    EXPECT_TRUE(Failed(RunTool(row.args), row.error, row.msg));
  }
  const std::string renew = root.Archive("/" + id + "/renew.json");
  for (const char* text : {"{}", "broken", "{\"domain\": \"a.example\"}"}) {
    WriteFile(renew, text, 0600);
    for (const char* command : {"renew", "revoke"})
      EXPECT_TRUE(Failed(RunTool({command, "-c", id}), 106)) << command << " " << text;
  }
  WriteFile(renew,
            "{\"domain\": \"a.example\", \"domains\": [\"a.example\", \"*.a.example\"], "
            "\"email\": \"a@a.example\", \"directory_url\": \"https://127.0.0.1:1/dir\"}",
            0600);
  EXPECT_TRUE(Failed(RunTool({"renew", "-c", id}), 102, "DNS-01"));
  unlink(renew.c_str());
  EXPECT_EQ(Snapshot(root.Archive("/" + id)), set);
  EXPECT_EQ(DirEntries(root.Archive()), archive);
  // Another run holding the lock, a closed port, a silent server (timeout_s): nothing left.
  Json::Value config = ClosedServerConfig();
  config["timeout_s"] = 1;
  WriteToolConfig(config);
  held = -1;
  ASSERT_TRUE(QLIBCFileLockTimeByFile(root.Path(kEtc + "/.lock").c_str(),
                                      QLIBC_LOCK_EXCLUSIVE, 0, &held));
  a = RunTool(NewCert(kDomain));
  QLIBCFileUnlockByFile(held);
  EXPECT_TRUE(Failed(a, 109, "lock"));
  if (!LegoInstalled()) GTEST_SKIP() << "lego is not installed (scripts/setup.sh installs it)";
  config.removeMember("timeout_s");
  WriteToolConfig(config);
  EXPECT_TRUE(Failed(RunTool(NewCert(kDomain)), 100, "connection refused"));
  int port;
  UniqueFd silent = ListeningSocket(&port);
  config["directory_url"] = "https://127.0.0.1:" + std::to_string(port) + "/dir";
  config["timeout_s"] = 1;
  WriteToolConfig(config);
  EXPECT_EQ(RunTool(NewCert(kDomain)).error(), 109);
  EXPECT_EQ(DirEntries(root.Archive("/Ab12Cd.temp")), kNone);
  EXPECT_EQ(DirEntries(root.Path(kEtc + "/work")), kNone);
}

// At a CA that demands external account binding, the tool alone and behind the module: create,
// renew (also by renew-due), delete, and the ACME side's failures as the tool's and module's codes.
TEST(ZephLetsencryptTool, AloneAndBehindTheModuleAgainstPebble) {
  if (!LegoInstalled() || !PebbleInstalled()) GTEST_SKIP() << "no pebble or lego (setup.sh)";
  ApplianceRoot root;
  MakeDirs(root.Path("/pebble"));
  Pebble pebble(root.Path("/pebble"), {"", true});
  std::string error;
  ASSERT_TRUE(pebble.Start(&error)) << error;
  Json::Value config = ClosedServerConfig();
  config["directory_url"] = pebble.DirectoryUrl();
  config["ca_bundle"] = pebble.ca_file();
  config["timeout_s"] = 60;
  config["eab_kid"] = kEabKid;
  config["eab_hmac_key"] = kEabHmacKey;
  WriteToolConfig(config);
  // Upper case in the name, into a directory made as the module's create makes it.
  const std::string dir = root.Archive("/Ab12Cd");
  MakeDirs(dir);
  ToolAnswer a = RunTool(NewCert("NAS.zeph.test", "Ab12Cd"));
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_EQ(a.err.find(kEabHmacKey), std::string::npos);
  ASSERT_NO_FATAL_FAILURE(ExpectIssuedSet(dir));
  const auto first = Snapshot(dir);
  Json::Value renew;
  ASSERT_TRUE(JsonParse(first.at("renew.json"), renew));
  EXPECT_EQ(renew["email"].asString(), kEmail);
  EXPECT_EQ(renew["account"], a.answer["account"]);
  EXPECT_EQ(renew["serial"].asString(), Serial(dir + "/cert.pem"));
  EXPECT_EQ(renew["serial"], a.answer["serial"]);
  EXPECT_EQ(ModeOf(root.Path(kEtc + "/account/" + a.answer["account"].asString() + "/info.json")),
            0600u);
  EXPECT_EQ(ModeOf(root.Path(kEtc + "/lego")), 0700u);
  // Without an e-mail the one recorded account.
  MakeDirs(root.Archive("/Ef34Gh"));
  ToolAnswer other = RunTool(NewCert(kDomain, "Ef34Gh", ""));
  ASSERT_EQ(other.error(), 0) << other.msg();
  EXPECT_EQ(other.answer["account"], a.answer["account"]);
  // A renewal replaces the whole set and clears what a renewal killed midway left.
  MakeDirs(root.Archive("/.Ab12Cd.renew.Zz99Yy"));
  WriteFile(root.Archive("/.Ab12Cd.renew.Zz99Yy/cert.pem"), "half", 0400);
  ToolAnswer renewed = RunTool({"renew", "-c", "Ab12Cd"});
  ASSERT_EQ(renewed.error(), 0) << renewed.msg() << "\n" << renewed.err;
  ASSERT_NO_FATAL_FAILURE(ExpectIssuedSet(dir));
  const auto second = Snapshot(dir);
  EXPECT_NE(second.at("privkey.pem"), first.at("privkey.pem"));  // and the set fits the key
  ASSERT_TRUE(JsonParse(second.at("renew.json"), renew));
  EXPECT_EQ(renew["serial"], renewed.answer["serial"]);
  // Through the module: a default certificate bound to the web service, redeployed on renewal.
  CallResult r = root.Call(kLe, "create", R"({"desc": "public", "domain_name": "www.zeph.test",
                                            "email": "owner@zeph.test", "as_default": true})");
  ASSERT_TRUE(r.ok()) << r.code() << "\n" << root.Log();
  const std::string id = r.data()["id"].asString();
  const std::string self = root.CreateCertificate("self.zeph.test");
  ASSERT_FALSE(self.empty());
  Json::Value bind;
  bind["settings"][0]["service"] = root.WebService();
  bind["settings"][0]["id"] = id;
  bind["settings"][0]["old_id"] = "";
  ASSERT_TRUE(root.Call("ZEPH.Core.Certificate.Service", "set", bind).ok());
  const std::string cert = root.Archive("/" + id + "/cert.pem");
  std::string serial = Serial(cert);
  ASSERT_EQ(Serial(root.Path(kWebCert)), serial);
  auto redeployed = [&] {  // `cert` changed since the last look and the web service has it
    const std::string before = serial;
    serial = Serial(cert);
    return serial != before && Serial(root.Path(kWebCert)) == serial;
  };
  r = root.Call(kLe, "renew", "{\"id\": \"" + id + "\"}");
  ASSERT_TRUE(r.ok()) << r.code() << "\n" << root.Log();
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(redeployed());
  // Not due within 30 days; due, the root's tool renews and deploys it, skipping the self-signed.
  ExpectRenewDue(RenewDue(), 0, kNone, kEmpty, 2);
  ASSERT_EQ(CheckExpiry(root.Archive("/" + self + "/cert.pem"), 36500, nullptr), Expiry::kDue);
  ExpectRenewDue(RenewDue({"--days", "36500"}), 0, {id}, kEmpty, 1);
  EXPECT_TRUE(redeployed());
  ASSERT_TRUE(JsonFromFile(renew, root.Archive("/" + id + "/renew.json")));
  EXPECT_EQ(renew["serial"].asString(), serial);
  // The server is gone: the tool's and the module's codes, certificates and deployment kept.
  pebble.Stop();
  EXPECT_EQ(RunTool({"renew", "-c", "Ab12Cd"}).error(), 100);
  const auto kept = Snapshot(root.Archive("/" + id));
  Json::Value failed;
  ASSERT_TRUE(JsonParse("[{\"code\":5520,\"id\":\"" + id + "\"}]", failed));
  ExpectRenewDue(RenewDue({"--days", "36500"}), 111, kNone, failed, 1);
  EXPECT_EQ(Snapshot(root.Archive("/" + id)), kept);
  EXPECT_EQ(Serial(root.Path(kWebCert)), serial);
  // A new server knows no account: renewal fails, the set stays; create makes one, of two names.
  ASSERT_TRUE(pebble.Start(&error)) << error;
  EXPECT_EQ(RunTool({"renew", "-c", "Ab12Cd"}).error(), 101);
  EXPECT_EQ(Snapshot(dir), second);
  r = root.Call(kLe, "create", R"({"desc": "two", "domain_name": "a.zeph.test, b.zeph.test",
                                   "email": "fourth@zeph.test"})");
  ASSERT_TRUE(r.ok()) << r.code() << "\n" << root.Log();
  const std::string two = r.data()["id"].asString();
  EXPECT_EQ(SubjectCommonName(ReadFile(root.Archive("/" + two + "/cert.pem"))), "a.zeph.test");
  // Deleting a certificate revokes it: the tool, given a copy, finds it revoked.
  MakeDirs(root.Archive("/Proof1"));
  for (const char* file : {"/cert.pem", "/renew.json"})
    WriteFile(root.Archive("/Proof1") + file, ReadFile(root.Archive("/" + two) + file));
  r = root.Call("ZEPH.Core.Certificate.CRT", "delete", "{\"ids\": [\"" + two + "\"]}");
  ASSERT_TRUE(r.ok()) << r.code();
  const std::string tool = root.Path("/usr/zeph/sbin/zeph-letsencrypt");
  EXPECT_TRUE(Failed(RunTool({"revoke", "-c", "Proof1"}, tool), 110, "alreadyRevoked"));
  // With a wrong key, or without the binding, a new account is refused.
  config["eab_hmac_key"] = std::string(kEabHmacKey).substr(0, 40) + "AAAAAAAA";
  WriteToolConfig(config);
  EXPECT_EQ(RunTool(NewCert(kDomain, "Cd34Ef.temp", "other@zeph.test")).error(), 101);
  config.removeMember("eab_kid");
  config.removeMember("eab_hmac_key");
  WriteToolConfig(config);
  EXPECT_EQ(RunTool(NewCert(kDomain, "Ef56Gh.temp", "third@zeph.test")).error(), 101);
  EXPECT_EQ(DirEntries(root.Path(kEtc + "/work")), kNone);
  for (const std::string& name : DirEntries(root.Archive())) EXPECT_NE(name[0], '.') << name;
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
