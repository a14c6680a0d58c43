// The classification of lego's failures. The outputs are lego's own, as
// it prints them against pebble and Let's Encrypt; the ones a local test
// server cannot produce (rate limits, a failed validation) are here only.
#include <errno.h>
#include <gtest/gtest.h>

#include "tools/zeph_letsencrypt/classify.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

LegoRun Exited(int status, const std::string& output) {
  LegoRun run;
  run.end = LegoRun::End::kExited;
  run.status = status;
  run.output = output;
  return run;
}

const char kStamp[] = "2026/11/21 23:38:50 ";

std::string Lines(std::initializer_list<std::string> lines) {
  std::string out;
  for (const std::string& l : lines) out += l + "\n";
  return out;
}

TEST(ClassifyLegoRun, MapsLegosFailuresOntoTheToolsNumbers) {
  const std::string info = std::string(kStamp) +
                           "[INFO] [a.example] acme: Obtaining bundled SAN certificate";
  const struct {
    std::string output;
    int error;
  } cases[] = {
      {Lines({info, std::string(kStamp) + "Could not obtain certificates:",
              "\tacme: error: 429 :: POST :: https://acme.example/new-order :: "
              "urn:ietf:params:acme:error:rateLimited :: too many certificates"}),
       kRateLimited},
      {Lines({std::string(kStamp) + "Could not obtain certificates:",
              "\tacme: error: 400 :: POST :: https://127.0.0.1:14000/order-plz :: "
              "urn:ietf:params:acme:error:malformed :: Order included DNS identifier "
              "with a value containing an illegal character: '_'"}),
       kInvalidDomain},
      {Lines({std::string(kStamp) + "Could not obtain certificates:",
              "\tacme: error: 400 :: urn:ietf:params:acme:error:rejectedIdentifier :: "
              "Error creating new order :: Cannot issue for \"a.local\""}),
       kInvalidDomain},
      {Lines({std::string(kStamp) + "Could not complete registration",
              "\tacme: error: 400 :: POST :: https://127.0.0.1:14000/sign-me-up :: "
              "urn:ietf:params:acme:error:invalidContact :: contact email \"bad\" is invalid"}),
       kAccountRefused},
      {Lines({std::string(kStamp) + "Could not obtain certificates:",
              "\tacme: error: 400 :: POST :: https://127.0.0.1:14000/order-plz :: "
              "urn:ietf:params:acme:error:accountDoesNotExist :: unable to find account"}),
       kAccountRefused},
      {Lines({std::string(kStamp) + "Server requires External Account Binding. Use "
              "--eab with --kid and --hmac."}),
       kAccountRefused},
      // The server could not reach our solver: a challenge failure, not an
      // unreachable server, although the text says "connection refused".
      {Lines({info, std::string(kStamp) + "Could not obtain certificates:",
              "\terror: one or more domains had a problem:",
              "[a.example] acme: error: 400 :: urn:ietf:params:acme:error:connection :: "
              "203.0.113.7: Fetching http://a.example/.well-known/acme-challenge/x: "
              "dial tcp 203.0.113.7:80: connect: connection refused"}),
       kChallengeFailed},
      {Lines({std::string(kStamp) + "Could not obtain certificates:",
              "\terror: one or more domains had a problem:",
              "[t.example.com] [t.example.com] acme: error presenting token: could not "
              "start HTTP server for challenge: listen tcp 127.0.0.1:5002: bind: "
              "address already in use"}),
       kChallengeFailed},
      {Lines({std::string(kStamp) + "Could not create client: get directory at "
              "'https://127.0.0.1:1/dir': Get \"https://127.0.0.1:1/dir\": dial tcp "
              "127.0.0.1:1: connect: connection refused"}),
       kUnreachable},
      {Lines({std::string(kStamp) + "Could not create client: get directory at "
              "'https://127.0.0.1:14999/dir': Get \"https://127.0.0.1:14999/dir\": "
              "x509: certificate signed by unknown authority"}),
       kUnreachable},
      {Lines({std::string(kStamp) + "Could not create client: get directory at "
              "'https://127.0.0.1:14999/nodir': 404 ::GET :: https://127.0.0.1:14999/nodir "
              ":: invalid character 'p' after top-level value :: 404 page not found"}),
       kUnreachable},
      {Lines({std::string(kStamp) + "Could not obtain certificates:",
              "\tacme: error: 500 :: POST :: https://acme.example/finalize :: "
              "urn:ietf:params:acme:error:serverInternal :: something broke"}),
       kAcmeFailed},
      {Lines({"panic: error reading LEGO_CA_CERTIFICATES=\"/nonexist\": open /nonexist: "
              "no such file or directory", "", "goroutine 1 [running]:"}),
       kInternal},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.output);
    const Outcome o = ClassifyLegoRun(Exited(1, c.output), Operation::kObtain, 120);
    EXPECT_EQ(o.error, c.error);
    EXPECT_FALSE(o.msg.empty());
  }
}

