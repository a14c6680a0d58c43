// Helpers shared by the fault tests: a fixture with its own appliance root,
// zephcert calls, the making of certificates, and the checks that must hold
// after any call that met a fault: the catalogue readable with no service
// bound twice, and every certificate the archive had before with its files.
//
// The calls may run in a private mount namespace: zephcert is then started
// through the command that enters it, and the test reads the files through
// the namespace holder's /proc/<pid>/root, so it sees what the calls saw.
#ifndef ZEPH_TESTS_FAULTS_FAULT_SUPPORT_H_
#define ZEPH_TESTS_FAULTS_FAULT_SUPPORT_H_

#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/types.h>

#include <map>
#include <set>
#include <string>
#include <vector>

#include "test_support.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace test {

constexpr char kArchive[] = "/usr/zeph/etc/certificate/_archive";
// The files every certificate directory holds.
constexpr const char* kCertFiles[] = {"cert.pem", "privkey.pem", "fullchain.pem"};

class ArchiveFixture : public ::testing::Test {
 protected:
  // `path` below the root, as the zephcert calls see it.
  std::string View(const std::string& path) const { return view_ + root_.Path(path); }

  std::string Archive(const std::string& rest) const {
    return View(std::string(kArchive) + rest);
  }

  CommandResult Zephcert(std::vector<std::string> args) {
    args.insert(args.begin(), {BinDir() + "/zephcert", "--root", root_.dir()});
    args.insert(args.begin(), enter_.begin(), enter_.end());
    return ZEPH::test::Run(args);
  }

  // One method call; its answer in `answer` (null when it is not JSON).
  CommandResult Call(const std::string& api, const std::string& method,
                     const Json::Value& params, Json::Value& answer) {
    CommandResult r = Zephcert({"call", api, method, JsonCompact(params)});
    answer = Json::Value();
    JsonParse(r.out, answer);
    return r;
  }

  static Json::Value CreateParams(bool as_default) {
    Json::Value p(Json::objectValue);
    for (const std::string prefix : {"", "ca_"}) {
      for (const char* key : {"country", "state", "city", "organization", "department",
                              "email"}) {
        p[prefix + key] = "";
      }
      p[prefix + "country"] = "TW";
      p[prefix + "common_name"] = prefix.empty() ? "fault.example" : "Fault CA";
    }
    p["desc"] = "made for a fault";
    p["as_default"] = as_default;
    p["key_length"] = 1024;
    p["ca_key_length"] = 1024;
    return p;
  }

  // A new certificate, without faults; its id.
  std::string Create(bool as_default) {
    Json::Value answer;
    CommandResult r = Call("ZEPH.Core.Certificate.CRT", "create", CreateParams(as_default),
                           answer);
    if (r.status != 0 || !answer["data"]["id"].isString()) {
      ADD_FAILURE() << r.out << r.err;
      return "";
    }
    return answer["data"]["id"].asString();
  }

  Json::Value Info() {
    Json::Value info;
    JsonFromFile(info, Archive("/INFO"));
    return info;
  }

  // The Service "set" setting that moves `service` from `from` to `to`.
  static Json::Value Move(const Json::Value& service, const std::string& from,
                          const std::string& to) {
    Json::Value setting;
    setting["service"] = service;
    setting["id"] = to;
    setting["old_id"] = from;
    Json::Value p;
    p["settings"].append(setting);
    return p;
  }

  struct Snapshot {
    std::map<std::string, std::map<std::string, std::string>> certs;  // id -> file -> content
  };

  Snapshot Take() {
    Snapshot s;
    const Json::Value info = Info();
    for (const std::string& id : info.getMemberNames()) {
      for (const char* file : kCertFiles) {
        s.certs[id][file] = ReadFile(Archive("/" + id + "/" + file));
      }
    }
    return s;
  }

  // What must hold after any faulted call. `gone` are the ids the method
  // may remove.
  void CheckArchive(const Snapshot& before, const std::set<std::string>& gone,
                    const std::string& what) {
    Json::Value info;
    ASSERT_TRUE(JsonFromFile(info, Archive("/INFO"))) << what;
    ASSERT_TRUE(info.isObject()) << what;
    std::set<std::string> bound;
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& s : info[id]["services"]) {
        EXPECT_TRUE(bound.insert(s["subscriber"].asString() + "/" + s["service"].asString())
                        .second)
            << what << ": bound twice in " << JsonCompact(info);
      }
    }
    for (const auto& cert : before.certs) {
      if (gone.count(cert.first) != 0) continue;
      EXPECT_TRUE(info.isMember(cert.first)) << what << ": lost " << cert.first;
      for (const auto& file : cert.second) {
        const std::string path = Archive("/" + cert.first + "/" + file.first);
        EXPECT_TRUE(Exists(path)) << what << ": " << cert.first << "/" << file.first;
        // A replace (create with an id) may change the set; nothing else does.
        if (!replaced_.count(cert.first)) {
          EXPECT_EQ(ReadFile(path), file.second)
              << what << ": " << cert.first << "/" << file.first << " changed";
        }
      }
    }
  }

  TempRoot root_;
  std::set<std::string> replaced_;
  // While the calls run in a private mount namespace: the command that
  // enters it, put before zephcert, and the prefix under which the test
  // reads the namespace's files. Both empty otherwise.
  std::vector<std::string> enter_;
  std::string view_;
};

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_TESTS_FAULTS_FAULT_SUPPORT_H_
