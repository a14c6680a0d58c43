#include "module/methods/methods_test_support.h"

#include <gtest/gtest.h>
#include <openssl/ec.h>
#include <openssl/err.h>
#include <openssl/pem.h>

#include <sstream>

#include "host/provision.h"
#include "module/common/ssl_ptr.h"
#include "module/frame/table.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace test {

ApplianceRoot::ApplianceRoot() {
  std::string error;
  EXPECT_TRUE(ProvisionRoot(&error)) << error;
}

CallResult ApplianceRoot::Call(const std::string& api, const std::string& method,
                               const Json::Value& params) const {
  CallResult result;
  for (const ZEPH_API_TABLE* row = GetAPITable(); row->api != nullptr; ++row) {
    if (api == row->api && method == row->method) {
      APIRequest request(params);
      row->handler(&request, &result.response);
      EXPECT_EQ(result.response.outcome_count(), 1) << api << " " << method;
      return result;
    }
  }
  ADD_FAILURE() << "no row " << api << " " << method;
  return result;
}

CallResult ApplianceRoot::Call(const std::string& api, const std::string& method,
                               const std::string& params) const {
  Json::Value value;
  EXPECT_TRUE(JsonParse(params, value)) << params;
  return Call(api, method, value);
}

std::vector<Json::Value> ApplianceRoot::Events() const {
  std::vector<Json::Value> events;
  std::istringstream in(ReadFile(Path("/var/log/zeph/events.jsonl")));
  std::string line;
  while (std::getline(in, line)) {
    Json::Value event;
    EXPECT_TRUE(JsonParse(line, event)) << line;
    events.push_back(event);
  }
  return events;
}

Json::Value ApplianceRoot::Info() const {
  Json::Value info;
  EXPECT_TRUE(JsonFromFile(info, Archive("/INFO")));
  return info;
}

Json::Value ApplianceRoot::WebService() const {
  Json::Value services;
  EXPECT_TRUE(JsonFromFile(services, Archive("/SERVICES")));
  return services[0];
}

namespace {

std::string KeyText(const EVP_PKEY* key) {
  if (key == nullptr) return "?";
  if (EVP_PKEY_base_id(key) == EVP_PKEY_RSA) {
    return "rsa" + std::to_string(EVP_PKEY_bits(key));
  }
  const EC_KEY* ec = EVP_PKEY_get0_EC_KEY(key);
  const int nid = ec ? EC_GROUP_get_curve_name(EC_KEY_get0_group(ec)) : 0;
  return nid == NID_X9_62_prime256v1 ? "P-256"
         : nid == NID_secp384r1      ? "P-384"
                                     : "?";
}

}  // namespace

std::string KeyAndSignature(const std::string& path) {
  const std::string pem = ReadFile(path);
  ssl::BioPtr bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  ssl::X509Ptr cert(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
  const X509_ALGOR* alg = nullptr;
  std::string key;
  ssl::X509ReqPtr req;
  if (cert) {
    key = KeyText(X509_get0_pubkey(cert.get()));
    X509_get0_signature(nullptr, &alg, cert.get());
  } else {
    bio.reset(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    req.reset(PEM_read_bio_X509_REQ(bio.get(), nullptr, nullptr, nullptr));
    if (!req) return "unreadable " + path;
    key = KeyText(X509_REQ_get0_pubkey(req.get()));
    X509_REQ_get0_signature(req.get(), nullptr, &alg);
  }
  ERR_clear_error();
  const ASN1_OBJECT* oid = nullptr;
  X509_ALGOR_get0(&oid, nullptr, nullptr, alg);
  return key + " " + OBJ_nid2ln(OBJ_obj2nid(oid));
}

Json::Value CreateParams(const std::string& common_name) {
  Json::Value p(Json::objectValue);
  for (const char* prefix : {"ca_", ""}) {
    const std::string x = prefix;
    p[x + "country"] = "TW";
    p[x + "state"] = "";
    p[x + "city"] = "Taipel";
    p[x + "organization"] = "Zeph Test";
    p[x + "department"] = "";
    p[x + "email"] = "";
  }
  p["ca_common_name"] = common_name + " CA";
  p["common_name"] = common_name;
  p["desc"] = "made by a test";
  p["key_length"] = 1024;
  p["ca_key_length"] = 1024;
  return p;
}

std::string ApplianceRoot::CreateCertificate(const std::string& common_name,
                                             const Json::Value& extra) const {
  Json::Value params = CreateParams(common_name);
  if (extra.isObject()) {
    for (const std::string& key : extra.getMemberNames()) params[key] = extra[key];
  }
  CallResult r = Call("ZEPH.Core.Certificate.CRT", "create", params);
  EXPECT_TRUE(r.ok()) << r.code();
  return r.ok() ? r.data()["id"].asString() : "";
}

}  // namespace test
}  // namespace ZEPH
