// Injected faults: every method of the module is run through zephcert with
// the fault shim preloaded, failing one rename, write, open, stream open,
// process start or chown at the 1st, 2nd, ... occurrence until the method
// gets through without meeting the fault. Whatever fails, the method answers (success or
// one of the error codes it has for its failures), the catalogue stays
// readable with no service bound twice, every certificate the archive had
// before keeps its files, and a certificate whose set is replaced holds a
// whole set (a key that fits its certificate). What a method only reads or
// hands out stays as it was; what it makes is whole when it says so.

#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "faults/fault_support.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ArchiveFixture;
using ZEPH::test::CommandResult;
using ZEPH::test::Exists;
using ZEPH::test::kArchive;
using ZEPH::test::MakeDirs;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;
using ZEPH::test::WriteFile;

// Beyond this many occurrences a method is not expected to go.
const int kMaxOccurrence = 60;

// The web administration service's own copy of its certificate.
constexpr char kWebServiceDir[] = "/usr/zeph/etc/certificate/system/default";
// Where the CSR methods leave their products and the export its archive.
constexpr char kGenDir[] = "/usr/zeph/etc/ssl/.gen";

std::string Shim() { return ZEPH::test::BinDir() + "/libzeph_fault_shim.so"; }

struct Outcome {
  int status = -1;
  Json::Value answer;
  std::string out;
};

// What a method may do when one of its calls fails, and what the sweep
// must see of it.
struct Expect {
  // The error codes it answers for its failures; empty: it always answers
  // success.
  std::set<int> codes;
  // The calls it makes on the paths counted: the sweep must fail each of
  // them at least once, and must never meet any other.
  std::set<std::string> calls;
  // Renames, writes, opens and stream opens count on paths below this
  // directory of the root ("" for the whole root: uploads, lock files and
  // downloads too).
  std::string scope = "/usr/zeph";
  // Directories below the root whose files must be left as they were.
  std::vector<std::string> unchanged;
  // More zephcert arguments.
  std::vector<std::string> args;
  // Checks of the method's own products after each attempt; `fired` tells
  // whether the fault met the method.
  std::function<void(const Outcome&, bool fired, const std::string& what)> check;
};

using Tree = std::map<std::string, std::string>;  // path -> mode and content

// Every entry below `dir`: its kind, mode and, for a file, its content.
Tree Contents(const std::string& dir) {
  namespace fs = std::filesystem;
  Tree tree;
  std::error_code ec;
  for (fs::recursive_directory_iterator it(dir, ec), end; !ec && it != end;
       it.increment(ec)) {
    struct stat st;
    const std::string path = it->path().string();
    if (lstat(path.c_str(), &st) != 0) continue;
    std::string entry = std::to_string(st.st_mode) + " ";
    if (S_ISREG(st.st_mode)) entry += ReadFile(path);
    tree[path.substr(dir.size())] = entry;
  }
  return tree;
}

// The entries added, removed or changed from `before` to `after`.
std::string Changes(const Tree& before, const Tree& after) {
  std::string changes;
  for (const auto& e : before) {
    auto now = after.find(e.first);
    if (now == after.end()) {
      changes += " removed " + e.first;
    } else if (now->second != e.second) {
      changes += " changed " + e.first;
    }
  }
  for (const auto& e : after) {
    if (before.count(e.first) == 0) changes += " added " + e.first;
  }
  return changes;
}

class Faults : public ArchiveFixture {
 protected:
  void SetUp() override {
    ASSERT_EQ(Zephcert({"init"}).status, 0);
    other_ = Create(false);
    ASSERT_EQ(other_.size(), 6u);
  }

