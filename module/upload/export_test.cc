// ZEPH.Core.Certificate "export" through the method table: the archives are
// opened with 7z and their members checked.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <set>
#include <string>
#include <thread>
#include <vector>

#include "module/upload/sslca_form_handler.h"
#include "module/upload/upload_testing.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::APIResponse;
using ZEPH::test::ApplianceRoot;
using ZEPH::test::CallExport;
using ZEPH::test::Exists;
using ZEPH::test::ExportResult;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::WriteFile;
using ZEPH::test::ZipMember;
using ZEPH::test::ZipMembers;
using Names = std::set<std::string>;

Json::Value ArchiveParams(const std::string& id) {
  Json::Value p;
  p["file"] = "archive";
  p["id"] = id;
  return p;
}

Json::Value FileParams(const std::string& file) {
  Json::Value p;
  p["file"] = file;
  return p;
}

class ExportTest : public ::testing::Test {
 protected:
  std::string Gen(const std::string& name) const {
    return root_.Path("/usr/zeph/etc/ssl/.gen/" + name);
  }
  // The members of the delivered archive.
  Names Members(const ExportResult& r) const {
    const std::string zip = root_.Path("/delivered.zip");
    ZEPH::test::SaveDownload(r, zip);
    return ZipMembers(zip);
  }
  std::string Member(const ExportResult& r, const std::string& name) const {
    const std::string zip = root_.Path("/delivered.zip");
    ZEPH::test::SaveDownload(r, zip);
    return ZipMember(zip, name);
  }
  void SetFeature(const std::string& value) const {
    WriteFile(root_.Path("/usr/zeph/etc/features.conf"),
              "support_self_sign_cert=" + value + "\n");
  }
  // A download is the whole answer: no JSON outcome, output switched off.
  static void ExpectDownload(const ExportResult& r) {
    EXPECT_TRUE(r.delivered);
    EXPECT_EQ(r.response.outcome_count(), 0);
    EXPECT_FALSE(r.response.enable_output());
    ASSERT_EQ(r.headers.size(), 1u);
    EXPECT_EQ(r.headers[0].first, "content-disposition");
    EXPECT_EQ(r.headers[0].second, "attachment; filename=\"archive.zip\"");
  }
  static void ExpectNothing(const ExportResult& r) {
    EXPECT_FALSE(r.delivered);
    EXPECT_EQ(r.response.outcome_count(), 0);
    EXPECT_TRUE(r.response.enable_output());
  }

  ApplianceRoot root_;
};

TEST_F(ExportTest, CertificateSetFollowsTheSelfSignFeature) {
  const std::string id = root_.CreateCertificate("export.example");
  ASSERT_FALSE(id.empty());
  const std::string dir = root_.Archive("/" + id);
  // A chain file as an imported certificate would have.
  WriteFile(dir + "/chain.pem", ReadFile(dir + "/zeph-ca-cert.pem"), 0400);

  SetFeature("yes");
  // A missing work directory is made the owner's alone: the archive holds
  // private keys.
  ZEPH::test::Run({"/bin/rm", "-rf", Gen("")});
  ExportResult r = CallExport(ArchiveParams(id));
  ExpectDownload(r);
  EXPECT_EQ(Members(r), (Names{"zeph-ca-cert.pem", "zeph-ca-privkey.pem",
                               "privkey.pem", "cert.pem", "chain.pem"}));
  EXPECT_EQ(Member(r, "privkey.pem"), ReadFile(dir + "/privkey.pem"));
  EXPECT_EQ(Member(r, "zeph-ca-privkey.pem"),
            ReadFile(dir + "/zeph-ca-privkey.pem"));
  EXPECT_EQ(ModeOf(Gen("archive.zip")) & 07777, 0400u);
  EXPECT_EQ(ModeOf(Gen("")) & 07777, 0700u);
  EXPECT_EQ(ReadFile(Gen("archive.zip")), r.copy);

  SetFeature("no");
  r = CallExport(ArchiveParams(id));
  ExpectDownload(r);
  EXPECT_EQ(Members(r), (Names{"privkey.pem", "cert.pem", "chain.pem"}));

  // The set itself is left as it was.
  EXPECT_TRUE(Exists(dir + "/zeph-ca-privkey.pem"));
  EXPECT_TRUE(Exists(dir + "/privkey.pem"));
}

