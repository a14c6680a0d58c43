// ZEPH.Core.Certificate "import": an uploaded key, certificate and
// intermediate certificate become a certificate of the archive.
#include <errno.h>
#include <strings.h>
#include <sys/stat.h>

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>

#include <string>

#include "module/archive/cert_id.h"
#include "module/archive/dir_ops.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/common/ssl_ptr.h"
#include "module/deploy/deploy.h"
#include "module/methods/action_log.h"
#include "module/methods/cert_info.h"
#include "module/methods/properties.h"
#include "module/mkcert/verify.h"
#include "module/upload/full_chain.h"
#include "module/upload/sslca_form_handler.h"
#include "zeph/qlibc_exec.h"
#include "zeph/root.h"

namespace {

constexpr int kSuccess = 5502;
constexpr int kGeneralFailure = 5501;
constexpr int kInvalidParams = 5503;
constexpr int kCertUnreadable = 5510;
constexpr int kKeyUnreadable = 5511;
constexpr int kInterUnreadable = 5512;
constexpr int kKeyMismatch = 5514;
constexpr int kCopyFailed = 5515;
constexpr int kNoChain = 5517;
constexpr int kDsaKey = 5518;

// Never asks for a pass phrase: OpenSSL's default would prompt on the
// terminal of the server. An encrypted key is simply unreadable.
int NoPassphrase(char* /*buf*/, int /*size*/, int /*rwflag*/, void* /*u*/) {
  return 0;
}

std::string TextParam(ZEPH::APIRequest* request, const char* name) {
  const Json::Value v = request->GetParam(name, "");
  return v.isString() ? v.asString() : "";
}

// A boolean parameter. The import's parameter rules demand a text for
// "as_default", so the usual texts of a form are taken as well as JSON
// booleans and numbers; anything else is `fallback`.
bool BoolParam(ZEPH::APIRequest* request, const char* name, bool fallback) {
  const Json::Value v = request->GetParam(name, fallback);
  if (v.isBool()) return v.asBool();
  if (v.isIntegral()) return v.asLargestInt() != 0;
  if (v.isString()) {
    const std::string s = v.asString();
    for (const char* yes : {"true", "1", "yes", "on"}) {
      if (strcasecmp(s.c_str(), yes) == 0) return true;
    }
    for (const char* no : {"false", "0", "no", "off", ""}) {
      if (strcasecmp(s.c_str(), no) == 0) return false;
    }
  }
  return fallback;
}

// The upload path as an argument of cp: a relative path that starts with
// "-" would be taken for an option.
std::string CpOperand(const std::string& path) {
  return !path.empty() && path[0] == '-' ? "./" + path : path;
}

// Copies `src` to `dst` with "/bin/cp" and makes the copy read-only.
bool CopyReadOnly(const std::string& src, const std::string& dst) {
  errno = 0;
  if (QLIBCExec(ZEPH::cert::kCp, CpOperand(src).c_str(), dst.c_str(), nullptr,
                nullptr) != 0 ||
      chmod(dst.c_str(), 0400) != 0) {
    UPLOAD_LOG("Failed to copy and chmod to %s [%d]", dst.c_str(), errno);
    return false;
  }
  return true;
}

bool DirExists(const std::string& path) {
  struct stat st;
  return !path.empty() && lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

struct ImportParams {
  bool user_deletable = true;
  bool as_default = false;
  std::string id;
  std::string desc;
  std::string key_tmp;
  std::string cert_tmp;
  std::string inter_cert_tmp;
  bool has_inter_cert = false;
};

// Where an import got to: what the answer and the clean-up need.
struct ImportState {
  int code = kSuccess;
  bool replace = false;
  std::string id;
  std::string target;
  std::string work_dir;
  Json::Value result{Json::objectValue};
};

// The import up to its answer. Returning with `s.code` still kSuccess is
// a success, whatever `s.result` holds by then.
void Import(const ImportParams& p, ZEPH::APIRequest* request,
            ZEPH::APIResponse* response, ImportState& s) {
  if (!p.id.empty()) {
    if (!IsCrtIdValid(p.id)) {
      UPLOAD_LOG("%s is not a valid cert id", p.id.c_str());
      s.code = kInvalidParams;
      return;
    }
    s.replace = true;
    s.id = p.id;
    s.target = ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + p.id;
  } else {
    std::string made_id;
    if (!ZEPH::cert::MakeCrtDir(s.target, made_id)) {
      UPLOAD_LOG("Failed to create a temp directory.");
      s.code = kGeneralFailure;
      return;
    }
    s.id = GetCrtId(s.target);
  }

  s.work_dir = s.target + ".temp";
  if (!CleanDir(s.work_dir, 0700)) {
    UPLOAD_LOG("Failed to clean %s", s.work_dir.c_str());
    s.code = kGeneralFailure;
    return;
  }

  const int checked = SSLCAFormHandler::checkCAContent(
      p.cert_tmp.c_str(), p.key_tmp.c_str(), p.inter_cert_tmp.c_str());
  if (checked != kSuccess) {
    UPLOAD_LOG("ProcessJsonReq: checkCAContent failed");
    s.code = checked;
    return;
  }
  // The information is not used: reading it proves the files are
  // certificates a list can show.
  Json::Value info(Json::arrayValue);
  if (getCertificateInfo(p.cert_tmp, info, request) != 0) {
    UPLOAD_LOG("Failed to get certificate info from cert file");
    s.code = kCertUnreadable;
    return;
  }
  if (!p.inter_cert_tmp.empty() &&
      getCertificateInfo(p.inter_cert_tmp, info, request) != 0) {
    UPLOAD_LOG("Failed to get certificate info from inter cert file");
    s.code = kInterUnreadable;
    return;
  }

  if (!CopyReadOnly(p.key_tmp, s.work_dir + "/privkey.pem") ||
      !CopyReadOnly(p.cert_tmp, s.work_dir + "/cert.pem") ||
      (p.has_inter_cert &&
       !CopyReadOnly(p.inter_cert_tmp, s.work_dir + "/chain.pem"))) {
    s.code = kCopyFailed;
    return;
  }
  if (!genChainCRT(s.work_dir)) {
    UPLOAD_LOG("Failed to genChainCRT for %s", s.work_dir.c_str());
    s.code = kCopyFailed;
    return;
  }

  // From here on a failure is logged and answered as a success with an
  // empty result: the uploaded files were good, and what is left to do is
  // the appliance's own business.
  if (!MoveDir(s.work_dir, s.target)) {
    UPLOAD_LOG("Failed to move %s to %s", s.work_dir.c_str(),
               s.target.c_str());
    return;
  }
  if (!SetCrtProperty(s.id, p.desc, p.as_default, p.user_deletable)) {
    UPLOAD_LOG("Failed to SetCrtProperty. [%s][%s][%s]", s.id.c_str(),
               p.desc.c_str(), p.as_default ? "default" : "default not set");
  }
  if (s.replace) {
    bool restart = false;
    if (!UpdateCertToService(s.id, restart)) {
      UPLOAD_LOG("Failed to update cert for %s", s.id.c_str());
      return;
    }
    response->SetHttpdRestart(restart);
    s.result["restart_httpd"] = restart;
  }
  s.result["id"] = s.id;
}

}  // namespace

int SSLCAFormHandler::checkPrivateKey(const std::string& keyPath) {
  ZEPH::ssl::BioPtr bio(BIO_new_file(keyPath.c_str(), "r"));
  if (!bio) {
    ERR_clear_error();
    UPLOAD_LOG("Failed to BIO_new_file. [%s]", keyPath.c_str());
    return kKeyUnreadable;
  }
  ZEPH::ssl::EvpPkeyPtr key(
      PEM_read_bio_PrivateKey(bio.get(), nullptr, NoPassphrase, nullptr));
  ERR_clear_error();
  if (!key) {
    UPLOAD_LOG("Failed to read private key from %s", keyPath.c_str());
    return kKeyUnreadable;
  }
  return EVP_PKEY_base_id(key.get()) == EVP_PKEY_DSA ? kDsaKey : kSuccess;
}

int SSLCAFormHandler::checkCAContent(const char* certPath, const char* keyPath,
                                     const char* interPath) {
  const std::string cert = certPath != nullptr ? certPath : "";
  const std::string key = keyPath != nullptr ? keyPath : "";
  const std::string inter = interPath != nullptr ? interPath : "";

  const int key_checked = checkPrivateKey(key);
  if (key_checked != kSuccess) {
    UPLOAD_LOG("Failed to check private key for %s", key.c_str());
    return key_checked;
  }
  if (!inter.empty() && verifyCrtChain(cert.c_str(), inter.c_str()) != 0) {
    UPLOAD_LOG("Intermediate certificate & certificate is not matching.");
    return kNoChain;
  }
  if (verifyCrtAndKey(cert, key) != 0) {
    UPLOAD_LOG("%s and %s are not match", cert.c_str(), key.c_str());
    return kKeyMismatch;
  }
  return kSuccess;
}

void SSLCAFormHandler::ProcessJsonReq(ZEPH::APIRequest* request,
                                      ZEPH::APIResponse* response) {
  ImportParams p;
  p.user_deletable = BoolParam(request, "user_deletable", true);
  p.as_default = BoolParam(request, "as_default", false);
  p.id = TextParam(request, "id");
  p.desc = TextParam(request, "desc");
  p.key_tmp = TextParam(request, "key_tmp");
  p.cert_tmp = TextParam(request, "cert_tmp");
  p.inter_cert_tmp = TextParam(request, "inter_cert_tmp");
  p.has_inter_cert = request->HasParam("inter_cert_tmp");

  ImportState s;
  Import(p, request, response, s);

  LogAction(s.replace ? CERT_ACTION_REPLACE : CERT_ACTION_CREATE,
            s.code == kSuccess, s.id, "", "");
  if (s.code == kSuccess) {
    response->SetSuccess(s.result);
    return;
  }
  if (DirExists(s.work_dir) && !RemoveDir(s.work_dir)) {
    UPLOAD_LOG("Failed to remove %s", s.work_dir.c_str());
  }
  // Only the directory this import made; an existing certificate stays.
  if (!s.replace && DirExists(s.target) && !RemoveDir(s.target)) {
    UPLOAD_LOG("Failed to remove %s", s.target.c_str());
  }
  response->SetError(s.code, Json::Value());
}
