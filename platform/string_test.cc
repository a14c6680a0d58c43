#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "zeph/qlibc_string.h"

namespace {

std::vector<std::string> Split(const char* text) {
  ZEPH::UniqueSzList list(QLIBCSzListAlloc(2));
  EXPECT_TRUE(list);
  EXPECT_EQ(QLIBCStrSep(text, ";", list.get()), 0);
  std::vector<std::string> out;
  for (int i = 0; i < list->count; ++i) out.push_back(QLIBCSzListGet(list.get(), i));
  EXPECT_EQ(QLIBCSzListGet(list.get(), list->count), nullptr);
  EXPECT_EQ(QLIBCSzListGet(list.get(), -1), nullptr);
  return out;
}

TEST(StrSep, KeepsEmptyPiecesAndGrowsPastCapacity) {
  using V = std::vector<std::string>;
  EXPECT_EQ(Split("nas1;10.0.0.5"), (V{"nas1", "10.0.0.5"}));
  EXPECT_EQ(Split(";nas1;;10.0.0.1"), (V{"", "nas1", "", "10.0.0.1"}));
  EXPECT_EQ(Split(""), (V{""}));
  EXPECT_EQ(Split("a;"), (V{"a", ""}));
  EXPECT_EQ(Split("a;b;c;d;e"), (V{"a", "b", "c", "d", "e"}));

  ZEPH::UniqueSzList list(QLIBCSzListAlloc(1));
  EXPECT_EQ(QLIBCStrSep(nullptr, ";", list.get()), -1);
  EXPECT_EQ(QLIBCStrSep("a", ";", nullptr), -1);
  EXPECT_EQ(QLIBCSzListAlloc(0), nullptr);
}

TEST(IsIpAddr, AcceptsIpv4AndIpv6Only) {
  for (const char* ip : {"10.0.0.5", "192.168.1.254", "0.0.0.0", "::1",
                         "fe80::1", "2001:db8::42", "::ffff:10.0.0.1"}) {
    EXPECT_EQ(BlQLIBIsIpAddr(ip), 1) << ip;
  }
  for (const char* name : {"nas1", "", "10.0.0", "10.0.0.256", "1.2.3.4.5",
                           "arvelon.local", "10.0.0.5 ", "fe80::1%eth0",
                           "::g"}) {
    EXPECT_EQ(BlQLIBIsIpAddr(name), 0) << name;
  }
  EXPECT_EQ(BlQLIBIsIpAddr(nullptr), 0);
}

}  // namespace
