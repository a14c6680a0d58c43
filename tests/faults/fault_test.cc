// Faults met by the methods, called through zephcert: one failed call (the
// fault shim) at each occurrence, a full disk, a read-only archive, a stuck
// lock. The method answers success or one of its codes and the archive stays
// whole: INFO readable, no service bound twice, every set kept or whole.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <initializer_list>
#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "test_support.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace test {
namespace {

constexpr char kEtc[] = "/usr/zeph/etc";
constexpr char kCertDir[] = "/usr/zeph/etc/certificate";
constexpr char kWebDir[] = "/usr/zeph/etc/certificate/system/default";
// Where the CSR methods leave their products and the export its archive.
constexpr char kGenDir[] = "/usr/zeph/etc/ssl/.gen";
constexpr const char* kCertFiles[] = {"cert.pem", "privkey.pem", "fullchain.pem"};
// Beyond this many occurrences a method is not expected to go.
constexpr int kMaxOccurrence = 60;
// The small disk (the tree is ~150 KiB); every method gets through with kMaxRoom free.
constexpr char kDiskSize[] = "2m";
constexpr off_t kMaxRoom = 256 * 1024;
constexpr off_t kPage = 4096;

using Ids = std::set<std::string>;
using Files = std::map<std::string, std::string>;  // name -> content

Json::Value Object(std::initializer_list<std::pair<const char*, Json::Value>> members) {
  Json::Value object(Json::objectValue);
  for (const auto& m : members) object[m.first] = m.second;
  return object;
}

Files FilesOf(const std::string& dir) {
  Files files;
  std::error_code ec;
  for (const auto& entry : std::filesystem::directory_iterator(dir, ec)) {
    files[entry.path().filename()] = ReadFile(entry.path());
  }
  return files;
}

// Every entry below `dir` -> its mode and, for a file, its content.
Files Contents(const std::string& dir) {
  Files tree;
  std::error_code ec;
  for (std::filesystem::recursive_directory_iterator it(dir, ec), end; !ec && it != end;
       it.increment(ec)) {
    struct stat st;
    const std::string path = it->path().string();
    if (lstat(path.c_str(), &st) != 0) continue;
    tree[path.substr(dir.size())] =
        std::to_string(st.st_mode) + " " + (S_ISREG(st.st_mode) ? ReadFile(path) : "");
  }
  return tree;
}

// Whether `text` is whole PEM: a BEGIN line first, an END line last.
bool IsPem(const std::string& text) {
  return text.rfind("-----BEGIN ", 0) == 0 && text.find("-----END ") != std::string::npos &&
         text.size() > 6 && text.compare(text.size() - 6, 6, "-----\n") == 0;
}

// The answer of a call: success or one of `codes`, the exit status matching.
void CheckAnswer(int status, const Json::Value& answer, const std::set<int>& codes,
                 const std::string& what) {
  ASSERT_TRUE((status == 0 || status == 1) && answer["success"].isBool()) << what;
  EXPECT_EQ(status == 0, answer["success"].asBool()) << what;
  EXPECT_TRUE(answer["success"].asBool() || codes.count(answer["error"]["code"].asInt()) == 1)
      << what;
}

// A root with a second certificate (other_). zephcert runs through enter_ (a fault or a
// mount namespace); the test reads files through view_ (the holder's /proc/<pid>/root).
class ArchiveFixture : public ::testing::Test {
 public:
  void SetUp() override {
    ASSERT_EQ(Zephcert({"init"}).status, 0);
    other_ = Create(false);
  }

  std::string View(const std::string& path) const { return view_ + root_.Path(path); }
  std::string Archive(const std::string& rest) const { return View(kArchive + rest); }
  std::string ArchiveFile(const std::string& id, const std::string& file) const {
    return ReadFile(Archive("/" + id + "/" + file));
  }

  CommandResult Zephcert(std::vector<std::string> args) {
    args.insert(args.begin(), {BinDir() + "/zephcert", "--root", root_.dir()});
    args.insert(args.begin(), enter_.begin(), enter_.end());
    return ZEPH::test::Run(args);
  }

  // One method call; its answer in `answer` (null when it is not JSON).
  CommandResult Call(const std::string& api, const std::string& method, const Json::Value& params,
                     Json::Value& answer, const std::vector<std::string>& more = {}) {
    std::vector<std::string> args = {"call", api, method, JsonCompact(params)};
    args.insert(args.end(), more.begin(), more.end());
    CommandResult r = Zephcert(args);
    answer = Json::Value();
    JsonParse(r.out, answer);
    return r;
  }

  // CRT create's parameters; with an `id`, they replace its set.
  static Json::Value CreateParams(bool as_default, const std::string& id = "") {
    Json::Value p = Object({{"desc", "made for a fault"}, {"as_default", as_default},
                            {"key_length", 1024}, {"ca_key_length", 1024}});
    if (!id.empty()) p["id"] = id;
    for (const std::string prefix : {"", "ca_"}) {
      for (const char* key : {"state", "city", "organization", "department", "email"}) {
        p[prefix + key] = "";
      }
      p[prefix + "country"] = "TW";
      p[prefix + "common_name"] = prefix.empty() ? "fault.example" : "Fault CA";
    }
    return p;
  }

  std::string Create(bool as_default) {
    Json::Value answer;
    CommandResult r = Call(kCrt, "create", CreateParams(as_default), answer);
    EXPECT_TRUE(r.status == 0 && answer["data"]["id"].isString()) << r.out << r.err;
    return answer["data"]["id"].asString();
  }

