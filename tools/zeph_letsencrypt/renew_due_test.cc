// zeph-letsencrypt renew-due: the built tool loading the built module, in a
// provisioned root; the renewals run the tool the root holds, lego and a
// pebble server on 127.0.0.1.
#include <gtest/gtest.h>
#include <openssl/pem.h>
#include <stdlib.h>
#include <unistd.h>

#include <map>

#include "module/common/ssl_ptr.h"
#include "module/methods/methods_test_support.h"
#include "pebble_test_support.h"
#include "tools/zeph_letsencrypt/renew_due.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_lock.h"

namespace ZEPH {
namespace test {
namespace {

using letsencrypt::CheckExpiry;
using letsencrypt::Expiry;

const char kLe[] = "ZEPH.Core.Certificate.LetsEncrypt";
const char kWebCert[] = "/usr/zeph/etc/certificate/system/default/cert.pem";

// Sets (or, with null, removes) an environment variable for a scope; the
// tool runs inherit it.
class ScopedEnv {
 public:
  ScopedEnv(const char* name, const char* value) : name_(name) {
    if (const char* old = getenv(name)) {
      had_ = true;
      old_ = old;
    }
    if (value != nullptr) {
      setenv(name, value, 1);
    } else {
      unsetenv(name);
    }
  }
  ~ScopedEnv() {
    if (had_) {
      setenv(name_, old_.c_str(), 1);
    } else {
      unsetenv(name_);
    }
  }
  ScopedEnv(const ScopedEnv&) = delete;
  ScopedEnv& operator=(const ScopedEnv&) = delete;

 private:
  const char* name_;
  bool had_ = false;
  std::string old_;
};

ToolAnswer RenewDue(const std::vector<std::string>& options = {},
                    const std::string& program = "") {
  std::vector<std::string> args{"renew-due"};
  args.insert(args.end(), options.begin(), options.end());
  return RunTool(args, program);
}

std::vector<std::string> Strings(const Json::Value& array) {
  std::vector<std::string> out;
  for (const Json::Value& v : array) out.push_back(v.asString());
  return out;
}

ssl::X509Ptr ReadCert(const std::string& path) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  return ssl::X509Ptr(bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)
                          : nullptr);
}

std::string Serial(const std::string& path) {
  ssl::X509Ptr cert = ReadCert(path);
  if (!cert) return "";
  // Written as the tool writes it into renew.json.
  ssl::BioPtr out(BIO_new(BIO_s_mem()));
  if (!out || i2a_ASN1_INTEGER(out.get(), X509_get0_serialNumber(cert.get())) <= 0) {
    return "";
  }
  char* data = nullptr;
  const long n = BIO_get_mem_data(out.get(), &data);
  return std::string(data, static_cast<size_t>(n));
}

// Whole days from now until the notAfter of the certificate in `path`.
int DaysLeft(const std::string& path) {
  ssl::X509Ptr cert = ReadCert(path);
  int days = -1, seconds = 0;
  if (!cert || !ASN1_TIME_diff(&days, &seconds, nullptr, X509_get0_notAfter(cert.get()))) {
    ADD_FAILURE() << "cannot read " << path;
  }
  return days;
}

std::map<std::string, std::string> Snapshot(const std::string& dir) {
  std::map<std::string, std::string> files;
  for (const char* name :
       {"cert.pem", "chain.pem", "fullchain.pem", "privkey.pem", "renew.json"}) {
    files[name] = ReadFile(dir + "/" + name);
  }
  return files;
}

// A self-signed certificate for `cn` valid from `from_days` days from now
// to half a day after `days` days from now (negative: in the past), and
// its key, in `dir`. The half day keeps counts of whole days left from
// depending on the second a test runs.
void MakeCertificate(const std::string& dir, int days, const std::string& cn = "due.test",
                     int from_days = 0) {
  MakeDirs(dir);
  ssl::EvpPkeyPtr key(EVP_EC_gen("P-256"));
  ssl::X509Ptr cert(X509_new());
  ASSERT_TRUE(key && cert);
  X509_NAME* name = X509_get_subject_name(cert.get());
  X509_NAME_add_entry_by_NID(name, NID_commonName, MBSTRING_UTF8,
                             reinterpret_cast<const unsigned char*>(cn.c_str()), -1, -1, 0);
  X509_set_issuer_name(cert.get(), name);
  ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), 1);
  X509_gmtime_adj(X509_getm_notBefore(cert.get()), from_days * 86400L);
  X509_gmtime_adj(X509_getm_notAfter(cert.get()), days * 86400L + 43200);
  X509_set_pubkey(cert.get(), key.get());
  ASSERT_GT(X509_sign(cert.get(), key.get(), EVP_sha256()), 0);
  for (const char* file : {"/cert.pem", "/privkey.pem"}) unlink((dir + file).c_str());
  ssl::BioPtr out(BIO_new_file((dir + "/cert.pem").c_str(), "w"));
  ssl::BioPtr key_out(BIO_new_file((dir + "/privkey.pem").c_str(), "w"));
  ASSERT_TRUE(out && key_out);
  ASSERT_EQ(PEM_write_bio_X509(out.get(), cert.get()), 1);
  ASSERT_EQ(PEM_write_bio_PrivateKey(key_out.get(), key.get(), nullptr, nullptr, 0,
                                     nullptr, nullptr),
            1);
}

