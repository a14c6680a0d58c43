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
#include "module/methods/action_log.h"
#include "module/mkcert/generation_lock.h"
#include "module/mkcert/verify.h"
#include "module/upload/pkcs12.h"
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
constexpr char kPkcs12File[] = "/usr/zeph/etc/ssl/.gen/archive.p12";
constexpr int kInvalidParams = 5503;
constexpr int kGeneralFailure = 5501;
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

// The name a PKCS#12 file is offered under: the certificate's common name
// with every character but letters, digits, ".", "-" and "_" made "_" (a
// wildcard's "*" too), and ".p12"; the id when that leaves nothing useful.
std::string Pkcs12Name(const std::string& common_name, const std::string& id) {
  std::string name;
  for (unsigned char c : common_name) {
    const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                       (c >= '0' && c <= '9') || c == '.' || c == '-' ||
                       c == '_';
    name.push_back(plain ? static_cast<char>(c) : '_');
  }
  if (name.empty() || name[0] == '.' ||
      name.find_first_not_of("._-") == std::string::npos) {
    name = id;
  }
  return name + ".p12";
}

// Checks the parameters of a PKCS#12 export: "format" "pkcs12", "file"
// "archive", a plain "id", a usable "passphrase" and a boolean "legacy" if
// any. False, with a log line that never shows the passphrase, otherwise.
bool Pkcs12Params(ZEPH::APIRequest* request, std::string* id,
                  std::string* passphrase, bool* legacy) {
  const Json::Value format = request->GetParam("format", Json::Value());
  const Json::Value file = request->GetParam("file", Json::Value());
  const Json::Value id_value = request->GetParam("id", Json::Value());
  const Json::Value pass = request->GetParam("passphrase", Json::Value());
  const Json::Value legacy_value = request->GetParam("legacy", false);
  if (!format.isString() || format.asString() != "pkcs12") {
    UPLOAD_LOG("Unknown export format");
    return false;
  }
  if (!file.isString() || file.asString() != "archive") {
    UPLOAD_LOG("A PKCS#12 file is made of a certificate set only");
    return false;
  }
  *id = id_value.isString() ? id_value.asString() : "";
  if (!IsCrtIdName(*id)) {
    UPLOAD_LOG("%s is not a valid cert id", id->c_str());
    return false;
  }
  if (!pass.isString() || !ZEPH::cert::IsUsablePassphrase(pass.asString())) {
    UPLOAD_LOG("A PKCS#12 file needs a passphrase of one line");
    return false;
  }
  if (!legacy_value.isBool()) {
    UPLOAD_LOG("\"legacy\" must be true or false");
    return false;
  }
  *passphrase = pass.asString();
  *legacy = legacy_value.asBool();
  return true;
}

// The PKCS#12 export of certificate set "id": its key, its certificate and
// the certificates above it (chain.pem, or the appliance's own authority
// of a self-signed set), as one .p12 download. Answers 5503 for unusable
// parameters and 5501 when the file cannot be made or handed out.
void ExportPkcs12(ZEPH::APIRequest* request, ZEPH::APIResponse* response,
                  ZEPH::APIDownload& download) {
  std::string id;
  std::string passphrase;
  bool legacy = false;
  if (!Pkcs12Params(request, &id, &passphrase, &legacy)) {
    response->SetError(kInvalidParams, Json::Value());
    return;
  }
  const std::string dir = ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + id + "/";
  ZEPH::cert::Pkcs12Input input;
  input.key_path = dir + "privkey.pem";
  input.cert_path = dir + "cert.pem";
  for (const char* chain : {"chain.pem", "zeph-ca-cert.pem"}) {
    if (access((dir + chain).c_str(), F_OK) == 0) {
      input.chain_path = dir + chain;
      break;
    }
  }
  const std::string common_name = GetCrtSubjectCN(id);
  input.friendly_name = common_name.empty() ? id : common_name;
  if (access(input.key_path.c_str(), F_OK) != 0 ||
      access(input.cert_path.c_str(), F_OK) != 0) {
    UPLOAD_LOG("No certificate set [%s]", id.c_str());
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }

  // The one PKCS#12 path is shared by all exports, as the ZIP's is.
  const std::string lock_path = ZEPH::RootPath(kExportLock);
  ZEPH::cert::ScopedFileLock lock;
  if (!lock.Lock(lock_path, QLIBC_LOCK_EXCLUSIVE, kExportLockSeconds)) {
    UPLOAD_LOG_LIBERR("Lock %s failed", lock_path.c_str());
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  const std::string gen_dir = ZEPH::RootPath(ZEPH::cert::kGenDir);
  if (mkdir(gen_dir.c_str(), 0700) != 0 && errno != EEXIST) {
    UPLOAD_LOG("Create %s failed. [%d]", gen_dir.c_str(), errno);
  }
  const std::string out = ZEPH::RootPath(kPkcs12File);
  if (ZEPH::cert::MakePkcs12(input, passphrase, legacy, out) != 0) {
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  response->SetEnableOutput(false);
  download.SetHeader("content-type", "application/x-pkcs12");
  download.SetHeader("content-disposition",
                     "attachment; filename=\"" + Pkcs12Name(common_name, id) +
                         "\"");
  const bool delivered = download.Output(out);
  // The sink has the file open or copied by now; the key stays in the
  // archive only.
  unlink(out.c_str());
  if (!delivered) {
    UPLOAD_LOG("Failed to output %s", out.c_str());
    response->SetEnableOutput(true);
    response->SetError(kGeneralFailure, Json::Value());
  }
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
  // "format" is absent or "zip" for the archive of old; anything else is
  // the PKCS#12 export or refused there.
  const Json::Value format = request->GetParam("format", Json::Value());
  if (request->HasParam("format") &&
      !(format.isString() && format.asString() == "zip")) {
    ExportPkcs12(request, response, download);
    return;
  }
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