  Json::Value ImportParams() {
    WriteFile(root_.Path("/up-cert.pem"), ArchiveFile(other_, "cert.pem"));
    WriteFile(root_.Path("/up-key.pem"), ArchiveFile(other_, "privkey.pem"));
    return Object({{"desc", "imported"}, {"cert_tmp", root_.Path("/up-cert.pem")},
                   {"key_tmp", root_.Path("/up-key.pem")}});
  }

  Json::Value SetParams(const std::string& desc) {
    return Object({{"id", other_}, {"desc", desc}, {"as_default", true}});
  }

  Json::Value Info() {
    Json::Value info;
    JsonFromFile(info, Archive("/INFO"));
    return info;
  }

  // The certificate the web service is bound to in INFO, and its service.
  std::string WebBinding(Json::Value* service = nullptr) {
    const Json::Value info = Info();
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& s : info[id]["services"]) {
        if (s["subscriber"] == "system" && s["service"] == "default") {
          if (service != nullptr) *service = s;
          return id;
        }
      }
    }
    ADD_FAILURE() << "web service not bound: " << JsonCompact(info);
    return "";
  }

  static Json::Value Move(const Json::Value& service, const std::string& from,
                          const std::string& to) {
    Json::Value p;
    p["settings"].append(Object({{"service", service}, {"id", to}, {"old_id", from}}));
    return p;
  }

  Json::Value MoveWebService() {
    Json::Value service;
    const std::string from = WebBinding(&service);
    std::string to;
    for (const std::string& id : Info().getMemberNames()) {
      if (id != from) to = id;
    }
    return Move(service, from, to);
  }

  using Snapshot = std::map<std::string, Files>;  // id -> its files
  Snapshot Take() {
    Snapshot s;
    for (const std::string& id : Info().getMemberNames()) {
      for (const char* file : kCertFiles) s[id][file] = ArchiveFile(id, file);
    }
    return s;
  }

  // INFO readable, no service bound twice, each of `before` but `gone` kept, its files
  // unchanged unless replaced; each replaced set (`all`: every set) whole: whole PEM files,
  // its key, a full chain beginning with its certificate.
  void CheckArchive(const Snapshot& before, const Ids& gone, const std::string& what,
                    bool all = false) {
    Json::Value info;
    ASSERT_TRUE(JsonFromFile(info, Archive("/INFO")) && info.isObject()) << what;
    Ids bound;
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& s : info[id]["services"]) {
        const std::string key = s["subscriber"].asString() + "/" + s["service"].asString();
        EXPECT_TRUE(bound.insert(key).second) << what << ": " << key << " bound twice";
      }
      if (!all && replaced_.count(id) == 0) continue;
      for (const char* file : kCertFiles) {
        EXPECT_TRUE(IsPem(ArchiveFile(id, file))) << what << ": " << id << "/" << file << " cut";
      }
      const std::string cert = ArchiveFile(id, "cert.pem");
      EXPECT_TRUE(CertificateFitsKey(cert, ArchiveFile(id, "privkey.pem")))
          << what << ": " << id << " has a key of another certificate";
      EXPECT_EQ(ArchiveFile(id, "fullchain.pem").compare(0, cert.size(), cert), 0)
          << what << ": " << id << "/fullchain.pem does not begin with its certificate";
    }
    for (const auto& cert : before) {
      if (gone.count(cert.first) != 0) continue;
      EXPECT_TRUE(info.isMember(cert.first)) << what << ": lost " << cert.first;
      for (const auto& file : cert.second) {
        const bool kept = ArchiveFile(cert.first, file.first) == file.second;
        EXPECT_TRUE(replaced_.count(cert.first) || kept)
            << what << ": " << cert.first << "/" << file.first << " changed";
      }
    }
  }

  TempRoot root_;
  std::string other_, view_;
  Ids replaced_;
  std::vector<std::string> enter_;
};

class Faults;
struct Outcome {
  int status;
  Json::Value answer;
  std::string out;
  bool fired;  // whether the fault met the method
  bool success() const { return answer["success"].asBool(); }
};

// A method swept, and what it may do when one of its calls fails.
struct Method {
  const char* name;
  const char* api;
  const char* method;
  std::set<int> codes;  // its error codes; empty: it always succeeds
  Ids calls;            // the sweep must fail each, and meet no other
  // Made before each attempt; the ids it may remove go in `gone`.
  Json::Value (*prepare)(Faults& f, Ids& gone);
  void (*check)(Faults& f, const Outcome& o, const std::string& what) = nullptr;
  void (*setup)(Faults& f) = nullptr;  // runs once before the sweep
  const char* unchanged = "";  // a directory left as it was
  // Calls on paths count below this directory of the root ("": uploads, downloads too).
  std::string scope = "/usr/zeph";
};
void PrintTo(const Method& m, std::ostream* os) { *os << m.name; }

const Ids kAllCalls = {"fopen", "rename", "write", "open", "posix_spawn", "chown"};
// Methods that rewrite INFO (and start key and certificate tools).
const Ids kRewritesInfo = {"fopen", "rename", "write", "open", "posix_spawn"};

