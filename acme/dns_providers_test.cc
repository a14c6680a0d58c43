// lego's own description of its DNS providers.
#include "acme/dns_providers.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>

#include "zeph/json_file.h"

namespace ZEPH {
namespace {

TEST(DnsProviders, LegoDescribesItsProvidersAndTheirVariables) {
  if (access(acme::kLegoProgram, X_OK) != 0) GTEST_SKIP() << "lego is not installed";
  std::vector<std::string> codes;
  ASSERT_TRUE(acme::DnsProviders(&codes));
  EXPECT_NE(std::find(codes.begin(), codes.end(), "cloudflare"), codes.end());
  EXPECT_NE(std::find(codes.begin(), codes.end(), "exec"), codes.end());
  Json::Value help;
  ASSERT_TRUE(acme::DnsProviderHelp("cloudflare", &help));
  EXPECT_EQ(help["name"].asString(), "Cloudflare");
  bool token = false;
  for (const Json::Value& c : help["credentials"]) {
    token = token || c["name"].asString() == "CF_DNS_API_TOKEN";
  }
  EXPECT_TRUE(token) << JsonCompact(help);
  EXPECT_FALSE(acme::DnsProviderHelp("nosuchprovider", &help));
  EXPECT_FALSE(acme::DnsProviderHelp("-h", &help));
}

}  // namespace
}  // namespace ZEPH
