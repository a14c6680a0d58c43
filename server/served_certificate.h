// The certificate nginx presents: a checked private copy of the web
// administration service's pair.
//
// The service's directory (<root>/usr/zeph/etc/certificate/system/default)
// holds "fullchain.pem" (the leaf, then its intermediates) and
// "privkey.pem". Deployments replace those files at any time, and mid-way
// through a deployment the pair may be missing, half written or mismatched.
// nginx must never load such a pair: it would refuse to reload, or worse,
// present a certificate whose key it does not hold. So nginx loads a copy
// in a directory of its own (`copy_dir`, mode 0700) and the copy is only
// ever replaced by a pair that passed the checks:
//
//   - both files parse (the leaf and any intermediates, an unencrypted key);
//   - the key belongs to the leaf;
//   - TLS accepts the pair at OpenSSL's security level (a 1024-bit RSA key
//     is refused at the usual level 2 and would lock every client out).
//
// The bytes that were checked are the bytes that are copied, so a
// deployment between the check and the copy cannot slip an unchecked pair
// in. A pair that fails keeps the copy as it was, with one log line saying
// why (said again only when the reason changes).
//
// Thread-safety: all members may be called from any thread; looks at the
// source files are serialised.
#ifndef ZEPH_SERVER_SERVED_CERTIFICATE_H_
#define ZEPH_SERVER_SERVED_CERTIFICATE_H_

#include <openssl/x509.h>
#include <sys/types.h>
#include <time.h>

#include <functional>
#include <mutex>
#include <string>

namespace ZEPH {
namespace webapid {

class ServedCertificate {
 public:
  // `source_dir`: the service's directory; `copy_dir`: where nginx loads
  // the pair from (made when missing). Lines about the pair go to `log`
  // (may be empty).
  ServedCertificate(std::string source_dir, std::string copy_dir,
                    std::function<void(const std::string&)> log);
  ServedCertificate(const ServedCertificate&) = delete;
  ServedCertificate& operator=(const ServedCertificate&) = delete;

  // Checks the source pair and writes the copy, the first time. False with
  // a one-line reason in `error` when the source holds no usable pair or
  // the copy cannot be written.
  bool Load(std::string* error);

  // Looks at the source files again when they changed since the last look
  // (device, inode, size, modification time), or always when `force` is
  // set. True when a pair that passed differs from the copy and the copy
  // now holds it: nginx must reload to present it.
  bool Refresh(bool force);

  // SHA-256 fingerprint of the leaf in the copy, "AB:CD:..." as
  // `openssl x509 -fingerprint` prints it; empty before Load.
  std::string Fingerprint() const;
  // notAfter of that leaf as OpenSSL prints it; empty before Load.
  std::string NotAfter() const;

  // The copy nginx loads.
  std::string chain_path() const { return copy_dir_ + "/fullchain.pem"; }
  std::string key_path() const { return copy_dir_ + "/privkey.pem"; }

 private:
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
  struct Pair {
    std::string chain_pem, key_pem;
    std::string fingerprint, not_after;
  };

  bool ReadStamp(Stamp* stamp) const;
  bool ReadPair(Pair* pair, std::string* error) const;
  bool WriteCopy(const Pair& pair, std::string* error) const;
  void Say(const std::string& why);

  const std::string source_dir_;
  const std::string copy_dir_;
  const std::function<void(const std::string&)> log_;
  std::mutex refresh_mu_;   // one look at the source files at a time
  Stamp tried_;             // guarded by refresh_mu_: last files read
  std::string last_error_;  // guarded by refresh_mu_: said once
  Pair copied_;             // guarded by refresh_mu_: what the copy holds
  mutable std::mutex mu_;
  std::string fingerprint_, not_after_;  // guarded by mu_: of the copy
};

// SHA-256 fingerprint of `cert` in the form of Fingerprint(); empty on
// failure.
std::string CertificateFingerprint(X509* cert);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_SERVED_CERTIFICATE_H_
