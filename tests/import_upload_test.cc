// What administrators bring for an import, through zephcert and through
// the server's multipart upload: every form is either imported as a plain set (the certificate, then its intermediates
// in order, no private key in any certificate file) or refused with a
// reason that names the problem.
#include <gtest/gtest.h>
#include <unistd.h>

#include <memory>
#include <set>
#include <string>
#include <vector>

#include "host/import_preparation.h"
#include "server/webapid_test_support.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::CommandResult;
using ZEPH::test::ReadFile;
using ZEPH::test::TempRoot;

const char kPass[] = "s3cret";

// Key material made once with openssl: a root, two intermediates and a
// leaf for up.example, and every form of them an administrator meets.
class Material {
 public:
  Material() : dir_(root_.Path("/material")) {
    ZEPH::test::MakeDirs(dir_);
    ZEPH::test::WriteFile(F("ca.ext"), "basicConstraints=critical,CA:TRUE\n"
                                       "keyUsage=keyCertSign,cRLSign\n");
    ZEPH::test::WriteFile(F("leaf.ext"), "subjectAltName=DNS:up.example\n");
    ZEPH::test::WriteFile(F("host.ext"),
                          "subjectAltName=DNS:" + ZEPH::ApplianceHostName() + "\n");
    Key("root.key");
    Openssl({"req", "-x509", "-key", F("root.key"), "-out", F("root.pem"), "-days", "30",
             "-subj", "/CN=Root", "-addext", "basicConstraints=critical,CA:TRUE",
             "-addext", "keyUsage=keyCertSign,cRLSign"});
    Issue("inter1", "root", "ca.ext", "30");
    Issue("inter2", "inter1", "ca.ext", "30");
    Issue("leaf", "inter2", "leaf.ext", "30");
    Issue("expired", "inter2", "leaf.ext", "-1", "leaf.key");
    Issue("host", "inter2", "host.ext", "30", "leaf.key");
    Key("other.key");
    Openssl({"req", "-x509", "-key", F("other.key"), "-out", F("other.pem"), "-days", "30",
             "-subj", "/CN=Other Root", "-addext", "basicConstraints=critical,CA:TRUE"});
    Issue("stray", "other", "ca.ext", "30");
    Openssl({"req", "-new", "-key", F("leaf.key"), "-out", F("leaf.csr"), "-subj",
             "/CN=up.example"});

    Cat({"inter2.pem", "inter1.pem"}, "chain.pem");
    Cat({"leaf.pem", "inter2.pem", "inter1.pem"}, "fullchain.pem");
    Cat({"inter1.pem", "inter2.pem"}, "reversed.pem");
    Cat({"leaf.key", "leaf.pem"}, "combined.pem");
    ZEPH::test::WriteFile(F("bom.pem"), "\xEF\xBB\xBF" + ReadFile(F("chain.pem")));
    ZEPH::test::WriteFile(F("crlf.pem"), Crlf(ReadFile(F("leaf.pem"))));
    ZEPH::test::WriteFile(F("empty"), "");
    Openssl({"x509", "-in", F("leaf.pem"), "-outform", "DER", "-out", F("leaf.der")});
    Openssl({"x509", "-in", F("leaf.pem"), "-trustout", "-out", F("trusted.pem")});
    Openssl({"crl2pkcs7", "-nocrl", "-certfile", F("fullchain.pem"), "-out", F("full.p7b")});
    Openssl({"crl2pkcs7", "-nocrl", "-certfile", F("fullchain.pem"), "-outform", "DER",
             "-out", F("full.p7b.der")});
    Openssl({"pkey", "-in", F("leaf.key"), "-outform", "DER", "-out", F("leaf.key.der")});
    Openssl({"pkcs8", "-topk8", "-in", F("leaf.key"), "-v2", "aes-256-cbc", "-passout",
             std::string("pass:") + kPass, "-out", F("leaf.key.p8")});
    Openssl({"ec", "-in", F("leaf.key"), "-aes256", "-passout",
             std::string("pass:") + kPass, "-out", F("leaf.key.trad")});
    Openssl({"pkcs12", "-export", "-inkey", F("leaf.key"), "-in", F("leaf.pem"),
             "-certfile", F("chain.pem"), "-passout", std::string("pass:") + kPass,
             "-out", F("full.p12")});
    Openssl({"pkcs12", "-export", "-legacy", "-inkey", F("leaf.key"), "-in",
             F("leaf.pem"), "-certfile", F("chain.pem"), "-passout",
             std::string("pass:") + kPass, "-out", F("legacy.p12")});
    Openssl({"dsaparam", "-genkey", "-out", F("dsa.key"), "1024"});
  }

