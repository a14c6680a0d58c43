// ZEPH.Core.Certificate "export": a certificate set handed out as a ZIP
// archive made by 7z.
#include <errno.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "module/archive/file_lock.h"
#include "module/archive/cert_id.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/mkcert/generation_lock.h"
#include "module/mkcert/verify.h"
#include "module/upload/sslca_form_handler.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_lock.h"
#include "zeph/qlibc_support.h"
#include "zeph/root.h"

namespace {

constexpr char kServerKey[] = "/usr/zeph/etc/ssl/.gen/server.key";
constexpr char kServerCrt[] = "/usr/zeph/etc/ssl/.gen/server.crt";
constexpr char kArchiveZip[] = "/usr/zeph/etc/ssl/.gen/archive.zip";
constexpr char kArchiveName[] = "archive.zip";
constexpr char kExportLock[] = "/tmp/zephcertificate_export.lock";
constexpr int kExportLockSeconds = 60;
constexpr char kSelfSignFeature[] = "support_self_sign_cert";

// What an export packs, and whether the packed files are products of the
// CSR methods, handed out once.
struct ExportSet {
  std::vector<std::string> files;
  bool generated = false;
  bool request_and_key = false;  // files: the request, then its key
};

// The set selected by "file"; false for a value that selects nothing.
bool SelectSet(ZEPH::APIRequest* request, ExportSet& set) {
  const Json::Value file_value = request->GetParam("file", "");
  const std::string file = file_value.isString() ? file_value.asString() : "";
  if (file == "archive") {
    const Json::Value id_value = request->GetParam("id", "");
    const std::string id = id_value.isString() ? id_value.asString() : "";
    if (!IsCrtIdName(id)) {
      UPLOAD_LOG("%s is not a valid cert id", id.c_str());
      return false;
    }
    const std::string dir =
        ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + id + "/";
    // The appliance's own authority travels with its certificates only
    // where self-signed certificates are supported.
    if (QLIBCSupportGet(kSelfSignFeature) == 1) {
      set.files.push_back(dir + "zeph-ca-cert.pem");
      set.files.push_back(dir + "zeph-ca-privkey.pem");
    }
    for (const char* name : {"privkey.pem", "cert.pem", "chain.pem"}) {
      set.files.push_back(dir + name);
    }
    return true;
  }
  if (file == "csr_set") {
    set.files = {ZEPH::RootPath(ZEPH::cert::kServerCsr),
                 ZEPH::RootPath(kServerKey)};
    set.generated = true;
    set.request_and_key = true;
    return true;
  }
  if (file == "signed_set") {
    set.files = {ZEPH::RootPath(kServerCrt)};
    set.generated = true;
    return true;
  }
  return false;
}

// A request is handed out only with the key it was made with: a request
// and a key that do not belong together (one of them missing, or left by
// different generations) are worth nothing to the administrator.
bool IsWholeSet(const ExportSet& set) {
  if (!set.request_and_key) return true;
  if (verifyCsrAndKey(set.files[0], set.files[1]) == 0) return true;
  UPLOAD_LOG("The request %s does not belong to the key %s",
             set.files[0].c_str(), set.files[1].c_str());
  return false;
}

}  // namespace

int SSLCAFormHandler::CreateArchive(const char** files, const char* archivePath,
                                    int count) {
  if (archivePath == nullptr || *archivePath == '\0' || count < 0 ||
      (count > 0 && files == nullptr)) {
    UPLOAD_LOG("CreateArchive: invalid parameters");
    return -1;
  }
  if (QLIBCExec(ZEPH::cert::kRm, "-rf", archivePath, nullptr, nullptr) != 0) {
    UPLOAD_LOG_LIBERR("Remove previous archive failed");
    return -1;
  }
  // 7z writes its report and progress to standard output, which belongs to
  // the host (zephcert prints its answer there); errors still go to
  // standard error.
  std::vector<std::string> args = {ZEPH::cert::k7z, "a", archivePath,
                                   "-bso0", "-bsp0"};
  const size_t fixed = args.size();
  for (int i = 0; i < count; ++i) {
    if (files[i] != nullptr && access(files[i], F_OK) == 0) {
      args.push_back(files[i]);
    }
  }
  if (args.size() == fixed) {
    UPLOAD_LOG("No file will be compress");
    return -1;
  }
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  if (QLIBCExecv(argv[0], argv.data(), 1) != 0) {
    UPLOAD_LOG_LIBERR("7z file failed");
    // A half-written archive may hold keys; it is never handed out.
    unlink(archivePath);
    return -1;
  }
  // A finished archive is handed out even when its mode cannot be set.
  if (chmod(archivePath, 0400) != 0) {
    UPLOAD_LOG("Failed to chmod: [%s]", archivePath);
  }
  return 0;
}

void SSLCAFormHandler::DownloadAction(ZEPH::APIRequest* request,
                                      ZEPH::APIResponse* response) {
  ZEPH::APIDownload download;
  ExportSet set;
  if (!SelectSet(request, set)) return;

  // Exports share one archive path: without the lock, one export could hand
  // out another's archive, or remove it before it is handed out (and with
  // it the only copy of a request's key).
  const std::string lock_path = ZEPH::RootPath(kExportLock);
  ZEPH::cert::ScopedFileLock lock;
  if (!lock.Lock(lock_path, QLIBC_LOCK_EXCLUSIVE, kExportLockSeconds)) {
    UPLOAD_LOG_LIBERR("Lock %s failed", lock_path.c_str());
    return;
  }

  // The CSR methods' products are work files of key generation; while they
  // are packed and removed no generation may replace them.
  ZEPH::cert::GenerationLock generation(
      ZEPH::cert::GenerationLock::Use::kWorkFiles);
  if (set.generated && !generation.Lock()) return;
  if (!IsWholeSet(set)) set.files.clear();  // packs nothing, as when absent

  const std::string archive = ZEPH::RootPath(kArchiveZip);
  // The archive holds private keys: its directory is the owner's alone
  // (7z would make a missing one with the default mode).
  const std::string gen_dir = ZEPH::RootPath(ZEPH::cert::kGenDir);
  if (mkdir(gen_dir.c_str(), 0700) != 0 && errno != EEXIST) {
    UPLOAD_LOG("Create %s failed. [%d]", gen_dir.c_str(), errno);
  }

  std::vector<const char*> files;
  for (const std::string& f : set.files) files.push_back(f.c_str());
  if (CreateArchive(files.data(), archive.c_str(),
                    static_cast<int>(files.size())) != 0) {
    UPLOAD_LOG_LIBERR("Create archive failed");
    return;
  }
  if (access(archive.c_str(), F_OK) != 0) return;
  response->SetEnableOutput(false);
  download.SetHeader("content-disposition",
                     std::string("attachment; filename=\"") + kArchiveName +
                         "\"");
  if (!download.Output(archive)) {
    // Not handed out: a request's key has no other copy, so the set stays
    // for the next export.
    UPLOAD_LOG("Failed to output %s", archive.c_str());
    return;
  }
  if (set.generated) {
    for (const std::string& f : set.files) {
      if (unlink(f.c_str()) != 0 && errno != ENOENT) {
        UPLOAD_LOG("Failed to remove %s [%d]", f.c_str(), errno);
      }
    }
  }
}
