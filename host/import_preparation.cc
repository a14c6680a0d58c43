#include "host/import_preparation.h"

#include <fcntl.h>
#include <limits.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <algorithm>
#include <map>

#include "host/upload_contents.h"
#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace {

constexpr int kCertUnreadable = 5510;
constexpr int kKeyUnreadable = 5511;
constexpr int kInterUnreadable = 5512;
constexpr int kKeyMismatch = 5514;
constexpr int kNoChain = 5517;
constexpr int kDsaKey = 5518;

// What a file is for, and how a sentence names it.
enum class Role { kCertificate, kKey, kIntermediate, kPkcs12 };

const char* FileName(Role role) {
  switch (role) {
    case Role::kCertificate: return "the certificate file";
    case Role::kKey: return "the key file";
    case Role::kIntermediate: return "the intermediate certificate file";
    case Role::kPkcs12: return "the PKCS#12 file";
  }
  return "the file";
}

// One named upload, read.
struct Input {
  bool given = false;
  UploadContents contents;
};

// Why a file does not hold what its role needs.
UploadNote Unusable(const UploadContents& c, Role role) {
  using Lock = UploadContents::Lock;
  const bool wants_key = role == Role::kKey;
  const std::string file = FileName(role);
  if (c.format == UploadContents::Format::kEmpty) {
    return {"empty_file", file + " is empty"};
  }
  if (c.lock == Lock::kNeedsPassphrase) {
    return c.format == UploadContents::Format::kPkcs12
               ? UploadNote{"passphrase_required", "this PKCS#12 file needs a passphrase"}
               : UploadNote{"key_encrypted", "the key is encrypted: give its passphrase"};
  }
  if (c.lock == Lock::kWrongPassphrase) {
    return {"passphrase_wrong", c.format == UploadContents::Format::kPkcs12
                                    ? "the passphrase does not open this PKCS#12 file"
                                    : "the passphrase does not open the key"};
  }
  if (c.format == UploadContents::Format::kPkcs12) {
    return {"unreadable", file + " is a PKCS#12 file that cannot be read"};
  }
  if (c.requests > 0) {
    return {"request", wants_key ? "this is a certificate signing request, not a private key"
                                 : "this is a certificate signing request, not a certificate"};
  }
  if (wants_key && !c.certs.empty()) {
    return {"certificate_not_key", "this is a certificate, not a private key"};
  }
  if (!wants_key && (!c.keys.empty() || c.lock != Lock::kNone)) {
    return {"key_not_certificate", "this is a private key, not a certificate"};
  }
  return {"unknown_format",
          wants_key ? file + " holds no private key in a form that is understood "
                             "(PEM, DER or PKCS#12)"
                    : file + " holds no certificate in a form that is understood "
                             "(PEM, DER, PKCS#7 or PKCS#12)"};
}

PreparedImport Refuse(int code, UploadNote note) {
  PreparedImport r;
  r.refused = true;
  r.code = code;
  r.refusal = std::move(note);
  return r;
}

std::string CommonName(X509* cert) {
  char text[256] = "";
  if (X509_NAME_get_text_by_NID(X509_get_subject_name(cert), NID_commonName, text,
                                sizeof(text)) <= 0) {
    return "(no common name)";
  }
  return text;
}

std::string Der(X509* cert) {
  unsigned char* der = nullptr;
  const int n = i2d_X509(cert, &der);
  ssl::OpensslBytes owner(der);
  return n > 0 ? std::string(reinterpret_cast<char*>(der), static_cast<size_t>(n)) : "";
}

bool SelfSigned(X509* cert) {
  return X509_NAME_cmp(X509_get_subject_name(cert), X509_get_issuer_name(cert)) == 0 &&
         X509_verify(cert, X509_get0_pubkey(cert)) == 1;
}