  std::string F(const std::string& name) const { return dir_ + "/" + name; }
  std::string Pem(const std::string& name) const { return ReadFile(F(name)); }

 private:
  void Openssl(std::vector<std::string> args) {
    args.insert(args.begin(), "/usr/bin/openssl");
    const CommandResult r = ZEPH::test::Run(args);
    ASSERT_EQ(r.status, 0) << args[1] << ": " << r.err;
  }
  void Key(const std::string& name) {
    Openssl({"genpkey", "-algorithm", "EC", "-pkeyopt", "ec_paramgen_curve:P-256",
             "-out", F(name)});
  }
  // `name`.pem for a new key `name`.key (or `key`), issued by `issuer`.
  void Issue(const std::string& name, const std::string& issuer,
             const std::string& ext, const std::string& days, std::string key = "") {
    if (key.empty()) {
      key = name + ".key";
      Key(key);
    }
    Openssl({"req", "-new", "-key", F(key), "-out", F(name + ".csr"), "-subj",
             "/CN=" + name});
    Openssl({"x509", "-req", "-in", F(name + ".csr"), "-CA", F(issuer + ".pem"), "-CAkey",
             F(issuer + ".key"), "-CAcreateserial", "-days", days, "-extfile", F(ext),
             "-out", F(name + ".pem")});
  }
  void Cat(const std::vector<std::string>& parts, const std::string& out) {
    std::string all;
    for (const std::string& p : parts) all += ReadFile(F(p));
    ZEPH::test::WriteFile(F(out), all);
  }
  static std::string Crlf(const std::string& text) {
    std::string out;
    for (char c : text) {
      if (c == '\n') out += '\r';
      out += c;
    }
    return out;
  }

  TempRoot root_;
  std::string dir_;
};

// One form an administrator brings, and what must come of it.
struct Case {
  const char* what;
  // The files, as the upload parameters name them (values are names of
  // the material), and whether the passphrase goes along.
  std::vector<std::pair<const char*, const char*>> files;
  bool passphrase;
  int code;            // 0: imported
  // The reason of a refusal; for an import, a warning it carries besides
  // the one about the host name, which every certificate but "host" gets.
  const char* reason;
  // An import's fullchain.pem: the certificate, then its intermediates.
  std::vector<const char*> fullchain;
};

