#include "tools/zeph_letsencrypt/eab_account.h"

#include <httplib.h>
#include <openssl/ec.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/pem.h>
#include <sys/stat.h>

#include <memory>

#include "acme/base64url.h"
#include "module/common/ssl_ptr.h"
#include "tools/zeph_letsencrypt/files.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

constexpr int kNonceRetries = 3;
constexpr char kJose[] = "application/jose+json";

// "https://host:port/path" into its origin and its path.
bool SplitUrl(const std::string& url, std::string* origin, std::string* path) {
  if (url.compare(0, 8, "https://") != 0) return false;
  const size_t slash = url.find('/', 8);
  *origin = url.substr(0, slash);
  *path = slash == std::string::npos ? "/" : url.substr(slash);
  return origin->size() > 8;
}

// The directory name lego gives a server: its URL's host and port, ":"
// made "_".
std::string ServerDir(const std::string& directory_url) {
  std::string origin, path;
  if (!SplitUrl(directory_url, &origin, &path)) return "";
  std::string host = origin.substr(8);
  for (char& c : host) {
    if (c == ':') c = '_';
  }
  return host;
}

// A fresh P-256 key: the account key of RFC 8555's ES256.
ssl::EvpPkeyPtr NewAccountKey() {
  ssl::EvpPkeyCtxPtr ctx(EVP_PKEY_CTX_new_id(EVP_PKEY_EC, nullptr));
  EVP_PKEY* key = nullptr;
  if (!ctx || EVP_PKEY_keygen_init(ctx.get()) != 1 ||
      EVP_PKEY_CTX_set_ec_paramgen_curve_nid(ctx.get(), NID_X9_62_prime256v1) != 1 ||
      EVP_PKEY_keygen(ctx.get(), &key) != 1) {
    return nullptr;
  }
  return ssl::EvpPkeyPtr(key);
}

// The public JWK of a P-256 key (RFC 7518): {"crv", "kty", "x", "y"}.
bool Jwk(EVP_PKEY* key, Json::Value* jwk) {
  const EC_KEY* ec = EVP_PKEY_get0_EC_KEY(key);
  if (ec == nullptr) return false;
  unsigned char point[65];
  if (EC_POINT_point2oct(EC_KEY_get0_group(ec), EC_KEY_get0_public_key(ec),
                         POINT_CONVERSION_UNCOMPRESSED, point, sizeof(point),
                         nullptr) != sizeof(point)) {
    return false;
  }
  (*jwk)["crv"] = "P-256";
  (*jwk)["kty"] = "EC";
  (*jwk)["x"] = acme::Base64UrlEncode(std::string(reinterpret_cast<char*>(point + 1), 32));
  (*jwk)["y"] = acme::Base64UrlEncode(std::string(reinterpret_cast<char*>(point + 33), 32));
  return true;
}

// ES256 over `input`: the raw r and s of 32 bytes each (RFC 7518, 3.4).
bool SignEs256(EVP_PKEY* key, const std::string& input, std::string* signature) {
  ssl::EvpMdCtxPtr md(EVP_MD_CTX_new());
  size_t len = 0;
  if (!md || EVP_DigestSignInit(md.get(), nullptr, EVP_sha256(), nullptr, key) != 1 ||
      EVP_DigestSign(md.get(), nullptr, &len,
                     reinterpret_cast<const unsigned char*>(input.data()),
                     input.size()) != 1) {
    return false;
  }
  std::string der(len, '\0');
  unsigned char* out = reinterpret_cast<unsigned char*>(&der[0]);
  if (EVP_DigestSign(md.get(), out, &len,
                     reinterpret_cast<const unsigned char*>(input.data()),
                     input.size()) != 1) {
    return false;
  }
  const unsigned char* p = out;
  ssl::EcdsaSigPtr sig(d2i_ECDSA_SIG(nullptr, &p, static_cast<long>(len)));
  if (!sig) return false;
  const BIGNUM* r = nullptr;
  const BIGNUM* s = nullptr;
  ECDSA_SIG_get0(sig.get(), &r, &s);
  unsigned char raw[64];
  if (BN_bn2binpad(r, raw, 32) != 32 || BN_bn2binpad(s, raw + 32, 32) != 32) {
    return false;
  }
  *signature = std::string(reinterpret_cast<char*>(raw), sizeof(raw));
  return true;
}

