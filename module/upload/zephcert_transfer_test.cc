// Import and export end to end through the zephcert command: the upload
// paths are parameters, the download goes to --output, and standard output
// carries nothing but the one JSON answer.
#include <gtest/gtest.h>

#include <algorithm>
#include <set>
#include <string>
#include <vector>

#include "module/upload/upload_testing.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ReadFile;

// Runs zephcert on the test's root; returns its exit status and the JSON
// answer it printed (null when standard output is not one JSON object).
int Zephcert(const ZEPH::test::TempRoot& root,
             const std::vector<std::string>& args, Json::Value& answer) {
  std::vector<std::string> argv = {ZEPH::test::BinDir() + "/zephcert",
                                   "--root", root.dir()};
  argv.insert(argv.end(), args.begin(), args.end());
  const ZEPH::test::CommandResult r = ZEPH::test::Run(argv);
  answer = Json::Value();
  std::string out = r.out;
  EXPECT_EQ(std::count(out.begin(), out.end(), '\n'), 1) << out;
  EXPECT_TRUE(ZEPH::JsonParse(out, answer)) << out << r.err;
  return r.status;
}

TEST(ZephcertTransfer, ImportThenExportToFile) {
  ZEPH::test::ApplianceRoot root;
  const std::string up = root.Path("/upload/");
  ZEPH::test::MakeDirs(up);
  ZEPH::test::MakeKey(ZEPH::test::KeyKind::kEc, up + "ca.key");
  ZEPH::test::MakeSelfSigned(up + "ca.key", "Transfer CA", up + "ca.pem");
  ZEPH::test::MakeKey(ZEPH::test::KeyKind::kRsa, up + "leaf.key");
  ZEPH::test::MakeIssued(up + "leaf.key", "transfer.example", up + "ca.pem",
                         up + "ca.key", up + "leaf.pem");

  Json::Value params;
  params["desc"] = "from the shell";
  params["key_tmp"] = up + "leaf.key";
  params["cert_tmp"] = up + "leaf.pem";
  params["inter_cert_tmp"] = up + "ca.pem";
  Json::Value answer;
  ASSERT_EQ(Zephcert(root, {"call", "ZEPH.Core.Certificate", "import",
                            ZEPH::JsonCompact(params)},
                     answer),
            0);
  ASSERT_TRUE(answer["success"].asBool()) << ZEPH::JsonCompact(answer);
  const std::string id = answer["data"]["id"].asString();
  ASSERT_EQ(id.size(), 6u);

  Json::Value exp;
  exp["file"] = "archive";
  exp["id"] = id;
  const std::string out = root.Path("/exported.zip");
  ASSERT_EQ(Zephcert(root, {"call", "ZEPH.Core.Certificate", "export",
                            ZEPH::JsonCompact(exp), "--output", out},
                     answer),
            0);
  EXPECT_EQ(answer["download"]["headers"]["content-disposition"].asString(),
            "attachment; filename=\"archive.zip\"");
  const std::string zip = ReadFile(out);
  EXPECT_EQ(answer["download"]["bytes"].asUInt64(), zip.size());
  EXPECT_EQ(zip.substr(0, 2), "PK");
  EXPECT_EQ(ZEPH::test::ZipMembers(out),
            (std::set<std::string>{"privkey.pem", "cert.pem", "chain.pem"}));
  EXPECT_EQ(ZEPH::test::ZipMember(out, "cert.pem"), ReadFile(up + "leaf.pem"));

  // A failed import is an API error: exit status 1.
  params["key_tmp"] = up + "ca.key";
  ASSERT_EQ(Zephcert(root, {"call", "ZEPH.Core.Certificate", "import",
                            ZEPH::JsonCompact(params)},
                     answer),
            1);
  EXPECT_EQ(answer["error"]["code"].asInt(), 5514);
}

}  // namespace