// Whether `issuer` issued and signed `cert`.
bool Issued(X509* issuer, X509* cert) {
  return X509_check_issued(issuer, cert) == X509_V_OK &&
         X509_verify(cert, X509_get0_pubkey(issuer)) == 1;
}

std::string TimeText(const ASN1_TIME* t) {
  ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  char* data = nullptr;
  if (!bio || ASN1_TIME_print(bio.get(), t) != 1) return "";
  const long n = BIO_get_mem_data(bio.get(), &data);
  return std::string(data, static_cast<size_t>(n));
}

// The DNS names of the certificate, or its common name when it has none.
std::vector<std::string> Names(X509* cert) {
  std::vector<std::string> names;
  ssl::GeneralNamesPtr sans(static_cast<GENERAL_NAMES*>(
      X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr)));
  for (int i = 0; sans && i < sk_GENERAL_NAME_num(sans.get()); ++i) {
    const GENERAL_NAME* n = sk_GENERAL_NAME_value(sans.get(), i);
    if (n->type != GEN_DNS) continue;
    const ASN1_STRING* s = n->d.dNSName;
    names.emplace_back(reinterpret_cast<const char*>(ASN1_STRING_get0_data(s)),
                       static_cast<size_t>(ASN1_STRING_length(s)));
  }
  if (names.empty()) names.push_back(CommonName(cert));
  return names;
}

// Whether certificate name `name` (perhaps "*.example.org") covers `host`.
// A host name without dots (the appliance's short name) is compared with
// the first label of each name.
bool Covers(const std::string& name, const std::string& host) {
  if (strcasecmp(name.c_str(), host.c_str()) == 0) return true;
  if (host.find('.') == std::string::npos) {
    const std::string label = name.substr(0, name.find('.'));
    return strcasecmp(label.c_str(), host.c_str()) == 0;
  }
  if (name.compare(0, 2, "*.") == 0) {
    const size_t dot = host.find('.');
    return strcasecmp(name.c_str() + 1, host.c_str() + dot) == 0;
  }
  return false;
}

std::vector<UploadNote> Warnings(X509* leaf, const std::string& host) {
  std::vector<UploadNote> notes;
  if (X509_cmp_current_time(X509_get0_notAfter(leaf)) < 0) {
    notes.push_back({"expired", "the certificate expired on " +
                                    TimeText(X509_get0_notAfter(leaf))});
  } else if (X509_cmp_current_time(X509_get0_notBefore(leaf)) > 0) {
    notes.push_back({"not_yet_valid", "the certificate is valid only from " +
                                          TimeText(X509_get0_notBefore(leaf))});
  }
  const std::vector<std::string> names = Names(leaf);
  bool covered = host.empty();
  std::string listed;
  for (const std::string& n : names) {
    covered = covered || Covers(n, host);
    listed += (listed.empty() ? "" : ", ") + n;
  }
  if (!covered) {
    notes.push_back({"host_name_not_covered",
                     "the certificate's names (" + listed +
                         ") do not include this appliance's host name " + host});
  }
  return notes;
}

bool ReadWhole(const std::string& path, std::string& out) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  struct stat st;
  return fd && fstat(fd.get(), &st) == 0 && S_ISREG(st.st_mode) &&
         ReadAll(fd.get(), out);
}

// Writes `pem` into `dir` as `name`; its path, or "" (with `error` set).
std::string WriteOut(UploadDir& dir, const std::string& name, const std::string& pem,
                     std::string* error) {
  std::string path;
  UniqueFd fd = dir.Create(name, &path, error);
  if (!fd || !WriteAll(fd.get(), pem) || close(fd.release()) != 0) return "";
  return path;
}

template <typename Write>
std::string Pem(Write write) {
  ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  char* data = nullptr;
  if (!bio || !write(bio.get())) return "";
  const long n = BIO_get_mem_data(bio.get(), &data);
  return std::string(data, static_cast<size_t>(n));
}