class Faults : public ArchiveFixture, public ::testing::WithParamInterface<Method> {
 public:
  Outcome RunWithFault(const std::string& call, int at, const std::string& match,
                       const Json::Value& params) {
    const Method& m = GetParam();
    const std::string report = root_.Path("/fault-report");
    unlink(report.c_str());
    enter_ = {"/usr/bin/env", "LD_PRELOAD=" + BinDir() + "/libzeph_fault_shim.so",
              "ZEPH_FAULT_CALL=" + call, "ZEPH_FAULT_AT=" + std::to_string(at),
              "ZEPH_FAULT_MATCH=" + match, "ZEPH_FAULT_REPORT=" + report,
              // A sanitizer build wants its runtime first; the shim comes first.
              "ASAN_OPTIONS=verify_asan_link_order=0"};
    std::vector<std::string> more;
    if (m.method == std::string("export")) more = {"--output", Download()};
    Json::Value answer;
    const CommandResult r = Call(m.api, m.method, params, answer, more);
    enter_.clear();
    return {r.status, answer, r.out, Exists(report)};
  }

  void Sweep() {
    const Method& m = GetParam();
    if (m.setup != nullptr) m.setup(*this);
    if (HasFailure()) return;
    Ids met;
    for (const std::string call : {"rename", "write", "open", "fopen", "posix_spawn", "chown"}) {
      const bool scoped = call != "posix_spawn" && call != "chown";
      int at = 1;
      for (; at <= kMaxOccurrence; ++at) {
        Ids gone;
        const Json::Value params = m.prepare(*this, gone);
        if (HasFailure()) return;
        const Snapshot before = Take();
        const Files kept = m.unchanged[0] != '\0' ? Contents(root_.Path(m.unchanged)) : Files();
        const Outcome o = RunWithFault(call, at, scoped ? root_.Path(m.scope) : "", params);
        const std::string what = std::string(m.method) + " with " + call + " failing at " +
                                 std::to_string(at) + ": " + o.out;
        // Status 2: zephcert failed to copy an upload, called nothing, answers nothing.
        if (o.status == 2) {
          EXPECT_EQ(o.out, "") << what;
        } else {
          CheckAnswer(o.status, o.answer, m.codes, what);
        }
        CheckArchive(before, gone, what);
        EXPECT_TRUE(m.unchanged[0] == '\0' || kept == Contents(root_.Path(m.unchanged)))
            << what << ": " << m.unchanged << " changed";
        if (m.check != nullptr) m.check(*this, o, what);
        if (HasFailure()) return;
        if (!o.fired) {
          EXPECT_TRUE(o.success()) << what << ": got through untouched";
          break;
        }
        met.insert(call);
      }
      EXPECT_LE(at, kMaxOccurrence) << call;
    }
    EXPECT_EQ(met, m.calls) << "the calls that met a fault";
  }

  void ExpectDeployed(const std::string& what) {
    for (const char* file : kCertFiles) {
      EXPECT_EQ(ReadFile(root_.Path(std::string(kWebDir) + "/" + file)), ArchiveFile(def_, file))
          << what << ": the web service's " << file << " is not that of " << def_;
    }
  }

  // The CSR methods' request and key: matching, 1024 bits, for the subject asked for.
  static void CheckRequest(Faults& f, const Outcome& o, const std::string& what) {
    if (!o.success()) return;
    const std::string cn = f.GetParam().method == std::string("create") ? "csr.example"
                                                                        : "fault.example";
    const std::string csr = ReadFile(f.Gen("server.csr")), key = ReadFile(f.Gen("server.key"));
    EXPECT_TRUE(RequestFitsKey(csr, key)) << what << ": no request of the key";
    EXPECT_EQ(KeyBits(key), 1024) << what;
    EXPECT_EQ(SubjectCommonName(csr), cn) << what;
  }

  std::string Gen(const std::string& name) const { return root_.Path(kGenDir + ("/" + name)); }
  std::string Download() const { return root_.Path("/export.zip"); }
  void UseDefault() {
    def_ = WebBinding();
    replaced_.insert(def_);
  }

  // Export never answers an error. A download is the archive made, one of archives_, and
  // removes the files handed out once (sources_); a failed one leaves them and no file.
  static void CheckExport(Faults& f, const Outcome& o, const std::string& what) {
    const Json::Value& download = o.answer["download"];
    EXPECT_TRUE(o.fired || download.isObject()) << what;
    for (const auto& s : f.sources_) {
      EXPECT_TRUE(download.isObject() ? !Exists(s.first) : ReadFile(s.first) == s.second)
          << what << ": " << s.first << (download.isObject() ? " still there" : " lost");
    }
    if (!download.isObject()) {
      EXPECT_FALSE(Exists(f.Download())) << what << ": a download that failed";
      return;
    }
    const std::string zip = ReadFile(f.Gen("archive.zip"));
    EXPECT_TRUE(ReadFile(f.Download()) == zip) << what << ": not the archive made";
    EXPECT_EQ(download["bytes"].asUInt64(), zip.size()) << what;
    Files files;
    for (const std::string& n : ZipMembers(f.Download())) files[n] = ZipMember(f.Download(), n);
    EXPECT_TRUE(std::find(f.archives_.begin(), f.archives_.end(), files) != f.archives_.end())
        << what << ": an archive of " << files.size() << " files, not of the set";
  }

