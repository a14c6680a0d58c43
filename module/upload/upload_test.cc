#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <map>
#include <set>
#include <string>
#include <vector>

#include "module/archive/archive_testing.h"
#include "module/frame/table.h"
#include "module/methods/methods_test_support.h"
#include "module/upload/full_chain.h"
#include "module/upload/sslca_form_handler.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::CallResult;
using ZEPH::test::DirEntries;
using ZEPH::test::Exists;
using ZEPH::test::kCertApi;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::WriteFile;
using ZEPH::test::ZipMember;
using ZEPH::test::ZipMembers;
using Names = std::set<std::string>;

const char kExport[] = "ZEPH.Core.Certificate.export";
const char kBom[] = "\xEF\xBB\xBF";

void Openssl(std::vector<std::string> args) {
  args.insert(args.begin(), "/usr/bin/openssl");
  const ZEPH::test::CommandResult r = ZEPH::test::Run(args);
  EXPECT_EQ(r.status, 0) << args[1] << ": " << r.err;
}

void MakeKey(const std::string& algorithm, const std::string& path) {
  if (algorithm == "DSA") return Openssl({"dsaparam", "-genkey", "-out", path, "1024"});
  std::vector<std::string> args = {"genpkey", "-algorithm", algorithm, "-out", path};
  if (algorithm == "EC") args.insert(args.end(), {"-pkeyopt", "ec_paramgen_curve:P-256"});
  Openssl(args);
}

void MakeSelfSigned(const std::string& key, const std::string& cn, const std::string& out) {
  Openssl({"req", "-x509", "-new", "-key", key, "-subj", "/CN=" + cn, "-days", "30", "-out", out});
}

using Files = std::map<std::string, std::string>;
Files Contents(const std::string& dir) {
  Files files;
  for (const std::string& name : DirEntries(dir)) files[name] = ReadFile(dir + "/" + name);
  return files;
}

void ExpectStored(const std::string& dir, const Files& files) {
  EXPECT_EQ(Contents(dir), files);
  EXPECT_EQ(ModeOf(dir) & 07777, 0700u);
  for (const auto& f : files) EXPECT_EQ(ModeOf(dir + "/" + f.first) & 07777, 0400u) << f.first;
  EXPECT_FALSE(Exists(dir + ".temp"));
}

struct ExportResult : ZEPH::DownloadSink {
  bool Deliver(const ZEPH::HeaderList& h, const std::string& path) override {
    delivered = true;
    headers = h;
    copy = ReadFile(path);
    return true;
  }
  ZEPH::APIResponse response;
  bool delivered = false;
  ZEPH::HeaderList headers;
  std::string copy;
};

class UploadTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZEPH::test::MakeDirs(Up(""));
    MakeKey("EC", Up("ca.key"));
    MakeSelfSigned(Up("ca.key"), "Upload Test Intermediate", Up("ca.pem"));
    MakeKey("RSA", Up("leaf.key"));
    Openssl({"req", "-new", "-key", Up("leaf.key"), "-subj", "/CN=leaf.example", "-out",
             Up("leaf.csr")});
    Openssl({"x509", "-req", "-in", Up("leaf.csr"), "-CA", Up("ca.pem"), "-CAkey", Up("ca.key"),
             "-set_serial", "7", "-days", "30", "-out", Up("leaf.pem")});
  }
  std::string Up(const std::string& name) const { return root_.Path("/upload/" + name); }
  // `inter`: null for none, "" for an empty path.
  Json::Value Params(const char* key, const char* cert, const char* inter = nullptr) const {
    Json::Value p;
    p["desc"] = "uploaded";
    p["key_tmp"] = Up(key);
    p["cert_tmp"] = Up(cert);
    if (inter != nullptr) p["inter_cert_tmp"] = *inter ? Up(inter) : "";
    return p;
  }
  CallResult Import(const Json::Value& params) const { return root_.Call(kCertApi, "import", params); }
  std::string Dir(const std::string& id) const { return root_.Archive("/" + id); }
  // Calls the export row with `file`, `id` and the members of `extra` (null removes one).
  static ExportResult Export(const std::string& file, const std::string& id = "",
                             const Json::Value& extra = Json::objectValue) {
    Json::Value params;
    params["file"] = file;
    if (!id.empty()) params["id"] = id;
    for (const std::string& k : extra.getMemberNames()) {
      if (extra[k].isNull()) params.removeMember(k); else params[k] = extra[k];
    }
    ExportResult result;
    const ZEPH_API_TABLE* row = GetAPITable();
    while (row->api != nullptr && std::string(row->api) + "." + row->method != kExport) ++row;
    ZEPH::APIRequest request(params);
    ZEPH::ScopedDownloadSink scope(&result);
    if (row->api != nullptr) row->handler(&request, &result.response); else ADD_FAILURE();
    return result;
  }
  std::string Gen(const char* name) const { return root_.Path("/usr/zeph/etc/ssl/.gen/") + name; }
  std::string Saved(const ExportResult& r, const std::string& name = "/delivered.zip") const {
    WriteFile(root_.Path(name), r.copy, 0600);
    return root_.Path(name);
  }
  // A download is the whole answer: no JSON outcome, output switched off.
  static void ExpectZip(const ExportResult& r) {
    EXPECT_TRUE(r.delivered && r.response.outcome_count() == 0 && !r.response.enable_output());
    EXPECT_EQ(r.headers,
              (ZEPH::HeaderList{{"content-disposition", "attachment; filename=\"archive.zip\""}}));
  }
  static void ExpectNothing(const ExportResult& r) {
    EXPECT_TRUE(!r.delivered && r.response.outcome_count() == 0 && r.response.enable_output());
  }
  ApplianceRoot root_;
};