TEST(RenewDueExpiry, ComparesNotAfterWithNowPlusDays) {
  TempRoot root;
  const std::string dir = root.Path("/c");
  MakeCertificate(dir, 10);
  std::string not_after;
  EXPECT_EQ(CheckExpiry(dir + "/cert.pem", 0, &not_after), Expiry::kNotDue);
  EXPECT_NE(not_after.find("GMT"), std::string::npos) << not_after;
  EXPECT_EQ(CheckExpiry(dir + "/cert.pem", 9, nullptr), Expiry::kNotDue);
  EXPECT_EQ(CheckExpiry(dir + "/cert.pem", 11, nullptr), Expiry::kDue);
  EXPECT_EQ(CheckExpiry(dir + "/cert.pem", 30, nullptr), Expiry::kDue);

  // Only the first certificate of a file counts.
  MakeCertificate(root.Path("/long"), 400);
  WriteFile(dir + "/both.pem",
            ReadFile(root.Path("/long/cert.pem")) + ReadFile(dir + "/cert.pem"));
  EXPECT_EQ(CheckExpiry(dir + "/both.pem", 30, nullptr), Expiry::kNotDue);

  EXPECT_EQ(CheckExpiry(dir + "/missing.pem", 30, &not_after), Expiry::kUnreadable);
  EXPECT_EQ(not_after, "");
  EXPECT_EQ(CheckExpiry(dir + "/privkey.pem", 30, nullptr), Expiry::kUnreadable);
}

