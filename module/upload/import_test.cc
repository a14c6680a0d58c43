// ZEPH.Core.Certificate "import" through the method table, with key material
// made by openssl for each test.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <openssl/pem.h>

#include <set>
#include <string>
#include <vector>

#include "module/archive/archive_testing.h"
#include "module/common/ssl_ptr.h"
#include "module/upload/upload_testing.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ApplianceRoot;
using ZEPH::test::CallResult;
using ZEPH::test::Exists;
using ZEPH::test::KeyKind;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::WriteFile;

const char kApi[] = "ZEPH.Core.Certificate";

std::set<std::string> Entries(const std::string& dir) {
  std::set<std::string> out;
  const std::string listing = ZEPH::test::Run({"/bin/ls", "-A", dir}).out;
  size_t start = 0;
  for (size_t nl; (nl = listing.find('\n', start)) != std::string::npos;
       start = nl + 1) {
    out.insert(listing.substr(start, nl - start));
  }
  return out;
}

// The number of PEM certificates OpenSSL reads from `path`.
int CountCerts(const std::string& path) {
  ZEPH::ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  if (!bio) return -1;
  int n = 0;
  while (ZEPH::ssl::X509Ptr(
      PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr))) {
    ++n;
  }
  return n;
}

// An appliance root with an upload directory holding an authority
// ("ca.pem", "ca.key"), a server key "leaf.key" and its certificate
// "leaf.pem" issued by the authority.
class ImportTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZEPH::test::MakeDirs(Up(""));
    ZEPH::test::MakeKey(KeyKind::kEc, Up("ca.key"));
    ZEPH::test::MakeSelfSigned(Up("ca.key"), "Upload Test Intermediate",
                               Up("ca.pem"));
    ZEPH::test::MakeKey(KeyKind::kRsa, Up("leaf.key"));
    ZEPH::test::MakeIssued(Up("leaf.key"), "leaf.example", Up("ca.pem"),
                           Up("ca.key"), Up("leaf.pem"));
  }

  std::string Up(const std::string& name) const {
    return root_.Path("/upload/" + name);
  }

  Json::Value Params(const std::string& key, const std::string& cert,
                     const std::string& inter = "") const {
    Json::Value p;
    p["desc"] = "uploaded";
    p["key_tmp"] = Up(key);
    p["cert_tmp"] = Up(cert);
    if (!inter.empty()) p["inter_cert_tmp"] = Up(inter);
    return p;
  }

  CallResult Import(const Json::Value& params) const {
    return root_.Call(kApi, "import", params);
  }

  std::string Dir(const std::string& id) const {
    return root_.Archive("/" + id);
  }

  ApplianceRoot root_;
};

TEST_F(ImportTest, NewCertificateWithIntermediate) {
  const std::string key = ReadFile(Up("leaf.key"));
  const std::string cert = ReadFile(Up("leaf.pem"));
  const std::string inter = ReadFile(Up("ca.pem"));

  CallResult r = Import(Params("leaf.key", "leaf.pem", "ca.pem"));
  ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
  const std::string id = r.data()["id"].asString();
  ASSERT_EQ(id.size(), 6u);
  EXPECT_EQ(r.data().getMemberNames(), std::vector<std::string>{"id"});
  EXPECT_FALSE(r.response.httpd_restart());

  const std::string dir = Dir(id);
  EXPECT_EQ(Entries(dir), (std::set<std::string>{"cert.pem", "chain.pem",
                                                 "fullchain.pem",
                                                 "privkey.pem"}));
  EXPECT_EQ(ModeOf(dir) & 07777, 0700u);
  for (const char* f : {"cert.pem", "chain.pem", "fullchain.pem", "privkey.pem"}) {
    EXPECT_EQ(ModeOf(dir + "/" + f) & 07777, 0400u) << f;
  }
  EXPECT_EQ(ReadFile(dir + "/privkey.pem"), key);
  EXPECT_EQ(ReadFile(dir + "/cert.pem"), cert);
  EXPECT_EQ(ReadFile(dir + "/chain.pem"), inter);
  EXPECT_EQ(ReadFile(dir + "/fullchain.pem"), cert + inter);
  EXPECT_FALSE(Exists(dir + ".temp"));
  // The uploads are the server's; the import leaves them alone.
  EXPECT_EQ(ReadFile(Up("leaf.key")), key);
  EXPECT_EQ(ReadFile(Up("leaf.pem")), cert);

  const Json::Value entry = root_.Info()[id];
  EXPECT_EQ(entry["desc"].asString(), "uploaded");
  EXPECT_TRUE(entry["user_deletable"].asBool());
  EXPECT_EQ(entry["services"], Json::Value(Json::arrayValue));
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00003u);
  EXPECT_EQ(root_.Events().back()["text1"].asString(), "leaf.example");

  // The list shows what was imported.
  CallResult list = root_.Call("ZEPH.Core.Certificate.CRT", "list");
  ASSERT_TRUE(list.ok());
  EXPECT_NE(ZEPH::JsonCompact(list.data()).find(id), std::string::npos);
}