  // The Let's Encrypt tool's stand-in "issues" the prepared set ("a" or "b") the certificate
  // lacks into the directory the tool writes (new-cert: named by -c; renew: the cert's).
  void InstallLetsEncryptStandIn() {
    MakeSet("a", other_);
    MakeSet("b", Create(false));
    WriteFile(root_.Path("/usr/zeph/sbin/zeph-letsencrypt"),
              "#!/bin/sh\narchive='" + root_.Path(kArchive) + "'\nsets='" +
                  root_.Path("/le-sets") + "'\n" + R"sh(command=$1; shift; name=
while [ $# -gt 0 ]; do [ "$1" = -c ] && { name=$2; shift; }; shift; done
other() { if cmp -s "$archive/$1/cert.pem" "$sets/a/cert.pem"; then echo b; else echo a; fi; }
put() { for f in "$sets/$1"/*; do rm -f "$2/${f##*/}" && cp "$f" "$2/" || return 1; done; }
case "$command" in
  new-cert) [ -d "$archive/$name" ] && put "$(other "${name%.temp}")" "$archive/$name" ;;
  renew) [ -f "$archive/$name/renew.json" ] && put "$(other "$name")" "$archive/$name" ;;
  revoke) true ;;
  *) false ;;
esac || { echo '{"error": 105, "msg": "stand-in failed"}'; exit 1; }
echo '{"error": 0}'
)sh",
              0755);
  }

  void MakeSet(const std::string& name, const std::string& id) {
    const std::string cert = ArchiveFile(id, "cert.pem"), ca = ArchiveFile(id, "zeph-ca-cert.pem");
    le_sets_[name] = {{"cert.pem", cert}, {"chain.pem", ca}, {"fullchain.pem", cert + ca},
                      {"privkey.pem", ArchiveFile(id, "privkey.pem")},
                      {"renew.json", "{\"domain\": \"le.example\"}\n"}};
    MakeDirs(root_.Path("/le-sets/" + name));
    for (const auto& f : le_sets_[name]) {
      WriteFile(root_.Path("/le-sets/" + name + "/" + f.first), f.second, 0600);
    }
  }

  // The stand-in's set held by certificate `id` ("" for neither).
  std::string SetOf(const std::string& id) {
    for (const auto& set : le_sets_) {
      bool all = true;
      for (const auto& f : set.second) all = all && ArchiveFile(id, f.first) == f.second;
      if (all) return set.first;
    }
    return "";
  }

  // After issuing or renewing def_: the stand-in's other set, deployed.
  void CheckReissued(const Outcome& o, const std::string& what) {
    if (!o.success()) return;
    EXPECT_EQ(o.answer["data"]["id"].asString(), def_) << what;
    EXPECT_EQ(SetOf(def_), held_ == "a" ? "b" : "a") << what;
    ExpectDeployed(what);
  }

  static Json::Value LetsEncryptParams(const std::string& id) {
    Json::Value p = Object({{"desc", "from Let's Encrypt"}, {"domain_name", "le.example"},
                            {"email", "admin@le.example"}});
    if (!id.empty()) p["id"] = id;
    return p;
  }

  // The web service's certificate, when the method replaces it; what it held before.
  std::string def_, held_;
  Json::Value info_, params_;  // INFO before the sweep; the export's parameters
  std::vector<Files> archives_;
  Files sources_;  // path -> content
  std::map<std::string, Files> le_sets_;
};

const Json::Value kCsrParams =
    Object({{"common_name", "csr.example"}, {"key_length", 1024}, {"country", ""}, {"state", ""},
            {"city", ""}, {"organization", ""}, {"department", ""}, {"email", ""}});

Json::Value CsrWork(Faults& f, const Json::Value& params) {
  unlink(f.Gen("server.key").c_str());
  unlink(f.Gen("server.csr").c_str());
  return params;
}

Json::Value ExportWork(Faults& f, Ids&) {
  unlink(f.Download().c_str());
  for (const auto& s : f.sources_) WriteFile(s.first, s.second, 0400);
  return f.params_;
}

Json::Value NoParams(Faults&, Ids&) { return Json::Value(Json::objectValue); }