// The parameters' upload files, read; false when one of them is for the
// module to judge (not a string, empty, unreadable).
bool ReadInputs(const Json::Value& params, const std::string& passphrase,
                bool has_passphrase, const std::string& scratch,
                std::map<std::string, Input>& inputs) {
  for (const char* name : {"pkcs12_tmp", "cert_tmp", "key_tmp", "inter_cert_tmp"}) {
    if (!params.isMember(name)) continue;
    const Json::Value& v = params[name];
    std::string bytes;
    if (!v.isString() || v.asString().empty() || !ReadWhole(v.asString(), bytes)) {
      return false;
    }
    Input& in = inputs[name];
    in.given = true;
    in.contents = ReadUpload(bytes, passphrase, has_passphrase, scratch);
  }
  return true;
}

}  // namespace

bool IsImportCall(const std::string& api, const std::string& method) {
  return api == "ZEPH.Core.Certificate" && method == "import";
}

std::string ApplianceHostName() {
  char name[HOST_NAME_MAX + 1] = "";
  if (gethostname(name, sizeof(name)) != 0) return "";
  name[HOST_NAME_MAX] = '\0';
  return name;
}

Json::Value NoteJson(const UploadNote& note) {
  Json::Value v(Json::objectValue);
  v["reason"] = note.reason;
  v["message"] = note.message;
  return v;
}

void AddWarnings(const std::vector<UploadNote>& warnings, Json::Value& data) {
  if (warnings.empty()) return;
  if (!data.isObject()) data = Json::Value(Json::objectValue);
  Json::Value& list = data["warnings"] = Json::Value(Json::arrayValue);
  for (const UploadNote& w : warnings) list.append(NoteJson(w));
}

