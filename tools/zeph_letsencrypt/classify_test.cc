// The classification of lego's failures (its own outputs; rate limits and failed
// validations only here) and the directory operations a renewal relies on.
#include <errno.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "test_support.h"
#include "tools/zeph_letsencrypt/classify.h"
#include "tools/zeph_letsencrypt/files.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

using End = LegoRun::End;
using test::Exists;
using test::ReadFile;
using test::WriteFile;

// `lines` as lego prints them, the first `stamped` with the date and time.
std::string Lines(std::initializer_list<std::string> lines, size_t stamped = 1) {
  std::string out;
  size_t n = 0;
  for (const std::string& l : lines) {
    out += (n++ < stamped ? "2026/11/21 23:38:50 " : "") + l + "\n";
  }
  return out;
}

// An ACME problem of `type` as lego prints it.
std::string Problem(const std::string& type, const std::string& detail) {
  return "\tacme: error: 400 :: POST :: https://127.0.0.1:14000/x :: urn:ietf:params:acme:error:" +
         type + " :: " + detail;
}

TEST(ClassifyLegoRun, MapsLegosFailuresOntoTheToolsNumbersAndMessages) {
  constexpr Operation kGet = Operation::kObtain, kRevoke = Operation::kRevoke;
  const std::string obtain = "Could not obtain certificates:";
  const std::string info = "[INFO] [a.example] acme: Obtaining bundled SAN certificate";
  const std::string domains = "\terror: one or more domains had a problem:";
  const std::string revoke = "Error while revoking the certificate for domain a.example";
  const std::string client = "Could not create client: get directory at 'https://127.0.0.1:";
  const std::string token = "[t.example.com] [t.example.com] acme: error presenting token: could "
                            "not start HTTP server for challenge: listen tcp 127.0.0.1:5002: "
                            "bind: address already in use";
  const std::string already = Problem("alreadyRevoked", "Certificate has already been revoked.");
  struct Row {
    std::string output;
    Operation operation;
    int error;
    std::string part = "";   // of the message, which is never empty
    std::string exact = "";  // the whole message, "" for any
    End end = End::kExited;
    int status = 1;  // the exit status or signal; for kNotStarted the errno
    int timeout_s = 120;
  };
  const Row kRows[] = {
      {Lines({info, obtain, Problem("rateLimited", "too many certificates")}, 2), kGet,
       kRateLimited},
      {Lines({obtain, Problem("malformed", "Order included DNS identifier with a value "
                                           "containing an illegal character: '_'")}),
       kGet, kInvalidDomain},
      {Lines({obtain, Problem("rejectedIdentifier", "Cannot issue for \"a.local\"")}), kGet,
       kInvalidDomain},
      {Lines({"Could not complete registration", Problem("invalidContact", "bad")}), kGet,
       kAccountRefused},
      // The server could not reach our solver, not an unreachable server.
      {Lines({info, obtain, domains,
              "[a.example] acme: error: 400 :: urn:ietf:params:acme:error:connection :: "
              "dial tcp 203.0.113.7:80: connect: connection refused"}, 2),
       kGet, kChallengeFailed},
      {Lines({"No key found for account a@b.example.",
              "[INFO] acme: Registering account for a@b.example", obtain, domains, token, ""}, 3),
       kGet, kChallengeFailed, "", obtain + " " + domains.substr(1) + " " + token},
      {Lines({client + "14999/dir': x509: certificate signed by unknown authority"}), kGet,
       kUnreachable},
      {Lines({client + "14999/nodir': 404 ::GET :: https://127.0.0.1:14999/nodir :: invalid "
                       "character 'p' after top-level value :: 404 page not found"}),
       kGet, kUnreachable},
      {Lines({obtain, Problem("serverInternal", "something broke")}), kGet, kAcmeFailed},
      {Lines({"panic: error reading LEGO_CA_CERTIFICATES=\"/nonexist\": open /nonexist: "
              "no such file or directory", "", "goroutine 1 [running]:"}, 0),
       kGet, kInternal},
      {Lines({"[INFO] one", "[INFO] two"}, 2), kGet, kAcmeFailed, "", "[INFO] two"},
      {"plain words\n", kGet, kAcmeFailed, "", "plain words"},
      {std::string(3000, 'x'), kGet, kAcmeFailed, "", std::string(1000, 'x')},
      {Lines({revoke, Problem("unauthorized", "not yours")}), kRevoke, kRevokeFailed},
      {Lines({client + "1/dir': dial tcp 127.0.0.1:1: connect: connection refused"}), kRevoke,
       kUnreachable},
      {Lines({"Trying to revoke certificate for domain a.example", revoke, already}, 2), kRevoke,
       kRevokeFailed, "", revoke + " " + already.substr(1)},
      {"", kGet, kInternal, "No such file", "", End::kNotStarted, ENOENT},
      {"", kRevoke, kTimedOut, "7 s", "", End::kTimedOut, 0, 7},
      {"", kGet, kInternal, "", "", End::kSignaled, 9},
      {"", kGet, kAcmeFailed, "", "lego failed with status 3", End::kExited, 3},
      {"[INFO] fine\n", kGet, kOk, "", "", End::kExited, 0},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(row.output);
    LegoRun run;
    run.end = row.end;
    (row.end == End::kNotStarted ? run.start_errno : run.status) = row.status;
    run.output = row.output;
    const Outcome o = ClassifyLegoRun(run, row.operation, row.timeout_s);
    EXPECT_EQ(o.error, row.error);
    EXPECT_EQ(o.msg.empty(), row.error == kOk) << o.msg;
    EXPECT_NE(o.msg.find(row.part), std::string::npos) << o.msg;
    EXPECT_TRUE(row.exact.empty() || o.msg == row.exact) << o.msg;
  }
}

TEST(Files, ExchangeRemoveAndWriteWhole) {
  test::TempRoot root;
  const std::string target = root.Path("/set"), staging = root.Path("/.set.renew");
  ASSERT_TRUE(MakeDir(target, 0700) && MakeDir(staging, 0700));
  WriteFile(target + "/cert.pem", "old", 0400);
  WriteFile(target + "/only-old", "x", 0400);
  WriteFile(staging + "/cert.pem", "new", 0400);
  ASSERT_TRUE(ExchangeDirs(staging, target));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "new");
  EXPECT_FALSE(Exists(target + "/only-old"));
  EXPECT_EQ(ReadFile(staging + "/cert.pem"), "old");
  ASSERT_TRUE(RemoveTree(staging));
  EXPECT_FALSE(ExchangeDirs(staging, target));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "new");
  const std::string work = root.Path("/work");
  ASSERT_TRUE(MakeDir(work, 0700) && MakeDir(work + "/certificates", 0700));
  WriteFile(work + "/certificates/a.key", "k", 0400);
  ASSERT_EQ(symlink(target.c_str(), (work + "/accounts").c_str()), 0);
  EXPECT_TRUE(RemoveTree(work));
  EXPECT_FALSE(Exists(work));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "new");
  EXPECT_TRUE(RemoveTree(work));
  EXPECT_FALSE(MakeDir(target + "/cert.pem", 0700));
  EXPECT_TRUE(MakeDir(target, 0700));
  ASSERT_TRUE(WriteWhole(target + "/cert.pem", "newer", 0600));
  EXPECT_EQ(ReadFile(target + "/cert.pem"), "newer");
  EXPECT_EQ(test::ModeOf(target + "/cert.pem"), 0600u);
  EXPECT_FALSE(WriteWhole(root.Path("/missing/dir/file"), "x", 0600));
}

}  // namespace
}  // namespace letsencrypt
}  // namespace ZEPH