TEST(ClassifyLegoRun, RevocationFailuresAre110UnlessTheServerIsUnreachable) {
  const std::string already = Lines(
      {std::string(kStamp) + "Trying to revoke certificate for domain a.example",
       std::string(kStamp) + "Error while revoking the certificate for domain a.example",
       "\tacme: error: 400 :: POST :: https://127.0.0.1:14999/revoke-cert :: "
       "urn:ietf:params:acme:error:alreadyRevoked :: Certificate has already been revoked."});
  Outcome o = ClassifyLegoRun(Exited(1, already), Operation::kRevoke, 120);
  EXPECT_EQ(o.error, kRevokeFailed);
  EXPECT_EQ(o.msg,
            "Error while revoking the certificate for domain a.example acme: error: 400 "
            ":: POST :: https://127.0.0.1:14999/revoke-cert :: "
            "urn:ietf:params:acme:error:alreadyRevoked :: Certificate has already been "
            "revoked.");
  const std::string unauthorized = Lines(
      {std::string(kStamp) + "Error while revoking the certificate for domain a.example",
       "\tacme: error: 403 :: urn:ietf:params:acme:error:unauthorized :: not yours"});
  EXPECT_EQ(ClassifyLegoRun(Exited(1, unauthorized), Operation::kRevoke, 120).error,
            kRevokeFailed);
  const std::string refused = Lines(
      {std::string(kStamp) + "Could not create client: get directory at 'https://"
       "127.0.0.1:1/dir': dial tcp 127.0.0.1:1: connect: connection refused"});
  EXPECT_EQ(ClassifyLegoRun(Exited(1, refused), Operation::kRevoke, 120).error,
            kUnreachable);
}

TEST(ClassifyLegoRun, RunsThatDidNotEndByThemselves) {
  LegoRun run;
  run.end = LegoRun::End::kNotStarted;
  run.start_errno = ENOENT;
  Outcome o = ClassifyLegoRun(run, Operation::kObtain, 120);
  EXPECT_EQ(o.error, kInternal);
  EXPECT_NE(o.msg.find("No such file"), std::string::npos) << o.msg;

  run.end = LegoRun::End::kTimedOut;
  o = ClassifyLegoRun(run, Operation::kRevoke, 7);
  EXPECT_EQ(o.error, kTimedOut);
  EXPECT_NE(o.msg.find("7 s"), std::string::npos) << o.msg;

  run.end = LegoRun::End::kSignaled;
  run.status = 9;
  EXPECT_EQ(ClassifyLegoRun(run, Operation::kObtain, 120).error, kInternal);

  EXPECT_TRUE(ClassifyLegoRun(Exited(0, "[INFO] fine\n"), Operation::kObtain, 1).ok());
  // A failure without a word still says something.
  o = ClassifyLegoRun(Exited(3, ""), Operation::kObtain, 1);
  EXPECT_EQ(o.error, kAcmeFailed);
  EXPECT_EQ(o.msg, "lego failed with status 3");
}

TEST(FailureSummary, KeepsTheLastFailureWithItsContinuationLines) {
  EXPECT_EQ(FailureSummary(Lines(
                {std::string(kStamp) + "No key found for account a@b.example.",
                 std::string(kStamp) + "[INFO] acme: Registering account for a@b.example",
                 std::string(kStamp) + "Could not obtain certificates:",
                 "\terror: one or more domains had a problem:",
                 "[a.example] acme: error presenting token: nope",
                 ""})),
            "Could not obtain certificates: error: one or more domains had a problem: "
            "[a.example] acme: error presenting token: nope");
  // Only chatter: its last line.
  EXPECT_EQ(FailureSummary(std::string(kStamp) + "[INFO] one\n" + kStamp + "[INFO] two\n"),
            "[INFO] two");
  EXPECT_EQ(FailureSummary("plain words\n"), "plain words");
  EXPECT_EQ(FailureSummary(std::string(3000, 'x')).size(), 1000u);
}

}  // namespace
}  // namespace letsencrypt
}  // namespace ZEPH