  // Runs one method with `call` failing at occurrence `at`; whether the
  // fault fired.
  bool RunWithFault(const std::string& call, int at, const std::string& match,
                    const std::string& api, const std::string& method,
                    const Json::Value& params, const std::vector<std::string>& more,
                    Outcome& outcome) {
    const std::string report = root_.Path("/fault-report");
    unlink(report.c_str());
    std::vector<std::string> argv = {
        "/usr/bin/env", "LD_PRELOAD=" + Shim(), "ZEPH_FAULT_CALL=" + call,
        "ZEPH_FAULT_AT=" + std::to_string(at), "ZEPH_FAULT_MATCH=" + match,
        "ZEPH_FAULT_REPORT=" + report,
        // A sanitizer build wants its runtime first; the shim comes first.
        "ASAN_OPTIONS=verify_asan_link_order=0", ZEPH::test::BinDir() + "/zephcert",
        "--root", root_.dir(), "call", api, method, ZEPH::JsonCompact(params)};
    argv.insert(argv.end(), more.begin(), more.end());
    const CommandResult r = ZEPH::test::Run(argv);
    outcome.status = r.status;
    outcome.out = r.out;
    outcome.answer = Json::Value();
    ZEPH::JsonParse(outcome.out, outcome.answer);
    return Exists(report);
  }

  // Runs `method` under every occurrence of every injectable call.
  // `prepare` runs before each attempt and gives the parameters and the
  // ids the method may remove.
  void Sweep(const std::string& api, const std::string& method,
             const std::function<Json::Value(std::set<std::string>&)>& prepare,
             const Expect& expect) {
    const std::string scope = root_.dir() + expect.scope;
    const std::vector<std::pair<std::string, std::string>> calls = {
        {"rename", scope}, {"write", scope},       {"open", scope},
        {"fopen", scope},  {"posix_spawn", ""},    {"chown", ""}};
    for (const auto& call : calls) {
      int at = 1;
      for (; at <= kMaxOccurrence; ++at) {
        std::set<std::string> gone;
        const Json::Value params = prepare(gone);
        if (HasFailure()) return;
        const Snapshot before = Take();
        std::vector<Tree> kept;
        for (const std::string& dir : expect.unchanged) {
          kept.push_back(Contents(root_.Path(dir)));
        }
        Outcome outcome;
        const bool fired = RunWithFault(call.first, at, call.second, api, method,
                                        params, expect.args, outcome);
        const std::string what = method + " with " + call.first + " failing at " +
                                 std::to_string(at) + ": " + outcome.out;
        // Status 2: zephcert could not make its private copy of an upload
        // and did not call the method; it prints no answer then.
        const bool called = outcome.status != 2;
        ASSERT_TRUE(called ? outcome.status == 0 || outcome.status == 1
                           : outcome.out.empty())
            << what;
        if (called) {
          ASSERT_TRUE(outcome.answer["success"].isBool()) << what;
          EXPECT_EQ(outcome.status == 0, outcome.answer["success"].asBool()) << what;
        }
        if (called && !outcome.answer["success"].asBool()) {
          EXPECT_EQ(expect.codes.count(outcome.answer["error"]["code"].asInt()), 1u)
              << what;
        }
        CheckArchive(before, gone, what);
        CheckReplacedSets(what);
        for (size_t i = 0; i < kept.size(); ++i) {
          EXPECT_EQ(Changes(kept[i], Contents(root_.Path(expect.unchanged[i]))), "")
              << what << ": in " << expect.unchanged[i];
        }
        if (expect.check) expect.check(outcome, fired, what);
        if (HasFailure()) return;
        if (fired) ++fired_[call.first];
        if (!fired) {
          // Got through untouched: the sweep of this call is complete.
          EXPECT_TRUE(outcome.answer["success"].asBool()) << what;
          break;
        }
      }
      EXPECT_LE(at, kMaxOccurrence) << method << ": " << call.first;
    }
    std::set<std::string> met;
    for (const auto& f : fired_) {
      if (f.second > 0) met.insert(f.first);
    }
    EXPECT_EQ(met, expect.calls) << method << ": the calls that met a fault";
  }

  // A certificate whose set a method may replace holds a whole set: the
  // key belongs to the certificate and the full chain begins with it.
  void CheckReplacedSets(const std::string& what) {
    const Json::Value info = Info();
    for (const std::string& id : replaced_) {
      if (!info.isMember(id)) continue;
      const std::string cert = ReadFile(Archive("/" + id + "/cert.pem"));
      EXPECT_TRUE(ZEPH::test::CertificateFitsKey(cert, ReadFile(Archive("/" + id + "/privkey.pem"))))
          << what << ": " << id << " has a key of another certificate";
      EXPECT_EQ(ReadFile(Archive("/" + id + "/fullchain.pem")).compare(0, cert.size(), cert),
                0)
          << what << ": " << id << "/fullchain.pem is not of its certificate";
    }
  }