// RSA and EC keys import, and so does a key of a type the checks do not
// know (Ed25519); each directory holds no "chain.pem" without an
// intermediate, and its full chain is the certificate alone.
TEST_F(ImportTest, KeyTypesWithoutIntermediate) {
  for (KeyKind kind : {KeyKind::kRsa, KeyKind::kEc, KeyKind::kEd25519}) {
    const std::string name = "k" + std::to_string(static_cast<int>(kind));
    ZEPH::test::MakeKey(kind, Up(name + ".key"));
    ZEPH::test::MakeSelfSigned(Up(name + ".key"), name + ".example",
                               Up(name + ".pem"));
    CallResult r = Import(Params(name + ".key", name + ".pem"));
    ASSERT_TRUE(r.ok()) << name << " " << r.code() << root_.Log();
    const std::string dir = Dir(r.data()["id"].asString());
    EXPECT_EQ(Entries(dir), (std::set<std::string>{"cert.pem", "fullchain.pem",
                                                   "privkey.pem"}));
    EXPECT_EQ(ReadFile(dir + "/fullchain.pem"), ReadFile(Up(name + ".pem")));
  }
}

TEST_F(ImportTest, FlagsAcceptTextAndBooleans) {
  Json::Value p = Params("leaf.key", "leaf.pem");
  p["as_default"] = "true";
  p["user_deletable"] = false;
  CallResult r = Import(p);
  ASSERT_TRUE(r.ok()) << r.code();
  const std::string id = r.data()["id"].asString();
  EXPECT_EQ(ReadFile(root_.Archive("/DEFAULT")), id + "\n");
  EXPECT_FALSE(root_.Info()[id]["user_deletable"].asBool());

  p["as_default"] = "0";
  p["user_deletable"] = "yes";
  r = Import(p);
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(ReadFile(root_.Archive("/DEFAULT")), id + "\n");
  EXPECT_TRUE(root_.Info()[r.data()["id"].asString()]["user_deletable"].asBool());
}

// Joined byte for byte, a certificate without its last line feed would
// glue the intermediate's BEGIN line to its END line.
TEST_F(ImportTest, CertificateWithoutFinalLineFeed) {
  std::string cert = ReadFile(Up("leaf.pem"));
  ASSERT_EQ(cert.back(), '\n');
  cert.pop_back();
  WriteFile(Up("leaf.pem"), cert);
  std::string inter = ReadFile(Up("ca.pem"));
  inter.pop_back();
  WriteFile(Up("ca.pem"), inter);

  CallResult r = Import(Params("leaf.key", "leaf.pem", "ca.pem"));
  ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
  const std::string dir = Dir(r.data()["id"].asString());
  EXPECT_EQ(ReadFile(dir + "/cert.pem"), cert);  // copied as uploaded
  const std::string full = ReadFile(dir + "/fullchain.pem");
  EXPECT_EQ(full, cert + "\n" + inter + "\n");
  EXPECT_NE(full.find("-----END CERTIFICATE-----\n-----BEGIN CERTIFICATE-----"),
            std::string::npos);
  EXPECT_EQ(CountCerts(dir + "/fullchain.pem"), 2);
}

