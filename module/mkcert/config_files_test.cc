// The configuration files are compared byte for byte: the tool reads them,
// and other programs of the appliance write and read the same paths.
#include "module/mkcert/config_files.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <initializer_list>

#include "module/mkcert/mkcert_test_util.h"
#include "zeph/qlibc_string.h"

namespace ZEPH {
namespace test {
namespace {

constexpr char kServerHead[] =
    "extensions = x509v3\n"
    "[ x509v3 ]\n"
    "subjectAltName   = email:copy\n"
    "nsComment        = \"mod_ssl generated custom server certificate\"\n"
    "nsCertType       = server\n"
    "keyUsage         = critical, digitalSignature, keyEncipherment\n"
    "extendedKeyUsage = serverAuth, clientAuth\n";

constexpr char kReqHead[] =
    "[ req ]\n"
    "default_bits                    = 1024\n"
    "distinguished_name              = req_DN\n"
    "prompt                          = no\n"
    "[ req_DN ]\n";

UniqueSzList List(std::initializer_list<const char*> items) {
  UniqueSzList list(QLIBCSzListAlloc(8));
  for (const char* item : items) QLIBCSzListAdd(list.get(), item);
  return list;
}

TEST(CaExtensionFile, IsWrittenWholeInANewDirectory) {
  TempRoot root;
  const std::string path = root.Path("/new/dir/ca.crt.cfg");
  ASSERT_EQ(generateCACNF(path.c_str()), 0);
  const std::string expected =
      "extensions = x509v3\n"
      "[ x509v3 ]\n"
      "subjectAltName   = email:copy\n"
      "basicConstraints = CA:true,pathlen:0\n"
      "nsComment        = \"mod_ssl generated custom CA certificate\"\n"
      "nsCertType       = sslCA\n";
  EXPECT_EQ(ReadFile(path), expected);

  // An older, longer file is truncated, not patched.
  WriteFile(path, std::string(4096, 'x'));
  ASSERT_EQ(generateCACNF(path.c_str()), 0);
  EXPECT_EQ(ReadFile(path), expected);
}

struct AliasCase {
  const char* name;
  std::vector<const char*> aliases;
  const char* alt_line;  // "" when no line is expected
};

void PrintTo(const AliasCase& c, std::ostream* os) { *os << c.name; }

class ServerExtensionFile : public ::testing::TestWithParam<AliasCase> {};

TEST_P(ServerExtensionFile, WritesTheAliasLine) {
  TempRoot root;
  const std::string path = root.Path("/cfg.d/server.crt.cfg");
  UniqueSzList list(QLIBCSzListAlloc(8));
  for (const char* a : GetParam().aliases) QLIBCSzListAdd(list.get(), a);
  ASSERT_EQ(generateServerCNF(path.c_str(), list.get()), 0);
  EXPECT_EQ(ReadFile(path), std::string(kServerHead) + GetParam().alt_line);
}

INSTANTIATE_TEST_SUITE_P(
    Aliases, ServerExtensionFile,
    ::testing::Values(
        AliasCase{"HostAndAddress",
                  {"nas1", "10.0.0.5"},
                  "subjectAltName = \"DNS:nas1, IP:10.0.0.5\"\n"},
        AliasCase{"EmptyEntriesSkipped",
                  {"", "nas1", "", "10.0.0.1"},
                  "subjectAltName = \"DNS:nas1, IP:10.0.0.1\"\n"},
        AliasCase{"Ipv6AndNearAddresses",
                  {"fe80::1", "2001:db8::7", "nas-2.example.com", "10.1.2"},
                  "subjectAltName = \"IP:fe80::1, IP:2001:db8::7, "
                  "DNS:nas-2.example.com, DNS:10.1.2\"\n"},
        AliasCase{"OnlyEmptyEntries", {"", "", ""}, ""},
        AliasCase{"NoEntries", {}, ""}),
    [](const ::testing::TestParamInfo<AliasCase>& param) {
      return std::string(param.param.name);
    });

TEST(RequestConfiguration, HasOneLineForEachNonEmptyField) {
  TempRoot root;
  const std::string path = root.Path("/a/b/server.cfg");
  _tag_CSR_ARGUMENT full =
      Subject("TW", "Taiwan", "Taipel", "Arvelon Inc.", "Storage",
              "nas.example.com", "admin@example.com");
  ASSERT_EQ(modifyCsrCfg(path, &full), 0);
  EXPECT_EQ(ReadFile(path),
            std::string(kReqHead) +
                "countryName                     = 'TW'\n"
                "stateOrProvinceName             = 'Taiwan'\n"
                "localityName                    = 'Taipel'\n"
                "0.organizationName              = 'Arvelon Inc.'\n"
                "organizationalUnitName          = 'Storage'\n"
                "commonName                      = 'nas.example.com'\n"
                "emailAddress                    = 'admin@example.com'\n");

  _tag_CSR_ARGUMENT cn_only;
  cn_only.common_name = "arvelon";
  ASSERT_EQ(modifyCsrCfg(path, &cn_only), 0);
  EXPECT_EQ(
      ReadFile(path),
      std::string(kReqHead) + "commonName                      = 'arvelon'\n");

  _tag_CSR_ARGUMENT empty;
  ASSERT_EQ(modifyCsrCfg(path, &empty), 0);
  EXPECT_EQ(ReadFile(path), kReqHead);

  // Values go in as they are: quotes are not escaped.
  _tag_CSR_ARGUMENT quoted;
  quoted.organization = "O'Brien \"&\" Sons";
  ASSERT_EQ(modifyCsrCfg(path, &quoted), 0);
  EXPECT_EQ(ReadFile(path),
            std::string(kReqHead) +
                "0.organizationName              = 'O'Brien \"&\" Sons'\n");
}

TEST(ConfigurationWriters, RefuseBadInputWithoutTouchingTheDisk) {
  TempRoot root;
  const std::vector<std::string> before = DirEntries(root.dir());
  UniqueSzList list = List({"nas1"});
  _tag_CSR_ARGUMENT subject;
  subject.common_name = "x";

  EXPECT_EQ(makeParentDir(""), -1);
  EXPECT_TRUE(
      Logged(root, "Failed to generate directory with invalid parameters"));
  EXPECT_EQ(generateCACNF(nullptr), -1);
  EXPECT_EQ(generateCACNF(""), -1);
  EXPECT_EQ(LogCount(root, "CA CNF name is null or empty.[0x", true), 2);
  EXPECT_EQ(generateServerCNF("", list.get()), -1);
  EXPECT_TRUE(LoggedWithLibError(root, "Server CNF name is null or empty."));
  const std::string server = root.Path("/cfg/server.crt.cfg");
  EXPECT_EQ(generateServerCNF(server.c_str(), nullptr), -1);
  EXPECT_TRUE(Logged(root, "alias list is null"));
  EXPECT_EQ(modifyCsrCfg("", &subject), -1);
  EXPECT_EQ(modifyCsrCfg(root.Path("/cfg/req.cfg"), nullptr), -1);
  EXPECT_EQ(LogCount(root, "modifyCsrCfg sanity failed.[0x", true), 2);

  std::vector<std::string> after = DirEntries(root.dir());
  after.erase(std::remove(after.begin(), after.end(), "test.log"), after.end());
  EXPECT_EQ(after, before);
}

TEST(ConfigurationWriters, ReportWhereTheFileCannotBeMade) {
  TempRoot root;
  WriteFile(root.Path("/blocker"), "a file, not a directory");
  UniqueSzList list = List({"nas1"});
  _tag_CSR_ARGUMENT subject;
  subject.common_name = "x";

  // The parent cannot be made below a plain file.
  const std::string below_file = root.Path("/blocker/sub/x.cfg");
  EXPECT_EQ(makeParentDir(below_file), -1);
  EXPECT_TRUE(Logged(root, "Exec mkdir failed"));
  root.ClearLog();
  EXPECT_EQ(generateCACNF(below_file.c_str()), -1);
  EXPECT_EQ(generateServerCNF(below_file.c_str(), list.get()), -1);
  EXPECT_EQ(modifyCsrCfg(below_file, &subject), -1);
  EXPECT_EQ(LogCount(root, "generate directory failed"), 3) << root.Log();

  // The parent is there, but the file cannot be opened for writing.
  MakeDirs(root.Path("/cfg/taken"));
  const std::string dir_path = root.Path("/cfg/taken");
  root.ClearLog();
  EXPECT_EQ(generateCACNF(dir_path.c_str()), -1);
  EXPECT_TRUE(LoggedWithLibError(root, "fopen " + dir_path + " failed"))
      << root.Log();
  EXPECT_EQ(generateServerCNF(dir_path.c_str(), list.get()), -1);
  EXPECT_EQ(modifyCsrCfg(dir_path, &subject), -1);
  EXPECT_TRUE(LoggedWithLibError(root, "Open " + dir_path + " failed"))
      << root.Log();
}

}  // namespace
}  // namespace test
}  // namespace ZEPH