  // The certificate the web service uses, from INFO.
  std::string InUse() {
    const Json::Value info = Info();
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& s : info[id]["services"]) {
        if (s["subscriber"] == "system" && s["service"] == "default") return id;
      }
    }
    ADD_FAILURE() << "no certificate serves the web service";
    return "";
  }

  // After a method that redeployed `id` answered success: the web service
  // has the certificate's files.
  void ExpectDeployed(const std::string& id, const std::string& what) {
    for (const char* file : ZEPH::test::kCertFiles) {
      EXPECT_EQ(ReadFile(root_.Path(std::string(kWebServiceDir) + "/" + file)),
                ReadFile(Archive("/" + id + "/" + file)))
          << what << ": the web service's " << file << " is not that of " << id;
    }
  }

  // The request and key that the CSR methods leave: a request for `cn`,
  // signed with the key beside it, of `bits`.
  void CheckRequest(const std::string& cn, int bits, const std::string& what) {
    const std::string csr = ReadFile(Gen("server.csr"));
    const std::string key = ReadFile(Gen("server.key"));
    EXPECT_TRUE(ZEPH::test::RequestFitsKey(csr, key)) << what << ": no request of the key";
    EXPECT_EQ(ZEPH::test::KeyBits(key), bits) << what;
    EXPECT_EQ(ZEPH::test::SubjectCommonName(csr), cn) << what;
  }

  std::string Gen(const std::string& name) const {
    return root_.Path(std::string(kGenDir) + "/" + name);
  }

  // The entries of the ZIP archive `zip`, by name.
  std::map<std::string, std::string> Unpack(const std::string& zip) {
    const std::string dir = root_.Path("/unpacked");
    std::filesystem::remove_all(dir);
    std::map<std::string, std::string> entries;
    CommandResult r = ZEPH::test::Run({"/usr/bin/7z", "x", "-y", "-bso0", "-bsp0",
                                       "-o" + dir, zip});
    if (r.status != 0) {
      ADD_FAILURE() << zip << " does not unpack: " << r.err;
      return entries;
    }
    for (const auto& e : std::filesystem::directory_iterator(dir)) {
      entries[e.path().filename().string()] = ReadFile(e.path().string());
    }
    return entries;
  }

  // Sweeps the export of `params`, whose archive must hold one of
  // `archives` (each name -> content). `sources` are files handed out
  // once: an export that delivered its archive removed them, one that did
  // not leaves them as they were; they are put back before each attempt.
  void SweepExport(const Json::Value& params,
                   const std::vector<std::map<std::string, std::string>>& archives,
                   const std::map<std::string, std::string>& sources,
                   const std::set<std::string>& calls) {
    const std::string out = root_.Path("/export.zip");
    Expect expect;
    expect.calls = calls;
    expect.scope = "";
    expect.unchanged = {"/usr/zeph/etc/certificate"};
    expect.args = {"--output", out};
    expect.check = [&](const Outcome& outcome, bool fired, const std::string& what) {
      const Json::Value& download = outcome.answer["download"];
      if (!fired) {
        EXPECT_TRUE(download.isObject()) << what;
      }
      if (download.isObject()) {
        // What was handed out is the archive made, whole.
        const std::string zip = ReadFile(Gen("archive.zip"));
        const std::string got = ReadFile(out);
        EXPECT_TRUE(got == zip) << what << ": a download of " << got.size()
                                << " bytes, not the archive of " << zip.size();
        EXPECT_EQ(download["bytes"].asUInt64(), zip.size()) << what;
        const std::map<std::string, std::string> files = Unpack(out);
        EXPECT_TRUE(std::find(archives.begin(), archives.end(), files) != archives.end())
            << what << ": an archive of " << files.size() << " files, not of the set";
        for (const auto& s : sources) {
          EXPECT_FALSE(Exists(s.first))
              << what << ": " << s.first << " still there after it was handed out";
        }
      } else {
        // No download: nothing half written stays, and nothing handed out
        // once is lost without having been handed out.
        EXPECT_FALSE(Exists(out)) << what << ": a download that failed";
        for (const auto& s : sources) {
          EXPECT_TRUE(ReadFile(s.first) == s.second)
              << what << ": " << s.first << " lost without having been handed out";
        }
      }
    };
    Sweep("ZEPH.Core.Certificate", "export",
          [&](std::set<std::string>&) {
            unlink(out.c_str());
            for (const auto& s : sources) WriteFile(s.first, s.second, 0400);
            return params;
          },
          expect);
  }

  // The Let's Encrypt tool's stand-in: it "issues" one of two prepared
  // certificate sets, always the one the certificate does not hold yet,
  // into the directory that the real tool writes (the work directory
  // named by -c for "new-cert", the certificate's own for "renew"), and
  // answers as the tool does.
  void InstallLetsEncryptStandIn() {
    MakeSet("a", other_);
    const std::string second = Create(false);
    ASSERT_FALSE(second.empty());
    MakeSet("b", second);
    const std::string archive = root_.Path(kArchive);
    const std::string sets = root_.Path("/le-sets");
    const std::string script =
        "#!/bin/sh\n"
        "archive='" + archive + "'\n"
        "sets='" + sets + "'\n"
        "command=$1; shift\n"
        "name=\n"
        "while [ $# -gt 0 ]; do\n"
        "  if [ \"$1\" = -c ]; then name=$2; shift; fi\n"
        "  shift\n"
        "done\n"
        "other() {\n"
        "  if cmp -s \"$archive/$1/cert.pem\" \"$sets/a/cert.pem\"; then echo b; else echo a; fi\n"
        "}\n"
        "put() {\n"
        "  for f in \"$sets/$1\"/*; do\n"
        "    rm -f \"$2/${f##*/}\" && cp \"$f\" \"$2/\" || return 1\n"
        "  done\n"
        "}\n"
        "case \"$command\" in\n"
        "  new-cert) [ -d \"$archive/$name\" ] && put \"$(other \"${name%.temp}\")\" "
        "\"$archive/$name\" ;;\n"
        "  renew) [ -f \"$archive/$name/renew.json\" ] && put \"$(other \"$name\")\" "
        "\"$archive/$name\" ;;\n"
        "  revoke) true ;;\n"
        "  *) false ;;\n"
        "esac || { echo '{\"error\": 105, \"msg\": \"stand-in failed\"}'; exit 1; }\n"
        "echo '{\"error\": 0}'\n";
    WriteFile(root_.Path("/usr/zeph/sbin/zeph-letsencrypt"), script, 0755);
  }

  // Set `name` of the stand-in, made of the files of certificate `id`.
  void MakeSet(const std::string& name, const std::string& id) {
    const std::string dir = root_.Path("/le-sets/" + name);
    MakeDirs(dir);
    const std::string cert = ReadFile(Archive("/" + id + "/cert.pem"));
    const std::string chain = ReadFile(Archive("/" + id + "/zeph-ca-cert.pem"));
    std::map<std::string, std::string>& set = le_sets_[name];
    set["cert.pem"] = cert;
    set["chain.pem"] = chain;
    set["fullchain.pem"] = cert + chain;
    set["privkey.pem"] = ReadFile(Archive("/" + id + "/privkey.pem"));
    set["renew.json"] = "{\"domain\": \"le.example\"}\n";
    for (const auto& f : set) WriteFile(dir + "/" + f.first, f.second, 0600);
  }

  // The stand-in's set held by certificate `id` ("" for neither).
  std::string SetOf(const std::string& id) {
    for (const auto& set : le_sets_) {
      bool all = true;
      for (const auto& f : set.second) {
        all = all && ReadFile(Archive("/" + id + "/" + f.first)) == f.second;
      }
      if (all) return set.first;
    }
    return "";
  }

  // The set the stand-in issues next for a certificate holding `held`.
  static std::string NextSet(const std::string& held) { return held == "a" ? "b" : "a"; }

  Json::Value LetsEncryptParams(const std::string& id) {
    Json::Value p;
    if (!id.empty()) p["id"] = id;
    p["desc"] = "from Let's Encrypt";
    p["domain_name"] = "le.example";
    p["email"] = "admin@le.example";
    return p;
  }

  std::string other_;
  std::map<std::string, int> fired_;  // call -> faults that fired
  std::map<std::string, std::map<std::string, std::string>> le_sets_;
};

