#include "tools/zeph_letsencrypt/expiry_warnings.h"

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <unistd.h>

#include <iostream>

#include "module/common/paths.h"
#include "module/common/ssl_ptr.h"
#include "tools/zeph_letsencrypt/files.h"
#include "tools/zeph_letsencrypt/issued_set.h"
#include "zeph/json_file.h"
#include "zeph/root.h"
#include "zeph/system.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

constexpr long kDaySeconds = 24 * 60 * 60;

std::string Day(time_t t) {
  struct tm when;
  gmtime_r(&t, &when);
  char text[16];
  strftime(text, sizeof(text), "%Y-%m-%d", &when);
  return text;
}

// What a warning says of one certificate.
struct Expiring {
  std::string name;       // common name, else ""
  std::string day;        // of its notAfter
  long days_left = 0;     // floor((notAfter - now) / day)
};

// The certificate in `path` when it expires within kExpiryWarningDays of
// `now` (or has expired); false otherwise or when it cannot be read.
bool ExpiringCertificate(const std::string& path, time_t now, Expiring* out) {
  ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  ssl::X509Ptr cert(bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)
                        : nullptr);
  ERR_clear_error();
  if (!cert) return false;
  const ASN1_TIME* end = X509_get0_notAfter(cert.get());
  struct tm tm_end;
  ssl::Asn1TimePtr start(ASN1_TIME_set(nullptr, now));
  int days = 0, seconds = 0;
  if (!start || ASN1_TIME_to_tm(end, &tm_end) != 1 ||
      ASN1_TIME_diff(&days, &seconds, start.get(), end) != 1) {
    ERR_clear_error();
    return false;
  }
  const long left = static_cast<long>(days) * kDaySeconds + seconds;
  if (left >= static_cast<long>(kExpiryWarningDays) * kDaySeconds) return false;
  out->days_left = left >= 0 ? left / kDaySeconds : -((-left + kDaySeconds - 1) / kDaySeconds);
  char day[16];
  strftime(day, sizeof(day), "%Y-%m-%d", &tm_end);
  out->day = day;
  char cn[1024] = "";
  if (X509_NAME_get_text_by_NID(X509_get_subject_name(cert.get()), NID_commonName, cn,
                                sizeof(cn)) > 0) {
    out->name = cn;
  }
  return true;
}

std::string ServiceNames(const Json::Value& services) {
  std::string out;
  for (const Json::Value& s : services) {
    if (!s.isObject()) continue;
    std::string name = s["display_name"].isString() ? s["display_name"].asString() : "";
    if (name.empty()) name = s["subscriber"].asString() + "/" + s["service"].asString();
    out += (out.empty() ? "" : ", ") + name;
  }
  return out;
}

bool IsCertificateId(const std::string& id) {
  return !id.empty() && id.find_first_of("/.") == std::string::npos;
}

}  // namespace

std::vector<std::string> WarnAboutExpiry(const Json::Value& info,
                                         const std::set<std::string>& failed,
                                         time_t now) {
  const std::string record_path = RootPath(kExpiryWarningsFile);
  Json::Value record;
  if (!JsonFromFile(record, record_path) || !record.isObject()) {
    record = Json::Value(Json::objectValue);
  }
  const std::string today = Day(now);
  const std::string archive = RootPath(cert::kArchiveDir);
  Json::Value kept(Json::objectValue);
  std::vector<std::string> warned;
  for (const std::string& id : info.getMemberNames()) {
    const Json::Value& entry = info[id];
    if (!IsCertificateId(id) || !entry.isObject() || !entry["services"].isArray() ||
        entry["services"].empty()) {
      continue;
    }
    const std::string dir = archive + "/" + id;
    const bool renews_itself =
        access((dir + "/" + kRenewFile).c_str(), F_OK) == 0 && failed.count(id) == 0;
    Expiring expiring;
    if (renews_itself || !ExpiringCertificate(dir + "/cert.pem", now, &expiring)) {
      continue;
    }
    kept[id] = today;
    if (record[id].isString() && record[id].asString() == today) continue;
    const std::string name = expiring.name.empty() ? id : expiring.name;
    const std::string services = ServiceNames(entry["services"]);
    const std::string days = std::to_string(expiring.days_left);
    ZEPHLogSet1(1, kExpiryWarningLevel, kExpiryWarningId, name.c_str(), services.c_str(),
                expiring.day.c_str(), days.c_str());
    std::cerr << "zeph-letsencrypt: " << id << " (" << name << ", used by " << services
              << ") expires " << expiring.day << std::endl;
    warned.push_back(id);
  }
  if (!WriteWhole(record_path, kept.toStyledString(), 0600)) {
    std::cerr << "zeph-letsencrypt: cannot write " << record_path << std::endl;
  }
  return warned;
}

}  // namespace letsencrypt
}  // namespace ZEPH
