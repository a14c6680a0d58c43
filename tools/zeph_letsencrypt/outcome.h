// What one run of zeph-letsencrypt answers: the error number and message
// the module reads, plus the members a command adds (on success; renew-due
// also with error 111).
//
// Error numbers (the module maps them onto its API codes 5520-5530, 5527
// and 5501):
//
//   0    success
//   100  the ACME server could not be reached or is not usable: connection
//        refused, unknown host, network down, its TLS certificate is not
//        trusted (see "ca_bundle"), no ACME directory at "directory_url"
//   101  the ACME server refused the account: registration failed, invalid
//        or unsupported contact e-mail, terms of service to agree to,
//        external account binding required, the account does not exist
//        (any more) at that server; also no e-mail given and no single
//        recorded account to fall back on
//   102  invalid domain name (checked before anything is sent) or an
//        identifier the server rejects
//   103  rate limited by the ACME server
//   104  the challenge (authorization) failed: the server could not
//        validate the domain, or the local solver could not listen on
//        "http_address" / the DNS provider failed to present the record
//   105  the certificate set could not be written into the archive
//   106  nothing to renew or revoke: the certificate directory is missing,
//        has no (usable) "renew.json" or no "cert.pem"; that is, it is not a
//        certificate this tool issued
//   107  the ACME client failed for a reason not recognised above; "msg"
//        carries its last words
//   108  bad configuration file (config.json)
//   109  time-out: the ACME run took longer than "timeout_s" and was
//        stopped, or another run held the tool's lock that long
//   110  the ACME server refused the revocation (already revoked, unknown
//        certificate, not authorised)
//   111  renew-due: one or more of the due renewals failed ("failed" lists
//        them; the others were renewed)
//   112  renew-due could not start: another renew-due run is in progress,
//        the certificate module cannot be found or loaded or has no
//        "renew", or the catalogue INFO is missing or broken
//   (the module never runs renew-due; it would map 111 and 112 to 5501)
//   200  bad command line
//   205  internal error: lego is missing or crashed, its output is unusable,
//        a working directory could not be made, an unexpected exception
//
// Thread-safety: plain values.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_OUTCOME_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_OUTCOME_H_

#include <json/json.h>

#include <string>

namespace ZEPH {
namespace letsencrypt {

enum ErrorNumber : int {
  kOk = 0,
  kUnreachable = 100,
  kAccountRefused = 101,
  kInvalidDomain = 102,
  kRateLimited = 103,
  kChallengeFailed = 104,
  kWriteFailed = 105,
  kNotRenewable = 106,
  kAcmeFailed = 107,
  kBadConfig = 108,
  kTimedOut = 109,
  kRevokeFailed = 110,
  kSomeRenewalsFailed = 111,
  kCannotRenewDue = 112,
  kBadCommandLine = 200,
  kInternal = 205,
};

struct Outcome {
  int error = kOk;
  std::string msg;                       // set when error is not 0
  Json::Value data{Json::objectValue};   // extra members of the answer

  bool ok() const { return error == kOk; }

  static Outcome Fail(int error, const std::string& msg) {
    Outcome o;
    o.error = error;
    o.msg = msg;
    return o;
  }

  // {"error": 0, <data members>} or {"error": N, "msg": "...", <data
  // members>}; failures of the single-certificate commands have none.
  Json::Value ToJson() const {
    Json::Value out(Json::objectValue);
    for (const std::string& key : data.getMemberNames()) out[key] = data[key];
    if (!ok()) out["msg"] = msg;
    out["error"] = error;
    return out;
  }
};

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_OUTCOME_H_
