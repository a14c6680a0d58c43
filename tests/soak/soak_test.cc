// Soak: eight creations at once through zeph-webapid, then eight workers
// calling every method on one root for ZEPH_SOAK_SECONDS (default 60), half
// through zephcert, half through the server, while INFO is checked; at the
// end the archive is whole and no lock is held.
#include <gtest/gtest.h>
#include <json/json.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <initializer_list>
#include <map>
#include <memory>
#include <mutex>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "server/webapid_test_support.h"
#include "test_support.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_lock.h"

namespace ZEPH {
namespace test {
namespace {

const char kCertDir[] = "/usr/zeph/etc/certificate";

std::string ServiceKey(const Json::Value& service) {
  return service["subscriber"].asString() + "/" + service["service"].asString();
}

// A subject for the CSR methods; for CRT create the authority's (`ca`), a description and
// 2048-bit keys (the server's TLS refuses 1024-bit ones, and the web service may get it).
Json::Value Subject(const std::string& cn, const std::string& ca = "") {
  Json::Value p(Json::objectValue);
  for (const std::string prefix : {"", "ca_"}) {
    for (const char* key : {"state", "city", "department", "email"}) p[prefix + key] = "";
    p[prefix + "country"] = "TW";
    p[prefix + "organization"] = "Soak";
    p[prefix + "common_name"] = prefix.empty() ? cn : ca;
    if (ca.empty()) break;
  }
  p["key_length"] = 1024;
  if (ca.empty()) return p;
  p["key_length"] = p["ca_key_length"] = 2048;
  p["desc"] = "made for " + cn;
  return p;
}

Json::Value Object(std::initializer_list<std::pair<const char*, Json::Value>> members) {
  Json::Value object(Json::objectValue);
  for (const auto& m : members) object[m.first] = m.second;
  return object;
}

struct Answer {
  bool transport_ok = false;  // a well-formed answer came back
  bool success = false;
  int code = 0;
  Json::Value data;
  std::string raw, download;  // download: the archive an export handed out
};

Answer Parse(const std::string& text) {
  Answer a;
  a.raw = text;
  Json::Value v;
  if (!JsonParse(text, v) || !v.isObject() || !v["success"].isBool()) return a;
  a.transport_ok = true;
  a.success = v["success"].asBool();
  a.data = a.success ? v["data"] : v["error"]["data"];
  a.code = a.success ? 0 : v["error"]["code"].asInt();
  return a;
}

class Soak : public ::testing::Test {
 protected:
  // Three services besides the web interface bound to the default certificate (whose set is
  // also the import material), a request to sign, and the server.
  void SetUp() override {
    ASSERT_EQ(ZEPH::test::Run({BinDir() + "/zephcert", "--root", root_.dir(), "init"}).status, 0);
    Json::Value bind;
    ASSERT_TRUE(JsonFromFile(services_, Archive("/SERVICES")) && services_.size() == 1u);
    std::string id = ReadFile(Archive("/DEFAULT"));
    id = id.substr(0, id.find('\n'));
    for (int i = 1; i <= 3; ++i) {
      Json::Value& s = services_.append(services_[0]);
      s["subscriber"] = "soak";
      s["service"] = "svc" + std::to_string(i);
      s["display_name"] = "Soak service " + std::to_string(i);
      bind["settings"].append(Object({{"service", s}, {"id", id}, {"old_id", ""}}));
    }
    WriteFile(Archive("/SERVICES"), JsonCompact(services_) + "\n");
    const Answer a = Call(false, "ZEPH.Core.Certificate.Service", "set", bind, 0);
    ASSERT_TRUE(a.success && a.data["err_settings"].empty()) << a.raw;
    cert_pem_ = ReadFile(Archive("/" + id + "/cert.pem"));
    key_pem_ = ReadFile(Archive("/" + id + "/privkey.pem"));
    const CommandResult made =
        ZEPH::test::Run({"/usr/bin/openssl", "req", "-new", "-newkey", "rsa:2048", "-nodes",
                         "-keyout", root_.Path("/upload.key"), "-out", root_.Path("/upload.csr"),
                         "-subj", "/CN=client.example"});
    ASSERT_EQ(made.status, 0) << made.err;
    server_.reset(new ServerProcess(root_.dir()));
    ASSERT_TRUE(server_->listening()) << server_->Log();
    token_ = server_->Token();
  }