const Method kMethods[] = {
    {"Create", kCrt, "create", {5501}, kRewritesInfo,
     [](Faults&, Ids&) { return Faults::CreateParams(true); }},
    // Replace mode redeploys the web service's certificate.
    {"CreateReplacingACertificateInUse", kCrt, "create", {5501}, kAllCalls,
     [](Faults& f, Ids&) { return Faults::CreateParams(false, f.def_); },
     nullptr, [](Faults& f) { f.UseDefault(); }},
    {"Import", kCertApi, "import", {5501, 5510, 5511, 5515}, kRewritesInfo,
     [](Faults& f, Ids&) { return f.ImportParams(); }},
    {"SetProperties", kCrt, "set", {5501}, {"fopen", "rename", "write", "open"},
     [](Faults& f, Ids&) { return f.SetParams("changed"); }},
    {"ServiceSet", kService, "set", {5501}, kAllCalls,
     [](Faults& f, Ids&) { return f.MoveWebService(); }},
    {"Delete", kCrt, "delete", {5501}, kRewritesInfo,
     [](Faults& f, Ids& gone) {
       const std::string id = f.Create(false);
       gone.insert(id);
       Json::Value p;
       p["ids"].append(id);
       return p;
     }},
    {"Reset", kCertApi, "reset", {5501}, kAllCalls,
     [](Faults& f, Ids& gone) {
       const Json::Value info = f.Info();
       for (const std::string& id : info.getMemberNames()) {
         if (info[id]["user_deletable"].asBool()) gone.insert(id);
       }
       return Json::Value(Json::objectValue);
     }},
    // New key material for the certificate in use, redeployed; INFO alone.
    {"RecreateACertificateInUse", kCrt, "recreate", {5501},
     {"fopen", "rename", "open", "posix_spawn", "chown"},
     [](Faults& f, Ids&) {
       f.held_ = f.ArchiveFile(f.def_, "privkey.pem");
       return Object({{"id", f.def_}});
     },
     [](Faults& f, const Outcome& o, const std::string& what) {
       if (!o.success()) return;
       EXPECT_NE(f.ArchiveFile(f.def_, "privkey.pem"), f.held_) << what << ": no new key";
       EXPECT_TRUE(o.answer["data"]["restart_httpd"].asBool()) << what;
       f.ExpectDeployed(what);
     },
     [](Faults& f) { f.UseDefault(); }},
    {"CsrCreate", kCsr, "create", {5501}, {"fopen", "posix_spawn"},
     [](Faults& f, Ids&) { return CsrWork(f, kCsrParams); }, Faults::CheckRequest, nullptr,
     kCertDir},
    {"CsrRenew", kCsr, "renew", {5501}, {"fopen", "posix_spawn"},
     [](Faults& f, Ids&) { return CsrWork(f, Object({{"id", f.other_}})); },
     Faults::CheckRequest, nullptr, kCertDir},
    // Signing answers success even when it made nothing; what it leaves is signed by the
    // authority. zephcert's private copy of the upload opens and writes under faults too.
    {"CsrSign", kCsr, "sign", {5501}, {"fopen", "open", "posix_spawn", "write"},
     [](Faults& f, Ids&) {
       unlink(f.Gen("server.crt").c_str());
       return Object({{"id", f.other_}, {"days", 30}, {"csr", "client.csr"},
                      {"csr_tmp", f.root_.Path("/upload.csr")},
                      {"alias", "client.example;10.1.2.3"}});
     },
     [](Faults& f, const Outcome& o, const std::string& what) {
       EXPECT_TRUE(o.fired || Exists(f.Gen("server.crt"))) << what;
       if (!Exists(f.Gen("server.crt"))) return;
       const std::string crt = ReadFile(f.Gen("server.crt"));
       EXPECT_EQ(SubjectCommonName(crt), "client.example") << what;
       EXPECT_TRUE(IssuedBy(crt, f.held_)) << what << ": not signed by the authority";
     },
     [](Faults& f) {
       const CommandResult made = ZEPH::test::Run(
           {"/usr/bin/openssl", "req", "-new", "-newkey", "rsa:1024", "-nodes", "-keyout",
            f.root_.Path("/upload.key"), "-out", f.root_.Path("/upload.csr"), "-subj",
            "/CN=client.example"});
       ASSERT_EQ(made.status, 0) << made.err;
       f.held_ = f.ArchiveFile(f.other_, "zeph-ca-cert.pem");
     },
     kCertDir, ""},
    // An unreadable feature switch: self-signed sets count as unsupported, no authority files.
    {"ExportArchive", kCertApi, "export", {}, {"fopen", "write", "open", "posix_spawn"},
     ExportWork, Faults::CheckExport,
     [](Faults& f) {
       Files files;
       for (const char* name :
            {"cert.pem", "privkey.pem", "zeph-ca-cert.pem", "zeph-ca-privkey.pem"}) {
         files[name] = f.ArchiveFile(f.other_, name);
       }
       f.archives_ = {files,
                      {{"cert.pem", files["cert.pem"]}, {"privkey.pem", files["privkey.pem"]}}};
       f.params_ = Object({{"id", f.other_}, {"file", "archive"}});
     },
     kCertDir, ""},
    {"ExportRequestAndKey", kCertApi, "export", {}, {"write", "open", "fopen", "posix_spawn"},
     ExportWork, Faults::CheckExport,
     [](Faults& f) {
       Json::Value answer;
       ASSERT_EQ(f.Call(kCsr, "create", kCsrParams, answer).status, 0);
       Files files;
       for (const char* name : {"server.csr", "server.key"}) {
         files[name] = f.sources_[f.Gen(name)] = ReadFile(f.Gen(name));
       }
       f.archives_ = {files};
       f.params_ = Object({{"file", "csr_set"}});
     },
     kCertDir, ""},
    {"ExportSignedCertificate", kCertApi, "export", {}, {"write", "open", "posix_spawn"},
     ExportWork, Faults::CheckExport,
     [](Faults& f) {
       const std::string crt = f.ArchiveFile(f.other_, "cert.pem");
       MakeDirs(f.root_.Path(kGenDir));
       f.sources_ = {{f.Gen("server.crt"), crt}};
       f.archives_ = {{{"server.crt", crt}}};
       f.params_ = Object({{"file", "signed_set"}});
     },
     kCertDir, ""},
    // The lists only read: the certificate list answers its general
    // failure when it cannot read INFO, the account list always success.
    {"CrtList", kCrt, "list", {5501}, {"fopen", "open"}, NoParams,
     [](Faults& f, const Outcome& o, const std::string& what) {
       if (!o.success()) return;
       Ids listed;
       for (const Json::Value& c : o.answer["data"]["certificates"]) {
         EXPECT_TRUE(f.info_.isMember(c["id"].asString())) << what;
         listed.insert(c["id"].asString());
       }
       EXPECT_TRUE(o.fired || listed.size() == f.info_.size()) << what;
     },
     [](Faults& f) { f.info_ = f.Info(); }, "/usr/zeph"},
    {"LetsEncryptAccountList", "ZEPH.Core.Certificate.LetsEncrypt.Account", "list", {}, {"open"},
     NoParams,
     [](Faults&, const Outcome& o, const std::string& what) {
       Ids listed;
       for (const auto& e : o.answer["data"]["email"]) listed.insert(e["contact"].asString());
       const Ids all = {"a@le.example", "b@le.example"};
       EXPECT_TRUE(std::includes(all.begin(), all.end(), listed.begin(), listed.end())) << what;
       EXPECT_TRUE(o.fired || listed == all) << what;
     },
     [](Faults& f) {
       for (const std::string contact : {"a@le.example", "b@le.example"}) {
         const std::string dir = f.root_.Path("/usr/zeph/etc/letsencrypt/account/" + contact);
         MakeDirs(dir);
         WriteFile(dir + "/info.json", "{\"contact\": \"" + contact + "\"}\n", 0600);
       }
     },
     "/usr/zeph"},
    // A new certificate is the tool's set; INFO records its properties when it can be
    // rewritten (when not, the issuance still succeeds and the certificate stays unlisted).
    {"LetsEncryptCreate", kLe, "create", {5501}, kRewritesInfo,
     [](Faults&, Ids&) { return Faults::LetsEncryptParams(""); },
     [](Faults& f, const Outcome& o, const std::string& what) {
       if (!o.success()) return;
       const std::string id = o.answer["data"]["id"].asString();
       EXPECT_EQ(f.SetOf(id), "a") << what;
       const Json::Value info = f.Info();
       EXPECT_TRUE(!info.isMember(id) || info[id]["desc"] == "from Let's Encrypt") << what;
     },
     [](Faults& f) { f.InstallLetsEncryptStandIn(); }},
    // Issuing for the certificate in use replaces its set and redeploys it.
    {"LetsEncryptCreateReplacingACertificateInUse", kLe, "create", {5501}, kAllCalls,
     [](Faults& f, Ids&) {
       f.held_ = f.SetOf(f.def_);
       return Faults::LetsEncryptParams(f.def_);
     },
     [](Faults& f, const Outcome& o, const std::string& what) {
       f.CheckReissued(o, what);
       EXPECT_TRUE(!o.success() || o.answer["data"]["restart_httpd"].asBool()) << what;
     },
     [](Faults& f) { f.InstallLetsEncryptStandIn(); f.UseDefault(); }},
    // The tool renews in the certificate's directory, the module redeploys; INFO stays.
    {"LetsEncryptRenew", kLe, "renew", {5501}, {"fopen", "rename", "open", "posix_spawn", "chown"},
     [](Faults& f, Ids&) {
       f.held_ = f.SetOf(f.def_);
       EXPECT_NE(f.held_, "") << f.def_ << " holds no set of the tool";
       return Object({{"id", f.def_}});
     },
     [](Faults& f, const Outcome& o, const std::string& what) { f.CheckReissued(o, what); },
     [](Faults& f) {
       f.InstallLetsEncryptStandIn();
       f.UseDefault();
       Json::Value answer;
       ASSERT_EQ(f.Call(kLe, "create", Faults::LetsEncryptParams(f.def_), answer).status, 0)
           << answer;
     }},
};