// A leading UTF-8 byte-order mark (as some editors save) is stripped from
// the uploaded certificate and key, the one change made to the uploads.
TEST_F(ImportTest, ByteOrderMarkIsStripped) {
  const std::string bom = "\xEF\xBB\xBF";
  const std::string key = ReadFile(Up("leaf.key"));
  const std::string cert = ReadFile(Up("leaf.pem"));
  WriteFile(Up("leaf.key"), bom + key);
  WriteFile(Up("leaf.pem"), bom + cert);

  CallResult r = Import(Params("leaf.key", "leaf.pem", "ca.pem"));
  ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
  const std::string dir = Dir(r.data()["id"].asString());
  EXPECT_EQ(ReadFile(dir + "/privkey.pem"), key);
  EXPECT_EQ(ReadFile(dir + "/cert.pem"), cert);
  EXPECT_EQ(ReadFile(dir + "/fullchain.pem").substr(0, 5), "-----");
  EXPECT_EQ(ReadFile(Up("leaf.key")), key);
  EXPECT_EQ(ReadFile(Up("leaf.pem")), cert);
}

TEST_F(ImportTest, DsaKeyIsRefused) {
  ZEPH::test::MakeKey(KeyKind::kDsa, Up("dsa.key"));
  ZEPH::test::MakeSelfSigned(Up("dsa.key"), "dsa.example", Up("dsa.pem"));
  const std::set<std::string> before = Entries(root_.Archive());
  CallResult r = Import(Params("dsa.key", "dsa.pem"));
  EXPECT_EQ(r.code(), 5518);
  EXPECT_TRUE(root_.LogContains("Failed to check private key for " + Up("dsa.key")));
  EXPECT_EQ(Entries(root_.Archive()), before);
}

TEST_F(ImportTest, KeyOfAnotherCertificateLeavesNothingBehind) {
  ZEPH::test::MakeKey(KeyKind::kRsa, Up("other.key"));
  const std::set<std::string> before = Entries(root_.Archive());
  CallResult r = Import(Params("other.key", "leaf.pem"));
  EXPECT_EQ(r.code(), 5514);
  EXPECT_TRUE(r.data().isNull());
  EXPECT_TRUE(root_.LogContains(Up("leaf.pem") + " and " + Up("other.key") +
                                " are not match"));
  // Neither the new directory nor its work directory survives.
  EXPECT_EQ(Entries(root_.Archive()), before);
}

TEST_F(ImportTest, UnrelatedIntermediateIsRefused) {
  ZEPH::test::MakeKey(KeyKind::kEc, Up("stranger.key"));
  ZEPH::test::MakeSelfSigned(Up("stranger.key"), "Someone Else CA",
                             Up("stranger.pem"));
  const std::set<std::string> before = Entries(root_.Archive());
  CallResult r = Import(Params("leaf.key", "leaf.pem", "stranger.pem"));
  EXPECT_EQ(r.code(), 5517);
  EXPECT_TRUE(root_.LogContains(
      "Intermediate certificate & certificate is not matching."));
  EXPECT_EQ(Entries(root_.Archive()), before);
}

