#include "tools/zeph_letsencrypt/issued_set.h"

#include <dirent.h>
#include <errno.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <vector>

#include "module/common/ssl_ptr.h"
#include "tools/zeph_letsencrypt/files.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

bool EndsWith(const std::string& s, const std::string& suffix) {
  return s.size() > suffix.size() &&
         s.compare(s.size() - suffix.size(), suffix.size(), suffix) == 0;
}

// The one "<name>.key" of the directory, as "<name>"; empty when there is
// none or more than one.
std::string KeyBase(const std::string& dir) {
  std::vector<std::string> bases;
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* e = readdir(d)) {
      const std::string n = e->d_name;
      if (EndsWith(n, ".key")) bases.push_back(n.substr(0, n.size() - 4));
    }
    closedir(d);
  }
  return bases.size() == 1 ? bases[0] : "";
}

std::string BioText(BIO* bio) {
  char* data = nullptr;
  const long n = BIO_get_mem_data(bio, &data);
  return n > 0 ? std::string(data, static_cast<size_t>(n)) : "";
}

// Every certificate of the PEM text, in order.
std::vector<ssl::X509Ptr> Certificates(const std::string& pem) {
  std::vector<ssl::X509Ptr> certs;
  ssl::BioPtr bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  while (bio) {
    ssl::X509Ptr cert(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
    if (!cert) break;
    certs.push_back(std::move(cert));
  }
  ERR_clear_error();  // the end of the text reads as an error
  return certs;
}

std::string Pem(X509* cert) {
  ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || PEM_write_bio_X509(bio.get(), cert) != 1) return "";
  return BioText(bio.get());
}

std::string SerialHex(X509* cert) {
  ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || i2a_ASN1_INTEGER(bio.get(), X509_get0_serialNumber(cert)) <= 0) {
    return "";
  }
  return BioText(bio.get());
}

std::string NotAfter(X509* cert) {
  struct tm when = {};
  if (ASN1_TIME_to_tm(X509_get0_notAfter(cert), &when) != 1) return "";
  char text[32];
  strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%SZ", &when);
  return text;
}

Outcome Unusable(const std::string& why) {
  return Outcome::Fail(kInternal, "lego's certificate output is unusable: " + why);
}

}  // namespace

Outcome ReadLegoCertificate(const std::string& certificates_dir, IssuedSet* set) {
  const std::string base = KeyBase(certificates_dir);
  if (base.empty()) return Unusable("no single key in " + certificates_dir);
  const std::string prefix = certificates_dir + "/" + base;
  std::string crt, issuer;
  if (!ReadWhole(prefix + ".key", &set->key) || !ReadWhole(prefix + ".crt", &crt)) {
    return Unusable(prefix + ".crt: " + strerror(errno));
  }
  ReadWhole(prefix + ".issuer.crt", &issuer);  // absent: the chain is in .crt

  std::vector<ssl::X509Ptr> leaf_and_more = Certificates(crt);
  if (leaf_and_more.empty()) return Unusable("no certificate in " + prefix + ".crt");
  std::vector<ssl::X509Ptr> chain = Certificates(issuer);
  if (chain.empty()) {
    for (size_t i = 1; i < leaf_and_more.size(); ++i) {
      chain.push_back(std::move(leaf_and_more[i]));
    }
  }
  if (chain.empty()) return Unusable("no intermediate certificate");
  X509* leaf = leaf_and_more[0].get();

  ssl::BioPtr key_bio(
      BIO_new_mem_buf(set->key.data(), static_cast<int>(set->key.size())));
  ssl::EvpPkeyPtr key(
      key_bio ? PEM_read_bio_PrivateKey(key_bio.get(), nullptr, nullptr, nullptr)
              : nullptr);
  if (!key) return Unusable("the key does not parse");
  if (X509_check_private_key(leaf, key.get()) != 1) {
    ERR_clear_error();
    return Unusable("the key does not belong to the certificate");
  }
  set->cert = Pem(leaf);
  set->chain.clear();
  for (const ssl::X509Ptr& c : chain) set->chain += Pem(c.get());
  set->serial = SerialHex(leaf);
  set->not_after = NotAfter(leaf);
  if (set->cert.empty() || set->chain.empty()) return Unusable("cannot encode");
  return Outcome();
}

Outcome WriteSet(const std::string& dir, const IssuedSet& set,
                 const Json::Value& renew) {
  const struct {
    const char* name;
    std::string content;
    mode_t mode;
  } files[] = {
      {"privkey.pem", set.key, 0400},
      {"cert.pem", set.cert, 0400},
      {"chain.pem", set.chain, 0400},
      {"fullchain.pem", set.cert + set.chain, 0400},
      {kRenewFile, JsonCompact(renew) + "\n", 0600},
  };
  for (size_t i = 0; i < sizeof(files) / sizeof(files[0]); ++i) {
    const std::string path = dir + "/" + files[i].name;
    if (!WriteWhole(path, files[i].content, files[i].mode)) {
      const std::string why = path + ": " + strerror(errno);
      for (size_t j = 0; j < i; ++j) unlink((dir + "/" + files[j].name).c_str());
      return Outcome::Fail(kWriteFailed, "cannot write the certificate: " + why);
    }
  }
  return Outcome();
}

}  // namespace letsencrypt
}  // namespace ZEPH