TEST_P(Faults, Sweep) { Sweep(); }
INSTANTIATE_TEST_SUITE_P(Methods, Faults, ::testing::ValuesIn(kMethods),
                         [](const auto& row) { return std::string(row.param.name); });

// A change under a storage fault: its parameters, made before each attempt, its codes, and
// (when set) whether the work is whole after the attempt (by default a success is).
struct Change {
  const char* api;
  const char* method;
  std::function<Json::Value()> params;
  std::set<int> codes;
  std::function<bool(const Json::Value& answer, const std::string& what)> whole = nullptr;
};

class StorageFaults : public ArchiveFixture {
 protected:
  // Whether a tool's complaint is the system's refusal (EPERM, EACCES).
  static bool NotAllowed(const std::string& complaint) {
    return complaint.find("not permitted") != std::string::npos ||
           complaint.find("ermission denied") != std::string::npos;
  }

  ~StorageFaults() override { if (holder_ != nullptr) pclose(holder_); }

  // Runs `script` (no single quotes; "$1" the root) in a private mount namespace held by a
  // waiting shell, and the calls from here on in it; `why`: why not, if the machine refuses.
  void EnterPrivateMounts(const std::string& script, std::string& why) {
    if (!Exists("/usr/bin/unshare") || !Exists("/usr/bin/nsenter")) {
      why = "needs unshare and nsenter (util-linux) for a private mount namespace";
      return;
    }
    const std::string ready = root_.Path("/mounts-ready"), log = root_.Path("/mounts-log");
    holder_ = popen(("/usr/bin/unshare --mount --propagation private /bin/sh -c 'set -e\n" +
                     script + "\necho $$ > \"$1/mounts-ready.new\"\nmv \"$1/mounts-ready.new\" " +
                     "\"$1/mounts-ready\"\nread line' sh " + root_.dir() + " > " + log +
                     " 2>&1 || echo failed > " + ready).c_str(), "w");
    for (int i = 0; i < 3000 && !Exists(ready); ++i) usleep(10000);
    const std::string pid = ReadFile(ready).substr(0, ReadFile(ready).find('\n'));
    if (pid.empty() || pid == "failed") {
      ASSERT_TRUE(NotAllowed(ReadFile(log))) << "setting up the mounts failed: " << ReadFile(log);
      why = "this machine allows no private mount namespace with its own mounts: " + ReadFile(log);
      return;
    }
    enter_ = {"/usr/bin/nsenter", "--mount=/proc/" + pid + "/ns/mnt", "--"};
    view_ = "/proc/" + pid + "/root";
    const CommandResult r = ZEPH::test::Run({enter_[0], enter_[1], "/bin/true"});
    if (r.status != 0) {
      ASSERT_TRUE(NotAllowed(r.err)) << "entering the mount namespace failed: " << r.err;
      why = "this machine does not let the test enter its mount namespace: " + r.err;
      return;
    }
    EXPECT_EQ(ReadFile("/proc/self/mountinfo").find(root_.dir()), std::string::npos);
  }

