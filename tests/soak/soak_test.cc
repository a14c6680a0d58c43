// Soak: eight creations at once through a running zeph-webapid must each
// sign with their own authority. Then eight workers call the module at
// once on one root, half through the zephcert command and half through the
// server, mixing every method that changes the archive (requests made,
// renewed and signed, and their exports, among them) with the ones that
// read it, while a checker keeps reading the catalogue. Every exported
// request must come with its own key. At the end, with everything quiet,
// the archive must be whole: every registered service bound to one
// existing certificate, every catalogued certificate complete and a
// self-signed one signed by its own authority, the default existing, no
// staging or backup directory left and no lock held.
//
// ZEPH_SOAK_SECONDS sets how long the workers run (default 60).
#include <gtest/gtest.h>
#include <json/json.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <map>
#include <mutex>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "server/webapid_test_support.h"
#include "test_support.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_lock.h"

namespace {

using ZEPH::test::CommandResult;
using ZEPH::test::CurlReply;
using ZEPH::test::DirEntries;
using ZEPH::test::Exists;
using ZEPH::test::ReadFile;
using ZEPH::test::ServerProcess;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;

const char kArchive[] = "/usr/zeph/etc/certificate/_archive";
const char kCertDir[] = "/usr/zeph/etc/certificate";

int SoakSeconds() {
  const char* s = getenv("ZEPH_SOAK_SECONDS");
  int n = s != nullptr ? atoi(s) : 0;
  return n > 0 ? n : 60;
}

std::string ServiceKey(const Json::Value& service) {
  return service["subscriber"].asString() + "/" + service["service"].asString();
}

// What one call answered, whichever way it went.
struct Answer {
  bool transport_ok = false;  // a well-formed answer came back
  bool success = false;
  int code = 0;
  Json::Value data;
  std::string raw;
  std::string download;  // the archive an export handed out
};

class Soak {
 public:
  explicit Soak(const TempRoot& root) : root_(root) {}

  // Sets up the root (three services besides the web interface), starts
  // the server. False with a reason when that fails.
  bool Start(std::string& why) {
    CommandResult r = Zephcert({"init"});
    if (r.status != 0) {
      why = "init: " + r.err;
      return false;
    }
    Json::Value services;
    if (!ZEPH::JsonFromFile(services, Archive("/SERVICES")) || !services.isArray() ||
        services.size() != 1) {
      why = "SERVICES of init";
      return false;
    }
    for (int i = 1; i <= 3; ++i) {
      Json::Value s = services[0];
      s["subscriber"] = "soak";
      s["service"] = "svc" + std::to_string(i);
      s["display_name"] = "Soak service " + std::to_string(i);
      services.append(s);
    }
    WriteFile(Archive("/SERVICES"), ZEPH::JsonCompact(services) + "\n");
    services_ = services;
    // The new services start on the default certificate; its set is also
    // the import material.
    std::string id = ReadFile(Archive("/DEFAULT"));
    if (!id.empty() && id.back() == '\n') id.pop_back();
    Json::Value bind;
    for (Json::ArrayIndex i = 1; i < services.size(); ++i) {
      Json::Value& setting = bind["settings"].append(Json::objectValue);
      setting["service"] = services[i];
      setting["id"] = id;
      setting["old_id"] = "";
    }
    Answer a = Call(false, "ZEPH.Core.Certificate.Service", "set", bind, 0);
    if (!a.success || !a.data["err_settings"].empty()) {
      why = "binding the services: " + a.raw;
      return false;
    }
    cert_pem_ = ReadFile(Archive("/" + id + "/cert.pem"));
    key_pem_ = ReadFile(Archive("/" + id + "/privkey.pem"));
    if (cert_pem_.empty() || key_pem_.empty()) {
      why = "default certificate files";
      return false;
    }
    // A request to sign, as an administrator's client would bring one.
    const CommandResult made = ZEPH::test::Run(
        {"/usr/bin/openssl", "req", "-new", "-newkey", "rsa:2048", "-nodes", "-keyout",
         root_.Path("/upload.key"), "-out", UploadRequest(), "-subj", "/CN=client.example"});
    if (made.status != 0) {
      why = "upload request: " + made.err;
      return false;
    }
    server_.reset(new ServerProcess(root_.dir()));
    if (!server_->listening()) {
      why = "server: " + server_->Log();
      return false;
    }
    token_ = server_->Token();
    return true;
  }

