#include "server/options.h"

#include <gtest/gtest.h>

namespace {

using ZEPH::webapid::Options;
using ZEPH::webapid::ParseListen;
using ZEPH::webapid::ParseOptions;

TEST(ParseListen, AcceptsAddressesWithPorts) {
  std::string address = "keep";
  int port = -1;
  ASSERT_TRUE(ParseListen("0.0.0.0:9000", &address, &port));
  EXPECT_EQ(address, "0.0.0.0");
  EXPECT_EQ(port, 9000);
  ASSERT_TRUE(ParseListen("[::1]:8443", &address, &port));
  EXPECT_EQ(address, "::1");
  EXPECT_EQ(port, 8443);
  ASSERT_TRUE(ParseListen("localhost:0", &address, &port));
  EXPECT_EQ(address, "localhost");
  EXPECT_EQ(port, 0);
  // Only a port: the address stays.
  ASSERT_TRUE(ParseListen(":65535", &address, &port));
  EXPECT_EQ(address, "localhost");
  EXPECT_EQ(port, 65535);
}

TEST(ParseListen, RefusesMalformedText) {
  for (const char* text :
       {"127.0.0.1", "127.0.0.1:", "127.0.0.1:65536", "127.0.0.1:8a",
        "127.0.0.1:-1", "::1:80", "[]:80", "[::1:80", "host:123456"}) {
    std::string address = "unchanged";
    int port = 7;
    EXPECT_FALSE(ParseListen(text, &address, &port)) << text;
    EXPECT_EQ(address, "unchanged") << text;
    EXPECT_EQ(port, 7) << text;
  }
}

TEST(ParseOptions, DefaultsAndEveryOption) {
  Options options;
  std::string error;
  ASSERT_TRUE(ParseOptions({}, &options, &error));
  EXPECT_EQ(options.address, "127.0.0.1");
  EXPECT_EQ(options.port, ZEPH::webapid::kDefaultPort);
  EXPECT_FALSE(options.has_root);

  ASSERT_TRUE(ParseOptions({"--root", "/r", "--listen", "[::]:1234", "--module",
                            "/m.so", "--web", "/w"},
                           &options, &error))
      << error;
  EXPECT_TRUE(options.has_root);
  EXPECT_EQ(options.root, "/r");
  EXPECT_EQ(options.address, "::");
  EXPECT_EQ(options.port, 1234);
  EXPECT_EQ(options.module, "/m.so");
  EXPECT_EQ(options.web_dir, "/w");
}

TEST(ParseOptions, RefusesBadCommandLines) {
  const std::vector<std::vector<std::string>> bad = {
      {"--root"},    {"--root", ""}, {"--listen", "nowhere"},
      {"--verbose"}, {"serve"},      {"--module"},
      {"--web"}};
  for (const auto& args : bad) {
    Options options;
    std::string error;
    EXPECT_FALSE(ParseOptions(args, &options, &error)) << args[0];
    EXPECT_FALSE(error.empty()) << args[0];
  }
}

}  // namespace