// Methods that rewrite INFO: a new file opened, written and renamed into
// place; certificates and keys read through streams; and (creating,
// importing) key and certificate tools started.
const std::set<std::string> kRewritesInfo = {"fopen", "rename", "write", "open", "posix_spawn"};

Expect Codes(std::set<int> codes, std::set<std::string> calls) {
  Expect e;
  e.codes = std::move(codes);
  e.calls = std::move(calls);
  return e;
}

Json::Value IdParams(const std::string& id) {
  Json::Value p;
  p["id"] = id;
  return p;
}

// CSR create for csr.example with a 1024-bit key.
Json::Value CsrParams() {
  Json::Value p;
  for (const char* key : {"country", "state", "city", "organization", "department", "email"}) {
    p[key] = "";
  }
  p["common_name"] = "csr.example";
  p["key_length"] = 1024;
  return p;
}

TEST_F(Faults, Create) {
  Sweep("ZEPH.Core.Certificate.CRT", "create",
        [](std::set<std::string>&) { return CreateParams(true); },
        Codes({5501}, kRewritesInfo));
}

TEST_F(Faults, CreateReplacingACertificateInUse) {
  // Replace mode redeploys the web service's certificate.
  const std::string def = InUse();
  replaced_.insert(def);
  Sweep("ZEPH.Core.Certificate.CRT", "create",
        [&](std::set<std::string>&) {
          Json::Value p = CreateParams(false);
          p["id"] = def;
          return p;
        },
        Codes({5501}, {"fopen", "rename", "write", "open", "posix_spawn", "chown"}));
}