  void Run(int workers, int seconds) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    std::vector<std::thread> threads;
    for (int i = 0; i < workers; ++i) {
      threads.emplace_back([this, i, end] { Work(i, end); });
    }
    std::thread checker([this] {
      while (!stop_) {
        CheckWhileBusy();
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
      }
    });
    for (std::thread& t : threads) t.join();
    stop_ = true;
    checker.join();
  }

  // `count` CRT creates at once through the server. The ids of those that
  // succeeded; a reason for each that did not goes into `failures`.
  std::vector<std::string> CreateAtOnce(int count, std::vector<std::string>& failures) {
    std::vector<Answer> answers(static_cast<size_t>(count));
    std::vector<std::thread> threads;
    for (int i = 0; i < count; ++i) {
      threads.emplace_back([this, i, &answers] {
        answers[static_cast<size_t>(i)] =
            Call(true, "ZEPH.Core.Certificate.CRT", "create",
                 CreateParams(100 + i, "at once " + std::to_string(i)), 100 + i);
      });
    }
    for (std::thread& t : threads) t.join();
    std::vector<std::string> ids;
    for (const Answer& a : answers) {
      if (a.success) {
        ids.push_back(a.data["id"].asString());
      } else {
        failures.push_back(a.raw.empty() ? "code " + std::to_string(a.code) : a.raw);
      }
    }
    return ids;
  }

  ServerProcess& server() { return *server_; }
  std::vector<std::string> violations() {
    std::lock_guard<std::mutex> lock(mutex_);
    return violations_;
  }
  std::map<std::string, std::pair<int, int>> counts() {
    std::lock_guard<std::mutex> lock(mutex_);
    return counts_;
  }
  int checks() const { return checks_; }
  const Json::Value& services() const { return services_; }

  std::string Archive(const std::string& rest) const {
    return root_.Path(std::string(kArchive) + rest);
  }

 private:
  CommandResult Zephcert(std::vector<std::string> args) {
    args.insert(args.begin(), {ZEPH::test::BinDir() + "/zephcert", "--root", root_.dir()});
    return ZEPH::test::Run(args);
  }