std::string HmacSha256(const std::string& key, const std::string& input) {
  unsigned char mac[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  if (HMAC(EVP_sha256(), key.data(), static_cast<int>(key.size()),
           reinterpret_cast<const unsigned char*>(input.data()), input.size(),
           mac, &len) == nullptr) {
    return "";
  }
  return std::string(reinterpret_cast<char*>(mac), len);
}

// One HTTPS origin of the ACME server, trusted as lego trusts it.
class AcmeClient {
 public:
  AcmeClient(const std::string& origin, const Config& config)
      : http_(origin) {
    http_.enable_server_certificate_verification(true);
    if (!config.ca_bundle.empty()) http_.set_ca_cert_path(config.ca_bundle);
    http_.set_connection_timeout(config.timeout_s, 0);
    http_.set_read_timeout(config.timeout_s, 0);
    http_.set_write_timeout(config.timeout_s, 0);
    http_.set_default_headers({{"User-Agent", "zeph-letsencrypt"}});
  }
  httplib::Client& http() { return http_; }

 private:
  httplib::Client http_;
};

Outcome Unreachable(const std::string& url, const httplib::Result& r) {
  return Outcome::Fail(kUnreachable, "cannot reach the ACME server at " + url + ": " +
                                         httplib::to_string(r.error()));
}

// The server's refusal as the tool's error: a problem document (RFC 7807)
// of an account kind is 101, anything else 107.
Outcome Refused(const httplib::Response& res) {
  Json::Value problem;
  const bool parsed = JsonParse(res.body, problem) && problem.isObject();
  const std::string type = parsed ? problem["type"].asString() : "";
  const std::string detail = parsed ? problem["detail"].asString() : res.body.substr(0, 200);
  const std::string text = "the ACME server refused the account (" +
                           std::to_string(res.status) + " " + type + "): " + detail;
  for (const char* kind : {"externalAccountRequired", "unauthorized", "malformed",
                           "invalidContact", "unsupportedContact", "userActionRequired",
                           "accountDoesNotExist"}) {
    if (type == std::string("urn:ietf:params:acme:error:") + kind) {
      return Outcome::Fail(kAccountRefused, text);
    }
  }
  return Outcome::Fail(kAcmeFailed, text);
}

}  // namespace

std::string LegoAccountDir(const std::string& lego_dir,
                           const std::string& directory_url,
                           const std::string& email) {
  return lego_dir + "/accounts/" + ServerDir(directory_url) + "/" + email;
}

