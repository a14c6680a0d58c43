// ZEPH.Core.Certificate.CSR "create", "renew" and "sign".
#include "module/methods/csr.h"

#include <errno.h>
#include <sys/stat.h>

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>

#include "module/archive/cert_id.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/common/ssl_ptr.h"
#include "module/methods/cert_info.h"
#include "module/methods/workers.h"
#include "module/mkcert/generate.h"
#include "module/mkcert/generation_lock.h"
#include "module/upload/sslca_form_handler.h"
#include "zeph/json_file.h"
#include "zeph/qlibc.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

constexpr int kSuccess = 5502;
constexpr int kGeneralFailure = 5501;
constexpr int kInvalidParams = 5503;
// Key length of a renewed request when the certificate's key is not RSA.
constexpr int kNonRsaKeyLength = 2048;

std::string GenPath(const char* name) {
  return ZEPH::RootPath(ZEPH::cert::kGenDir) + "/" + name;
}

std::string TextParam(ZEPH::APIRequest* request, const char* name,
                      const char* fallback) {
  const Json::Value v = request->GetParam(name, fallback);
  return v.isString() ? v.asString() : fallback;
}

// An integer parameter whose default is given as text, as the request layer
// hands numbers over: a numeric text converts, anything else falls back.
int IntParam(ZEPH::APIRequest* request, const char* name, int fallback) {
  const Json::Value v = request->GetParam(name, std::to_string(fallback));
  if (v.isInt()) return v.asInt();
  if (v.isString()) {
    try {
      size_t used = 0;
      int n = std::stoi(v.asString(), &used);
      if (used == v.asString().size()) return n;
    } catch (const std::exception&) {
    }
  }
  return fallback;
}

// The bit length of the key in certificate `path`: the RSA modulus size, or
// kNonRsaKeyLength for any other kind of key. -1 on failure.
int KeyLengthOf(const std::string& path) {
  ZEPH::UniqueFile file(fopen(path.c_str(), "re"));
  if (!file) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    CERT_LOG_LIBERR("open %s failed ", path.c_str());
    return -1;
  }
  ZEPH::ssl::X509Ptr cert(PEM_read_X509(file.get(), nullptr, nullptr, nullptr));
  if (!cert) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    CERT_LOG_LIBERR("read x509 failed");
    return -1;
  }
  ZEPH::ssl::EvpPkeyPtr key(X509_get_pubkey(cert.get()));
  if (!key) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    CERT_LOG_LIBERR("get public key from file failed");
    return -1;
  }
  if (EVP_PKEY_base_id(key.get()) != EVP_PKEY_RSA) return kNonRsaKeyLength;
  return EVP_PKEY_bits(key.get());
}

}  // namespace

int fillCSRInfo(ZEPH::APIRequest* request, _tag_CSR_ARGUMENT* subject,
                bool is_ca) {
  if (subject == nullptr || request == nullptr) {
    CERT_LOG("sanity check failed");
    return -1;
  }
  const std::string p = is_ca ? "ca_" : "";
  subject->country = TextParam(request, (p + "country").c_str(), "TW");
  subject->state = TextParam(request, (p + "state").c_str(), "Taipei");
  subject->city = TextParam(request, (p + "city").c_str(), "Taipel");
  subject->organization =
      TextParam(request, (p + "organization").c_str(), "Organization");
  subject->department =
      TextParam(request, (p + "department").c_str(), "Department");
  subject->common_name =
      TextParam(request, (p + "common_name").c_str(), kDefaultCommonName);
  subject->email = TextParam(request, (p + "email").c_str(),
                             is_ca ? kDefaultCaEmail : kDefaultEmail);
  return 0;
}

bool KeyTypeParam(ZEPH::APIRequest* request, const char* name,
                  ZEPH::cert::KeyType* out) {
  if (!request->HasParam(name)) return true;
  const Json::Value v = request->GetParam(name, Json::Value());
  if (v.isString() && ZEPH::cert::ParseKeyType(v.asString(), out)) return true;
  CERT_LOG("Invalid key type [%s]",
           v.isString() ? v.asString().c_str() : ZEPH::JsonCompact(v).c_str());
  return false;
}

bool generateCSR(int bits, _tag_CSR_ARGUMENT& subject) {
  return generateCSROfType(ZEPH::cert::KeyType::kRsa, bits, subject);
}

bool generateCSROfType(ZEPH::cert::KeyType type, int bits,
                       _tag_CSR_ARGUMENT& subject) {
  ZEPH::cert::GenerationLock lock(ZEPH::cert::GenerationLock::Use::kWorkFiles);
  if (!lock.Lock()) return false;
  const std::string gen = ZEPH::RootPath(ZEPH::cert::kGenDir);
  if (mkdir(gen.c_str(), 0700) != 0 && errno != EEXIST) {
    CERT_LOG("Create %s failed.", gen.c_str());
    return false;
  }
  const std::string key = GenPath("server.key");
  const std::string csr = GenPath("server.csr");
  if (genKeyOfType(key, type, static_cast<unsigned int>(bits)) != 0) {
    CERT_LOG("genKey Error path: %s", key.c_str());
    return false;
  }
  if (genCsr(ZEPH::RootPath(ZEPH::cert::kCaCfg), key, csr, &subject) != 0) {
    CERT_LOG("genCsr Error path: %s", csr.c_str());
    return false;
  }
  return true;
}

