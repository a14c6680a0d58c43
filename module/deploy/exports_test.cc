// The names that other components of the appliance look up in the built
// module.
#include <dlfcn.h>
#include <gtest/gtest.h>

#include <string>

#include "module/archive/archive_testing.h"
#include "module/deploy/deploy.h"
#include "test_support.h"

// The helpers as a C++ component of the appliance declares them itself,
// without the module's headers, and links them from the module.
bool GenCrtChecksum(Json::Value& list);
bool isPemExpire(const std::string& path, int days);
bool IsCrtPathValid(bool local, const std::string& base,
                    const std::string& name);

namespace {

const std::string Module() {
  return ZEPH::test::BinDir() + "/ZEPH.Core.Certificate.so";
}

// The three helpers, however they were reached.
struct Helpers {
  const char* how;
  bool (*checksum)(Json::Value&);
  bool (*expire)(const std::string&, int);
  bool (*path_valid)(bool, const std::string&, const std::string&);
};

TEST(ExportsTest, UtilitiesAreLinkedByTheirCxxNamesAndFoundByTheirCNames) {
  void* handle = dlopen(Module().c_str(), RTLD_NOW | RTLD_LOCAL);
  ASSERT_NE(handle, nullptr) << dlerror();
  ZEPH::test::TempRoot root;
  ZEPH::test::WriteInfo(Json::objectValue);
  ASSERT_TRUE(
      ZEPH::test::MakeCertSet(root.Path("/usr/zeph/etc/certificate/c"), "x"));

  const Helpers ways[] = {
      {"linked", GenCrtChecksum, isPemExpire, IsCrtPathValid},
      {"dlsym",
       reinterpret_cast<bool (*)(Json::Value&)>(dlsym(handle, "GenCrtChecksum")),
       reinterpret_cast<bool (*)(const std::string&, int)>(
           dlsym(handle, "isPemExpire")),
       reinterpret_cast<bool (*)(bool, const std::string&, const std::string&)>(
           dlsym(handle, "IsCrtPathValid"))},
  };
  const std::string cert = root.Path("/usr/zeph/etc/certificate/c/cert.pem");
  for (const Helpers& h : ways) {
    SCOPED_TRACE(h.how);
    ASSERT_NE(h.checksum, nullptr);
    ASSERT_NE(h.expire, nullptr);
    ASSERT_NE(h.path_valid, nullptr);
    Json::Value list(Json::arrayValue);
    EXPECT_TRUE(h.checksum(list));
    EXPECT_FALSE(h.expire(cert, 1));
    EXPECT_TRUE(h.expire(cert, 1000));
    EXPECT_TRUE(h.path_valid(false, "c", "cert.pem"));
    EXPECT_FALSE(h.path_valid(false, "c", "../.."));
  }

  auto table =
      static_cast<const CRT_ACTION_INFO*>(dlsym(handle, "rgCRTActionInfo"));
  ASSERT_NE(table, nullptr);
  const int rows[kCrtActionCount][4] = {
      {0, 0, 0, 1}, {1, 0, 0, 1}, {2, 1, 1, 1}, {3, 0, 0, 0}, {4, 0, 0, 1}};
  for (int i = 0; i < kCrtActionCount; ++i) {
    EXPECT_EQ(table[i].action, rows[i][0]);
    EXPECT_EQ(table[i].keepTarget, rows[i][1]);
    EXPECT_EQ(table[i].keepPrevious, rows[i][2]);
    EXPECT_EQ(table[i].runHook, rows[i][3] == 1);
  }
  static_assert(sizeof(CRT_ACTION_INFO) == 16, "32 + 32 + 32 + 8 bits, padded");
  dlclose(handle);
}

TEST(ExportsTest, OnlyTheContractLeavesTheModule) {
  const ZEPH::test::CommandResult nm =
      ZEPH::test::Run({"/usr/bin/nm", "-D", "--defined-only", "-C", Module()});
  ASSERT_EQ(nm.status, 0) << nm.err;
  // What the method workers call is exported under its own name...
  for (const char* name :
       {"DeployCrt(", "DeployDefCrt(", "GetDefCrtId", "UpdateCertToService(",
        "GetServiceCertID(", "WriteCertInfo(", "DropCertInfo(", "MoveDir(",
        "GetCrtId"}) {
    EXPECT_NE(nm.out.find(name), std::string::npos) << name;
  }
  // ...the file-local parts of the deployment are not.
  for (const char* name :
       {"CopyCertToService", "RunServiceHook", "CopyCertFile"}) {
    EXPECT_EQ(nm.out.find(name), std::string::npos) << name;
  }
}

}  // namespace