TEST(RenewDueTool, RefusesWhatItCannotUse) {
  ApplianceRoot root;
  for (const std::vector<std::string>& options :
       std::vector<std::vector<std::string>>{{"--days"},
                                             {"--days", "x"},
                                             {"--days", "-1"},
                                             {"--days", "36501"},
                                             {"--days", "1", "--days", "2"},
                                             {"--module", ""},
                                             {"-c", "Ab12Cd"},
                                             {"extra"}}) {
    std::string shown;
    for (const std::string& o : options) shown += "[" + o + "]";
    SCOPED_TRACE(shown);
    EXPECT_EQ(RenewDue(options).error(), 200);
  }

  // Without a catalogue, or with a broken one, nothing is attempted.
  ToolAnswer a = RenewDue();
  EXPECT_EQ(a.error(), 112);
  EXPECT_NE(a.msg().find(root.Archive("/INFO")), std::string::npos) << a.msg();
  for (const char* broken : {"not json", "[1]"}) {
    SCOPED_TRACE(broken);
    WriteFile(root.Archive("/INFO"), broken);
    a = RenewDue();
    EXPECT_EQ(a.error(), 112);
    EXPECT_NE(a.msg().find("not a JSON object"), std::string::npos) << a.msg();
  }
  WriteFile(root.Archive("/INFO"), "{}");
  a = RenewDue();
  EXPECT_EQ(a.error(), 0) << a.msg();
  EXPECT_EQ(a.answer["renewed"], Json::Value(Json::arrayValue));
  EXPECT_EQ(a.answer["failed"], Json::Value(Json::arrayValue));
  EXPECT_EQ(a.answer["skipped"].asInt(), 0);

  // Where the module comes from: --module before ZEPH_CERT_MODULE before
  // the lookup beside the executable.
  const std::string built_module = BinDir() + "/ZEPH.Core.Certificate.so";
  {
    ScopedEnv env("ZEPH_CERT_MODULE", root.Path("/nowhere.so").c_str());
    a = RenewDue();
    EXPECT_EQ(a.error(), 112);
    EXPECT_NE(a.msg().find(root.Path("/nowhere.so")), std::string::npos) << a.msg();
    EXPECT_EQ(RenewDue({"--module", built_module}).error(), 0);
    a = RenewDue({"--module", BinDir() + "/libzephplatform.so"});
    EXPECT_EQ(a.error(), 112);
    EXPECT_NE(a.msg().find("no method table"), std::string::npos) << a.msg();
  }
  // The copy provisioning put into the root finds no module beside it.
  {
    ScopedEnv env("ZEPH_CERT_MODULE", nullptr);
    const std::string copy = root.Path("/usr/zeph/sbin/zeph-letsencrypt");
    const std::vector<std::string> candidates = letsencrypt::CertificateModuleCandidates();
    ASSERT_EQ(candidates.size(), 3u);
    if (access(candidates[2].c_str(), R_OK) == 0) {
      std::cerr << "an installed module exists at " << candidates[2]
                << "; the lookup of a copied tool is not tested\n";
    } else {
      a = RenewDue({}, copy);
      EXPECT_EQ(a.error(), 112);
      EXPECT_NE(a.msg().find("cannot find the certificate module"), std::string::npos);
      EXPECT_NE(a.msg().find(root.Path("/usr/zeph/sbin/ZEPH.Core.Certificate.so")),
                std::string::npos)
          << a.msg();
      EXPECT_NE(a.msg().find(candidates[2]), std::string::npos) << a.msg();
      EXPECT_NE(a.msg().find("ZEPH_CERT_MODULE"), std::string::npos) << a.msg();
    }
    ScopedEnv named("ZEPH_CERT_MODULE", built_module.c_str());
    EXPECT_EQ(RenewDue({}, copy).error(), 0);
  }

  // A second run leaves the work to the one in progress.
  int held = -1;
  ASSERT_TRUE(QLIBCFileLockTimeByFile(
      root.Path("/usr/zeph/etc/letsencrypt/.renew-due.lock").c_str(),
      QLIBC_LOCK_EXCLUSIVE, 0, &held));
  a = RenewDue();
  QLIBCFileUnlockByFile(held);
  EXPECT_EQ(a.error(), 112);
  EXPECT_NE(a.msg().find("in progress"), std::string::npos) << a.msg();
  EXPECT_EQ(RenewDue().error(), 0);
}

TEST(RenewDueTool, SkipsWhatIsNotRenewableNotDueOrUnreadable) {
  ApplianceRoot root;
  // The ACME server, should anything reach it, is a closed port.
  Json::Value config;
  config["directory_url"] = "https://127.0.0.1:" + std::to_string(FreePort()) + "/dir";
  WriteToolConfig(config);
  const std::string plain = root.CreateCertificate("plain.test");
  const std::string marked = root.CreateCertificate("marked.test");
  const std::string broken = root.CreateCertificate("broken.test");
  ASSERT_FALSE(plain.empty() || marked.empty() || broken.empty());
  // Renewable as far as renew-due can tell, but not due for a long time.
  Json::Value renew;
  renew["domain"] = "marked.test";
  renew["email"] = "admin@zeph.test";
  renew["directory_url"] = config["directory_url"];
  WriteFile(root.Archive("/" + marked + "/renew.json"), JsonCompact(renew), 0600);
  ASSERT_GT(DaysLeft(root.Archive("/" + marked + "/cert.pem")), 30);
  // Renewable, with a cert.pem that holds no certificate.
  WriteFile(root.Archive("/" + broken + "/renew.json"), "{}", 0600);
  unlink(root.Archive("/" + broken + "/cert.pem").c_str());
  WriteFile(root.Archive("/" + broken + "/cert.pem"), "garbage", 0400);
  // Catalogue entries that are no certificate directory of the archive.
  Json::Value info = root.Info();
  info["Gone99"] = info[plain];
  info["../x"] = info[plain];
  WriteFile(root.Archive("/INFO"), JsonCompact(info));
  const auto before = Snapshot(root.Archive("/" + marked));

  ToolAnswer a = RenewDue();
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
  EXPECT_EQ(a.answer["renewed"], Json::Value(Json::arrayValue));
  EXPECT_EQ(a.answer["failed"], Json::Value(Json::arrayValue));
  EXPECT_EQ(a.answer["skipped"].asInt(), 5);
  EXPECT_NE(a.err.find(broken + ": cannot read"), std::string::npos) << a.err;
  EXPECT_EQ(Snapshot(root.Archive("/" + marked)), before);
  EXPECT_FALSE(root.LogContains("handle le renew."));
}