void handleCSRAction(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  _tag_CSR_ARGUMENT subject;
  if (fillCSRInfo(request, &subject, false) == -1) {
    CERT_LOG("fill argument from json failed");
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  const int bits = IntParam(request, "key_length", 2048);
  ZEPH::cert::KeyType type = ZEPH::cert::KeyType::kRsa;
  if (!KeyTypeParam(request, "key_type", &type)) {
    response->SetError(kInvalidParams, Json::Value());
    return;
  }
  if (!generateCSROfType(type, bits, subject)) {
    CERT_LOG_LIBERR("Generate csr from csr action failed");
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  response->SetSuccess(Json::Value(Json::objectValue));
}

void handleRenewAction(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  const std::string id = TextParam(request, "id", "");
  // Without "key_type" the new key is RSA, as long as the certificate's
  // when that is RSA; with it, the key asked for.
  ZEPH::cert::KeyType type = ZEPH::cert::KeyType::kRsa;
  if (!KeyTypeParam(request, "key_type", &type)) {
    response->SetError(kInvalidParams, Json::Value());
    return;
  }
  if (!IsCrtIdValid(id)) {
    CERT_LOG("Invalid crt id [%s].", id.c_str());
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  const std::string path =
      ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + id + "/cert.pem";
  Json::Value infos(Json::arrayValue);
  if (!QLIBCFileExist(path.c_str()) ||
      getCertificateInfo(path, infos, request) != 0) {
    CERT_LOG("Get certificate info failed. [%s]", path.c_str());
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  Json::Value name;
  for (const Json::Value& info : infos) {
    if (info["type"].asString() == "server_cert") {
      name = info["subject"];
      break;
    }
  }
  auto field = [&name](const char* key) {
    return name.isObject() && name[key].isString() ? name[key].asString() : "";
  };
  _tag_CSR_ARGUMENT subject;
  subject.common_name = field("common_name");
  subject.country = field("country");
  subject.email = field("email");
  subject.city = field("city");
  subject.organization = field("organization");
  subject.department = field("department");
  subject.state = field("state");
  if (request->HasParam("country")) {
    subject.country = TextParam(request, "country", "");
  }

  const int bits = KeyLengthOf(path);
  if (bits < 0) {
    CERT_LOG_LIBERR("Getting key length from [%s] failed", path.c_str());
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  if (!generateCSROfType(type, bits, subject)) {
    CERT_LOG_LIBERR("Generate csr from renew action failed");
    response->SetError(kGeneralFailure, Json::Value());
    return;
  }
  response->SetSuccess(Json::Value(Json::objectValue));
}

void handleSignCSRAction(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  const std::string csr_tmp = TextParam(request, "csr_tmp", "");
  const std::string alias = TextParam(request, "alias", "");
  const int days = IntParam(request, "days", 730);
  const std::string id = TextParam(request, "id", "");
  if (!IsCrtIdValid(id)) {
    CERT_LOG("Invalid crt id [%s].", id.c_str());
    response->SetError(kInvalidParams, Json::Value());
    return;
  }
  const std::string dir = ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + id;
  const std::string ca_cert = dir + "/zeph-ca-cert.pem";
  const std::string ca_key = dir + "/zeph-ca-privkey.pem";
  if (!QLIBCFileExist(ca_cert.c_str()) || !QLIBCFileExist(ca_key.c_str())) {
    CERT_LOG("No Zeph CA info. [%s]", id.c_str());
    response->SetError(kInvalidParams, Json::Value());
    return;
  }
  if (days < 1) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    CERT_LOG_LIBERR("0 >= days");
    response->SetError(kInvalidParams, Json::Value());
    return;
  }
  const int checked = SSLCAFormHandler::checkCSRFormat(csr_tmp);
  if (checked != kSuccess) {
    CERT_LOG("Check CSR file failed");
    response->SetError(checked, Json::Value());
    return;
  }
  // A failed signing still answers success: the administrator finds out
  // when the export of the signed set has no file to hand out (a failed
  // run leaves none, nor the certificate an earlier signing made).
  ZEPH::cert::GenerationLock lock(ZEPH::cert::GenerationLock::Use::kWorkFiles);
  if (!lock.Lock() || genServerCrt(csr_tmp, ca_cert, GenPath("server.crt"),
                                   ca_key, days, alias) != 0) {
    CERT_LOG("Generate crt failed");
  }
  response->SetSuccess(Json::Value(Json::objectValue));
}