  void Violation(const std::string& what) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (violations_.size() < 50) violations_.push_back(what);
  }

  static Answer Parse(const std::string& text) {
    Answer a;
    a.raw = text;
    Json::Value v;
    if (!ZEPH::JsonParse(text, v) || !v.isObject() || !v["success"].isBool()) return a;
    a.transport_ok = true;
    a.success = v["success"].asBool();
    a.data = a.success ? v["data"] : v["error"]["data"];
    a.code = a.success ? 0 : v["error"]["code"].asInt();
    return a;
  }

  // One call, through zephcert or the server. `files` (import through the
  // server) become multipart file parts.
  Answer Call(bool via_server, const std::string& api, const std::string& method,
              const Json::Value& params, int worker,
              const std::map<std::string, std::string>& files = {}) {
    const std::string json = ZEPH::JsonCompact(params);
    if (!via_server) {
      std::vector<std::string> args = {"call", api, method, json};
      std::string out;
      if (method == "export") {
        out = Scratch(worker) + "/export.zip";
        args.push_back("--output");
        args.push_back(out);
      }
      CommandResult r = Zephcert(args);
      Answer a = Parse(r.out);
      if (r.status != (a.success ? 0 : 1)) {
        a.transport_ok = false;
        a.raw = "status " + std::to_string(r.status) + ": " + r.out + r.err;
      }
      if (!out.empty()) {
        a.download = ReadFile(out);
        unlink(out.c_str());
      }
      return a;
    }
    std::vector<std::string> args = {"-X", "POST"};
    if (files.empty()) {
      args.insert(args.end(), {"-H", "Content-Type: application/json", "-d", json});
    } else {
      const std::string params_file = Scratch(worker) + "/params.json";
      WriteFile(params_file, json);
      args.insert(args.end(), {"-F", "params=<" + params_file});
      for (const auto& f : files) args.insert(args.end(), {"-F", f.first + "=@" + f.second});
    }
    CurlReply reply = ZEPH::test::Curl(server_->port(), "/api/" + api + "/1/" + method,
                                       args, token_, Scratch(worker));
    Answer a;
    if (method == "export" && reply.status == 200 && reply.body.compare(0, 2, "PK") == 0) {
      a.transport_ok = a.success = true;
      a.download = reply.body;
      return a;
    }
    if (method == "export" && reply.status == 204) {
      // The certificate went away before its files were read: no download.
      a.transport_ok = true;
      a.code = 5501;
      return a;
    }
    if (reply.status != 200) {
      a.raw = "HTTP " + std::to_string(reply.status) + ": " + reply.body + reply.error;
      return a;
    }
    return Parse(reply.body);
  }

  std::string Scratch(int worker) const {
    const std::string dir = root_.Path("/soak-" + std::to_string(worker));
    ZEPH::test::MakeDirs(dir);
    return dir;
  }

  // A random id of the catalogue (read without the lock, as list does).
  std::string SomeId(std::mt19937& rng) {
    Json::Value info;
    if (!ZEPH::JsonFromFile(info, Archive("/INFO")) || !info.isObject() || info.empty()) {
      return "";
    }
    const std::vector<std::string> ids = info.getMemberNames();
    return ids[rng() % ids.size()];
  }

  // The certificate `service` is bound to in INFO now ("" when none).
  std::string BoundTo(const Json::Value& service) {
    Json::Value info;
    if (!ZEPH::JsonFromFile(info, Archive("/INFO")) || !info.isObject()) return "";
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& s : info[id]["services"]) {
        if (ServiceKey(s) == ServiceKey(service)) return id;
      }
    }
    return "";
  }

  static Json::Value Subject(const std::string& prefix, const std::string& cn) {
    Json::Value p(Json::objectValue);
    for (const char* key : {"country", "state", "city", "organization", "department",
                            "email"}) {
      p[prefix + key] = "";
    }
    p[prefix + "country"] = "TW";
    p[prefix + "organization"] = "Soak";
    p[prefix + "common_name"] = cn;
    return p;
  }

  // CRT create's parameters: the smallest keys the server's TLS accepts
  // (its security level refuses 1024-bit ones, and the web service may get
  // this set).
  static Json::Value CreateParams(int worker, const std::string& desc) {
    Json::Value p = Subject("", "soak" + std::to_string(worker) + ".example");
    const Json::Value ca = Subject("ca_", "Soak CA " + std::to_string(worker));
    for (const auto& m : ca.getMemberNames()) p[m] = ca[m];
    p["desc"] = desc;
    p["key_length"] = 2048;
    p["ca_key_length"] = 2048;
    return p;
  }

  std::string UploadRequest() const { return root_.Path("/upload.csr"); }

  // CSR create, renew or sign, then the export of its product. An exported
  // request must come with the key it was made with.
  Answer RequestAndExport(bool via_server, int worker, std::mt19937& rng) {
    const unsigned kind = rng() % 3;
    Answer a;
    if (kind == 0) {
      Json::Value p = Subject("", "request" + std::to_string(worker) + ".example");
      p["key_length"] = 1024;
      a = Call(via_server, "ZEPH.Core.Certificate.CSR", "create", p, worker);
    } else if (kind == 1) {
      Json::Value p;
      p["id"] = SomeId(rng);
      a = Call(via_server, "ZEPH.Core.Certificate.CSR", "renew", p, worker);
    } else {
      Json::Value p;
      p["id"] = SomeId(rng);
      p["days"] = 30;
      p["alias"] = "client.example";
      if (via_server) {
        a = Call(true, "ZEPH.Core.Certificate.CSR", "sign", p, worker,
                 {{"csr", UploadRequest()}});
      } else {
        p["csr"] = "client.csr";
        p["csr_tmp"] = UploadRequest();
        a = Call(false, "ZEPH.Core.Certificate.CSR", "sign", p, worker);
      }
    }
    if (!a.success) return a;
    Json::Value p;
    p["file"] = kind == 2 ? "signed_set" : "csr_set";
    const Answer exported = Call(via_server, "ZEPH.Core.Certificate", "export", p, worker);
    if (kind != 2 && !exported.download.empty()) {
      const std::string zip = Scratch(worker) + "/request.zip";
      WriteFile(zip, exported.download);
      if (!ZEPH::test::RequestFitsKey(ZEPH::test::ZipMember(zip, "server.csr"),
                                      ZEPH::test::ZipMember(zip, "server.key"))) {
        Violation("an exported request does not belong to the key beside it");
      }
    }
    return a;
  }

  void Work(int worker, std::chrono::steady_clock::time_point end) {
    std::mt19937 rng(1000u + static_cast<unsigned>(worker));
    const bool via_server = worker % 2 == 1;
    int n = 0;
    while (std::chrono::steady_clock::now() < end) {
      ++n;
      const unsigned pick = rng() % 100;
      std::string op;
      Answer a;
      if (pick < 12) {
        op = "list";
        a = Call(via_server, "ZEPH.Core.Certificate.CRT", "list", Json::objectValue, worker);
        if (a.success && !a.data["certificates"].isArray()) {
          Violation("list without certificates: " + a.raw);
        }
      } else if (pick < 24) {
        op = "create";
        Json::Value p = CreateParams(
            worker, "soak " + std::to_string(worker) + "/" + std::to_string(n));
        p["as_default"] = rng() % 4 == 0;
        a = Call(via_server, "ZEPH.Core.Certificate.CRT", "create", p, worker);
      } else if (pick < 33) {
        op = "set";
        Json::Value p;
        p["id"] = SomeId(rng);
        p["desc"] = "set by " + std::to_string(worker);
        p["as_default"] = rng() % 3 == 0;
        a = Call(via_server, "ZEPH.Core.Certificate.CRT", "set", p, worker);
      } else if (pick < 45) {
        op = "service";
        Json::Value setting;
        setting["service"] = services_[static_cast<Json::ArrayIndex>(rng() % services_.size())];
        setting["id"] = SomeId(rng);
        // As the page does: the certificate the service uses now.
        setting["old_id"] = BoundTo(setting["service"]);
        Json::Value p;
        p["settings"].append(setting);
        a = Call(via_server, "ZEPH.Core.Certificate.Service", "set", p, worker);
      } else if (pick < 55) {
        op = "import";
        const std::string dir = Scratch(worker);
        WriteFile(dir + "/cert.pem", cert_pem_);
        WriteFile(dir + "/key.pem", key_pem_);
        Json::Value p;
        p["desc"] = "imported by " + std::to_string(worker);
        if (via_server) {
          a = Call(true, "ZEPH.Core.Certificate", "import", p, worker,
                   {{"cert", dir + "/cert.pem"}, {"key", dir + "/key.pem"}});
        } else {
          p["cert_tmp"] = dir + "/cert.pem";
          p["key_tmp"] = dir + "/key.pem";
          a = Call(false, "ZEPH.Core.Certificate", "import", p, worker);
        }
      } else if (pick < 62) {
        op = "export";
        Json::Value p;
        p["id"] = SomeId(rng);
        p["file"] = "archive";
        a = Call(via_server, "ZEPH.Core.Certificate", "export", p, worker);
      } else if (pick < 72) {
        op = "request";
        a = RequestAndExport(via_server, worker, rng);
      } else if (pick < 77) {
        op = "recreate";
        Json::Value p;
        p["id"] = SomeId(rng);
        a = Call(via_server, "ZEPH.Core.Certificate.CRT", "recreate", p, worker);
      } else if (pick < 97) {
        op = "delete";
        Json::Value p;
        p["ids"].append(SomeId(rng));
        p["ids"].append(SomeId(rng));
        a = Call(via_server, "ZEPH.Core.Certificate.CRT", "delete", p, worker);
      } else {
        op = "reset";
        a = Call(via_server, "ZEPH.Core.Certificate", "reset", Json::objectValue, worker);
      }
      if (!a.transport_ok) Violation(op + ": no well-formed answer: " + a.raw);
      // Races with deletes legitimately fail a call: the general failure,
      // or invalid parameters where a method checks the id it is given
      // (signing also needs an authority, which imported sets lack).
      const bool checks_id = op == "export" || op == "request" || op == "recreate";
      if (a.transport_ok && !a.success && a.code != 5501 &&
          !(checks_id && a.code == 5503)) {
        Violation(op + ": unexpected code " + std::to_string(a.code) + ": " + a.raw);
      }
      std::lock_guard<std::mutex> lock(mutex_);
      (a.success ? counts_[op].first : counts_[op].second)++;
    }
  }

  // What must hold at every moment: INFO parses as an object of entries
  // with a services array, and no service stands in two entries.
  void CheckWhileBusy() {
    ++checks_;
    const std::string text = ReadFile(Archive("/INFO"));
    Json::Value info;
    if (!ZEPH::JsonParse(text, info) || !info.isObject()) {
      Violation("INFO does not parse: [" + text.substr(0, 200) + "]");
      return;
    }
    std::set<std::string> bound;
    for (const std::string& id : info.getMemberNames()) {
      const Json::Value& services = info[id]["services"];
      if (!services.isArray()) {
        Violation("INFO entry " + id + " without services");
        continue;
      }
      for (const Json::Value& s : services) {
        if (!bound.insert(ServiceKey(s)).second) {
          Violation("service " + ServiceKey(s) + " bound twice: " + text);
        }
      }
    }
  }

  const TempRoot& root_;
  std::unique_ptr<ServerProcess> server_;
  std::string token_;
  Json::Value services_;
  std::string cert_pem_;
  std::string key_pem_;
  std::atomic<bool> stop_{false};
  std::atomic<int> checks_{0};
  std::mutex mutex_;
  std::vector<std::string> violations_;
  std::map<std::string, std::pair<int, int>> counts_;
};

