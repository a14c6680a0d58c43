// The certificate the server presents, taken up again whenever it changes.
//
// The web administration service's directory holds "fullchain.pem" (the
// leaf certificate, then its intermediates) and "privkey.pem". A
// TlsIdentity keeps the parsed set in memory and hands it to every new TLS
// connection from OpenSSL's certificate callback, so that:
//
//   - a new set is used by the next handshake after Refresh loaded it, with
//     no restart of the process and no change to connections in flight
//     (each connection keeps the set it was handed at its handshake);
//   - before each handshake the files' identity (device, inode, size,
//     modification time) is compared with the loaded one, so a set deployed
//     by another process on the same root (zephcert) is picked up too;
//   - a set that cannot be used (missing file, unreadable PEM, a key that
//     does not belong to the certificate, as seen in the middle of a
//     deployment) never replaces a working one: the old set stays in use
//     and the files are tried again at the next handshake.
//
// Thread-safety: all members may be called from any thread; the set in use
// is swapped under a mutex and shared with handshakes by reference count.
#ifndef ZEPH_SERVER_TLS_IDENTITY_H_
#define ZEPH_SERVER_TLS_IDENTITY_H_

#include <openssl/ssl.h>
#include <sys/types.h>
#include <time.h>

#include <functional>
#include <memory>
#include <mutex>
#include <string>

namespace ZEPH {
namespace webapid {

class TlsIdentity {
 public:
  // Lines about loading go to `log` (may be empty).
  TlsIdentity(std::string dir, std::function<void(const std::string&)> log);
  ~TlsIdentity();
  TlsIdentity(const TlsIdentity&) = delete;
  TlsIdentity& operator=(const TlsIdentity&) = delete;

  // Loads the set for the first time. False with a one-line reason in
  // `error` when the directory holds no usable set.
  bool Load(std::string* error);

  // Loads the files again when they changed since the last look, or always
  // when `force` is set. True when a new set is in use afterwards.
  bool Refresh(bool force);

  // Prepares a server context: TLS 1.2 and later only, and this identity's
  // certificate callback. The identity must outlive the context.
  bool Configure(SSL_CTX* ctx);

  // SHA-256 fingerprint of the leaf in use, in uppercase hexadecimal pairs
  // separated by ':' (the form of `openssl x509 -fingerprint`); empty before
  // Load.
  std::string Fingerprint() const;
  // notAfter of the leaf in use, as OpenSSL prints it; empty before Load.
  std::string NotAfter() const;

  const std::string& dir() const { return dir_; }

 private:
  struct Set;
  struct FileStamp {
    dev_t dev = 0;
    ino_t ino = 0;
    off_t size = -1;
    struct timespec mtime = {0, 0};
    bool operator==(const FileStamp& o) const;
  };
  struct Stamp {
    FileStamp chain, key;
    bool operator==(const Stamp& o) const {
      return chain == o.chain && key == o.key;
    }
  };

  static int CertCallback(SSL* ssl, void* arg);
  bool ReadStamp(Stamp* stamp) const;
  std::shared_ptr<const Set> ReadSet(std::string* error) const;
  std::shared_ptr<const Set> Current() const;

  const std::string dir_;
  const std::function<void(const std::string&)> log_;
  std::mutex reload_mu_;  // one reader of the files at a time
  mutable std::mutex mu_;
  std::shared_ptr<const Set> set_;  // guarded by mu_
  Stamp tried_;                     // guarded by reload_mu_: last files read
  std::string last_error_;          // guarded by reload_mu_: said once
};

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_TLS_IDENTITY_H_
