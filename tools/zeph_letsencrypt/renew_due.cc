#include "tools/zeph_letsencrypt/renew_due.h"

#include <openssl/asn1.h>
#include <openssl/pem.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <iostream>
#include <memory>
#include <set>

#include "host/module_loader.h"
#include "module/common/paths.h"
#include "module/common/ssl_ptr.h"
#include "tools/zeph_letsencrypt/config.h"
#include "tools/zeph_letsencrypt/expiry_warnings.h"
#include "tools/zeph_letsencrypt/files.h"
#include "tools/zeph_letsencrypt/issued_set.h"
#include "zeph/api.h"
#include "zeph/api_table.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_error.h"
#include "zeph/qlibc_lock.h"
#include "zeph/root.h"

#ifndef ZEPH_INSTALLED_MODULE_DIR
#define ZEPH_INSTALLED_MODULE_DIR "/usr/local/lib/zeph"
#endif

namespace ZEPH {
namespace letsencrypt {
namespace {

constexpr char kModuleFile[] = "ZEPH.Core.Certificate.so";
constexpr char kModuleEnv[] = "ZEPH_CERT_MODULE";
constexpr char kRenewApi[] = "ZEPH.Core.Certificate.LetsEncrypt";
constexpr char kRenewMethod[] = "renew";
constexpr int kRenewVersion = 1;
// What a handler that wrote no error code of its own stands for.
constexpr int kGeneralFailure = 5501;

// The renew-due lock, released when it goes out of scope.
class RunLock {
 public:
  RunLock() = default;
  RunLock(const RunLock&) = delete;
  RunLock& operator=(const RunLock&) = delete;
  ~RunLock() {
    if (fd_ >= 0) QLIBCFileUnlockByFile(fd_);
  }

  // One try: a run that finds another one at work leaves the work to it.
  Outcome Take() {
    const std::string path = RootPath(kRenewDueLockFile);
    if (!MakeDir(RootPath(kStateDir), 0700)) {
      return Outcome::Fail(kCannotRenewDue, "cannot make " + RootPath(kStateDir));
    }
    if (!QLIBCFileLockTimeByFile(path.c_str(), QLIBC_LOCK_EXCLUSIVE, 0, &fd_)) {
      fd_ = -1;
      if (QLIBCErrGet() == QLIBC_ERR_TIMEOUT) {
        return Outcome::Fail(kCannotRenewDue,
                             "another renew-due run is in progress (" + path + ")");
      }
      return Outcome::Fail(kCannotRenewDue, "cannot take the lock " + path);
    }
    return Outcome();
  }