const Case kCases[] = {
    {"fullchain as intermediate", {{"key", "leaf.key"}, {"cert", "leaf.pem"}, {"inter_cert", "fullchain.pem"}}, false, 0, "", {"leaf", "inter2", "inter1"}},
    {"DER certificate", {{"key", "leaf.key"}, {"cert", "leaf.der"}}, false, 0, "", {"leaf"}},
    {"PKCS#7 bundle", {{"key", "leaf.key"}, {"cert", "full.p7b"}}, false, 0, "", {"leaf", "inter2", "inter1"}},
    {"DER PKCS#7 bundle", {{"key", "leaf.key"}, {"cert", "full.p7b.der"}}, false, 0, "", {"leaf", "inter2", "inter1"}},
    {"trusted certificate", {{"key", "leaf.key"}, {"cert", "trusted.pem"}}, false, 0, "", {"leaf"}},
    {"CRLF line ends", {{"key", "leaf.key"}, {"cert", "crlf.pem"}}, false, 0, "", {"leaf"}},
    {"request as certificate", {{"key", "leaf.key"}, {"cert", "leaf.csr"}}, false, 5510, "request", {}},
    {"empty certificate", {{"key", "leaf.key"}, {"cert", "empty"}}, false, 5510, "empty_file", {}},
    {"key as certificate", {{"key", "leaf.key"}, {"cert", "leaf.key"}}, false, 5510, "key_not_certificate", {}},
    {"certificate as key", {{"key", "leaf.pem"}, {"cert", "leaf.pem"}}, false, 5511, "certificate_not_key", {}},
    {"PKCS#12 with passphrase", {{"pkcs12", "full.p12"}}, true, 0, "", {"leaf", "inter2", "inter1"}},
    {"legacy PKCS#12", {{"pkcs12", "legacy.p12"}}, true, 0, "", {"leaf", "inter2", "inter1"}},
    {"PKCS#12 as certificate", {{"cert", "full.p12"}}, true, 0, "", {"leaf", "inter2", "inter1"}},
    {"PKCS#12 without passphrase", {{"pkcs12", "full.p12"}}, false, 5510, "passphrase_required", {}},
    {"encrypted PKCS#8 key", {{"key", "leaf.key.p8"}, {"cert", "leaf.pem"}}, true, 0, "", {"leaf"}},
    {"encrypted traditional key", {{"key", "leaf.key.trad"}, {"cert", "leaf.pem"}}, true, 0, "", {"leaf"}},
    {"encrypted key without passphrase", {{"key", "leaf.key.p8"}, {"cert", "leaf.pem"}}, false, 5511, "key_encrypted", {}},
    {"DER key", {{"key", "leaf.key.der"}, {"cert", "leaf.pem"}}, false, 0, "", {"leaf"}},
    {"key and certificate in one file", {{"cert", "combined.pem"}}, false, 0, "", {"leaf"}},
    {"combined file beside a key", {{"key", "leaf.key"}, {"cert", "combined.pem"}, {"inter_cert", "chain.pem"}}, false, 0, "", {"leaf", "inter2", "inter1"}},
    {"intermediates in the wrong order", {{"key", "leaf.key"}, {"cert", "leaf.pem"}, {"inter_cert", "reversed.pem"}}, false, 0, "", {"leaf", "inter2", "inter1"}},
    {"chain given twice", {{"key", "leaf.key"}, {"cert", "fullchain.pem"}, {"inter_cert", "chain.pem"}}, false, 0, "", {"leaf", "inter2", "inter1"}},
    {"byte-order mark in the intermediates", {{"key", "leaf.key"}, {"cert", "leaf.pem"}, {"inter_cert", "bom.pem"}}, false, 0, "", {"leaf", "inter2", "inter1"}},
    {"root among the intermediates", {{"key", "leaf.key"}, {"cert", "leaf.pem"}, {"inter_cert", "root.pem"}}, false, 0, "", {"leaf"}},
    {"expired certificate", {{"key", "leaf.key"}, {"cert", "expired.pem"}}, false, 0, "expired", {"expired"}},
    {"certificate for this host", {{"key", "leaf.key"}, {"cert", "host.pem"}}, false, 0, "", {"host"}},
    {"intermediate of another chain", {{"key", "leaf.key"}, {"cert", "leaf.pem"}, {"inter_cert", "stray.pem"}}, false, 5517, "chain_broken", {}},
    {"DSA key", {{"key", "dsa.key"}, {"cert", "leaf.pem"}}, false, 5518, "dsa_key", {}},
    {"key of another certificate", {{"key", "other.key"}, {"cert", "leaf.pem"}}, false, 5514, "key_mismatch", {}},
};

// The common names of the certificates of a PEM file, a line each.
std::string CommonNames(const std::string& pem_file) {
  return ZEPH::test::Run({"/bin/sh", "-c",
      "/usr/bin/openssl crl2pkcs7 -nocrl -certfile '" + pem_file +
      "' | /usr/bin/openssl pkcs7 -print_certs -noout | sed -n 's/^subject=CN = //p'"}).out;
}

// The two hosts that prepare an import.
enum class Host { kZephcert, kServer };

class ImportUpload : public ::testing::TestWithParam<Host> {
 protected:
  static void SetUpTestSuite() { material_ = new Material; }
  static void TearDownTestSuite() {
    delete material_;
    material_ = nullptr;
  }