// Each kind of bad upload gets its code, leaves the archive as it was and
// the upload files untouched.
TEST_F(ImportTest, BadUploads) {
  WriteFile(Up("empty"), "");
  std::string binary(4096, '\0');
  for (size_t i = 0; i < binary.size(); ++i) binary[i] = static_cast<char>(i * 37);
  WriteFile(Up("binary"), binary);
  // Several MiB of text that looks like PEM but is not.
  std::string huge = "-----BEGIN CERTIFICATE-----\n";
  while (huge.size() < 6u << 20) huge += std::string(64, 'A') + "\n";
  WriteFile(Up("huge"), huge);
  ZEPH::test::Run({"/usr/bin/openssl", "genpkey", "-algorithm", "EC",
                   "-pkeyopt", "ec_paramgen_curve:P-256", "-aes256", "-pass",
                   "pass:secret", "-out", Up("encrypted.key")});
  ZEPH::test::Run({"/usr/bin/openssl", "req", "-new", "-key", Up("leaf.key"),
                   "-subj", "/CN=request", "-out", Up("request.csr")});
  ASSERT_EQ(symlink(Up("missing").c_str(), Up("dangling").c_str()), 0);
  ASSERT_EQ(symlink(Up("leaf.key").c_str(), Up("key-link").c_str()), 0);

  const struct {
    const char* key;
    const char* cert;
    const char* inter;  // "" for none
    int code;
  } cases[] = {
      {"empty", "leaf.pem", "", 5511},
      {"binary", "leaf.pem", "", 5511},
      {"huge", "leaf.pem", "", 5511},
      {"leaf.pem", "leaf.pem", "", 5511},  // a certificate for a key
      {"encrypted.key", "leaf.pem", "", 5511},
      {"missing", "leaf.pem", "", 5511},
      {"dangling", "leaf.pem", "", 5511},
      {"", "leaf.pem", "", 5511},  // the upload directory itself
      {"leaf.key", "empty", "", 5514},
      {"leaf.key", "binary", "", 5514},
      {"leaf.key", "request.csr", "", 5514},
      {"leaf.key", "leaf.key", "", 5514},
      {"leaf.key", "missing", "", 5514},
      {"leaf.key", "huge", "", 5514},
      {"leaf.key", "leaf.pem", "empty", 5512},
      {"leaf.key", "leaf.pem", "binary", 5512},
      {"leaf.key", "leaf.pem", "huge", 5512},
      {"leaf.key", "leaf.pem", "leaf.key", 5512},
      {"leaf.key", "leaf.pem", "missing", 5517},
  };
  const std::set<std::string> before = Entries(root_.Archive());
  std::vector<std::string> names = {"leaf.key", "leaf.pem", "ca.pem", "empty",
                                    "binary", "huge", "encrypted.key",
                                    "request.csr"};
  std::vector<std::string> contents;
  for (const std::string& n : names) contents.push_back(ReadFile(Up(n)));

  for (const auto& c : cases) {
    CallResult r = Import(Params(c.key, c.cert, c.inter));
    EXPECT_EQ(r.code(), c.code) << c.key << " " << c.cert << " " << c.inter;
    EXPECT_EQ(Entries(root_.Archive()), before) << c.key << " " << c.cert;
  }
  for (size_t i = 0; i < names.size(); ++i) {
    EXPECT_EQ(ReadFile(Up(names[i])), contents[i]) << names[i];
  }
  EXPECT_TRUE(root_.LogContains("Failed to read private key from " + Up("empty")));
  EXPECT_TRUE(root_.LogContains("Failed to BIO_new_file. [" + Up("missing") + "]"));
  EXPECT_TRUE(root_.LogContains("Failed to get certificate info from inter cert file"));

  // A symbolic link is followed like any path the server hands over.
  CallResult r = Import(Params("key-link", "leaf.pem"));
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(ReadFile(Dir(r.data()["id"].asString()) + "/privkey.pem"),
            contents[0]);
}

// A request that names "inter_cert_tmp" gets its "chain.pem" from it, even
// an empty path, which cannot be copied.
TEST_F(ImportTest, EmptyIntermediatePathCannotBeCopied) {
  Json::Value p = Params("leaf.key", "leaf.pem");
  p["inter_cert_tmp"] = "";
  const std::set<std::string> before = Entries(root_.Archive());
  CallResult r = Import(p);
  EXPECT_EQ(r.code(), 5515);
  EXPECT_TRUE(root_.LogContains("Failed to copy and chmod to "));
  EXPECT_EQ(Entries(root_.Archive()), before);
}