TEST_F(Faults, Import) {
  const std::string cert = root_.Path("/up-cert.pem");
  const std::string key = root_.Path("/up-key.pem");
  Sweep("ZEPH.Core.Certificate", "import",
        [&](std::set<std::string>&) {
          WriteFile(cert, ReadFile(Archive("/" + other_ + "/cert.pem")));
          WriteFile(key, ReadFile(Archive("/" + other_ + "/privkey.pem")));
          Json::Value p;
          p["desc"] = "imported";
          p["cert_tmp"] = cert;
          p["key_tmp"] = key;
          return p;
        },
        Codes({5501, 5510, 5511, 5515}, kRewritesInfo));
}

TEST_F(Faults, SetProperties) {
  Sweep("ZEPH.Core.Certificate.CRT", "set",
        [&](std::set<std::string>&) {
          Json::Value p;
          p["id"] = other_;
          p["desc"] = "changed";
          p["as_default"] = true;
          return p;
        },
        Codes({5501}, {"fopen", "rename", "write", "open"}));
}

TEST_F(Faults, ServiceSet) {
  Sweep("ZEPH.Core.Certificate.Service", "set",
        [&](std::set<std::string>&) {
          // Moves the web service to whichever certificate it is not on.
          const Json::Value info = Info();
          std::string from;
          Json::Value service;
          for (const std::string& id : info.getMemberNames()) {
            if (!info[id]["services"].empty()) {
              from = id;
              service = info[id]["services"][0];
            }
          }
          std::string to = other_;
          if (from == other_) {
            for (const std::string& id : info.getMemberNames()) {
              if (id != other_) to = id;
            }
          }
          Json::Value setting;
          setting["service"] = service;
          setting["id"] = to;
          setting["old_id"] = from;
          Json::Value p;
          p["settings"].append(setting);
          return p;
        },
        Codes({5501}, {"fopen", "rename", "write", "open", "posix_spawn", "chown"}));
}

