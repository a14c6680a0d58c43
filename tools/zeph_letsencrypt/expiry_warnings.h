// The daily word before a certificate in use runs out.
//
// renew-due renews what can renew itself. What cannot, a self-signed or
// imported certificate, or one whose renewal failed, would run out
// unnoticed: for each such certificate that a service uses, renew-due
// writes one warning a day to the appliance's event log (ZEPHLogSet1):
//
//   type 1, level 2 (a warning), message id kExpiryWarningId;
//   text1  the certificate's name: its subject's common name, else its id
//   text2  the display names of the services using it, joined by ", "
//   text3  the day it expires, "YYYY-MM-DD" (UTC)
//   text4  whole days left, negative once it has expired ("-3")
//
// The server's event log turns the id into a sentence for the page.
//
// Thread-safety: run from the tool's one thread, under the renew-due lock
// (renew_due.h), which also guards the record of the days warned.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_EXPIRY_WARNINGS_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_EXPIRY_WARNINGS_H_

#include <json/json.h>
#include <time.h>

#include <set>
#include <string>
#include <vector>

namespace ZEPH {
namespace letsencrypt {

// The event's message id, next to the certificate module's own ids
// (0x12B00001 to 0x12B00012).
constexpr unsigned int kExpiryWarningId = 0x12B00013;
constexpr int kExpiryWarningLevel = 2;
// A certificate that expires within this many days is warned about.
constexpr int kExpiryWarningDays = 30;
// The UTC day of the last warning of each certificate (appliance path):
// {"<id>": "YYYY-MM-DD"}, mode 0600.
constexpr char kExpiryWarningsFile[] = "/usr/zeph/etc/letsencrypt/expiry-warnings.json";

// Warns, as the header says, about every certificate of the catalogue
// `info` (INFO's object: id -> {"services": [service objects], ...}) that
//   - is used by at least one service,
//   - will not renew itself: its directory holds no renew.json, or its id
//     is in `failed` (its renewal failed in this run),
//   - and whose cert.pem expires within kExpiryWarningDays of `now`, or
//     has expired;
// unless it was warned about on the UTC day of `now` already. A cert.pem
// that cannot be read is passed over. The ids warned about now, in the
// catalogue's order; the record of days keeps the certificates still
// expiring only. A record that cannot be written is reported on standard
// error (the warnings then may repeat that day).
std::vector<std::string> WarnAboutExpiry(const Json::Value& info,
                                         const std::set<std::string>& failed,
                                         time_t now);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_EXPIRY_WARNINGS_H_
