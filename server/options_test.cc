#include "server/options.h"

#include <gtest/gtest.h>

namespace {

using ZEPH::webapid::Options;
using ZEPH::webapid::ParseListen;
using ZEPH::webapid::ParseOptions;

TEST(ParseListen, AcceptsAddressesWithPortsAndRefusesTheRestUntouched) {
  std::string address = "keep";
  int port = -1;
  // Only a port: the address stays.
  const std::tuple<const char*, const char*, int> good[] = {
      {"0.0.0.0:9000", "0.0.0.0", 9000}, {"[::1]:8443", "::1", 8443}, {"localhost:0", "localhost", 0},
      {":65535", "localhost", 65535}};
  for (const auto& c : good) {
    ASSERT_TRUE(ParseListen(std::get<0>(c), &address, &port)) << std::get<0>(c);
    EXPECT_EQ(address, std::get<1>(c));
    EXPECT_EQ(port, std::get<2>(c));
  }
  for (const char* text : {"127.0.0.1", "127.0.0.1:", "127.0.0.1:65536", "127.0.0.1:8a", "127.0.0.1:-1",
                           "::1:80", "[]:80", "[::1:80", "host:123456"}) {
    EXPECT_FALSE(ParseListen(text, &address, &port)) << text;
    EXPECT_EQ(address, "localhost") << text;
    EXPECT_EQ(port, 65535) << text;
  }
}

TEST(ParseOptions, DefaultsEveryOptionAndBadCommandLines) {
  Options options;
  std::string error;
  ASSERT_TRUE(ParseOptions({}, &options, &error));
  EXPECT_EQ(options.address, "127.0.0.1");
  EXPECT_EQ(options.port, ZEPH::webapid::kDefaultPort);
  EXPECT_FALSE(options.has_root);

  ASSERT_TRUE(ParseOptions({"--root", "/r", "--listen", "[::]:1234", "--module", "/m.so", "--web", "/w"},
                           &options, &error))
      << error;
  EXPECT_TRUE(options.has_root);
  EXPECT_EQ(options.root, "/r");
  EXPECT_EQ(options.address, "::");
  EXPECT_EQ(options.port, 1234);
  EXPECT_EQ(options.module, "/m.so");
  EXPECT_EQ(options.web_dir, "/w");

  for (const std::vector<std::string>& args :
       std::vector<std::vector<std::string>>{{"--root"}, {"--root", ""}, {"--listen", "nowhere"}, {"--verbose"},
                                             {"serve"}, {"--module"}, {"--web"}}) {
    error.clear();
    EXPECT_FALSE(ParseOptions(args, &options, &error)) << args[0];
    EXPECT_FALSE(error.empty()) << args[0];
  }
}

}  // namespace