  void Fill(off_t room) {
    const std::string filler = View(std::string(kEtc) + "/filler");
    unlink(filler.c_str());
    const int fd = open(filler.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << filler;
    const std::string block(kPage, '\0');
    off_t size = 0;
    ssize_t n;
    while ((n = write(fd, block.data(), block.size())) > 0) size += n;
    const bool cut = size >= room && ftruncate(fd, size - room) == 0;
    close(fd);
    ASSERT_TRUE(cut) << "filler of " << size << " bytes, " << room << " to free";
    struct statvfs disk;
    ASSERT_EQ(statvfs(View(kEtc).c_str(), &disk), 0);
    ASSERT_EQ(static_cast<off_t>(disk.f_bavail * disk.f_frsize), room);
  }

  // Calls `c`; whether it failed (an error or a failed setting). Then: the archive unharmed,
  // INFO and DEFAULT as they were if it failed, every set whole, no work or backup directory
  // left (INFO.temp is harmless), the web service holding the whole set of a certificate.
  bool CallUnharmed(const Change& c, const Json::Value& params, const std::string& fault,
                    Json::Value& answer) {
    const Snapshot archive = Take();
    const std::string info_before = ReadFile(Archive("/INFO"));
    const std::string default_before = ReadFile(Archive("/DEFAULT"));
    const CommandResult r = Call(c.api, c.method, params, answer);
    const std::string what = std::string(c.api) + " " + c.method + " " + fault + ": " + r.out;
    CheckAnswer(r.status, answer, c.codes, what + r.err);
    const bool failed = !answer["success"].asBool() || !answer["data"]["err_settings"].empty();
    CheckArchive(archive, {}, what, true);
    if (failed) {
      EXPECT_EQ(ReadFile(Archive("/INFO")), info_before) << what;
      EXPECT_EQ(ReadFile(Archive("/DEFAULT")), default_before) << what;
      if (c.api == std::string(kService)) {
        EXPECT_EQ(answer["data"]["err_settings"], params["settings"]) << what;
      }
    }
    const Json::Value info = Info();
    const std::string def = ReadFile(Archive("/DEFAULT"));
    EXPECT_TRUE(def.size() == 7 && def[6] == '\n' && info.isMember(def.substr(0, 6)))
        << what << ": DEFAULT is \"" << def << "\"";
    EXPECT_EQ(StagingLeftovers(View(kCertDir)), std::vector<std::string>{}) << what;
    const Files web = FilesOf(View(kWebDir));
    bool served = false;
    for (const std::string& id : info.getMemberNames()) {
      bool all = true;
      for (const char* f : kCertFiles) all = all && web.count(f) && web.at(f) == ArchiveFile(id, f);
      served = served || all;
    }
    EXPECT_TRUE(served) << what << ": the web service has no whole set of a certificate";
    return failed;
  }

  FILE* holder_ = nullptr;
};

TEST_F(StorageFaults, FullDisk) {
  MakeDirs(root_.Path("/disk"));
  std::string why;
  ASSERT_NO_FATAL_FAILURE(EnterPrivateMounts(
      std::string("mount -t tmpfs -o size=") + kDiskSize + ",mode=0755 zephtest-disk \"$1/disk\"\n"
          "cp -a \"$1" + kEtc + "/.\" \"$1/disk/\"\nmount --bind \"$1/disk\" \"$1" + kEtc + "\"",
      why));
  if (!why.empty()) GTEST_SKIP() << why;
  struct statvfs disk;
  ASSERT_EQ(statvfs(View(kEtc).c_str(), &disk), 0);
  ASSERT_LT(disk.f_blocks * disk.f_frsize, 3u * 1024 * 1024) << "not on the small disk";
  // Create and import may succeed unlisted; the work is whole once INFO has the id.
  auto recorded = [this](const Json::Value& answer, const std::string&) {
    return Info().isMember(answer["data"]["id"].asString());
  };
  // A first deployment to a service has no backup to fall back on: its directory ends up
  // with the certificate's whole set or none; a setting not through is listed as failed.
  Json::Value first, first_params;
  const std::string subscriber_dir = View(std::string(kCertDir) + "/zephtest");
  Files archived;
  for (const char* file :
       {"cert.pem", "privkey.pem", "fullchain.pem", "chain.pem", "zeph-ca-cert.pem"}) {
    if (Exists(Archive("/" + other_ + "/" + file))) archived[file] = ArchiveFile(other_, file);
  }
  auto deployed_whole = [&](const Json::Value& answer, const std::string& what) {
    const Files deployed = FilesOf(subscriber_dir + "/first");
    EXPECT_TRUE(deployed.empty() || deployed == archived)
        << what << ": the service has " << deployed.size() << " files, not the whole set";
    bool bound = false;
    const Json::Value services = Info()[other_]["services"];
    for (const Json::Value& s : services) bound = bound || s == first;
    if (deployed.empty() || !bound) {
      EXPECT_EQ(answer["data"]["err_settings"], first_params["settings"]) << what;
    }
    return bound && !deployed.empty();
  };
  const Change changes[] = {
      {kCrt, "create", [] { return CreateParams(true); }, {5501}, recorded},
      {kCertApi, "import", [&] { return ImportParams(); }, {5501, 5515}, recorded},
      {kCrt, "set", [&] { return SetParams("changed on a full disk"); }, {5501}},
      {kService, "set", [&] { return MoveWebService(); }, {}},
      {kService, "set",
       [&] {
         WebBinding(&first);
         first["display_name"] = "Fault service";
         first["subscriber"] = "zephtest";
         first["service"] = "first";
         std::filesystem::remove_all(subscriber_dir);
         return first_params = Move(first, "", other_);
       },
       {}, deployed_whole},
  };
  for (const Change& c : changes) {
    bool through = false;
    for (off_t room = 0; room <= kMaxRoom && !through; room += kPage) {
      const Json::Value params = c.params();
      ASSERT_NO_FATAL_FAILURE(Fill(room));
      const std::string fault = "with " + std::to_string(room) + " bytes free";
      Json::Value answer;
      const bool failed = CallUnharmed(c, params, fault, answer);
      // Whatever the method writes needs room.
      EXPECT_TRUE(room > 0 || failed) << c.method << " " << fault << ": " << answer;
      const bool whole = !c.whole || c.whole(answer, c.method + (" " + fault));
      if (HasFailure()) return;
      through = !failed && whole;
    }
    EXPECT_TRUE(through) << c.api << " " << c.method << " never got through";
  }
}

TEST_F(StorageFaults, ReadOnlyArchive) {
  // The web service off the default certificate, so that deleting it moves the service.
  const std::string serving = Create(false);
  Json::Value service, answer;
  const std::string def = WebBinding(&service);
  Call(kService, "set", Move(service, def, serving), answer);
  ASSERT_TRUE(answer["success"].asBool() && !answer["data"].isMember("err_settings")) << answer;
  const std::string archive = std::string("\"$1") + kArchive + "\"";
  std::string why;
  ASSERT_NO_FATAL_FAILURE(EnterPrivateMounts(
      "mount --bind " + archive + " " + archive + "\nmount -o remount,bind,ro " + archive, why));
  if (!why.empty()) GTEST_SKIP() << why;
  Json::Value ids;
  ids.append(other_);
  ids.append(serving);
  const Change changes[] = {
      {kCrt, "create", [] { return CreateParams(true); }, {5501}},
      {kCertApi, "import", [&] { return ImportParams(); }, {5501}},
      {kCrt, "set", [&] { return SetParams("changed on a read-only archive"); }, {5501}},
      {kService, "set", [&] { return MoveWebService(); }, {}},
      {kCrt, "delete", [&] { return Object({{"ids", ids}}); }, {5501}},
      {kCertApi, "reset", [] { return Json::Value(Json::objectValue); }, {5501}},
  };
  for (const Change& c : changes) {
    const Json::Value params = c.params();
    EXPECT_TRUE(CallUnharmed(c, params, "on a read-only archive", answer)) << answer;
    EXPECT_TRUE(c.method != std::string("delete") || answer["error"]["data"]["err_ids"] == ids);
    if (HasFailure()) return;
  }
}

// A lock never let go: a change that needs it gives up after its wait, answers its failure
// and leaves the archive and the web files alone; once the lock is free it goes through.
TEST_F(StorageFaults, StuckLockChangesGiveUpAfterTheirWait) {
  Json::Value web;
  const std::string first = WebBinding(&web);
  const std::string info_lock = root_.Path("/tmp/zephcertificate_info.lock");
  // INFO's lock: a property change waits 10 s, a binding's look-up 30 s; the
  // web service's copy lock: a binding waits 60 s.
  const std::pair<std::string, Change> rows[] = {
      {info_lock,
       {kCrt, "set", [&] { return Object({{"id", other_}, {"desc", "never"}}); }, {5501}}},
      {info_lock, {kService, "set", [&] { return Move(web, first, first); }, {}}},
      {root_.Path("/tmp/certificate_system_default.lock"),
       {kService, "set", [&] { return Move(web, first, other_); }, {}}},
  };
  const Files deployed = FilesOf(View(kWebDir));
  for (const auto& [lock, change] : rows) {
    const int fd = open(lock.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    ASSERT_EQ(flock(fd, LOCK_EX), 0) << lock;
    Json::Value answer;
    EXPECT_TRUE(CallUnharmed(change, change.params(), "with " + lock + " held", answer));
    close(fd);
    if (change.api == std::string(kService)) {
      EXPECT_EQ(answer["data"]["restart_httpd"], false) << answer;
    }
    EXPECT_EQ(FilesOf(View(kWebDir)), deployed);
  }
  for (const auto& [lock, change] : rows) {
    Json::Value answer;
    Call(change.api, change.method, change.params(), answer);
    EXPECT_TRUE(answer["success"].asBool() && !answer["data"].isMember("err_settings"))
        << lock << ": " << answer;
  }
  EXPECT_EQ(Info()[other_]["desc"].asString(), "never");
  EXPECT_EQ(FilesOf(View(kWebDir)).at("cert.pem"), ArchiveFile(other_, "cert.pem"));
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