TEST_F(UploadTest, ImportStoresTheUploadedSet) {
  MakeKey("ED25519", Up("ed.key"));
  MakeSelfSigned(Up("ed.key"), "ed.example", Up("ed.pem"));
  WriteFile(Up("bom.key"), kBom + ReadFile(Up("leaf.key")));
  WriteFile(Up("bom.pem"), kBom + ReadFile(Up("leaf.pem")));
  auto plain = [](const std::string& t) { return t.compare(0, 3, kBom) == 0 ? t.substr(3) : t; };
  const struct { const char *key, *cert, *inter, *cn, *flags; bool is_default, deletable; } rows[] =
      {
      {"leaf.key", "leaf.pem", "ca.pem", "leaf.example", "{}", false, true},
      {"ed.key", "ed.pem", nullptr, "ed.example", "{}", false, true},
      {"bom.key", "bom.pem", "ca.pem", "leaf.example", "{}", false, true},
      {"leaf.key", "leaf.pem", nullptr, "leaf.example",
       R"({"as_default": "true", "user_deletable": false})", true, false},
      {"leaf.key", "leaf.pem", nullptr, "leaf.example",
       R"({"as_default": "0", "user_deletable": "yes"})", false, true}};
  for (const auto& row : rows) {
    SCOPED_TRACE(std::string(row.key) + " " + row.flags);
    const std::string key = plain(ReadFile(Up(row.key))), cert = plain(ReadFile(Up(row.cert)));
    const std::string old_default = ReadFile(root_.Archive("/DEFAULT"));
    Json::Value p = Params(row.key, row.cert, row.inter), flags;
    ASSERT_TRUE(ZEPH::JsonParse(row.flags, flags));
    for (const std::string& k : flags.getMemberNames()) p[k] = flags[k];
    CallResult r = Import(p);
    ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
    const std::string id = r.data()["id"].asString(), dir = Dir(id);
    EXPECT_EQ(r.data().getMemberNames(), std::vector<std::string>{"id"});
    EXPECT_FALSE(r.response.httpd_restart());
    const std::string inter = row.inter ? ReadFile(Up(row.inter)) : "";
    Files files = {{"cert.pem", cert}, {"fullchain.pem", cert + inter}, {"privkey.pem", key}};
    if (row.inter != nullptr) files["chain.pem"] = inter;
    ExpectStored(dir, files);
    EXPECT_EQ(ReadFile(Up(row.key)) + ReadFile(Up(row.cert)), key + cert);  // marks stripped
    const Json::Value entry = root_.Info()[id];
    EXPECT_EQ(entry["desc"].asString() + entry["services"].toStyledString(), "uploaded[]\n");
    EXPECT_EQ(entry["user_deletable"].asBool(), row.deletable);
    EXPECT_EQ(ReadFile(root_.Archive("/DEFAULT")), row.is_default ? id + "\n" : old_default);
    EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00003u);
    EXPECT_EQ(root_.Events().back()["text1"].asString(), row.cn);
  }
}