TEST_F(ImportTest, ParameterRules) {
  Json::Value p = Params("leaf.key", "leaf.pem");
  const struct {
    const char* name;
    Json::Value value;  // null: removed
    int code;
  } cases[] = {
      {"key_tmp", Json::Value(), 5511},
      {"desc", Json::Value(), 5511},
      {"id", Json::Value(5), 5511},
      {"as_default", Json::Value(true), 5511},
      {"cert_tmp", Json::Value(), 5510},
      {"cert_tmp", Json::Value(1), 5510},
      {"inter_cert_tmp", Json::Value(Json::arrayValue), 5512},
  };
  for (const auto& c : cases) {
    Json::Value q = p;
    if (c.value.isNull()) {
      q.removeMember(c.name);
    } else {
      q[c.name] = c.value;
    }
    EXPECT_EQ(Import(q).code(), c.code) << c.name;
  }
}

TEST_F(ImportTest, UnknownIdIsRefusedBeforeAnythingIsTouched) {
  const std::set<std::string> before = Entries(root_.Archive());
  for (const char* id : {"nosuch", "..", "../_archive", "a.b"}) {
    Json::Value p = Params("leaf.key", "leaf.pem");
    p["id"] = id;
    EXPECT_EQ(Import(p).code(), 5503) << id;
    EXPECT_TRUE(root_.LogContains(std::string(id) + " is not a valid cert id"));
  }
  EXPECT_EQ(Entries(root_.Archive()), before);
}

// Replacing the files of a certificate that the web administration
// interface uses keeps its id and asks for the web server to restart.
TEST_F(ImportTest, ReplaceKeepsIdAndRedeploys) {
  const std::string id = root_.CreateCertificate("old.example");
  ASSERT_FALSE(id.empty());
  Json::Value bind;
  bind["settings"][0]["service"] = root_.WebService();
  bind["settings"][0]["id"] = id;
  bind["settings"][0]["old_id"] = "";
  ASSERT_TRUE(root_.Call("ZEPH.Core.Certificate.Service", "set", bind).ok());
  const std::set<std::string> before = Entries(root_.Archive());

  Json::Value p = Params("leaf.key", "leaf.pem", "ca.pem");
  p["id"] = id;
  p["desc"] = "replaced";
  CallResult r = Import(p);
  ASSERT_TRUE(r.ok()) << r.code() << root_.Log();
  EXPECT_EQ(r.data()["id"].asString(), id);
  EXPECT_TRUE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(r.response.httpd_restart());

  EXPECT_EQ(Entries(root_.Archive()), before);
  EXPECT_EQ(Entries(Dir(id)), (std::set<std::string>{"cert.pem", "chain.pem",
                                                      "fullchain.pem",
                                                      "privkey.pem"}));
  EXPECT_EQ(ReadFile(Dir(id) + "/cert.pem"), ReadFile(Up("leaf.pem")));
  const std::string web = root_.Path("/usr/zeph/etc/certificate/system/default");
  EXPECT_EQ(ReadFile(web + "/cert.pem"), ReadFile(Up("leaf.pem")));
  EXPECT_EQ(ReadFile(web + "/fullchain.pem"),
            ReadFile(Up("leaf.pem")) + ReadFile(Up("ca.pem")));
  EXPECT_EQ(root_.Info()[id]["desc"].asString(), "replaced");
  EXPECT_EQ(root_.Info()[id]["services"].size(), 1u);
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00004u);

  // A certificate that no service uses needs no restart.
  const std::string unused = root_.CreateCertificate("unused.example");
  p["id"] = unused;
  r = Import(p);
  ASSERT_TRUE(r.ok()) << r.code();
  EXPECT_EQ(r.data()["id"].asString(), unused);
  EXPECT_FALSE(r.data()["restart_httpd"].asBool());
  EXPECT_TRUE(r.data().isMember("restart_httpd"));
  EXPECT_FALSE(r.response.httpd_restart());
}