Outcome EnsureEabAccount(const Config& config, const std::string& directory_url,
                         const std::string& email, const std::string& lego_dir) {
  const std::string account_dir = LegoAccountDir(lego_dir, directory_url, email);
  struct stat st;
  if (stat((account_dir + "/account.json").c_str(), &st) == 0) return Outcome();

  std::string origin, path;
  if (!SplitUrl(directory_url, &origin, &path)) {
    return Outcome::Fail(kBadConfig, "not an https URL: " + directory_url);
  }
  AcmeClient directory_client(origin, config);
  httplib::Result dir = directory_client.http().Get(path);
  if (!dir) return Unreachable(directory_url, dir);
  Json::Value directory;
  if (dir->status != 200 || !JsonParse(dir->body, directory) || !directory.isObject() ||
      !directory["newNonce"].isString() || !directory["newAccount"].isString()) {
    return Outcome::Fail(kUnreachable, "no ACME directory at " + directory_url);
  }
  const std::string new_account = directory["newAccount"].asString();
  std::string account_origin, account_path, nonce_origin, nonce_path;
  if (!SplitUrl(new_account, &account_origin, &account_path) ||
      !SplitUrl(directory["newNonce"].asString(), &nonce_origin, &nonce_path)) {
    return Outcome::Fail(kAcmeFailed, "unusable ACME directory at " + directory_url);
  }
  AcmeClient client(account_origin, config);
  httplib::Result nonce = client.http().Head(nonce_path);
  if (!nonce) return Unreachable(directory["newNonce"].asString(), nonce);
  std::string replay = nonce->get_header_value("Replay-Nonce");

  ssl::EvpPkeyPtr key = NewAccountKey();
  Json::Value jwk(Json::objectValue);
  if (!key || !Jwk(key.get(), &jwk)) {
    ERR_clear_error();
    return Outcome::Fail(kInternal, "cannot make an account key");
  }
  // The binding: the account key signed with the CA's HMAC key (checked
  // to be base64url with the settings).
  std::string hmac_key;
  acme::Base64UrlDecode(config.eab_hmac_key, &hmac_key);
  Json::Value eab_protected(Json::objectValue);
  eab_protected["alg"] = "HS256";
  eab_protected["kid"] = config.eab_kid;
  eab_protected["url"] = new_account;
  Json::Value binding(Json::objectValue);
  binding["protected"] = acme::Base64UrlEncode(JsonCompact(eab_protected));
  binding["payload"] = acme::Base64UrlEncode(JsonCompact(jwk));
  binding["signature"] = acme::Base64UrlEncode(
      HmacSha256(hmac_key,
                 binding["protected"].asString() + "." + binding["payload"].asString()));
  Json::Value payload(Json::objectValue);
  payload["termsOfServiceAgreed"] = true;
  payload["contact"].append("mailto:" + email);
  payload["externalAccountBinding"] = binding;
  const std::string payload64 = acme::Base64UrlEncode(JsonCompact(payload));

  std::unique_ptr<httplib::Result> created;
  for (int attempt = 0; attempt < kNonceRetries; ++attempt) {
    Json::Value header(Json::objectValue);
    header["alg"] = "ES256";
    header["jwk"] = jwk;
    header["nonce"] = replay;
    header["url"] = new_account;
    Json::Value jws(Json::objectValue);
    jws["protected"] = acme::Base64UrlEncode(JsonCompact(header));
    jws["payload"] = payload64;
    std::string signature;
    if (!SignEs256(key.get(), jws["protected"].asString() + "." + payload64, &signature)) {
      ERR_clear_error();
      return Outcome::Fail(kInternal, "cannot sign the account request");
    }
    jws["signature"] = acme::Base64UrlEncode(signature);
    created.reset(new httplib::Result(
        client.http().Post(account_path, JsonCompact(jws), kJose)));
    if (!*created) return Unreachable(new_account, *created);
    // A nonce the server no longer takes is retried with the one it sent.
    if ((*created)->status == 400 &&
        (*created)->body.find("urn:ietf:params:acme:error:badNonce") != std::string::npos) {
      replay = (*created)->get_header_value("Replay-Nonce");
      continue;
    }
    break;
  }
  const httplib::Response& res = **created;
  if (res.status != 200 && res.status != 201) return Refused(res);
  Json::Value body;
  const std::string location = res.get_header_value("Location");
  if (!JsonParse(res.body, body) || !body.isObject() || location.empty() ||
      !body["status"].isString()) {
    return Outcome::Fail(kAcmeFailed, "the ACME server's account answer is not usable");
  }

  // lego's own record of an account: the e-mail and the server's
  // registration, with the key in PEM ("EC PRIVATE KEY") beside it.
  Json::Value account(Json::objectValue);
  account["email"] = email;
  account["registration"]["body"] = body;
  account["registration"]["uri"] = location;
  ssl::BioPtr mem(BIO_new(BIO_s_mem()));
  char* pem = nullptr;
  long pem_len = 0;
  if (!mem || PEM_write_bio_PrivateKey_traditional(mem.get(), key.get(), nullptr,
                                                   nullptr, 0, nullptr, nullptr) != 1 ||
      (pem_len = BIO_get_mem_data(mem.get(), &pem)) <= 0) {
    ERR_clear_error();
    return Outcome::Fail(kInternal, "cannot write the account key");
  }
  const std::string keys = account_dir + "/keys";
  if (!MakeDir(lego_dir + "/accounts", 0700) ||
      !MakeDir(lego_dir + "/accounts/" + ServerDir(directory_url), 0700) ||
      !MakeDir(account_dir, 0700) || !MakeDir(keys, 0700) ||
      !WriteWhole(keys + "/" + email + ".key",
                  std::string(pem, static_cast<size_t>(pem_len)), 0600) ||
      !WriteWhole(account_dir + "/account.json", account.toStyledString(), 0600)) {
    return Outcome::Fail(kWriteFailed, "cannot store the account in " + account_dir);
  }
  return Outcome();
}

}  // namespace letsencrypt
}  // namespace ZEPH