TEST_F(UploadTest, BadUploadsChangeNothing) {
  WriteFile(Up("empty"), "");
  std::string huge = "-----BEGIN CERTIFICATE-----\n";  // MiBs of non-PEM
  while (huge.size() < 6u << 20) huge += std::string(64, 'A') + "\n";
  WriteFile(Up("huge"), huge);
  Openssl({"genpkey", "-algorithm", "EC", "-pkeyopt", "ec_paramgen_curve:P-256", "-aes256", "-pass",
           "pass:secret", "-out", Up("encrypted.key")});
  MakeKey("DSA", Up("dsa.key"));
  MakeSelfSigned(Up("dsa.key"), "dsa.example", Up("dsa.pem"));
  MakeKey("RSA", Up("other.key"));
  MakeKey("EC", Up("stranger.key"));
  MakeSelfSigned(Up("stranger.key"), "Someone Else CA", Up("stranger.pem"));
  const struct { const char *key, *cert, *inter; int code; std::string log; } bad[] = {
      {"empty", "leaf.pem", nullptr, 5511, "Failed to read private key from " + Up("empty")},
      {"huge", "leaf.pem", nullptr, 5511, ""}, {"encrypted.key", "leaf.pem", nullptr, 5511, ""},
      {"missing", "leaf.pem", nullptr, 5511, "Failed to BIO_new_file. [" + Up("missing") + "]"},
      {"leaf.key", "empty", nullptr, 5514, ""}, {"leaf.key", "leaf.csr", nullptr, 5514, ""},
      {"leaf.key", "missing", nullptr, 5514, ""}, {"leaf.key", "leaf.pem", "missing", 5517, ""},
      {"leaf.key", "leaf.pem", "empty", 5512, "Failed to get certificate info from inter cert"},
      {"leaf.key", "leaf.pem", "stranger.pem", 5517,
       "Intermediate certificate & certificate is not matching."},
      {"leaf.key", "leaf.pem", "", 5515, "Failed to copy and chmod to "},
      {"dsa.key", "dsa.pem", nullptr, 5518, "Failed to check private key for " + Up("dsa.key")},
      {"other.key", "leaf.pem", nullptr, 5514,
       Up("leaf.pem") + " and " + Up("other.key") + " are not match"}};
  const auto before = DirEntries(root_.Archive());
  const Files uploads = Contents(Up(""));
  for (const auto& row : bad) {
    SCOPED_TRACE(std::string(row.key) + " " + row.cert + " " + (row.inter ? row.inter : "-"));
    root_.ClearLog();
    CallResult r = Import(Params(row.key, row.cert, row.inter));
    EXPECT_EQ(r.code(), row.code);
    EXPECT_TRUE(r.data().isNull());
    EXPECT_TRUE(row.log.empty() || root_.LogContains(row.log)) << root_.Log();
    EXPECT_EQ(DirEntries(root_.Archive()), before);  // no directory, no ".temp"
  }
  const struct { const char* name; Json::Value value; int code; } params[] = {  // null: removed
      {"key_tmp", Json::Value(), 5511}, {"desc", Json::Value(), 5511}, {"id", Json::Value(5), 5511},
      {"as_default", Json::Value(true), 5511}, {"cert_tmp", Json::Value(), 5510},
      {"cert_tmp", Json::Value(1), 5510}, {"inter_cert_tmp", Json::Value(Json::arrayValue), 5512},
      {"id", "nosuch", 5503}, {"id", "..", 5503}, {"id", "../_archive", 5503}, {"id", "a.b", 5503}};
  for (const auto& row : params) {
    Json::Value p = Params("leaf.key", "leaf.pem");
    if (row.value.isNull()) p.removeMember(row.name); else p[row.name] = row.value;
    EXPECT_EQ(Import(p).code(), row.code) << row.name << " " << row.value;
    EXPECT_TRUE(row.code != 5503 || root_.LogContains(row.value.asString() + " is not a valid"));
  }
  EXPECT_EQ(DirEntries(root_.Archive()), before);
  EXPECT_EQ(Contents(Up("")), uploads);
}