  std::string Archive(const std::string& rest) const { return root_.Path(kArchive + rest); }
  std::string Scratch(int worker) const {
    const std::string dir = root_.Path("/soak-" + std::to_string(worker));
    MakeDirs(dir);
    return dir;
  }

  void Violation(const std::string& what) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (violations_.size() < 50) violations_.push_back(what);
  }

  // One call, through zephcert or the server; `files` are uploads.
  Answer Call(bool via_server, const std::string& api, const std::string& method,
              Json::Value params, int worker,
              const std::map<std::string, std::string>& files = {}) {
    const std::string out = Scratch(worker) + "/export.zip";
    if (!via_server) {
      for (const auto& f : files) params[f.first + "_tmp"] = f.second;
      if (files.count("csr")) params["csr"] = "client.csr";
      std::vector<std::string> args = {BinDir() + "/zephcert", "--root", root_.dir(),
                                       "call", api, method, JsonCompact(params)};
      if (method == "export") args.insert(args.end(), {"--output", out});
      const CommandResult r = ZEPH::test::Run(args);
      Answer a = Parse(r.out);
      if (r.status != (a.success ? 0 : 1)) {
        a.transport_ok = false;
        a.raw = "status " + std::to_string(r.status) + ": " + r.out + r.err;
      }
      a.download = ReadFile(out);  // empty but for an export
      unlink(out.c_str());
      return a;
    }
    std::vector<std::string> args = {"-X", "POST"};
    if (files.empty()) {
      args.insert(args.end(), {"-H", "Content-Type: application/json", "-d", JsonCompact(params)});
    } else {
      WriteFile(Scratch(worker) + "/params.json", JsonCompact(params));
      args.insert(args.end(), {"-F", "params=<" + Scratch(worker) + "/params.json"});
      for (const auto& f : files) args.insert(args.end(), {"-F", f.first + "=@" + f.second});
    }
    const CurlReply reply =
        Curl(server_->port(), "/api/" + api + "/1/" + method, args, token_, Scratch(worker));
    Answer a;
    if (method == "export" && reply.status == 200 && reply.body.compare(0, 2, "PK") == 0) {
      a.transport_ok = a.success = true;
      a.download = reply.body;
    } else if (method == "export" && reply.status == 204) {
      // The certificate went away before its files were read: no download.
      a.transport_ok = true;
      a.code = 5501;
    } else if (reply.status != 200) {
      a.raw = "HTTP " + std::to_string(reply.status) + ": " + reply.body + reply.error;
    } else {
      a = Parse(reply.body);
    }
    return a;
  }

  // INFO now (read without the lock, as list does); empty when unreadable.
  Json::Value Info() const {
    Json::Value info;
    return JsonFromFile(info, Archive("/INFO")) && info.isObject() ? info : Json::objectValue;
  }

  std::string SomeId(std::mt19937& rng) {
    const Json::Value info = Info();
    return info.empty() ? "" : info.getMemberNames()[rng() % info.size()];
  }

  // The certificate `service` is bound to in INFO now ("" when none).
  std::string BoundTo(const Json::Value& service) {
    const Json::Value info = Info();
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& s : info[id]["services"]) {
        if (ServiceKey(s) == ServiceKey(service)) return id;
      }
    }
    return "";
  }

  // CSR create, renew or sign, then the export; an exported request comes with its key.
  Answer RequestAndExport(bool via_server, int worker, std::mt19937& rng) {
    const unsigned kind = rng() % 3;
    Answer a;
    if (kind == 0) {
      a = Call(via_server, kCsr, "create", Subject("request" + std::to_string(worker) + ".example"),
               worker);
    } else if (kind == 1) {
      a = Call(via_server, kCsr, "renew", Object({{"id", SomeId(rng)}}), worker);
    } else {
      a = Call(via_server, kCsr, "sign",
               Object({{"id", SomeId(rng)}, {"days", 30}, {"alias", "client.example"}}), worker,
               {{"csr", root_.Path("/upload.csr")}});
    }
    if (!a.success) return a;
    const Answer exported = Call(via_server, kCertApi, "export",
                                 Object({{"file", kind == 2 ? "signed_set" : "csr_set"}}), worker);
    if (kind != 2 && !exported.download.empty()) {
      const std::string zip = Scratch(worker) + "/request.zip";
      WriteFile(zip, exported.download);
      if (!RequestFitsKey(ZipMember(zip, "server.csr"), ZipMember(zip, "server.key"))) {
        Violation("an exported request does not belong to the key beside it");
      }
    }
    return a;
  }

