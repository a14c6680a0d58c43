// Turning a failed lego run into one of the tool's error numbers.
//
// lego reports a failure as log lines on its standard error, e.g.
//
//   2026/01/02 03:04:05 Could not obtain certificates:
//   	acme: error: 429 :: POST :: https://.../new-order ::
//   	urn:ietf:params:acme:error:rateLimited :: too many certificates
//
// The ACME problem type (urn:ietf:params:acme:error:...) says most; the
// Go network errors ("connection refused", "no such host", "x509: ...")
// say the rest. Problem types are looked at first: a validation failure
// reads "urn:ietf:params:acme:error:connection :: ... connection refused"
// and is the server failing to reach us (104), not us failing to reach the
// server (100). What nothing matches is 107 (110 for a revocation), with
// lego's last words as the message: an honest "unknown" beats a wrong guess.
//
// Thread-safety: pure functions.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_CLASSIFY_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_CLASSIFY_H_

#include <string>

#include "tools/zeph_letsencrypt/lego_process.h"
#include "tools/zeph_letsencrypt/outcome.h"

namespace ZEPH {
namespace letsencrypt {

enum class Operation { kObtain, kRevoke };

// The outcome of `run`: success for a run that exited with status 0,
// otherwise the error number and a message:
//   - lego could not be started, was killed by a signal or panicked: 205;
//   - it ran past its time limit of `timeout_s`: 109;
//   - it failed: the number its output matches (see the header comment
//     and outcome.h); for kRevoke every failure except an unreachable
//     server (100) is 110.
Outcome ClassifyLegoRun(const LegoRun& run, Operation op, int timeout_s);

// The part of lego's output that explains its failure, on one line: the
// last line that is not [INFO] or [WARN], with its continuation lines, the
// timestamps taken off; lego's last line when there is no such line. At
// most 1000 characters.
std::string FailureSummary(const std::string& output);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_CLASSIFY_H_