TEST_F(UploadTest, ReplacingKeepsTheIdAndRestartsOnlyForTheWebService) {
  const std::string id = root_.CreateCertificate("old.example");
  ASSERT_TRUE(root_.Call("ZEPH.Core.Certificate.Service", "set", R"({"settings": [{"service": )" +
                         ZEPH::JsonCompact(root_.WebService()) + R"(, "id": ")" + id +
                         R"(", "old_id": ""}]})").ok());
  const auto names = DirEntries(root_.Archive());
  const Files old_files = Contents(Dir(id));
  MakeKey("EC", Up("other.key"));
  Json::Value p = Params("other.key", "leaf.pem", "ca.pem");
  p["id"] = id;
  p["desc"] = "replaced";
  EXPECT_EQ(Import(p).code(), 5514);
  EXPECT_EQ(DirEntries(root_.Archive()), names);
  EXPECT_EQ(Contents(Dir(id)), old_files);
  EXPECT_EQ(root_.Info()[id]["desc"].asString(), "made by a test");
  p["key_tmp"] = Up("leaf.key");
  CallResult r = Import(p);
  ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
  EXPECT_EQ(r.data()["id"].asString(), id);
  EXPECT_TRUE(r.data()["restart_httpd"].asBool() && r.response.httpd_restart());
  EXPECT_EQ(DirEntries(root_.Archive()), names);
  const std::string leaf = ReadFile(Up("leaf.pem")), ca = ReadFile(Up("ca.pem"));
  ExpectStored(Dir(id), {{"cert.pem", leaf}, {"chain.pem", ca}, {"fullchain.pem", leaf + ca},
                         {"privkey.pem", ReadFile(Up("leaf.key"))}});
  EXPECT_EQ(ReadFile(root_.Path("/usr/zeph/etc/certificate/system/default/fullchain.pem")),
            leaf + ca);
  EXPECT_EQ(root_.Info()[id]["desc"].asString(), "replaced");
  EXPECT_EQ(root_.Info()[id]["services"].size(), 1u);
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00004u);
  // A failed move (a file the backup copy cannot read, without root's privileges) after every
  // check is logged and answered as a success with an empty result; the old files stay.
  const std::string unused = root_.CreateCertificate("unused.example");
  const std::string uid_gid = std::to_string(ZEPH::test::UnprivilegedUid()) + ":" +
                              std::to_string(ZEPH::test::UnprivilegedGid());
  const std::string old_cert = ReadFile(Dir(unused) + "/cert.pem");
  ASSERT_EQ(chmod(root_.dir().c_str(), 0755), 0);
  ZEPH::test::Run({"/bin/chown", "-R", uid_gid, root_.dir()});
  ASSERT_EQ(chmod((Dir(unused) + "/zeph-ca-privkey.pem").c_str(), 0), 0);
  p["id"] = unused;
  EXPECT_EQ(ZEPH::test::RunUnprivileged([&]() {
              r = Import(p);
              return r.ok() && r.data().empty() ? 0 : 1;
            }), 0);
  EXPECT_EQ(ReadFile(Dir(unused) + "/cert.pem"), old_cert);
  EXPECT_EQ(root_.Info()[unused]["desc"].asString(), "made by a test");
  r = Import(p);  // a certificate that no service uses needs no restart
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(r.data()["id"], unused);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool() || r.response.httpd_restart());
}

TEST_F(UploadTest, ExportsHandOutTheSetAsItIs) {
  const std::string set_id = root_.CreateCertificate("export.example"), set_dir = Dir(set_id);
  WriteFile(set_dir + "/chain.pem", ReadFile(set_dir + "/zeph-ca-cert.pem"), 0400);
  ZEPH::test::Run({"/bin/rm", "-rf", Gen("")});  // made again, the owner's alone
  const struct { const char *feature, *remove; Names members; } features[] = {
      {"yes", "", {"zeph-ca-cert.pem", "zeph-ca-privkey.pem", "privkey.pem", "cert.pem",
                   "chain.pem"}},
      {"no", "", {"privkey.pem", "cert.pem", "chain.pem"}},
      {"yes", "zeph-ca-privkey.pem", {"zeph-ca-cert.pem", "privkey.pem", "cert.pem", "chain.pem"}}};
  for (const auto& row : features) {
    WriteFile(root_.Path("/usr/zeph/etc/features.conf"),
              std::string("support_self_sign_cert=") + row.feature);
    if (*row.remove) unlink((set_dir + "/" + row.remove).c_str());
    ExportResult got = Export("archive", set_id);
    ExpectZip(got);
    EXPECT_EQ(ZipMembers(Saved(got)), row.members);
    for (const auto& m : row.members) {
      EXPECT_EQ(ZipMember(Saved(got), m), ReadFile(set_dir + "/" + m)) << m;
    }
    EXPECT_TRUE(ModeOf(Gen("archive.zip")) == 0400u && ModeOf(Gen("")) == 0700u);
    EXPECT_EQ(ReadFile(Gen("archive.zip")), got.copy);
  }
  const std::string earlier = ReadFile(Gen("archive.zip"));
  for (const char* file : {"", "ARCHIVE", "archive ", "csr"}) ExpectNothing(Export(file));
  EXPECT_EQ(ReadFile(Gen("archive.zip")), earlier);
  ExpectNothing(Export("csr_set"));  // a set that is not there: the earlier archive goes
  EXPECT_FALSE(Exists(Gen("archive.zip")));
  ZEPH::test::MakeDirs(root_.Path("/elsewhere"));
  WriteFile(root_.Path("/elsewhere/privkey.pem"), "not for export");
  const std::pair<const char*, const char*> ids[] = {
      {"nosuch", "No file will be compress"}, {"../../../../../../elsewhere", "is not a valid"}};
  for (const auto& row : ids) {
    ExpectNothing(Export("archive", row.first));
    EXPECT_TRUE(root_.LogContains(row.second)) << row.first;
    EXPECT_FALSE(Exists(Gen("archive.zip")));
  }
}