  void SetUp() override {
    if (GetParam() == Host::kServer) {
      server_.reset(new ZEPH::test::ServerProcess(root_.dir()));
      ASSERT_TRUE(server_->listening()) << server_->Log();
    } else {
      ASSERT_EQ(ZEPH::test::Run({ZEPH::test::BinDir() + "/zephcert", "--root",
                                 root_.dir(), "init"}).status, 0);
    }
  }

  // The answer to an import of `c`'s files.
  Json::Value Import(const Case& c) {
    Json::Value params;
    params["desc"] = c.what;
    if (c.passphrase) params["passphrase"] = kPass;
    std::string out;
    if (GetParam() == Host::kServer) {
      ZEPH::test::WriteFile(root_.Path("/params.json"), ZEPH::JsonCompact(params));
      std::vector<std::string> form = {
          "-F", "params=<" + root_.Path("/params.json") + ";type=application/json"};
      for (const auto& f : c.files) {
        form.insert(form.end(), {"-F", std::string(f.first) + "=@" + material_->F(f.second)});
      }
      const ZEPH::test::CurlReply r =
          ZEPH::test::Curl(server_->port(), "/api/ZEPH.Core.Certificate/1/import",
                           form, server_->Token(), root_.dir());
      EXPECT_EQ(r.status, 200) << r.error;
      out = r.body;
    } else {
      for (const auto& f : c.files) {
        params[std::string(f.first) + "_tmp"] = material_->F(f.second);
      }
      out = ZEPH::test::Run({ZEPH::test::BinDir() + "/zephcert", "--root", root_.dir(),
                             "call", "ZEPH.Core.Certificate", "import",
                             ZEPH::JsonCompact(params)}).out;
    }
    Json::Value answer;
    EXPECT_TRUE(ZEPH::JsonParse(out, answer)) << out;
    return answer;
  }

  static Material* material_;
  TempRoot root_;
  std::unique_ptr<ZEPH::test::ServerProcess> server_;
};
Material* ImportUpload::material_ = nullptr;

TEST_P(ImportUpload, EveryFormIsImportedPlainOrRefusedWithItsReason) {
  const std::string archive = root_.Path("/usr/zeph/etc/certificate/_archive/");
  for (const Case& c : kCases) {
    SCOPED_TRACE(c.what);
    const Json::Value answer = Import(c);
    if (c.code != 0) {
      EXPECT_EQ(answer["error"]["code"].asInt(), c.code) << answer;
      EXPECT_EQ(answer["error"]["data"]["reason"].asString(), c.reason) << answer;
      EXPECT_FALSE(answer["error"]["data"]["message"].asString().empty());
      continue;
    }
    ASSERT_TRUE(answer["success"].asBool()) << answer;
    const std::string dir = archive + answer["data"]["id"].asString();
    // Only the certificate made for this host carries its name.
    std::set<std::string> warned, expected_warnings;
    for (const Json::Value& w : answer["data"]["warnings"]) {
      warned.insert(w["reason"].asString());
    }
    if (std::string(c.fullchain[0]) != "host") {
      expected_warnings.insert("host_name_not_covered");
    }
    if (*c.reason != '\0') expected_warnings.insert(c.reason);
    EXPECT_EQ(warned, expected_warnings) << answer;
    std::string expected;
    for (const char* cn : c.fullchain) expected += std::string(cn) + "\n";
    EXPECT_EQ(CommonNames(dir + "/fullchain.pem"), expected);
    for (const char* file : {"cert.pem", "fullchain.pem", "chain.pem"}) {
      EXPECT_EQ(ReadFile(dir + "/" + file).find("PRIVATE KEY"), std::string::npos) << file;
    }
    EXPECT_EQ(ZEPH::test::Exists(dir + "/chain.pem"), c.fullchain.size() > 1);
  }
}

std::string HostName(const ::testing::TestParamInfo<Host>& host) {
  return host.param == Host::kServer ? "Server" : "Zephcert";
}

INSTANTIATE_TEST_SUITE_P(Hosts, ImportUpload,
                         ::testing::Values(Host::kZephcert, Host::kServer), HostName);

}  // namespace