  Answer Do(const std::string& op, bool via_server, int worker, std::mt19937& rng) {
    const std::string by = std::to_string(worker);
    if (op == "list") {
      const Answer a = Call(via_server, kCrt, "list", Json::objectValue, worker);
      if (a.success && !a.data["certificates"].isArray()) Violation("list: " + a.raw);
      return a;
    } else if (op == "create") {
      Json::Value p = Subject("soak" + by + ".example", "Soak CA " + by);
      p["as_default"] = rng() % 4 == 0;
      return Call(via_server, kCrt, "create", p, worker);
    } else if (op == "set") {
      return Call(via_server, kCrt, "set",
                  Object({{"id", SomeId(rng)}, {"desc", "set by " + by},
                          {"as_default", rng() % 3 == 0}}),
                  worker);
    } else if (op == "service") {
      const Json::Value service =
          services_[static_cast<Json::ArrayIndex>(rng() % services_.size())];
      // As the page does: old_id is the certificate the service uses now.
      Json::Value p;
      p["settings"].append(
          Object({{"service", service}, {"id", SomeId(rng)}, {"old_id", BoundTo(service)}}));
      return Call(via_server, "ZEPH.Core.Certificate.Service", "set", p, worker);
    } else if (op == "import") {
      WriteFile(Scratch(worker) + "/cert.pem", cert_pem_);
      WriteFile(Scratch(worker) + "/key.pem", key_pem_);
      return Call(via_server, kCertApi, "import", Object({{"desc", "imported by " + by}}), worker,
                  {{"cert", Scratch(worker) + "/cert.pem"}, {"key", Scratch(worker) + "/key.pem"}});
    } else if (op == "export") {
      return Call(via_server, kCertApi, "export",
                  Object({{"id", SomeId(rng)}, {"file", "archive"}}), worker);
    } else if (op == "request") {
      return RequestAndExport(via_server, worker, rng);
    } else if (op == "recreate") {
      return Call(via_server, kCrt, "recreate", Object({{"id", SomeId(rng)}}), worker);
    } else if (op == "delete") {
      Json::Value ids;
      ids.append(SomeId(rng));
      ids.append(SomeId(rng));
      return Call(via_server, kCrt, "delete", Object({{"ids", ids}}), worker);
    }
    return Call(via_server, kCertApi, "reset", Json::objectValue, worker);
  }

  void Work(int worker, std::chrono::steady_clock::time_point end) {
    // The operations and their share of the calls, in percent.
    static const std::pair<const char*, unsigned> kMix[] = {
        {"list", 12},   {"create", 12}, {"set", 9},       {"service", 12}, {"import", 10},
        {"export", 7},  {"request", 10}, {"recreate", 5}, {"delete", 20},  {"reset", 3}};
    std::mt19937 rng(1000u + static_cast<unsigned>(worker));
    const bool via_server = worker % 2 == 1;
    while (std::chrono::steady_clock::now() < end) {
      unsigned pick = rng() % 100;
      size_t i = 0;
      while (pick >= kMix[i].second) pick -= kMix[i++].second;
      const std::string op = kMix[i].first;
      const Answer a = Do(op, via_server, worker, rng);
      if (!a.transport_ok) Violation(op + ": no well-formed answer: " + a.raw);
      // Races with deletes may fail a call: the general failure, or invalid parameters where a
      // method checks its id (signing also needs an authority, which imported sets lack).
      const bool checks_id = op == "export" || op == "request" || op == "recreate";
      if (a.transport_ok && !a.success && a.code != 5501 && !(checks_id && a.code == 5503)) {
        Violation(op + ": unexpected code " + std::to_string(a.code) + ": " + a.raw);
      }
      std::lock_guard<std::mutex> lock(mutex_);
      (a.success ? counts_[op].first : counts_[op].second)++;
    }
  }