TEST_F(UploadTest, ZipAndFullChainBuilders) {
  const std::string a = root_.Path("/a.txt"), b = root_.Path("/b.txt"), zip = root_.Path("/x.zip");
  const std::string work = root_.Path("/work.temp"), missing = root_.Path("/missing.txt");
  WriteFile(a, "A");
  WriteFile(b, "B");
  WriteFile(zip, "not a zip at all");
  const auto create = &SSLCAFormHandler::CreateArchive;
  const char* files[] = {a.c_str(), missing.c_str(), b.c_str()};
  ASSERT_EQ(create(files, zip.c_str(), 3), 0);
  EXPECT_EQ(ZipMembers(zip), (Names{"a.txt", "b.txt"}));
  EXPECT_EQ(ZipMember(zip, "b.txt"), "B");
  EXPECT_EQ(ModeOf(zip) & 07777, 0400u);
  ASSERT_EQ(create(files, zip.c_str(), 1), 0);  // the first only
  EXPECT_EQ(ZipMembers(zip), Names{"a.txt"});
  const char* none[] = {missing.c_str()};
  EXPECT_EQ(create(none, zip.c_str(), 1), -1);
  EXPECT_FALSE(Exists(zip));
  EXPECT_TRUE(create(files, zip.c_str(), 0) == -1 && create(files, nullptr, 3) == -1);
  EXPECT_TRUE(create(nullptr, zip.c_str(), 3) == -1 && create(files, zip.c_str(), -1) == -1);
  EXPECT_EQ(create(files, (a + "/x.zip").c_str(), 3), -1);  // 7z refuses
  ZEPH::test::MakeDirs(work);
  std::string long_cert(100000, 'x');  // one line longer than any buffer
  for (int i = 0; i < 20000; ++i) long_cert += "\nline " + std::to_string(i);
  // `cert` "-": no cert.pem; `chain` null: no chain.pem, "/": a directory; `full` "-": fails.
  // CRLF is kept; an empty file adds nothing.
  const struct { std::string cert; const char* chain; std::string full; } chains[] = {
      {"C1\nC2\n", nullptr, "C1\nC2\n"}, {"C1\nC2", nullptr, "C1\nC2\n"}, {"C1", "", "C1\n"},
      {"C1\nC2", "I1\nI2", "C1\nC2\nI1\nI2\n"}, {"", "I1", "I1\n"}, {"-", nullptr, "-"},
      {"C1\r\nC2\r\n", "I1\r\nI2", "C1\r\nC2\r\nI1\r\nI2\n"}, {"C\n", "/", "-"},
      {long_cert, "I\n", long_cert + "\nI\n"}};
  for (const auto& row : chains) {
    ZEPH::test::Run({"/bin/rm", "-rf", work + "/cert.pem", work + "/chain.pem"});
    if (row.cert != "-") WriteFile(work + "/cert.pem", row.cert);
    if (row.chain != nullptr && *row.chain == '/') ZEPH::test::MakeDirs(work + "/chain.pem");
    if (row.chain != nullptr && *row.chain != '/') WriteFile(work + "/chain.pem", row.chain);
    unlink((work + "/fullchain.pem").c_str());
    if (row.full == "-") {
      EXPECT_FALSE(genChainCRT(work) || (row.cert == "-" && Exists(work + "/fullchain.pem")));
      continue;
    }
    WriteFile(work + "/fullchain.pem", "stale content that is longer\n", 0600);
    ASSERT_TRUE(genChainCRT(work));
    EXPECT_TRUE(ReadFile(work + "/fullchain.pem") == row.full);
    EXPECT_EQ(ModeOf(work + "/fullchain.pem") & 07777, 0400u);
    EXPECT_EQ(ReadFile(work + "/cert.pem"), row.cert);  // inputs untouched
  }
  EXPECT_FALSE(genChainCRT(root_.Path("/no/such/work")));
  EXPECT_FALSE(Exists(root_.Path("/no/such/work/fullchain.pem")));
}