TEST_F(ExportTest, MissingFilesAreLeftOut) {
  const std::string id = root_.CreateCertificate("nochain.example");
  ASSERT_FALSE(id.empty());
  unlink(root_.Archive("/" + id + "/zeph-ca-privkey.pem").c_str());
  ExportResult r = CallExport(ArchiveParams(id));
  ExpectDownload(r);
  EXPECT_EQ(Members(r), (Names{"zeph-ca-cert.pem", "privkey.pem", "cert.pem"}));
}

TEST_F(ExportTest, UnknownCertificateGivesNoDownload) {
  ExportResult r = CallExport(ArchiveParams("nosuch"));
  ExpectNothing(r);
  EXPECT_TRUE(root_.LogContains("No file will be compress"));
  EXPECT_FALSE(Exists(Gen("archive.zip")));

  // Only a plain id names a directory of the archive.
  root_.ClearLog();
  ZEPH::test::MakeDirs(root_.Path("/elsewhere"));
  WriteFile(root_.Path("/elsewhere/privkey.pem"), "not for export");
  r = CallExport(ArchiveParams("../../../../../../elsewhere"));
  ExpectNothing(r);
  EXPECT_TRUE(root_.LogContains("is not a valid cert id"));
  EXPECT_FALSE(Exists(Gen("archive.zip")));
}

// CSR create's parameters for a request for `cn` with a short key.
Json::Value RequestParams(const std::string& cn) {
  Json::Value csr;
  for (const char* f : {"country", "state", "city", "organization",
                        "department", "email"}) {
    csr[f] = "";
  }
  csr["common_name"] = cn;
  csr["key_length"] = 1024;
  return csr;
}

// The key and request of the CSR method are handed out once.
TEST_F(ExportTest, RequestSetIsHandedOutOnce) {
  ASSERT_TRUE(root_.Call("ZEPH.Core.Certificate.CSR", "create",
                         RequestParams("request.example")).ok());
  const std::string key = ReadFile(Gen("server.key"));
  ASSERT_FALSE(key.empty());

  ExportResult r = CallExport(FileParams("csr_set"));
  ExpectDownload(r);
  EXPECT_EQ(Members(r), (Names{"server.csr", "server.key"}));
  EXPECT_EQ(Member(r, "server.key"), key);
  EXPECT_FALSE(Exists(Gen("server.key")));
  EXPECT_FALSE(Exists(Gen("server.csr")));

  root_.ClearLog();
  r = CallExport(FileParams("csr_set"));
  ExpectNothing(r);
  EXPECT_TRUE(root_.LogContains("No file will be compress"));
  EXPECT_TRUE(root_.LogContains("Create archive failed"));
  // The earlier archive is gone with it.
  EXPECT_FALSE(Exists(Gen("archive.zip")));
}

TEST_F(ExportTest, SignedCertificateIsHandedOutOnce) {
  ZEPH::test::MakeDirs(Gen(""));
  ZEPH::test::MakeKey(ZEPH::test::KeyKind::kEc, root_.Path("/k.pem"));
  ZEPH::test::MakeSelfSigned(root_.Path("/k.pem"), "signed.example",
                             Gen("server.crt"));
  ExportResult r = CallExport(FileParams("signed_set"));
  ExpectDownload(r);
  EXPECT_EQ(Members(r), Names{"server.crt"});
  EXPECT_FALSE(Exists(Gen("server.crt")));
  EXPECT_FALSE(CallExport(FileParams("signed_set")).delivered);
}

TEST_F(ExportTest, UnknownFileDoesNothing) {
  const std::string id = root_.CreateCertificate("keep.example");
  ASSERT_TRUE(CallExport(ArchiveParams(id)).delivered);
  const std::string earlier = ReadFile(Gen("archive.zip"));
  root_.ClearLog();
  for (const char* file : {"", "ARCHIVE", "archive ", "server.key", "csr"}) {
    ExportResult r = CallExport(FileParams(file));
    ExpectNothing(r);
  }
  EXPECT_EQ(ReadFile(Gen("archive.zip")), earlier);
  EXPECT_FALSE(root_.LogContains("uploadsslca:"));
}

