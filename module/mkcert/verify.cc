#include "module/mkcert/verify.h"

#include <openssl/err.h>
#include <openssl/pem.h>

#include <vector>

#include "module/common/log.h"
#include "module/common/ssl_ptr.h"
#include "zeph/qlibc_file.h"

namespace {

// Never asks for a pass phrase: an encrypted key simply cannot be read
// (OpenSSL's default would prompt on the terminal).
int NoPassphrase(char* /*buf*/, int /*size*/, int /*rwflag*/, void* /*u*/) {
  return 0;
}

// Appends every PEM certificate of `path` to `certs`, in file order. False
// when the file cannot be opened.
bool ReadAllCerts(const char* path, std::vector<ZEPH::ssl::X509Ptr>& certs) {
  ZEPH::ssl::BioPtr bio(BIO_new_file(path, "r"));
  if (!bio) {
    MKCERT_LOG_LIBERR("Open %s failed", path);
    return false;
  }
  while (X509* cert =
             PEM_read_bio_X509(bio.get(), nullptr, NoPassphrase, nullptr)) {
    certs.emplace_back(cert);
  }
  return true;
}

// The first PEM private key of `path`; null, after a log line, when the
// file cannot be opened or holds none.
ZEPH::ssl::EvpPkeyPtr ReadPrivateKey(const std::string& path) {
  ZEPH::ssl::BioPtr bio(BIO_new_file(path.c_str(), "r"));
  if (!bio) {
    MKCERT_LOG("Failed to BIO_new_file. [%s]", path.c_str());
    return nullptr;
  }
  ZEPH::ssl::EvpPkeyPtr key(
      PEM_read_bio_PrivateKey(bio.get(), nullptr, NoPassphrase, nullptr));
  if (!key) MKCERT_LOG("Failed to read private key from %s", path.c_str());
  return key;
}

// The body of verifyCrtAndKey after the byte-order marks are gone.
int MatchCertAndKey(const std::string& crtPath, const std::string& keyPath) {
  ZEPH::ssl::BioPtr crtBio(BIO_new_file(crtPath.c_str(), "r"));
  if (!crtBio) {
    MKCERT_LOG("Failed to BIO_new_file. [%s]", crtPath.c_str());
    return -1;
  }
  ZEPH::ssl::X509Ptr cert(
      PEM_read_bio_X509(crtBio.get(), nullptr, NoPassphrase, nullptr));
  if (!cert) {
    MKCERT_LOG("Failed to read cert from %s", crtPath.c_str());
    return -1;
  }
  ZEPH::ssl::EvpPkeyPtr key = ReadPrivateKey(keyPath);
  if (!key) return -1;
  return X509_check_private_key(cert.get(), key.get()) == 1 ? 0 : 1;
}

}  // namespace

int verifyCrtAndKey(const std::string& crtPath, const std::string& keyPath) {
  if (QLIBCFileUTF8BomStrip(crtPath.c_str()) != 0 ||
      QLIBCFileUTF8BomStrip(keyPath.c_str()) != 0) {
    MKCERT_LOG("Failed to strip utf8 BOM");
    return -1;
  }
  const int result = MatchCertAndKey(crtPath, keyPath);
  // The library's error queue is per thread; leave nothing in it for the
  // next caller on this thread to trip over.
  ERR_clear_error();
  return result;
}

int verifyCsrAndKey(const std::string& csrPath, const std::string& keyPath) {
  ZEPH::ssl::BioPtr bio(BIO_new_file(csrPath.c_str(), "r"));
  ZEPH::ssl::X509ReqPtr csr(
      bio ? PEM_read_bio_X509_REQ(bio.get(), nullptr, NoPassphrase, nullptr)
          : nullptr);
  int result = -1;
  if (!csr) {
    MKCERT_LOG("Failed to read csr from %s", csrPath.c_str());
  } else if (ZEPH::ssl::EvpPkeyPtr key = ReadPrivateKey(keyPath)) {
    result = X509_REQ_check_private_key(csr.get(), key.get()) == 1 ? 0 : 1;
  }
  ERR_clear_error();
  return result;
}

int verifyCrtChain(const char* crtPath, const char* upperPath) {
  if (crtPath == nullptr || *crtPath == '\0' || !QLIBCFileExist(crtPath) ||
      upperPath == nullptr || *upperPath == '\0' ||
      !QLIBCFileExist(upperPath)) {
    MKCERT_LOG("sanity check failed");
    return -1;
  }
  if (!QLIBCFileExist(upperPath)) {
    MKCERT_LOG("Upper Certificate is not existed");
    return -1;
  }
  if (!QLIBCFileExist(crtPath)) {
    MKCERT_LOG("Certificate is not existed");
    return -1;
  }

  std::vector<ZEPH::ssl::X509Ptr> certs;
  if (!ReadAllCerts(crtPath, certs) || !ReadAllCerts(upperPath, certs)) {
    MKCERT_LOG_LIBERR("Get X509 certificate failed.");
    ERR_clear_error();
    return -1;
  }
  ERR_clear_error();  // the end of each file leaves a "no start line" error
  if (certs.empty()) return 1;

  size_t issuers = 0;
  for (const auto& a : certs) {
    for (const auto& b : certs) {
      if (&a != &b && X509_NAME_cmp(X509_get_issuer_name(b.get()),
                                    X509_get_subject_name(a.get())) == 0) {
        ++issuers;
        break;
      }
    }
  }
  return issuers < certs.size() - 1 ? 1 : 0;
}