TEST(RenewDueTool, RenewsDueCertificatesThroughTheModuleAgainstPebble) {
  if (!LegoInstalled() || !PebbleInstalled()) {
    GTEST_SKIP() << "pebble or lego is not installed (scripts/setup.sh installs both)";
  }
  ApplianceRoot root;
  MakeDirs(root.Path("/pebble"));
  Pebble pebble(root.Path("/pebble"));
  std::string error;
  ASSERT_TRUE(pebble.Start(&error)) << error;
  WriteToolConfig(PebbleToolConfig(pebble));

  CallResult r = root.Call(kLe, "create",
                           "{\"desc\": \"public\", \"domain_name\": \"www.zeph.test\", "
                           "\"email\": \"owner@zeph.test\"}");
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
  const std::string first = Serial(cert);
  ASSERT_EQ(Serial(root.Path(kWebCert)), first);

  // pebble's certificates are valid for years: not due within 30 days, nor
  // within one day less than they have left.
  const int left = DaysLeft(cert);
  ASSERT_GT(left, 30);
  for (const std::vector<std::string>& options :
       std::vector<std::vector<std::string>>{{}, {"--days", std::to_string(left)}}) {
    ToolAnswer a = RenewDue(options);
    ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err;
    EXPECT_EQ(a.answer["renewed"], Json::Value(Json::arrayValue));
    EXPECT_EQ(a.answer["skipped"].asInt(), 2);
  }
  EXPECT_EQ(Serial(cert), first);
  EXPECT_FALSE(root.LogContains("handle le renew."));

  // Due: renewed through the module (which runs the root's copy of the
  // tool while renew-due runs) and deployed to the web service. The
  // self-signed certificate, due as well, is not renewable.
  ASSERT_EQ(CheckExpiry(root.Archive("/" + self + "/cert.pem"), 36500, nullptr),
            Expiry::kDue);
  ToolAnswer a = RenewDue({"--days", "36500"});
  ASSERT_EQ(a.error(), 0) << a.msg() << "\n" << a.err << "\n" << root.Log();
  EXPECT_EQ(Strings(a.answer["renewed"]), std::vector<std::string>{id});
  EXPECT_EQ(a.answer["failed"], Json::Value(Json::arrayValue));
  EXPECT_EQ(a.answer["skipped"].asInt(), 1);
  const std::string second = Serial(cert);
  EXPECT_NE(second, first);
  EXPECT_EQ(Serial(root.Path(kWebCert)), second);
  EXPECT_TRUE(root.LogContains("handle le renew. [" + id + "]"));
  Json::Value renew;
  ASSERT_TRUE(JsonFromFile(renew, root.Archive("/" + id + "/renew.json")));
  EXPECT_EQ(renew["serial"].asString(), second);

  // The ACME server is gone: the renewal fails with the module's code for
  // it, and the certificate and its deployment stay as they were.
  pebble.Stop();
  const auto kept = Snapshot(root.Archive("/" + id));
  a = RenewDue({"--days", "36500"});
  EXPECT_EQ(a.error(), 111);
  EXPECT_NE(a.msg().find("1 of 1"), std::string::npos) << a.msg();
  Json::Value failed(Json::arrayValue);
  failed[0]["id"] = id;
  failed[0]["code"] = 5520;
  EXPECT_EQ(a.answer["failed"], failed);
  EXPECT_EQ(a.answer["renewed"], Json::Value(Json::arrayValue));
  EXPECT_EQ(a.answer["skipped"].asInt(), 1);
  EXPECT_EQ(Snapshot(root.Archive("/" + id)), kept);
  EXPECT_EQ(Serial(root.Path(kWebCert)), second);
}