TEST_F(UploadTest, Pkcs12ExportsOpenWithThePassphraseOnly) {
  Json::Value ec;
  ec["key_type"] = "ec256";
  const std::string p12_id = root_.CreateCertificate("*.p12.example", ec);
  const std::string p12_dir = root_.Archive("/" + p12_id), secret = "correct horse \xC3\xA9";
  auto pkcs12 = [&](const std::string& pass) {  // the keys and certificates, the form on stderr
    return ZEPH::test::Run({"/usr/bin/openssl", "pkcs12", "-in", root_.Path("/delivered.p12"),
                            "-passin", "pass:" + pass, "-nodes", "-info"});
  };
  auto p12_params = [&](const std::string& text) {  // members over the base ones; null removes one
    Json::Value extra, over;
    extra["format"] = "pkcs12";
    extra["passphrase"] = secret;
    EXPECT_TRUE(ZEPH::JsonParse(text, over));
    for (const std::string& k : over.getMemberNames()) extra[k] = over[k];
    return extra;
  };
  const std::pair<std::string, int> refused[] = {
      {R"({"passphrase": ""})", 5503}, {R"({"passphrase": "two\nlines"})", 5503},
      {R"({"passphrase": ")" + std::string(1024, 'x') + "\"}", 5503},
      {R"({"passphrase": 1234})", 5503}, {R"({"legacy": "yes"})", 5503},
      {R"({"format": "pfx"})", 5503}, {R"({"file": "csr_set"})", 5503},
      {R"({"id": "../)" + p12_id + "\"}", 5503}, {R"({"id": "nosuch"})", 5501}};
  for (const auto& row : refused) {
    ExportResult got = Export("archive", p12_id, p12_params(row.first));
    EXPECT_FALSE(got.delivered || Exists(Gen("archive.p12"))) << row.first;
    EXPECT_EQ(got.response.error_code(), row.second) << row.first;
  }
  // `chain`: "chain.pem" is written first from this file of the set.
  const struct { const char *p12_params, *protection, *chain; } forms[] = {
      {"{}", "PBES2, PBKDF2, AES-256-CBC", nullptr},
      {R"({"legacy": true})", "pbeWithSHA1And3-KeyTripleDES-CBC", "cert.pem"},
      {R"({"legacy": false})", "PBES2, PBKDF2, AES-256-CBC", "cert.pem"}};
  for (const auto& row : forms) {
    if (row.chain) WriteFile(p12_dir + "/chain.pem", ReadFile(p12_dir + "/" + row.chain), 0400);
    ExportResult got = Export("archive", p12_id, p12_params(row.p12_params));
    EXPECT_FALSE(Exists(Gen("archive.p12")));
    ASSERT_TRUE(got.delivered && got.response.outcome_count() == 0);
    EXPECT_EQ(got.headers, (ZEPH::HeaderList{
        {"content-type", "application/x-pkcs12"},
        {"content-disposition", "attachment; filename=\"_.p12.example.p12\""}}));
    Saved(got, "/delivered.p12");
    const ZEPH::test::CommandResult info = pkcs12(secret);
    ASSERT_EQ(info.status, 0) << info.err;
    EXPECT_NE(info.err.find(row.protection), std::string::npos) << info.err;
    EXPECT_NE(pkcs12("wrong").status, 0);
    EXPECT_NE(info.out.find(ReadFile(p12_dir + "/privkey.pem")), std::string::npos);
    EXPECT_NE(info.out.find(ReadFile(p12_dir + "/cert.pem")), std::string::npos);
    EXPECT_EQ(info.out.find(ReadFile(p12_dir + "/zeph-ca-cert.pem")) < info.out.size(), !row.chain);
    EXPECT_EQ(info.out.find(ReadFile(p12_dir + "/zeph-ca-privkey.pem")), std::string::npos);
  }
  ExpectZip(Export("archive", p12_id, p12_params(R"({"format": "zip", "passphrase": null})")));
  EXPECT_EQ(root_.Log().find("correct horse"), std::string::npos);
}

}  // namespace
