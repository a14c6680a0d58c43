#include "server/served_certificate.h"

#include <errno.h>
#include <fcntl.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>
#include <utility>

#include "module/common/ssl_ptr.h"
#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {
namespace {

// Far beyond any certificate chain; a larger file is not one.
constexpr size_t kMaxPemBytes = 1 << 20;

using SslCtxPtr = std::unique_ptr<SSL_CTX, ssl::Deleter<SSL_CTX, SSL_CTX_free>>;

// Never ask a terminal for a pass phrase: an encrypted key is unusable here.
int NoPassword(char* /*buf*/, int /*size*/, int /*rwflag*/, void* /*u*/) {
  return -1;
}

std::string OpensslReason() {
  unsigned long e = ERR_peek_last_error();
  char text[256];
  ERR_error_string_n(e, text, sizeof(text));
  ERR_clear_error();
  return e != 0 ? text : "unknown error";
}

bool ReadSmallFile(const std::string& path, std::string* out,
                   std::string* error) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  struct stat st;
  if (!fd || fstat(fd.get(), &st) != 0) {
    *error = "cannot open " + path + ": " + strerror(errno);
    return false;
  }
  if (!S_ISREG(st.st_mode) || st.st_size > static_cast<off_t>(kMaxPemBytes)) {
    *error = path + " is not a PEM file";
    return false;
  }
  if (!ReadAll(fd.get(), *out)) {
    *error = "cannot read " + path + ": " + strerror(errno);
    return false;
  }
  return true;
}

ssl::BioPtr MemoryBio(const std::string& bytes) {
  return ssl::BioPtr(BIO_new_mem_buf(bytes.data(), static_cast<int>(bytes.size())));
}

std::string PrintTime(const ASN1_TIME* t) {
  ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || ASN1_TIME_print(bio.get(), t) != 1) return "";
  char* data = nullptr;
  long n = BIO_get_mem_data(bio.get(), &data);
  return n > 0 ? std::string(data, static_cast<size_t>(n)) : "";
}

// Writes `bytes` to `path` whole (mode 0600) by way of a file beside it.
bool ReplaceFile(const std::string& path, const std::string& bytes,
                 std::string* error) {
  const std::string temp = path + ".new";
  unlink(temp.c_str());
  UniqueFd fd(open(temp.c_str(),
                   O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!fd || !WriteAll(fd.get(), bytes) || fsync(fd.get()) != 0 ||
      close(fd.release()) != 0 || rename(temp.c_str(), path.c_str()) != 0) {
    *error = "cannot write " + path + ": " + strerror(errno);
    unlink(temp.c_str());
    return false;
  }
  return true;
}

}  // namespace