// Certificates in use that will not renew themselves and run out within
// 30 days get one warning a day in the event log, also when the module
// cannot be loaded and nothing renews at all.
TEST(RenewDueTool, WarnsOnceADayAboutCertificatesInUseThatRunOut) {
  ApplianceRoot root;
  Json::Value config;
  config["directory_url"] = "https://127.0.0.1:" + std::to_string(FreePort()) + "/dir";
  WriteToolConfig(config);
  struct Row {
    const char* id;
    int days;          // left; negative: expired that long ago
    bool renewable;
    const char* services;  // display names in INFO, "" for none
    const char* days_left; // text4 of its warning; nullptr: no warning
  };
  const Row kRows[] = {
      {"Self10", 10, false, "Web administration", "10"},
      {"Idle10", 10, false, "", nullptr},
      {"Acme10", 10, true, "Web administration|FTP", "10"},  // its renewal fails
      {"Gone03", -3, false, "FTP", "-3"},
      {"Long90", 90, false, "FTP", nullptr},
      {"Acme90", 90, true, "FTP", nullptr},
  };
  Json::Value info(Json::objectValue);
  for (const Row& row : kRows) {
    const std::string dir = root.Archive(std::string("/") + row.id);
    MakeCertificate(dir, row.days, std::string(row.id) + ".test", row.days < 0 ? row.days - 30 : 0);
    if (row.renewable) {
      Json::Value renew;
      renew["domain"] = std::string(row.id) + ".test";
      renew["email"] = "admin@zeph.test";
      renew["directory_url"] = config["directory_url"];
      WriteFile(dir + "/renew.json", JsonCompact(renew), 0600);
    }
    Json::Value& entry = info[row.id];
    entry["desc"] = row.id;
    entry["services"] = Json::Value(Json::arrayValue);
    std::string names = row.services;
    for (size_t start = 0; !names.empty() && start <= names.size();) {
      const size_t bar = names.find('|', start);
      Json::Value service;
      service["display_name"] = names.substr(start, bar - start);
      entry["services"].append(service);
      if (bar == std::string::npos) break;
      start = bar + 1;
    }
  }
  WriteFile(root.Archive("/INFO"), JsonCompact(info));

  auto warnings = [&root] {
    std::vector<Json::Value> out;
    for (const Json::Value& e : root.Events()) {
      if (e["message_id"].asUInt() == 0x12B00013u) out.push_back(e);
    }
    return out;
  };
  ToolAnswer a = RenewDue();
  EXPECT_EQ(a.error(), 111) << a.msg();  // Acme10 cannot be renewed
  EXPECT_EQ(Strings(a.answer["warned"]),
            (std::vector<std::string>{"Acme10", "Gone03", "Self10"}));
  std::vector<Json::Value> events = warnings();
  ASSERT_EQ(events.size(), 3u);
  std::map<std::string, Json::Value> by_name;
  for (const Json::Value& e : events) by_name[e["text1"].asString()] = e;
  for (const Row& row : kRows) {
    const std::string name = std::string(row.id) + ".test";
    SCOPED_TRACE(name);
    ASSERT_EQ(by_name.count(name), row.days_left ? 1u : 0u);
    if (!row.days_left) continue;
    const Json::Value& e = by_name[name];
    EXPECT_EQ(e["level"].asInt(), 2);
    EXPECT_EQ(e["type"].asInt(), 1);
    std::string services = row.services;
    for (size_t bar; (bar = services.find('|')) != std::string::npos;) {
      services.replace(bar, 1, ", ");
    }
    EXPECT_EQ(e["text2"].asString(), services);
    EXPECT_EQ(e["text4"].asString(), row.days_left);
    EXPECT_EQ(e["text3"].asString().size(), 10u) << e["text3"];
  }
  EXPECT_EQ(ModeOf(root.Path("/usr/zeph/etc/letsencrypt/expiry-warnings.json")), 0600u);

  // Once a day: a second run says nothing new; a warning of yesterday is
  // repeated today.
  a = RenewDue();
  EXPECT_EQ(a.answer["warned"], Json::Value(Json::arrayValue));
  EXPECT_EQ(warnings().size(), 3u);
  Json::Value record;
  ASSERT_TRUE(JsonFromFile(record, root.Path("/usr/zeph/etc/letsencrypt/expiry-warnings.json")));
  EXPECT_EQ(record.getMemberNames(), (std::vector<std::string>{"Acme10", "Gone03", "Self10"}));
  record["Self10"] = "2000-01-01";
  WriteFile(root.Path("/usr/zeph/etc/letsencrypt/expiry-warnings.json"), JsonCompact(record),
            0600);
  a = RenewDue();
  EXPECT_EQ(Strings(a.answer["warned"]), std::vector<std::string>{"Self10"});
  EXPECT_EQ(warnings().size(), 4u);

  // Without the module nothing renews, and the warnings come all the same.
  unlink(root.Path("/usr/zeph/etc/letsencrypt/expiry-warnings.json").c_str());
  ScopedEnv env("ZEPH_CERT_MODULE", root.Path("/nowhere.so").c_str());
  a = RenewDue();
  EXPECT_EQ(a.error(), 112);
  EXPECT_EQ(Strings(a.answer["warned"]),
            (std::vector<std::string>{"Acme10", "Gone03", "Self10"}));
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
