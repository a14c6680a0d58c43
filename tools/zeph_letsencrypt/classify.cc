#include "tools/zeph_letsencrypt/classify.h"

#include <string.h>

#include <sstream>
#include <vector>

namespace ZEPH {
namespace letsencrypt {
namespace {

struct Rule {
  const char* needle;
  int error;
};

// In order: the first rule whose text occurs in lego's output decides.
const Rule kRules[] = {
    // Problem types of the ACME server.
    {"urn:ietf:params:acme:error:rateLimited", kRateLimited},
    {"urn:ietf:params:acme:error:rejectedIdentifier", kInvalidDomain},
    {"urn:ietf:params:acme:error:unsupportedIdentifier", kInvalidDomain},
    {"DNS identifier with a value containing", kInvalidDomain},
    {"urn:ietf:params:acme:error:invalidContact", kAccountRefused},
    {"urn:ietf:params:acme:error:unsupportedContact", kAccountRefused},
    {"urn:ietf:params:acme:error:accountDoesNotExist", kAccountRefused},
    {"urn:ietf:params:acme:error:externalAccountRequired", kAccountRefused},
    {"urn:ietf:params:acme:error:userActionRequired", kAccountRefused},
    {"urn:ietf:params:acme:error:alreadyRevoked", kRevokeFailed},
    {"urn:ietf:params:acme:error:unauthorized", kChallengeFailed},
    {"urn:ietf:params:acme:error:caa", kChallengeFailed},
    {"urn:ietf:params:acme:error:dns", kChallengeFailed},
    {"urn:ietf:params:acme:error:connection", kChallengeFailed},
    {"urn:ietf:params:acme:error:incorrectResponse", kChallengeFailed},
    {"urn:ietf:params:acme:error:tls", kChallengeFailed},
    // lego's own words.
    {"Could not complete registration", kAccountRefused},
    {"Server requires External Account Binding", kAccountRefused},
    {"error presenting token", kChallengeFailed},
    {"one or more domains had a problem", kChallengeFailed},
    // Reaching the server at all.
    {"connection refused", kUnreachable},
    {"no such host", kUnreachable},
    {"network is unreachable", kUnreachable},
    {"no route to host", kUnreachable},
    {"i/o timeout", kUnreachable},
    {"connection reset", kUnreachable},
    {"Client.Timeout exceeded", kUnreachable},
    {"TLS handshake timeout", kUnreachable},
    {"x509: ", kUnreachable},
    {"tls: ", kUnreachable},
    {"Could not create client", kUnreachable},
};

// "2026/01/02 03:04:05 " at the start of a line.
bool HasTimestamp(const std::string& line) {
  static const char kShape[] = "dddd/dd/dd dd:dd:dd ";
  if (line.size() < sizeof(kShape) - 1) return false;
  for (size_t i = 0; i < sizeof(kShape) - 1; ++i) {
    const bool digit = line[i] >= '0' && line[i] <= '9';
    if (kShape[i] == 'd' ? !digit : line[i] != kShape[i]) return false;
  }
  return true;
}

std::string Trim(const std::string& s) {
  const char* space = " \t\r\n";
  const size_t b = s.find_first_not_of(space);
  if (b == std::string::npos) return "";
  return s.substr(b, s.find_last_not_of(space) - b + 1);
}

bool IsChatter(const std::string& text) {
  return text.compare(0, 6, "[INFO]") == 0 || text.compare(0, 6, "[WARN]") == 0;
}

}  // namespace

std::string FailureSummary(const std::string& output) {
  std::vector<std::string> lines;
  std::istringstream in(output);
  std::string line;
  while (std::getline(in, line)) {
    if (!Trim(line).empty()) lines.push_back(line);
  }
  if (lines.empty()) return "";
  // A Go panic: its first line says what happened.
  for (const std::string& l : lines) {
    if (l.compare(0, 7, "panic: ") == 0) return Trim(l).substr(0, 1000);
  }
  size_t start = lines.size();
  for (size_t i = lines.size(); i-- > 0;) {
    if (!HasTimestamp(lines[i])) continue;
    if (!IsChatter(lines[i].substr(20))) start = i;
    break;
  }
  std::string summary;
  if (start == lines.size()) {
    summary = Trim(HasTimestamp(lines.back()) ? lines.back().substr(20)
                                              : lines.back());
  } else {
    summary = Trim(lines[start].substr(20));
    for (size_t i = start + 1; i < lines.size(); ++i) {
      summary += " " + Trim(lines[i]);
    }
  }
  return summary.substr(0, 1000);
}

Outcome ClassifyLegoRun(const LegoRun& run, Operation op, int timeout_s) {
  switch (run.end) {
    case LegoRun::End::kNotStarted:
      return Outcome::Fail(kInternal, std::string("cannot run lego: ") +
                                          strerror(run.start_errno));
    case LegoRun::End::kTimedOut:
      return Outcome::Fail(
          kTimedOut, "the ACME run did not finish within " +
                         std::to_string(timeout_s) + " s and was stopped");
    case LegoRun::End::kSignaled:
      return Outcome::Fail(kInternal, "lego was killed by signal " +
                                          std::to_string(run.status));
    case LegoRun::End::kExited:
      break;
  }
  if (run.status == 0) return Outcome();
  const std::string summary = FailureSummary(run.output);
  const std::string msg =
      summary.empty() ? "lego failed with status " + std::to_string(run.status)
                      : summary;
  if (run.output.find("\npanic: ") != std::string::npos ||
      run.output.compare(0, 7, "panic: ") == 0) {
    return Outcome::Fail(kInternal, msg);
  }
  int error = op == Operation::kRevoke ? kRevokeFailed : kAcmeFailed;
  for (const Rule& rule : kRules) {
    if (run.output.find(rule.needle) != std::string::npos) {
      error = rule.error;
      break;
    }
  }
  if (op == Operation::kRevoke && error != kUnreachable) error = kRevokeFailed;
  return Outcome::Fail(error, msg);
}

}  // namespace letsencrypt
}  // namespace ZEPH