PreparedImport PrepareImport(Json::Value& params, UploadDir& dir,
                             const std::string& host_name) {
  const Json::Value pass_value = params.get("passphrase", Json::Value());
  params.removeMember("passphrase");
  const bool has_passphrase = pass_value.isString() && !pass_value.asString().empty();
  const std::string passphrase = has_passphrase ? pass_value.asString() : "";

  // The PKCS#12 reader needs a private place: the call's own directory.
  std::string error;
  if (!dir.Make(&error)) return Refuse(kCertUnreadable, {"internal", error});
  const std::string scratch = dir.path();

  std::map<std::string, Input> in;
  const bool usable = ReadInputs(params, passphrase, has_passphrase, scratch, in);
  const bool had_pkcs12 = params.isMember("pkcs12_tmp");
  params.removeMember("pkcs12_tmp");
  if (!usable) {
    if (had_pkcs12 && !in["pkcs12_tmp"].given) {
      return Refuse(kCertUnreadable, {"unreadable", "the PKCS#12 file cannot be read"});
    }
    return PreparedImport();  // the module answers for itself
  }
  if (in.empty()) return PreparedImport();

  Input& p12 = in["pkcs12_tmp"];
  Input& cert = in["cert_tmp"];
  Input& key = in["key_tmp"];
  Input& inter = in["inter_cert_tmp"];
  if (p12.given && p12.contents.certs.empty()) {
    return Refuse(kCertUnreadable, Unusable(p12.contents, Role::kPkcs12));
  }
  if (cert.given && cert.contents.certs.empty()) {
    return Refuse(kCertUnreadable, Unusable(cert.contents, Role::kCertificate));
  }
  if (key.given && key.contents.keys.empty()) {
    return Refuse(kKeyUnreadable, Unusable(key.contents, Role::kKey));
  }
  if (inter.given && inter.contents.certs.empty() &&
      inter.contents.format != UploadContents::Format::kEmpty) {
    return Refuse(kInterUnreadable, Unusable(inter.contents, Role::kIntermediate));
  }

  // The key: the key file's, else one found beside the certificates.
  EVP_PKEY* the_key = nullptr;
  for (Input* from : {&key, &cert, &p12, &inter}) {
    if (the_key == nullptr && !from->contents.keys.empty()) {
      the_key = from->contents.keys.front().get();
    }
  }
  if (the_key == nullptr) {
    return Refuse(kKeyUnreadable, {"no_key", "no private key was given"});
  }
  if (EVP_PKEY_base_id(the_key) == EVP_PKEY_DSA) {
    return Refuse(kDsaKey, {"dsa_key", "DSA keys are not supported"});
  }

  // Every certificate given, in the order of the files. The certificate is
  // the one of the certificate file (else of the PKCS#12 bundle, else any)
  // that belongs to the key.
  std::vector<X509*> pool;
  for (Input* from : {&cert, &p12, &key, &inter}) {
    for (const ssl::X509Ptr& c : from->contents.certs) pool.push_back(c.get());
  }
  if (pool.empty()) {
    return Refuse(kCertUnreadable, {"no_certificate", "no certificate was given"});
  }
  const Input& leaf_file = cert.given ? cert : p12.given ? p12 : key;
  X509* leaf = nullptr;
  for (X509* c : pool) {
    const bool candidate =
        leaf_file.contents.certs.empty() ||
        std::any_of(leaf_file.contents.certs.begin(), leaf_file.contents.certs.end(),
                    [c](const ssl::X509Ptr& own) { return own.get() == c; });
    if (leaf == nullptr && candidate && X509_check_private_key(c, the_key) == 1) {
      leaf = c;
    }
  }
  ERR_clear_error();
  if (leaf == nullptr) {
    return Refuse(kKeyMismatch, {"key_mismatch", "the private key does not belong to the "
                                                 "certificate " + CommonName(pool.front())});
  }

  // The intermediates: once each, without the certificate and roots,
  // ordered from the certificate's issuer upward.
  std::vector<X509*> rest;
  std::vector<std::string> seen = {Der(leaf)};
  for (X509* c : pool) {
    const std::string der = Der(c);
    if (std::find(seen.begin(), seen.end(), der) != seen.end()) continue;
    seen.push_back(der);
    if (!SelfSigned(c)) rest.push_back(c);
  }
  std::vector<X509*> chain;
  for (X509* current = leaf;;) {
    auto next = std::find_if(rest.begin(), rest.end(),
                             [current](X509* c) { return Issued(c, current); });
    if (next == rest.end()) break;
    current = *next;
    chain.push_back(current);
    rest.erase(next);
  }
  ERR_clear_error();
  if (!rest.empty()) {
    return Refuse(kNoChain, {"chain_broken", "the intermediate certificate " +
                                                 CommonName(rest.front()) +
                                                 " does not belong to the chain of " +
                                                 CommonName(leaf)});
  }

  // The plain files for the module.
  const std::string key_path = WriteOut(dir, "key.pem", Pem([the_key](BIO* b) {
    return PEM_write_bio_PrivateKey(b, the_key, nullptr, nullptr, 0, nullptr, nullptr) == 1;
  }), &error);
  const std::string cert_path = WriteOut(dir, "cert.pem", Pem([leaf](BIO* b) {
    return PEM_write_bio_X509(b, leaf) == 1;
  }), &error);
  std::string inter_path;
  if (!chain.empty()) {
    inter_path = WriteOut(dir, "inter_cert.pem", Pem([&chain](BIO* b) {
      for (X509* c : chain) {
        if (PEM_write_bio_X509(b, c) != 1) return false;
      }
      return true;
    }), &error);
  }
  if (key_path.empty() || cert_path.empty() || (!chain.empty() && inter_path.empty())) {
    return Refuse(kCertUnreadable, {"internal", error});
  }
  params["key_tmp"] = key_path;
  params["cert_tmp"] = cert_path;
  if (chain.empty()) {
    params.removeMember("inter_cert_tmp");
  } else {
    params["inter_cert_tmp"] = inter_path;
  }
  PreparedImport r;
  r.warnings = Warnings(leaf, host_name);
  return r;
}

}  // namespace ZEPH
