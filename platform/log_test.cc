#include <errno.h>
#include <gtest/gtest.h>

#include <thread>

#include "test_support.h"
#include "zeph/log.h"
#include "zeph/qlibc_error.h"

namespace {

using ZEPH::test::TempRoot;

TEST(Log, PrefixesSourceAndLineAndAppendsLibraryError) {
  TempRoot root;
  ZEPH::log::Write(LOG_ERR, "utils", 42, "Failed to remove %s [%d]", "/x", 2);
  QLIBCErrSet(QLIBC_ERR_NOT_FOUND, "/src/platform/qlibc_file.cc", 17);
  ZEPH::log::WriteWithLibError(LOG_ERR, "mkcert", 7, "Broken [%s].", "/INFO");
  errno = ENOENT;
  ZEPH_LOG(LOG_DEBUG, "certificate", "Failed to open %s (%m)", "/p");
  EXPECT_EQ(errno, ENOENT);

  const int line = __LINE__ - 3;
  EXPECT_EQ(root.Log(),
            "utils:42 Failed to remove /x [2]\n"
            "mkcert:7 Broken [/INFO].[0x0002 qlibc_file.cc:17]\n"
            "certificate:" + std::to_string(line) +
                " Failed to open /p (No such file or directory)\n");
}

TEST(Log, LongMessagesAreNotCut) {
  TempRoot root;
  std::string big(5000, 'x');
  ZEPH::log::Write(LOG_ERR, "utils", 1, "%s", big.c_str());
  EXPECT_EQ(root.Log(), "utils:1 " + big + "\n");
}

TEST(LastError, IsPerThread) {
  QLIBCErrSet(QLIBC_ERR_IO, "main.cc", 1);
  int other = -1;
  std::thread([&] { other = QLIBCErrGet(); }).join();
  EXPECT_EQ(other, QLIBC_ERR_NONE);
  EXPECT_EQ(QLIBCErrGet(), QLIBC_ERR_IO);
}

}  // namespace
