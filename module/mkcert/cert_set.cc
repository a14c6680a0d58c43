#include "module/mkcert/cert_set.h"

#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/mkcert/generate.h"
#include "module/mkcert/verify.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_file.h"
#include "zeph/root.h"

namespace {

// The server certificate of a set is valid for this long, whatever the
// caller of the set wants; the authority's always is (genCACrt).
constexpr int kSetDays = 366;
constexpr int kDefaultBits = 2048;
constexpr char kDefaultAlias[] = "arvelon";

std::string Join(const std::string& dir, const char* name) {
  return dir + "/" + name;
}

// genKey takes an unsigned length; a negative one would wrap around to an
// absurd size, so it is passed as 0, which genKey refuses.
unsigned int KeyBits(int bits) {
  return bits > 0 ? static_cast<unsigned int>(bits) : 0;
}

}  // namespace

int genCASet(_tag_CSR_ARGUMENT* subject, int bits, const std::string& dir) {
  return genCASetOfType(subject, ZEPH::cert::KeyType::kRsa, bits, dir);
}

int genCASetOfType(_tag_CSR_ARGUMENT* subject, ZEPH::cert::KeyType type,
                   int bits, const std::string& dir) {
  if (dir.empty() || !QLIBCFileCheckDir(dir.c_str())) {
    MKCERT_LOG("Invalid paramter [%s]", dir.c_str());
    return -1;
  }
  // Invalid input, as opposed to a failure: the caller answers differently.
  if (subject == nullptr || SubjectIsInvalid(*subject)) {
    MKCERT_LOG("Invalid paramter [%s]", dir.c_str());
    return -2;
  }
  const std::string caCert = Join(dir, ZEPH::cert::kSetCaCert);
  const std::string caKey = Join(dir, ZEPH::cert::kSetCaKey);
  if (genKeyOfType(caKey, type, KeyBits(bits)) != 0) {
    MKCERT_LOG("genCAKey() failed");
    return -1;
  }
  if (genCsr(ZEPH::RootPath(ZEPH::cert::kCaCfg), caKey,
             ZEPH::RootPath(ZEPH::cert::kCaCsr), subject) != 0) {
    MKCERT_LOG("genCACsr() failed");
    return -1;
  }
  if (genCACrt(caCert, caKey) != 0) {
    MKCERT_LOG("genCACrt() failed");
    return -1;
  }
  if (verifyCrtAndKey(caCert, caKey) != 0) {
    MKCERT_LOG("Root certificate and key is not matching");
    return -1;
  }
  return 0;
}

int genCertSet(_tag_CSR_ARGUMENT* subject, int bits, const std::string& aliases,
               const std::string& dir) {
  return genCertSetOfType(subject, ZEPH::cert::KeyType::kRsa, bits, aliases,
                          dir);
}

int genCertSetOfType(_tag_CSR_ARGUMENT* subject, ZEPH::cert::KeyType type,
                     int bits, const std::string& aliases,
                     const std::string& dir) {
  const std::string key = Join(dir, ZEPH::cert::kSetKey);
  const std::string cert = Join(dir, ZEPH::cert::kSetCert);
  const std::string fullchain = Join(dir, ZEPH::cert::kSetFullchain);
  const std::string caCert = Join(dir, ZEPH::cert::kSetCaCert);
  const std::string caKey = Join(dir, ZEPH::cert::kSetCaKey);
  const std::string csr = ZEPH::RootPath(ZEPH::cert::kServerCsr);

  if (genKeyOfType(key, type, KeyBits(bits)) != 0) {
    MKCERT_LOG("Failed to generate key");
    return -1;
  }
  if (genCsr(ZEPH::RootPath(ZEPH::cert::kServerCfg), key, csr, subject) == -1) {
    MKCERT_LOG("Failed to generate csr");
    return -1;
  }
  const ZEPH::cert::ServerKeyUsage usage =
      type == ZEPH::cert::KeyType::kRsa
          ? ZEPH::cert::ServerKeyUsage::kSignatureAndEncipherment
          : ZEPH::cert::ServerKeyUsage::kSignatureOnly;
  if (genServerCrt(csr, caCert, cert, caKey, kSetDays, aliases, usage) == -1) {
    MKCERT_LOG("Failed to generate cert");
    return -1;
  }
  if (verifyCrtAndKey(cert, key) != 0) {
    MKCERT_LOG("cert and key is not matching.");
    return -1;
  }
  // The full-chain file deliberately holds the server certificate alone,
  // without the authority's certificate after it.
  if (QLIBCExec(ZEPH::cert::kCp, "-f", cert.c_str(), fullchain.c_str(),
                nullptr) != 0) {
    MKCERT_LOG("Failed to copy crt to chain crt.");
    return -1;
  }
  return 0;
}

int genDefaultCrt(std::string dir) {
  _tag_CSR_ARGUMENT authority;
  authority.country = "TW";
  authority.city = "Taipel";  // kept letter for letter, as deployed
  authority.organization = "Arvelon Inc.";
  authority.common_name = "Arvelon Inc. CA";

  _tag_CSR_ARGUMENT server = authority;
  server.common_name = kDefaultAlias;

  if (genCASet(&authority, kDefaultBits, dir) != 0) {
    MKCERT_LOG("Generate CA key & crt failed");
    return -1;
  }
  if (genCertSet(&server, kDefaultBits, kDefaultAlias, dir) != 0) {
    MKCERT_LOG("Failed to generate cert set");
    return -1;
  }
  return 0;
}