// Exports running at the same time each hand out a whole archive of their
// own; the request's key reaches exactly one of them.
TEST_F(ExportTest, ConcurrentExportsDoNotMix) {
  const std::string id = root_.CreateCertificate("busy.example");
  ASSERT_FALSE(id.empty());
  ASSERT_TRUE(root_.Call("ZEPH.Core.Certificate.CSR", "create",
                         RequestParams("busy.example")).ok());
  const std::string key = ReadFile(Gen("server.key"));

  constexpr int kThreads = 6;
  std::vector<ExportResult> results(kThreads);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&results, &id, i] {
      results[i] = CallExport(i % 2 == 0 ? FileParams("csr_set")
                                         : ArchiveParams(id));
    });
  }
  for (std::thread& t : threads) t.join();

  int request_sets = 0;
  for (int i = 0; i < kThreads; ++i) {
    if (i % 2 == 1) {
      ASSERT_TRUE(results[i].delivered) << i;
      EXPECT_EQ(Members(results[i]),
                (Names{"zeph-ca-cert.pem", "zeph-ca-privkey.pem",
                       "privkey.pem", "cert.pem"}));
    } else if (results[i].delivered) {
      ++request_sets;
      EXPECT_EQ(Members(results[i]), (Names{"server.csr", "server.key"}));
      EXPECT_EQ(Member(results[i], "server.key"), key);
    }
  }
  EXPECT_EQ(request_sets, 1);
}

// A PKCS#12 export holds the key, the certificate and the certificates
// above it, readable with the passphrase only, in OpenSSL 3's default form
// or the legacy 3DES/SHA1 one; unusable parameters are refused.
TEST_F(ExportTest, Pkcs12FileOfACertificateSet) {
  Json::Value ec;
  ec["key_type"] = "ec256";
  const std::string id = root_.CreateCertificate("*.p12.example", ec);
  ASSERT_FALSE(id.empty());
  const std::string dir = root_.Archive("/" + id);
  const std::string secret = "correct horse \xC3\xA9";
  const std::string p12 = root_.Path("/delivered.p12");
  // openssl run by the test on the delivered file: "info" prints the
  // protection, "pem" the contents.
  auto openssl = [&](const std::string& what, const std::string& pass) {
    std::vector<std::string> argv = {"/usr/bin/openssl", "pkcs12", "-in", p12,
                                     "-passin", "pass:" + pass, "-nodes"};
    if (what == "info") argv.insert(argv.end(), {"-info", "-noout"});
    return ZEPH::test::Run(argv);
  };
  struct Row {
    std::string params;  // members over the base ones; null removes one
    int code;            // 0: a download
    const char* protection;
  };
  const Row kRows[] = {
      {"{}", 0, "PBES2, PBKDF2, AES-256-CBC"},
      {"{\"legacy\": false}", 0, "PBES2, PBKDF2, AES-256-CBC"},
      {"{\"legacy\": true}", 0, "pbeWithSHA1And3-KeyTripleDES-CBC"},
      {"{\"passphrase\": null}", 5503, ""},
      {"{\"passphrase\": \"\"}", 5503, ""},
      {"{\"passphrase\": \"two\\nlines\"}", 5503, ""},
      {"{\"passphrase\": \"" + std::string(1024, 'x') + "\"}", 5503, ""},
      {"{\"passphrase\": 1234}", 5503, ""},
      {"{\"legacy\": \"yes\"}", 5503, ""},
      {"{\"format\": \"pfx\"}", 5503, ""},
      {"{\"file\": \"csr_set\"}", 5503, ""},
      {"{\"id\": \"../" + id + "\"}", 5503, ""},
      {"{\"id\": \"nosuch\"}", 5501, ""},
  };
  for (const Row& row : kRows) {
    SCOPED_TRACE(row.params);
    Json::Value params = ArchiveParams(id);
    params["format"] = "pkcs12";
    params["passphrase"] = secret;
    Json::Value over;
    ASSERT_TRUE(ZEPH::JsonParse(row.params, over));
    for (const std::string& k : over.getMemberNames()) {
      if (over[k].isNull()) {
        params.removeMember(k);
      } else {
        params[k] = over[k];
      }
    }
    ExportResult r = CallExport(params);
    EXPECT_FALSE(Exists(Gen("archive.p12")));
    if (row.code != 0) {
      EXPECT_FALSE(r.delivered);
      EXPECT_EQ(r.response.error_code(), row.code);
      continue;
    }
    ASSERT_TRUE(r.delivered);
    EXPECT_EQ(r.response.outcome_count(), 0);
    EXPECT_EQ(r.headers, (ZEPH::HeaderList{
                             {"content-type", "application/x-pkcs12"},
                             {"content-disposition",
                              "attachment; filename=\"_.p12.example.p12\""}}));
    ZEPH::test::SaveDownload(r, p12);
    ZEPH::test::CommandResult info = openssl("info", secret);
    ASSERT_EQ(info.status, 0) << info.err;
    EXPECT_NE(info.err.find(row.protection), std::string::npos) << info.err;
    EXPECT_NE(openssl("info", "wrong").status, 0);
    const std::string pem = openssl("pem", secret).out;
    for (const char* file : {"privkey.pem", "cert.pem", "zeph-ca-cert.pem"}) {
      EXPECT_NE(pem.find(ReadFile(dir + "/" + file)), std::string::npos) << file;
    }
    EXPECT_EQ(pem.find(ReadFile(dir + "/zeph-ca-privkey.pem")), std::string::npos);
  }
  // The chain file of an imported set takes the place of the authority.
  WriteFile(dir + "/chain.pem", ReadFile(dir + "/cert.pem"), 0400);
  Json::Value params = ArchiveParams(id);
  params["format"] = "pkcs12";
  params["passphrase"] = "x";
  ExportResult r = CallExport(params);
  ASSERT_TRUE(r.delivered);
  ZEPH::test::SaveDownload(r, p12);
  EXPECT_EQ(openssl("pem", "x").out.find(ReadFile(dir + "/zeph-ca-cert.pem")),
            std::string::npos);
  // "zip" is the archive of old.
  params["format"] = "zip";
  ExpectDownload(CallExport(params));
  EXPECT_EQ(root_.Log().find("correct horse"), std::string::npos);
}