 private:
  int fd_ = -1;
};

std::string Join(const std::vector<std::string>& items) {
  std::string out;
  for (const std::string& item : items) out += (out.empty() ? "" : ", ") + item;
  return out;
}

Outcome LoadModule(const RenewDueOptions& options,
                   std::unique_ptr<LoadedModule>* module) {
  std::string path = options.module_path;
  if (path.empty()) {
    const char* env = getenv(kModuleEnv);
    if (env != nullptr) path = env;
  }
  if (path.empty()) {
    const std::vector<std::string> candidates = CertificateModuleCandidates();
    for (const std::string& c : candidates) {
      if (access(c.c_str(), R_OK) == 0) {
        path = c;
        break;
      }
    }
    if (path.empty()) {
      return Outcome::Fail(kCannotRenewDue,
                           std::string("cannot find the certificate module ") +
                               kModuleFile + " (looked for " + Join(candidates) +
                               "); name it with --module PATH or " + kModuleEnv);
    }
  }
  std::string error;
  *module = LoadedModule::Open(path, &error);
  if (!*module) return Outcome::Fail(kCannotRenewDue, error);
  return Outcome();
}

// Certificate ids are directory names the archive made: never "." in them
// (which also keeps the ".temp" working directories out).
bool IsCertificateId(const std::string& id) {
  return !id.empty() && id.find_first_of("/.") == std::string::npos;
}

// Calls the module's renew for `id`: 0 on success, else the API error code
// it answered.
int CallRenew(const ZEPH_API_TABLE& row, const std::string& id) {
  Json::Value params(Json::objectValue);
  params["id"] = id;
  APIRequest request(params);
  APIResponse response;
  row.handler(&request, &response);
  if (response.outcome() == APIResponse::Outcome::kSuccess) return 0;
  if (response.outcome() == APIResponse::Outcome::kError && response.error_code() != 0) {
    return response.error_code();
  }
  return kGeneralFailure;
}

}  // namespace

Expiry CheckExpiry(const std::string& path, int days, std::string* not_after) {
  if (not_after != nullptr) not_after->clear();
  ssl::BioPtr file(BIO_new_file(path.c_str(), "r"));
  ssl::X509Ptr cert(file ? PEM_read_bio_X509(file.get(), nullptr, nullptr, nullptr)
                         : nullptr);
  if (!cert) return Expiry::kUnreadable;
  const ASN1_TIME* end = X509_get0_notAfter(cert.get());
  if (not_after != nullptr) {
    ssl::BioPtr text(BIO_new(BIO_s_mem()));
    char* data = nullptr;
    if (text && ASN1_TIME_print(text.get(), end) == 1) {
      const long n = BIO_get_mem_data(text.get(), &data);
      if (n > 0) not_after->assign(data, static_cast<size_t>(n));
    }
  }
  time_t limit = time(nullptr) + static_cast<time_t>(days) * 24 * 60 * 60;
  // As the module's test does: a comparison that fails (0) is not due.
  return X509_cmp_time(end, &limit) < 0 ? Expiry::kDue : Expiry::kNotDue;
}

std::vector<std::string> CertificateModuleCandidates() {
  const std::string dir = ExecutableDir();
  return {dir + "/" + kModuleFile, dir + "/../lib/zeph/" + kModuleFile,
          std::string(ZEPH_INSTALLED_MODULE_DIR) + "/" + kModuleFile};
}

Outcome RenewDue(const RenewDueOptions& options) {
  RunLock lock;
  Outcome o = lock.Take();
  if (!o.ok()) return o;

  const std::string info_path = RootPath(cert::kInfoFile);
  if (access(info_path.c_str(), F_OK) != 0) {
    return Outcome::Fail(kCannotRenewDue, "no certificate catalogue " + info_path);
  }
  Json::Value info;
  if (!JsonFromFile(info, info_path) || !info.isObject()) {
    return Outcome::Fail(kCannotRenewDue, "the certificate catalogue " + info_path +
                                              " is not a JSON object");
  }

  // Without the module nothing renews itself today; the warnings about
  // certificates running out are written all the same.
  std::unique_ptr<LoadedModule> module;
  o = LoadModule(options, &module);
  const ZEPH_API_TABLE* renew =
      o.ok() ? module->Find(kRenewApi, kRenewVersion, kRenewMethod) : nullptr;
  if (o.ok() && renew == nullptr) {
    o = Outcome::Fail(kCannotRenewDue, std::string("the certificate module has no ") +
                                           kRenewApi + " " + kRenewMethod);
  }
  if (!o.ok()) {
    std::set<std::string> all;
    for (const std::string& id : info.getMemberNames()) all.insert(id);
    o.data["warned"] = Json::Value(Json::arrayValue);
    for (const std::string& id : WarnAboutExpiry(info, all, time(nullptr))) {
      o.data["warned"].append(id);
    }
    return o;
  }

  Json::Value renewed(Json::arrayValue);
  Json::Value failed(Json::arrayValue);
  std::set<std::string> failed_ids;
  int skipped = 0;
  const std::string archive = RootPath(cert::kArchiveDir);
  for (const std::string& id : info.getMemberNames()) {
    const std::string dir = archive + "/" + id;
    if (!IsCertificateId(id) || access((dir + "/" + kRenewFile).c_str(), F_OK) != 0) {
      ++skipped;
      continue;
    }
    std::string not_after;
    const Expiry expiry = CheckExpiry(dir + "/cert.pem", options.days, &not_after);
    if (expiry == Expiry::kUnreadable) {
      std::cerr << "zeph-letsencrypt: " << id << ": cannot read " << dir
                << "/cert.pem; skipped" << std::endl;
    }
    if (expiry != Expiry::kDue) {
      ++skipped;
      continue;
    }
    std::cerr << "zeph-letsencrypt: renewing " << id << " (expires " << not_after
              << ")" << std::endl;
    const int code = CallRenew(*renew, id);
    if (code == 0) {
      std::cerr << "zeph-letsencrypt: renewed " << id << std::endl;
      renewed.append(id);
    } else {
      std::cerr << "zeph-letsencrypt: renewal of " << id << " failed with " << code
                << std::endl;
      failed_ids.insert(id);
      Json::Value failure(Json::objectValue);
      failure["id"] = id;
      failure["code"] = code;
      failed.append(failure);
    }
  }

  Outcome result;
  if (!failed.empty()) {
    result = Outcome::Fail(kSomeRenewalsFailed,
                           std::to_string(failed.size()) + " of " +
                               std::to_string(failed.size() + renewed.size()) +
                               " due renewals failed");
  }
  result.data["renewed"] = renewed;
  result.data["failed"] = failed;
  result.data["skipped"] = skipped;
  result.data["warned"] = Json::Value(Json::arrayValue);
  for (const std::string& id : WarnAboutExpiry(info, failed_ids, time(nullptr))) {
    result.data["warned"].append(id);
  }
  return result;
}

}  // namespace letsencrypt
}  // namespace ZEPH