  // At every moment: INFO is an object of entries with services, none bound twice.
  void CheckWhileBusy() {
    const std::string text = ReadFile(Archive("/INFO"));
    Json::Value info;
    if (!JsonParse(text, info) || !info.isObject()) {
      return Violation("INFO does not parse: [" + text.substr(0, 200) + "]");
    }
    std::set<std::string> bound;
    for (const std::string& id : info.getMemberNames()) {
      if (!info[id]["services"].isArray()) Violation("INFO entry " + id + " without services");
      for (const Json::Value& s : info[id]["services"]) {
        if (!bound.insert(ServiceKey(s)).second) Violation(ServiceKey(s) + " bound twice: " + text);
      }
    }
  }

  TempRoot root_;
  std::unique_ptr<ServerProcess> server_;
  std::string token_;
  Json::Value services_;
  std::string cert_pem_, key_pem_;
  std::mutex mutex_;
  std::vector<std::string> violations_;
  std::map<std::string, std::pair<int, int>> counts_;  // op -> succeeded, failed
};

TEST_F(Soak, ConcurrentCallsKeepTheArchiveWhole) {
  // Eight creations at once over HTTPS: each signs with its own authority.
  std::vector<Answer> answers(8);
  std::vector<std::thread> threads;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([this, i, &answers] {
      const std::string by = std::to_string(100 + i);
      answers[i] = Call(true, kCrt, "create", Subject("soak" + by + ".example", "Soak CA " + by),
                        100 + i);
    });
  }
  for (std::thread& t : threads) t.join();
  for (const Answer& a : answers) {
    EXPECT_TRUE(a.success && SignedByOwnAuthority(Archive("/" + a.data["id"].asString())))
        << "creation at once: " << a.raw << " code " << a.code;
  }
  const int seconds = atoi(getenv("ZEPH_SOAK_SECONDS") ? getenv("ZEPH_SOAK_SECONDS") : "");
  const auto end =
      std::chrono::steady_clock::now() + std::chrono::seconds(seconds > 0 ? seconds : 60);
  std::vector<std::thread> workers;
  for (int i = 0; i < 8; ++i) workers.emplace_back([this, i, end] { Work(i, end); });
  while (std::chrono::steady_clock::now() < end) {
    CheckWhileBusy();
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  for (std::thread& t : workers) t.join();
  for (const std::string& v : violations_) ADD_FAILURE() << v;
  for (const char* op : {"list", "create", "set", "service", "import", "export", "request",
                         "recreate", "delete"}) {
    EXPECT_GT(counts_[op].first, 0) << op << ": " << counts_[op].second << " failed";
  }
  Json::Value info;
  ASSERT_TRUE(JsonFromFile(info, Archive("/INFO")) && info.isObject());
  auto expect_set = [](const std::string& dir) {
    for (const char* file : {"cert.pem", "privkey.pem", "fullchain.pem"}) {
      EXPECT_TRUE(Exists(dir + "/" + file)) << dir << "/" << file;
    }
  };
  std::map<std::string, int> bound;  // service -> the certificates it is bound to
  for (const std::string& id : info.getMemberNames()) {
    expect_set(Archive("/" + id));
    for (const Json::Value& s : info[id]["services"]) ++bound[ServiceKey(s)];
    if (Exists(Archive("/" + id + "/zeph-ca-cert.pem"))) {
      EXPECT_TRUE(SignedByOwnAuthority(Archive("/" + id))) << id;
    }
  }
  for (const Json::Value& s : services_) {
    EXPECT_EQ(bound[ServiceKey(s)], 1) << ServiceKey(s);
    expect_set(root_.Path(std::string(kCertDir) + "/" + ServiceKey(s)));
  }
  const std::string def = ReadFile(Archive("/DEFAULT"));
  EXPECT_TRUE(!def.empty() && def.back() == '\n' && info.isMember(def.substr(0, def.size() - 1)))
      << def;
  EXPECT_EQ(StagingLeftovers(root_.Path(kCertDir)), std::vector<std::string>{});
  for (const std::string& name : DirEntries(root_.Path("/tmp"))) {
    if (name.size() < 5 || name.compare(name.size() - 5, 5, ".lock") != 0) continue;
    int fd = -1;
    const std::string path = root_.Path("/tmp/" + name);
    EXPECT_NE(QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 0, &fd), 0)
        << "still held: " << name;
    if (fd >= 0) QLIBCFileUnlockByFile(fd);
  }
  EXPECT_EQ(server_->Stop(), 0);
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
