// The names that other components of the appliance link or look up in the built module.
#include <dlfcn.h>
#include <gtest/gtest.h>

#include <string>

#include "module/archive/archive_testing.h"
#include "test_support.h"

// The helpers as a C++ component of the appliance declares them, without the module's headers.
bool GenCrtChecksum(Json::Value& list);
bool isPemExpire(const std::string& path, int days);
bool IsCrtPathValid(bool local, const std::string& base, const std::string& name);

namespace {

// The utilities are linked by their C++ names and found by their C names; what the method
// workers call is exported under its own name, the file-local parts of the deployment are not.
TEST(ExportsTest, OnlyTheContractLeavesTheModule) {
  const std::string module = ZEPH::test::BinDir() + "/ZEPH.Core.Certificate.so";
  void* handle = dlopen(module.c_str(), RTLD_NOW | RTLD_LOCAL);
  ASSERT_NE(handle, nullptr) << dlerror();
  ZEPH::test::TempRoot root;
  ZEPH::test::WriteInfo(Json::objectValue);
  ASSERT_TRUE(ZEPH::test::MakeCertSet(root.Path("/usr/zeph/etc/certificate/c"), "x"));
  const std::string cert = root.Path("/usr/zeph/etc/certificate/c/cert.pem");
  const struct { decltype(&GenCrtChecksum) checksum; decltype(&isPemExpire) expire;
                 decltype(&IsCrtPathValid) path_valid; } ways[] = {
      {GenCrtChecksum, isPemExpire, IsCrtPathValid},
      {reinterpret_cast<decltype(&GenCrtChecksum)>(dlsym(handle, "GenCrtChecksum")),
       reinterpret_cast<decltype(&isPemExpire)>(dlsym(handle, "isPemExpire")),
       reinterpret_cast<decltype(&IsCrtPathValid)>(dlsym(handle, "IsCrtPathValid"))}};
  for (const auto& h : ways) {
    ASSERT_TRUE(h.checksum != nullptr && h.expire != nullptr && h.path_valid != nullptr);
    Json::Value list(Json::arrayValue);
    EXPECT_TRUE(h.checksum(list) && h.expire(cert, 1000) && h.path_valid(false, "c", "cert.pem"));
    EXPECT_FALSE(h.expire(cert, 1) || h.path_valid(false, "c", "../.."));
  }
  EXPECT_NE(dlsym(handle, "rgCRTActionInfo"), nullptr);
  dlclose(handle);
  const auto nm = ZEPH::test::Run({"/usr/bin/nm", "-D", "--defined-only", "-C", module});
  ASSERT_EQ(nm.status, 0) << nm.err;
  for (const char* name : {"DeployCrt(", "DeployDefCrt(", "GetDefCrtId", "UpdateCertToService(",
                           "GetServiceCertID(", "WriteCertInfo(", "DropCertInfo(", "MoveDir(",
                           "GetCrtId"}) {
    EXPECT_NE(nm.out.find(name), std::string::npos) << name;
  }
  for (const char* name : {"CopyCertToService", "RunServiceHook", "CopyCertFile"}) {
    EXPECT_EQ(nm.out.find(name), std::string::npos) << name;
  }
}

}  // namespace