TEST_F(Faults, Delete) {
  Sweep("ZEPH.Core.Certificate.CRT", "delete",
        [&](std::set<std::string>& gone) {
          const std::string id = Create(false);
          gone.insert(id);
          Json::Value p;
          p["ids"].append(id);
          return p;
        },
        Codes({5501}, {"fopen", "rename", "write", "open", "posix_spawn"}));
}

TEST_F(Faults, Reset) {
  Sweep("ZEPH.Core.Certificate", "reset",
        [&](std::set<std::string>& gone) {
          // Everything a user may delete may go.
          const Json::Value info = Info();
          for (const std::string& id : info.getMemberNames()) {
            if (info[id]["user_deletable"].asBool()) gone.insert(id);
          }
          return Json::Value(Json::objectValue);
        },
        Codes({5501}, {"fopen", "rename", "write", "open", "posix_spawn", "chown"}));
}

// Recreating the certificate in use makes new key material for it with the
// certificate-making tool and redeploys it; INFO is left alone.
TEST_F(Faults, RecreateACertificateInUse) {
  const std::string def = InUse();
  replaced_.insert(def);
  std::string key_before;
  Expect expect = Codes({5501}, {"fopen", "rename", "open", "posix_spawn", "chown"});
  expect.check = [&](const Outcome& outcome, bool, const std::string& what) {
    if (!outcome.answer["success"].asBool()) return;
    EXPECT_NE(ReadFile(Archive("/" + def + "/privkey.pem")), key_before)
        << what << ": no new key";
    EXPECT_TRUE(outcome.answer["data"]["restart_httpd"].asBool()) << what;
    ExpectDeployed(def, what);
  };
  Sweep("ZEPH.Core.Certificate.CRT", "recreate",
        [&](std::set<std::string>&) {
          key_before = ReadFile(Archive("/" + def + "/privkey.pem"));
          return IdParams(def);
        },
        expect);
}

// The CSR methods work in their own directory: the archive and the
// services stay as they were. A request they answer success for is there,
// with the key it was made for and the subject asked for (renew: that of
// the certificate renewed).
TEST_F(Faults, CsrCreateAndRenew) {
  for (const std::string method : {"create", "renew"}) {
    Expect expect = Codes({5501}, {"fopen", "posix_spawn"});
    expect.unchanged = {"/usr/zeph/etc/certificate"};
    expect.check = [&](const Outcome& outcome, bool, const std::string& what) {
      if (!outcome.answer["success"].asBool()) return;
      CheckRequest(method == "create" ? "csr.example" : "fault.example", 1024, what);
    };
    fired_.clear();
    Sweep("ZEPH.Core.Certificate.CSR", method,
          [&](std::set<std::string>&) {
            unlink(Gen("server.key").c_str());
            unlink(Gen("server.csr").c_str());
            return method == "create" ? CsrParams() : IdParams(other_);
          },
          expect);
  }
}

// Signing answers success even when no certificate could be made (the
// export of the signed set then finds none); a certificate it leaves is
// the request's, signed by the certificate's authority. The upload is
// read under faults too.
TEST_F(Faults, CsrSign) {
  const std::string upload = root_.Path("/upload.csr");
  CommandResult made = ZEPH::test::Run(
      {"/usr/bin/openssl", "req", "-new", "-newkey", "rsa:1024", "-nodes", "-keyout",
       root_.Path("/upload.key"), "-out", upload, "-subj", "/CN=client.example"});
  ASSERT_EQ(made.status, 0) << made.err;
  const std::string ca = ReadFile(Archive("/" + other_ + "/zeph-ca-cert.pem"));
  // open and write: zephcert's private copy of the upload.
  Expect expect = Codes({5501}, {"fopen", "open", "posix_spawn", "write"});
  expect.scope = "";
  expect.unchanged = {"/usr/zeph/etc/certificate"};
  expect.check = [&](const Outcome&, bool fired, const std::string& what) {
    const std::string crt = Gen("server.crt");
    if (!fired) {
      EXPECT_TRUE(Exists(crt)) << what;
    }
    if (!Exists(crt)) return;
    EXPECT_EQ(ZEPH::test::SubjectCommonName(ReadFile(crt)), "client.example") << what;
    EXPECT_TRUE(ZEPH::test::IssuedBy(ReadFile(crt), ca)) << what << ": not signed by the authority";
  };
  Sweep("ZEPH.Core.Certificate.CSR", "sign",
        [&](std::set<std::string>&) {
          unlink(Gen("server.crt").c_str());
          Json::Value p;
          p["id"] = other_;
          p["days"] = 30;
          p["csr"] = "client.csr";
          p["csr_tmp"] = upload;
          p["alias"] = "client.example;10.1.2.3";
          return p;
        },
        expect);
}