TEST(CreateArchive, PacksTheFilesThatExist) {
  ZEPH::test::TempRoot root;
  const std::string a = root.Path("/a.txt");
  const std::string b = root.Path("/b.txt");
  WriteFile(a, "A");
  WriteFile(b, "B");
  const std::string zip = root.Path("/out/x.zip");
  ZEPH::test::MakeDirs(root.Path("/out"));
  WriteFile(zip, "not a zip at all");  // an earlier file is replaced

  const std::string missing = root.Path("/missing.txt");
  const char* files[] = {a.c_str(), missing.c_str(), b.c_str()};
  ASSERT_EQ(SSLCAFormHandler::CreateArchive(files, zip.c_str(), 3), 0);
  EXPECT_EQ(ZipMembers(zip), (Names{"a.txt", "b.txt"}));
  EXPECT_EQ(ZipMember(zip, "b.txt"), "B");
  EXPECT_EQ(ModeOf(zip) & 07777, 0400u);

  // Only the first `count` files count.
  ASSERT_EQ(SSLCAFormHandler::CreateArchive(files, zip.c_str(), 1), 0);
  EXPECT_EQ(ZipMembers(zip), Names{"a.txt"});

  const char* none[] = {missing.c_str()};
  EXPECT_EQ(SSLCAFormHandler::CreateArchive(none, zip.c_str(), 1), -1);
  EXPECT_FALSE(Exists(zip));
  EXPECT_TRUE(root.LogContains("No file will be compress"));
  EXPECT_EQ(SSLCAFormHandler::CreateArchive(files, zip.c_str(), 0), -1);
  EXPECT_EQ(SSLCAFormHandler::CreateArchive(files, nullptr, 3), -1);
  EXPECT_EQ(SSLCAFormHandler::CreateArchive(nullptr, zip.c_str(), 3), -1);
  EXPECT_EQ(SSLCAFormHandler::CreateArchive(files, zip.c_str(), -1), -1);

  // 7z refuses to write into a file that is no directory.
  const std::string bad = a + "/x.zip";
  EXPECT_EQ(SSLCAFormHandler::CreateArchive(files, bad.c_str(), 3), -1);
  EXPECT_TRUE(root.LogContains("7z file failed"));
}

}  // namespace