TEST(Soak, ConcurrentCallsKeepTheArchiveWhole) {
  TempRoot root;
  Soak soak(root);
  std::string why;
  ASSERT_TRUE(soak.Start(why)) << why;

  // Eight creations at once over HTTPS: each succeeds and signs with its
  // own authority.
  std::vector<std::string> failures;
  for (const std::string& id : soak.CreateAtOnce(8, failures)) {
    EXPECT_TRUE(ZEPH::test::SignedByOwnAuthority(soak.Archive("/" + id))) << id;
  }
  for (const std::string& f : failures) ADD_FAILURE() << "creation at once: " << f;

  soak.Run(8, SoakSeconds());

  for (const std::string& v : soak.violations()) ADD_FAILURE() << v;
  EXPECT_GT(soak.checks(), 0);
  for (const auto& c : soak.counts()) {
    std::cout << c.first << ": " << c.second.first << " succeeded, " << c.second.second
              << " failed\n";
  }
  // Each kind of change got through at least once.
  auto counts = soak.counts();
  for (const char* op : {"list", "create", "set", "service", "import", "export",
                         "request", "recreate", "delete"}) {
    EXPECT_GT(counts[op].first, 0) << op;
  }
  EXPECT_TRUE(soak.server().Alive());

  // Quiet now: the whole archive must be consistent.
  Json::Value info;
  ASSERT_TRUE(ZEPH::JsonFromFile(info, soak.Archive("/INFO")));
  ASSERT_TRUE(info.isObject());
  std::map<std::string, std::vector<std::string>> bound;  // service -> ids
  for (const std::string& id : info.getMemberNames()) {
    for (const char* file : {"cert.pem", "privkey.pem", "fullchain.pem"}) {
      EXPECT_TRUE(Exists(soak.Archive("/" + id + "/" + file))) << id << "/" << file;
    }
    for (const Json::Value& s : info[id]["services"]) bound[ServiceKey(s)].push_back(id);
    // A self-signed set signs with its own authority.
    if (Exists(soak.Archive("/" + id + "/zeph-ca-cert.pem"))) {
      EXPECT_TRUE(ZEPH::test::SignedByOwnAuthority(soak.Archive("/" + id))) << id;
    }
  }
  for (const Json::Value& s : soak.services()) {
    const std::string key = ServiceKey(s);
    ASSERT_EQ(bound[key].size(), 1u) << key;
    // The service's directory holds a complete set.
    for (const char* file : {"cert.pem", "privkey.pem", "fullchain.pem"}) {
      EXPECT_TRUE(Exists(root.Path(std::string(kCertDir) + "/" + key + "/" + file)))
          << key << "/" << file;
    }
  }
  std::string def = ReadFile(soak.Archive("/DEFAULT"));
  ASSERT_FALSE(def.empty());
  EXPECT_EQ(def.back(), '\n');
  def.pop_back();
  EXPECT_TRUE(info.isMember(def)) << def;

  for (const std::string& l : ZEPH::test::StagingLeftovers(root.Path(kCertDir))) {
    ADD_FAILURE() << "left behind: " << l;
  }

  for (const std::string& name : DirEntries(root.Path("/tmp"))) {
    if (name.size() < 5 || name.compare(name.size() - 5, 5, ".lock") != 0) continue;
    int fd = -1;
    const std::string path = root.Path("/tmp/" + name);
    EXPECT_NE(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 0, &fd), 0)
        << "still held: " << name;
    if (fd >= 0) QLIBCFileUnlockByFile(fd);
  }
  EXPECT_EQ(soak.server().Stop(), 0);
}

}  // namespace
