// ZEPH.Core.Certificate.CRT "list": every certificate of the catalogue with
// what is inside it and who uses it.
#include <openssl/err.h>
#include <openssl/pem.h>

#include "module/archive/cert_id.h"
#include "module/archive/expiry.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/common/ssl_ptr.h"
#include "module/deploy/deploy.h"
#include "module/methods/cert_info.h"
#include "module/methods/workers.h"
#include "zeph/json_file.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

// The first certificate of a PEM file, or null (the error queue is left
// clean either way).
ZEPH::ssl::X509Ptr ReadFirstCertificate(FILE* file) {
  ZEPH::ssl::X509Ptr cert(PEM_read_X509(file, nullptr, nullptr, nullptr));
  if (!cert) ERR_clear_error();
  return cert;
}

// The certificate object of `id`, or false when its "cert.pem" cannot be
// read; `entry` is the certificate's INFO record.
bool DescribeCertificate(const std::string& id, const Json::Value& entry,
                         Json::Value& out) {
  const std::string dir = ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + id;
  const std::string path = dir + "/cert.pem";
  ZEPH::ssl::X509Ptr cert;
  ZEPH::UniqueFile file(fopen(path.c_str(), "re"));
  if (file) cert = ReadFirstCertificate(file.get());
  if (!cert) CERT_LOG("Failed to PEM_read_X509. [%s]", path.c_str());
  ZEPH::ssl::EvpPkeyPtr key(cert ? X509_get_pubkey(cert.get()) : nullptr);
  if (cert && !key) CERT_LOG("Failed to get public key of x509 [%s]", path.c_str());
  if (!cert || !key) {
    CERT_LOG("Failed to get cert info. [%s]", id.c_str());
    return false;
  }

  out["id"] = id;
  out["desc"] = entry.isObject() ? entry["desc"] : Json::Value();
  out["is_default"] = GetDefCrtId() == id;
  out["services"] = entry.isObject() ? entry["services"] : Json::Value();
  out["renewable"] = CertificateRenewable(id);
  out["user_deletable"] =
      entry.isObject() ? entry.get("user_deletable", true) : Json::Value(true);
  X509_NAME2Json(X509_get_issuer_name(cert.get()), out["issuer"]);
  X509_NAME2Json(X509_get_subject_name(cert.get()), out["subject"]);
  out["sub_alt_name"] = SubjectAltNames2Json(cert.get());
  out["signature_algorithm"] = SignatureAlgorithm(cert.get());
  out["is_ecc"] = EVP_PKEY_base_id(key.get()) == EVP_PKEY_EC;
  ASN1_TIME2Json(X509_get0_notBefore(cert.get()), out["valid_from"]);
  ASN1_TIME2Json(X509_get0_notAfter(cert.get()), out["valid_till"]);

  if (IsCrtIdValid(id)) {
    const std::string ca_path = dir + "/zeph-ca-cert.pem";
    ZEPH::UniqueFile ca_file(fopen(ca_path.c_str(), "re"));
    if (ca_file) {
      ZEPH::ssl::X509Ptr ca = ReadFirstCertificate(ca_file.get());
      if (ca) {
        Json::Value& info = out["self_signed_cacrt_info"];
        X509_NAME2Json(X509_get_issuer_name(ca.get()), info["issuer"]);
        X509_NAME2Json(X509_get_subject_name(ca.get()), info["subject"]);
      } else {
        CERT_LOG("Failed to PEM_read_X509. [%s]", ca_path.c_str());
      }
    }
  }
  return true;
}

}  // namespace

void handleCRTList(ZEPH::APIRequest* /*request*/, ZEPH::APIResponse* response) {
  Json::Value result(Json::objectValue);
  result["certificates"] = Json::Value(Json::arrayValue);
  const std::string info_path = ZEPH::RootPath(ZEPH::cert::kInfoFile);
  Json::Value info;
  if (!ZEPH::JsonFromFile(info, info_path) || !info.isObject()) {
    CERT_LOG("Broken [%s]", info_path.c_str());
    response->SetError(5501, Json::Value());
    return;
  }
  for (const std::string& id : info.getMemberNames()) {
    if (!IsCrtIdValid(id)) {
      CERT_LOG("%s is not a valid cert directory", id.c_str());
      continue;
    }
    Json::Value cert(Json::objectValue);
    if (DescribeCertificate(id, info[id], cert)) {
      result["certificates"].append(cert);
    }
  }
  response->SetSuccess(result);
}
