#include "module/methods/cert_info.h"

#include <arpa/inet.h>
#include <string.h>

#include <openssl/asn1.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include "module/common/ssl_ptr.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

struct NameKey {
  int nid;
  const char* key;
};

constexpr NameKey kNameKeys[] = {
    {NID_countryName, "country"},
    {NID_stateOrProvinceName, "state"},
    {NID_localityName, "city"},
    {NID_organizationName, "organization"},
    {NID_organizationalUnitName, "department"},
    {NID_commonName, "common_name"},
    {NID_pkcs9_emailAddress, "email"},
};

// The type of a certificate file, told by its fixed path.
const char* CertificateType(const std::string& path) {
  if (path == ZEPH::RootPath("/usr/zeph/etc/ssl/ssl.crt/ca.crt")) return "root_cert";
  if (path == ZEPH::RootPath("/usr/zeph/etc/ssl/ssl.intercrt/server-ca.crt")) {
    return "inter_cert";
  }
  return "server_cert";
}

}  // namespace

std::string SignatureAlgorithm(const X509* cert) {
  const char* name = OBJ_nid2ln(X509_get_signature_nid(cert));
  return name != nullptr ? name : "";
}

void X509_NAME2Json(X509_NAME* name, Json::Value& out) {
  // A name without any of the attributes below is still a name object:
  // readers look up its keys.
  if (out.isNull()) out = Json::Value(Json::objectValue);
  for (const NameKey& k : kNameKeys) {
    char buf[1024];
    memset(buf, 0, sizeof(buf));
    if (X509_NAME_get_text_by_NID(name, k.nid, buf, sizeof(buf)) > 0) {
      out[k.key] = buf;
    }
  }
}

void ASN1_TIME2Json(const ASN1_TIME* time, Json::Value& out) {
  ZEPH::ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio) return;
  ASN1_TIME_print(bio.get(), time);
  BIO_write(bio.get(), "", 1);  // the terminating zero byte
  char* data = nullptr;
  BIO_get_mem_data(bio.get(), &data);
  if (data != nullptr) out = data;
}

Json::Value SubjectAltNames2Json(X509* cert) {
  Json::Value names(Json::arrayValue);
  ZEPH::ssl::GeneralNamesPtr sans(static_cast<GENERAL_NAMES*>(
      X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr)));
  if (!sans) return names;
  for (int i = 0; i < sk_GENERAL_NAME_num(sans.get()); ++i) {
    const GENERAL_NAME* gn = sk_GENERAL_NAME_value(sans.get(), i);
    int type = 0;
    const ASN1_STRING* value =
        static_cast<const ASN1_STRING*>(GENERAL_NAME_get0_value(gn, &type));
    if (value == nullptr || ASN1_STRING_get0_data(value) == nullptr) continue;
    const unsigned char* data = ASN1_STRING_get0_data(value);
    const int length = ASN1_STRING_length(value);
    if (type == GEN_DNS || type == GEN_URI) {
      names.append(std::string(reinterpret_cast<const char*>(data),
                               static_cast<size_t>(length)));
    } else if (type == GEN_IPADD) {
      // A zeroed buffer: an address of any other length adds "".
      char text[46];
      memset(text, 0, sizeof(text));
      if (length == 4) {
        inet_ntop(AF_INET, data, text, sizeof(text));
      } else if (length == 16) {
        inet_ntop(AF_INET6, data, text, sizeof(text));
      }
      names.append(text);
    }
  }
  return names;
}

int getCertificateInfo(std::string path, Json::Value& out,
                       ZEPH::APIRequest* request) {
  const Json::Value additional =
      request != nullptr ? request->GetParam("additional", Json::Value())
                         : Json::Value();
  ZEPH::UniqueFile file(fopen(path.c_str(), "re"));
  if (!file) return 4;
  const char* type = CertificateType(path);
  bool first = true;
  for (;;) {
    ZEPH::ssl::X509Ptr cert(PEM_read_X509(file.get(), nullptr, nullptr, nullptr));
    if (!cert) break;
    first = false;
    Json::Value info(Json::objectValue);
    X509_NAME2Json(X509_get_issuer_name(cert.get()), info["issuer"]);
    X509_NAME2Json(X509_get_subject_name(cert.get()), info["subject"]);
    info["signature_algorithm"] = SignatureAlgorithm(cert.get());
    if (additional.isArray()) {
      for (const Json::Value& field : additional) {
        if (!field.isString()) continue;
        if (field.asString() == "valid_from") {
          ASN1_TIME2Json(X509_get0_notBefore(cert.get()), info["valid_from"]);
        } else if (field.asString() == "valid_till") {
          ASN1_TIME2Json(X509_get0_notAfter(cert.get()), info["valid_till"]);
        }
      }
    }
    info["type"] = type;
    out.append(info);
  }
  // The end of the file leaves a "no start line" error on the queue.
  ERR_clear_error();
  return first ? 3 : 0;
}
