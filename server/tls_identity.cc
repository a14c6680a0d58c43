#include "server/tls_identity.h"

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <stdio.h>
#include <sys/stat.h>

#include <utility>

#include "module/common/ssl_ptr.h"

namespace ZEPH {
namespace webapid {

struct TlsIdentity::Set {
  ssl::X509Ptr leaf;
  ssl::EvpPkeyPtr key;
  ssl::X509StackPtr chain;
  std::string fingerprint;
  std::string not_after;
};

namespace {

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

std::string Sha256Fingerprint(X509* cert) {
  unsigned char md[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  if (X509_digest(cert, EVP_sha256(), md, &len) != 1) return "";
  std::string out;
  char pair[4];
  for (unsigned int i = 0; i < len; ++i) {
    snprintf(pair, sizeof(pair), i + 1 < len ? "%02X:" : "%02X", md[i]);
    out += pair;
  }
  return out;
}

std::string PrintTime(const ASN1_TIME* t) {
  ssl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || ASN1_TIME_print(bio.get(), t) != 1) return "";
  char* data = nullptr;
  long n = BIO_get_mem_data(bio.get(), &data);
  return n > 0 ? std::string(data, static_cast<size_t>(n)) : "";
}

}  // namespace

bool TlsIdentity::FileStamp::operator==(const FileStamp& o) const {
  return dev == o.dev && ino == o.ino && size == o.size &&
         mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec;
}

TlsIdentity::TlsIdentity(std::string dir,
                         std::function<void(const std::string&)> log)
    : dir_(std::move(dir)), log_(std::move(log)) {}

TlsIdentity::~TlsIdentity() = default;

bool TlsIdentity::ReadStamp(Stamp* stamp) const {
  struct stat chain, key;
  if (stat((dir_ + "/fullchain.pem").c_str(), &chain) != 0 ||
      stat((dir_ + "/privkey.pem").c_str(), &key) != 0) {
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

std::shared_ptr<const TlsIdentity::Set> TlsIdentity::ReadSet(
    std::string* error) const {
  const std::string chain_path = dir_ + "/fullchain.pem";
  const std::string key_path = dir_ + "/privkey.pem";
  auto set = std::make_shared<Set>();

  ssl::BioPtr chain_bio(BIO_new_file(chain_path.c_str(), "r"));
  if (!chain_bio) {
    *error = "cannot open " + chain_path + ": " + OpensslReason();
    return nullptr;
  }
  set->leaf.reset(
      PEM_read_bio_X509(chain_bio.get(), nullptr, NoPassword, nullptr));
  if (!set->leaf) {
    *error = "no certificate in " + chain_path + ": " + OpensslReason();
    return nullptr;
  }
  set->chain.reset(sk_X509_new_null());
  if (!set->chain) {
    *error = "out of memory";
    return nullptr;
  }
  while (ssl::X509Ptr more{
      PEM_read_bio_X509(chain_bio.get(), nullptr, NoPassword, nullptr)}) {
    if (sk_X509_push(set->chain.get(), more.get()) == 0) {
      *error = "out of memory";
      return nullptr;
    }
    more.release();  // now owned by the stack
  }
  ERR_clear_error();  // the end of the file ends the loop with an error

  ssl::BioPtr key_bio(BIO_new_file(key_path.c_str(), "r"));
  if (!key_bio) {
    *error = "cannot open " + key_path + ": " + OpensslReason();
    return nullptr;
  }
  set->key.reset(
      PEM_read_bio_PrivateKey(key_bio.get(), nullptr, NoPassword, nullptr));
  if (!set->key) {
    *error = "no private key in " + key_path + ": " + OpensslReason();
    return nullptr;
  }
  if (X509_check_private_key(set->leaf.get(), set->key.get()) != 1) {
    ERR_clear_error();
    *error = key_path + " does not belong to the certificate in " + chain_path;
    return nullptr;
  }
  // OpenSSL checks the key against the security level at every handshake:
  // a set it refuses (a 1024-bit RSA key under the usual level 2) would lock
  // every client out, so it must never replace the set in use.
  std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)> probe(
      SSL_CTX_new(TLS_server_method()), &SSL_CTX_free);
  if (!probe || SSL_CTX_use_certificate(probe.get(), set->leaf.get()) != 1 ||
      SSL_CTX_use_PrivateKey(probe.get(), set->key.get()) != 1) {
    *error = "the certificate in " + chain_path +
             " is refused by TLS (" + OpensslReason() + ")";
    return nullptr;
  }
  set->fingerprint = Sha256Fingerprint(set->leaf.get());
  set->not_after = PrintTime(X509_get0_notAfter(set->leaf.get()));
  return set;
}

bool TlsIdentity::Load(std::string* error) {
  std::lock_guard<std::mutex> reload(reload_mu_);
  Stamp stamp;
  if (!ReadStamp(&stamp)) {
    *error = "no certificate deployed in " + dir_ +
             " (fullchain.pem and privkey.pem)";
    return false;
  }
  std::shared_ptr<const Set> set = ReadSet(error);
  if (!set) return false;
  tried_ = stamp;
  std::lock_guard<std::mutex> lock(mu_);
  set_ = std::move(set);
  return true;
}

bool TlsIdentity::Refresh(bool force) {
  Stamp before;
  const bool present = ReadStamp(&before);
  std::lock_guard<std::mutex> reload(reload_mu_);
  if (!present) {
    // In the middle of a deployment the directory is briefly replaced;
    // keep serving the set in use and look again at the next handshake.
    const std::string why = "no certificate files in " + dir_;
    if (why != last_error_ && log_)
      log_(why + "; keeping the certificate in use");
    last_error_ = why;
    return false;
  }
  if (!force && before == tried_) return false;

  std::string error;
  std::shared_ptr<const Set> set = ReadSet(&error);
  Stamp after;
  const bool steady = ReadStamp(&after) && after == before;
  if (!set) {
    // Files that are still being written are read again next time; files
    // that stay broken are read once until they change.
    if (steady) tried_ = before;
    if (error != last_error_ && log_)
      log_(error + "; keeping the certificate in use");
    last_error_ = error;
    return false;
  }
  // A set whose key matches its certificate is consistent even if the
  // files moved on meanwhile; the newer files are read at the next look.
  if (steady) tried_ = before;
  last_error_.clear();
  std::shared_ptr<const Set> old;
  {
    std::lock_guard<std::mutex> lock(mu_);
    old = set_;
    set_ = set;
  }
  if (log_ && (!old || old->fingerprint != set->fingerprint)) {
    log_("certificate in use: SHA256 " + set->fingerprint + ", valid until " +
         set->not_after);
  }
  return true;
}

std::shared_ptr<const TlsIdentity::Set> TlsIdentity::Current() const {
  std::lock_guard<std::mutex> lock(mu_);
  return set_;
}

std::string TlsIdentity::Fingerprint() const {
  std::shared_ptr<const Set> set = Current();
  return set ? set->fingerprint : "";
}

std::string TlsIdentity::NotAfter() const {
  std::shared_ptr<const Set> set = Current();
  return set ? set->not_after : "";
}

int TlsIdentity::CertCallback(SSL* ssl, void* arg) {
  auto* self = static_cast<TlsIdentity*>(arg);
  self->Refresh(false);
  std::shared_ptr<const Set> set = self->Current();
  if (!set) return 0;
  // The connection takes its own references: a later swap leaves it alone.
  if (SSL_use_certificate(ssl, set->leaf.get()) != 1 ||
      SSL_use_PrivateKey(ssl, set->key.get()) != 1 ||
      SSL_set1_chain(ssl, set->chain.get()) != 1) {
    return 0;
  }
  return 1;
}

bool TlsIdentity::Configure(SSL_CTX* ctx) {
  if (SSL_CTX_set_min_proto_version(ctx, TLS1_2_VERSION) != 1) return false;
  SSL_CTX_set_options(ctx, SSL_OP_NO_COMPRESSION | SSL_OP_NO_RENEGOTIATION |
                               SSL_OP_CIPHER_SERVER_PREFERENCE |
                               SSL_OP_NO_TICKET);
  // No session resumption: a resumed session would carry on with the
  // certificate of its first handshake after the identity changed.
  SSL_CTX_set_session_cache_mode(ctx, SSL_SESS_CACHE_OFF);
  SSL_CTX_set_num_tickets(ctx, 0);
  SSL_CTX_set_cert_cb(ctx, &TlsIdentity::CertCallback, this);
  return true;
}

}  // namespace webapid
}  // namespace ZEPH