std::string CertificateFingerprint(X509* cert) {
  unsigned char md[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  if (cert == nullptr || X509_digest(cert, EVP_sha256(), md, &len) != 1) {
    return "";
  }
  std::string out;
  char pair[4];
  for (unsigned int i = 0; i < len; ++i) {
    snprintf(pair, sizeof(pair), i + 1 < len ? "%02X:" : "%02X", md[i]);
    out += pair;
  }
  return out;
}

bool ServedCertificate::FileStamp::operator==(const FileStamp& o) const {
  return dev == o.dev && ino == o.ino && size == o.size &&
         mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec;
}

ServedCertificate::ServedCertificate(
    std::string source_dir, std::string copy_dir,
    std::function<void(const std::string&)> log)
    : source_dir_(std::move(source_dir)),
      copy_dir_(std::move(copy_dir)),
      log_(std::move(log)) {}

bool ServedCertificate::ReadStamp(Stamp* stamp) const {
  struct stat chain, key;
  if (stat((source_dir_ + "/fullchain.pem").c_str(), &chain) != 0 ||
      stat((source_dir_ + "/privkey.pem").c_str(), &key) != 0) {
    return false;
  }
  auto fill = [](const struct stat& st, FileStamp* f) {
    f->dev = st.st_dev;
    f->ino = st.st_ino;
    f->size = st.st_size;
    f->mtime = st.st_mtim;
  };
  fill(chain, &stamp->chain);
  fill(key, &stamp->key);
  return true;
}

bool ServedCertificate::ReadPair(Pair* pair, std::string* error) const {
  const std::string chain_path = source_dir_ + "/fullchain.pem";
  const std::string key_path = source_dir_ + "/privkey.pem";
  if (!ReadSmallFile(chain_path, &pair->chain_pem, error) ||
      !ReadSmallFile(key_path, &pair->key_pem, error)) {
    return false;
  }
  ssl::BioPtr chain_bio = MemoryBio(pair->chain_pem);
  ssl::BioPtr key_bio = MemoryBio(pair->key_pem);
  if (!chain_bio || !key_bio) {
    *error = "out of memory";
    return false;
  }
  ssl::X509Ptr leaf(
      PEM_read_bio_X509(chain_bio.get(), nullptr, NoPassword, nullptr));
  if (!leaf) {
    *error = "no certificate in " + chain_path + ": " + OpensslReason();
    return false;
  }
  SslCtxPtr probe(SSL_CTX_new(TLS_server_method()));
  if (!probe) {
    *error = "out of memory";
    return false;
  }
  // Every further certificate must parse too: nginx loads them all.
  while (ssl::X509Ptr more{
      PEM_read_bio_X509(chain_bio.get(), nullptr, NoPassword, nullptr)}) {
    if (SSL_CTX_add1_chain_cert(probe.get(), more.get()) != 1) {
      *error = "an intermediate in " + chain_path + " is refused by TLS (" +
               OpensslReason() + ")";
      return false;
    }
  }
  const unsigned long last = ERR_peek_last_error();
  if (ERR_GET_REASON(last) != PEM_R_NO_START_LINE) {
    *error = "a damaged certificate in " + chain_path + ": " + OpensslReason();
    return false;
  }
  ERR_clear_error();  // the end of the file ends the loop with an error

  ssl::EvpPkeyPtr key(
      PEM_read_bio_PrivateKey(key_bio.get(), nullptr, NoPassword, nullptr));
  if (!key) {
    *error = "no private key in " + key_path + ": " + OpensslReason();
    return false;
  }
  if (X509_check_private_key(leaf.get(), key.get()) != 1) {
    ERR_clear_error();
    *error = key_path + " does not belong to the certificate in " + chain_path;
    return false;
  }
  // OpenSSL checks the key against the security level as nginx loads it.
  if (SSL_CTX_use_certificate(probe.get(), leaf.get()) != 1 ||
      SSL_CTX_use_PrivateKey(probe.get(), key.get()) != 1) {
    *error = "the certificate in " + chain_path + " is refused by TLS (" +
             OpensslReason() + ")";
    return false;
  }
  pair->fingerprint = CertificateFingerprint(leaf.get());
  pair->not_after = PrintTime(X509_get0_notAfter(leaf.get()));
  return true;
}

bool ServedCertificate::WriteCopy(const Pair& pair, std::string* error) const {
  if (mkdir(copy_dir_.c_str(), 0700) != 0 && errno != EEXIST) {
    *error = "cannot make " + copy_dir_ + ": " + strerror(errno);
    return false;
  }
  // The key first: until the chain follows, the copy still holds the old
  // chain with a new key, which nobody reads before the reload.
  return ReplaceFile(key_path(), pair.key_pem, error) &&
         ReplaceFile(chain_path(), pair.chain_pem, error);
}

void ServedCertificate::Say(const std::string& why) {
  if (why != last_error_ && log_) log_(why + "; keeping the certificate in use");
  last_error_ = why;
}

bool ServedCertificate::Load(std::string* error) {
  std::lock_guard<std::mutex> refresh(refresh_mu_);
  Stamp stamp;
  if (!ReadStamp(&stamp)) {
    *error = "no certificate deployed in " + source_dir_ +
             " (fullchain.pem and privkey.pem)";
    return false;
  }
  Pair pair;
  if (!ReadPair(&pair, error) || !WriteCopy(pair, error)) return false;
  tried_ = stamp;
  copied_ = pair;
  std::lock_guard<std::mutex> lock(mu_);
  fingerprint_ = pair.fingerprint;
  not_after_ = pair.not_after;
  return true;
}

bool ServedCertificate::Refresh(bool force) {
  std::lock_guard<std::mutex> refresh(refresh_mu_);
  Stamp before;
  if (!ReadStamp(&before)) {
    // In the middle of a deployment the directory is briefly replaced.
    Say("no certificate files in " + source_dir_);
    return false;
  }
  if (!force && before == tried_) return false;

  Pair pair;
  std::string error;
  const bool usable = ReadPair(&pair, &error);
  Stamp after;
  // Files still being written are read again at the next look; files that
  // stay as they are, broken or not, only when they change.
  if (ReadStamp(&after) && after == before) tried_ = before;
  if (!usable) {
    Say(error);
    return false;
  }
  last_error_.clear();
  if (pair.chain_pem == copied_.chain_pem && pair.key_pem == copied_.key_pem) {
    return false;  // the copy holds these already
  }
  if (!WriteCopy(pair, &error)) {
    Say(error);
    return false;
  }
  copied_ = pair;
  std::string old;
  {
    std::lock_guard<std::mutex> lock(mu_);
    old = fingerprint_;
    fingerprint_ = pair.fingerprint;
    not_after_ = pair.not_after;
  }
  if (log_ && old != pair.fingerprint) {
    log_("certificate in use: SHA256 " + pair.fingerprint + ", valid until " +
         pair.not_after);
  }
  return true;
}

std::string ServedCertificate::Fingerprint() const {
  std::lock_guard<std::mutex> lock(mu_);
  return fingerprint_;
}

std::string ServedCertificate::NotAfter() const {
  std::lock_guard<std::mutex> lock(mu_);
  return not_after_;
}

}  // namespace webapid
}  // namespace ZEPH