// Export hands a ZIP archive out as a download (zephcert writes it to
// --output and reports it under "download"); it never answers an error.
// A download is the whole archive of the set's files; one that failed
// leaves no file behind.
TEST_F(Faults, ExportArchive) {
  std::map<std::string, std::string> files;
  for (const char* name :
       {"cert.pem", "privkey.pem", "zeph-ca-cert.pem", "zeph-ca-privkey.pem"}) {
    files[name] = ReadFile(Archive("/" + other_ + "/" + name));
  }
  // Where the feature switch cannot be read, self-signed certificates
  // count as unsupported and the authority's files stay out.
  std::map<std::string, std::string> without_authority = files;
  without_authority.erase("zeph-ca-cert.pem");
  without_authority.erase("zeph-ca-privkey.pem");
  Json::Value p;
  p["file"] = "archive";
  p["id"] = other_;
  SweepExport(p, {files, without_authority}, {}, {"fopen", "write", "open", "posix_spawn"});
}

// The request and key of the CSR methods are handed out once: a delivered
// download removes them, a failed one keeps them.
TEST_F(Faults, ExportRequestAndKey) {
  Json::Value answer;
  ASSERT_EQ(Call("ZEPH.Core.Certificate.CSR", "create", CsrParams(), answer).status, 0);
  std::map<std::string, std::string> files = {
      {"server.csr", ReadFile(Gen("server.csr"))}, {"server.key", ReadFile(Gen("server.key"))}};
  Json::Value p;
  p["file"] = "csr_set";
  SweepExport(p, {files},
              {{Gen("server.csr"), files["server.csr"]}, {Gen("server.key"), files["server.key"]}},
              {"write", "open", "fopen", "posix_spawn"});
}

TEST_F(Faults, ExportSignedCertificate) {
  const std::string crt = ReadFile(Archive("/" + other_ + "/cert.pem"));
  MakeDirs(root_.Path(kGenDir));
  Json::Value p;
  p["file"] = "signed_set";
  SweepExport(p, {{{"server.crt", crt}}}, {{Gen("server.crt"), crt}},
              {"write", "open", "posix_spawn"});
}

// The lists only read: they answer (the certificate list its general
// failure when it cannot read INFO, the account list always success) and
// nothing changes.
TEST_F(Faults, CrtList) {
  const Json::Value info = Info();
  Expect expect = Codes({5501}, {"fopen", "open"});
  expect.unchanged = {"/usr/zeph"};
  expect.check = [&](const Outcome& outcome, bool fired, const std::string& what) {
    if (!outcome.answer["success"].asBool()) return;
    std::set<std::string> listed;
    for (const Json::Value& c : outcome.answer["data"]["certificates"]) {
      EXPECT_TRUE(info.isMember(c["id"].asString())) << what;
      listed.insert(c["id"].asString());
    }
    if (!fired) {
      EXPECT_EQ(listed.size(), info.size()) << what;
    }
  };
  Sweep("ZEPH.Core.Certificate.CRT", "list",
        [](std::set<std::string>&) { return Json::Value(Json::objectValue); }, expect);
}