TEST_F(ImportTest, FailedReplaceKeepsTheCertificate) {
  const std::string id = root_.CreateCertificate("old.example");
  ASSERT_FALSE(id.empty());
  std::vector<std::string> files = {"privkey.pem", "cert.pem", "fullchain.pem",
                                    "zeph-ca-cert.pem", "zeph-ca-privkey.pem"};
  std::vector<std::string> contents;
  for (const std::string& f : files) contents.push_back(ReadFile(Dir(id) + "/" + f));

  ZEPH::test::MakeKey(KeyKind::kEc, Up("other.key"));
  Json::Value p = Params("other.key", "leaf.pem", "ca.pem");
  p["id"] = id;
  EXPECT_EQ(Import(p).code(), 5514);
  for (size_t i = 0; i < files.size(); ++i) {
    EXPECT_EQ(ReadFile(Dir(id) + "/" + files[i]), contents[i]) << files[i];
  }
  EXPECT_FALSE(Exists(Dir(id) + ".temp"));
  EXPECT_EQ(root_.Info()[id]["desc"].asString(), "made by a test");
}

// Failures that only show without root's privileges: the import runs in a
// child process as an unprivileged user on a root that user owns.
class UnprivilegedImportTest : public ImportTest {
 protected:
  void SetUp() override {
    ImportTest::SetUp();
    existing_ = root_.CreateCertificate("old.example");
    ASSERT_FALSE(existing_.empty());
    ASSERT_EQ(chmod(root_.dir().c_str(), 0755), 0);
    ZEPH::test::Run({"/bin/chown", "-R",
                     std::to_string(ZEPH::test::UnprivilegedUid()) + ":" +
                         std::to_string(ZEPH::test::UnprivilegedGid()),
                     root_.dir()});
  }

  // The import's outcome in the child: -1 success with an empty result,
  // 0 success with a result, else the error code.
  int ImportUnprivileged(const Json::Value& params) {
    const int status = ZEPH::test::RunUnprivileged([&]() {
      CallResult r = Import(params);
      if (r.ok()) return r.data().empty() ? 1 : 0;
      return r.code() - 5500;
    });
    if (status == 1) return -1;
    if (status == 0) return 0;
    return status + 5500;
  }

  std::string existing_;
};

TEST_F(UnprivilegedImportTest, UnreadableUploads) {
  const std::set<std::string> before = Entries(root_.Archive());
  ASSERT_EQ(chmod(Up("leaf.key").c_str(), 0), 0);
  EXPECT_EQ(ImportUnprivileged(Params("leaf.key", "leaf.pem")), 5511);
  ASSERT_EQ(chmod(Up("leaf.key").c_str(), 0600), 0);
  ASSERT_EQ(chmod(Up("ca.pem").c_str(), 0), 0);
  EXPECT_EQ(ImportUnprivileged(Params("leaf.key", "leaf.pem", "ca.pem")), 5517);
  ASSERT_EQ(chmod(Up("leaf.pem").c_str(), 0), 0);
  EXPECT_EQ(ImportUnprivileged(Params("leaf.key", "leaf.pem")), 5514);
  EXPECT_EQ(Entries(root_.Archive()), before);
  // The same user imports readable files: the failures were the files'.
  ASSERT_EQ(chmod(Up("leaf.pem").c_str(), 0600), 0);
  EXPECT_EQ(ImportUnprivileged(Params("leaf.key", "leaf.pem")), 0);
}

// Once the uploads have passed every check, a failure to move them into
// place is logged and answered as a success with an empty result; the
// certificate keeps its old files.
TEST_F(UnprivilegedImportTest, FailedMoveStillAnswersSuccess) {
  const std::string old_cert = ReadFile(Dir(existing_) + "/cert.pem");
  // A file the backup copy cannot read makes the move fail untouched.
  ASSERT_EQ(chmod((Dir(existing_) + "/zeph-ca-privkey.pem").c_str(), 0), 0);
  Json::Value p = Params("leaf.key", "leaf.pem");
  p["id"] = existing_;
  p["desc"] = "never recorded";
  EXPECT_EQ(ImportUnprivileged(p), -1);
  EXPECT_TRUE(root_.LogContains("Failed to move " + Dir(existing_) + ".temp to " +
                                Dir(existing_)));
  EXPECT_EQ(ReadFile(Dir(existing_) + "/cert.pem"), old_cert);
  EXPECT_EQ(root_.Info()[existing_]["desc"].asString(), "made by a test");
  EXPECT_EQ(root_.Events().back()["message_id"].asUInt(), 0x12B00004u);
}

}  // namespace