TEST_F(Faults, LetsEncryptAccountList) {
  const std::string accounts = root_.Path("/usr/zeph/etc/letsencrypt/account");
  const std::set<std::string> contacts = {"a@le.example", "b@le.example"};
  for (const std::string& contact : contacts) {
    MakeDirs(accounts + "/" + contact);
    WriteFile(accounts + "/" + contact + "/info.json",
              "{\"contact\": \"" + contact + "\"}\n", 0600);
  }
  Expect expect = Codes({}, {"open"});
  expect.unchanged = {"/usr/zeph"};
  expect.check = [&](const Outcome& outcome, bool fired, const std::string& what) {
    std::set<std::string> listed;
    for (const Json::Value& e : outcome.answer["data"]["email"]) {
      EXPECT_EQ(contacts.count(e["contact"].asString()), 1u) << what;
      listed.insert(e["contact"].asString());
    }
    if (!fired) {
      EXPECT_EQ(listed, contacts) << what;
    }
  };
  Sweep("ZEPH.Core.Certificate.LetsEncrypt.Account", "list",
        [](std::set<std::string>&) { return Json::Value(Json::objectValue); }, expect);
}

// Let's Encrypt issuance with the tool's stand-in: a new certificate is
// the set the tool left, recorded in INFO.
TEST_F(Faults, LetsEncryptCreate) {
  ASSERT_NO_FATAL_FAILURE(InstallLetsEncryptStandIn());
  Expect expect = Codes({5501}, {"fopen", "rename", "write", "open", "posix_spawn"});
  expect.check = [&](const Outcome& outcome, bool, const std::string& what) {
    if (!outcome.answer["success"].asBool()) return;
    const std::string id = outcome.answer["data"]["id"].asString();
    EXPECT_EQ(SetOf(id), "a") << what;
    // The properties are recorded when INFO can be rewritten; when it
    // cannot, the issuance still succeeds and the certificate stays
    // unlisted (only logged).
    const Json::Value info = Info();
    if (info.isMember(id)) {
      EXPECT_EQ(info[id]["desc"].asString(), "from Let's Encrypt") << what;
    }
  };
  Sweep("ZEPH.Core.Certificate.LetsEncrypt", "create",
        [&](std::set<std::string>&) { return LetsEncryptParams(""); }, expect);
}

// Issuing for the certificate in use replaces its set and redeploys it.
TEST_F(Faults, LetsEncryptCreateReplacingACertificateInUse) {
  ASSERT_NO_FATAL_FAILURE(InstallLetsEncryptStandIn());
  const std::string def = InUse();
  replaced_.insert(def);
  std::string held;
  Expect expect = Codes({5501}, {"fopen", "rename", "write", "open", "posix_spawn", "chown"});
  expect.check = [&](const Outcome& outcome, bool, const std::string& what) {
    if (!outcome.answer["success"].asBool()) return;
    EXPECT_EQ(outcome.answer["data"]["id"].asString(), def) << what;
    EXPECT_TRUE(outcome.answer["data"]["restart_httpd"].asBool()) << what;
    EXPECT_EQ(SetOf(def), NextSet(held)) << what;
    ExpectDeployed(def, what);
  };
  Sweep("ZEPH.Core.Certificate.LetsEncrypt", "create",
        [&](std::set<std::string>&) {
          held = SetOf(def);
          return LetsEncryptParams(def);
        },
        expect);
}

// Renewal: the tool renews the files in the certificate's directory, the
// module redeploys them; INFO is left alone.
TEST_F(Faults, LetsEncryptRenew) {
  ASSERT_NO_FATAL_FAILURE(InstallLetsEncryptStandIn());
  const std::string def = InUse();
  Json::Value answer;
  ASSERT_EQ(Call("ZEPH.Core.Certificate.LetsEncrypt", "create", LetsEncryptParams(def),
                 answer)
                .status,
            0)
      << answer;
  replaced_.insert(def);
  std::string held;
  Expect expect = Codes({5501}, {"fopen", "rename", "open", "posix_spawn", "chown"});
  expect.check = [&](const Outcome& outcome, bool, const std::string& what) {
    if (!outcome.answer["success"].asBool()) return;
    EXPECT_EQ(outcome.answer["data"]["id"].asString(), def) << what;
    EXPECT_EQ(SetOf(def), NextSet(held)) << what;
    ExpectDeployed(def, what);
  };
  Sweep("ZEPH.Core.Certificate.LetsEncrypt", "renew",
        [&](std::set<std::string>&) {
          held = SetOf(def);
          EXPECT_NE(held, "") << def << " holds no set of the tool";
          return IdParams(def);
        },
        expect);
}

}  // namespace
