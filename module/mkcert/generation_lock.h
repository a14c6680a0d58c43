// The generation lock: one exclusive lock around every use of the
// appliance's shared key-generation work files.
//
// Keys, requests and certificates are made from fixed work files: the
// request configurations and extension files in "/usr/zeph/etc/ssl/cfg.d",
// the authority's request "/usr/zeph/etc/ssl/ssl.csr/ca.csr", the serial
// file "/usr/zeph/etc/ssl/.mkcert.serial", and in "/usr/zeph/etc/ssl/.gen"
// the server request of a set and the key, request and signed certificate
// that the CSR methods leave there for the export. Two generations at once
// would sign with each other's authority and hand out each other's
// requests. So every user holds this lock while it uses those files:
//   - CRT create (genCASet and genCertSet),
//   - the mkcert tool, which CRT recreate runs,
//   - CSR create, renew and sign,
//   - the default certificate of reset (and so of a root's first start),
//   - the export of "csr_set" and "signed_set".
//
// The lock file is "/tmp/zephcertificate_gen.lock" below the root, beside
// the INFO lock. A waiter gives up after kGenerationLockSeconds: long
// enough for several 4096-bit creations queued in front of it.
//
// Lock order. The generation lock is held only around generation and the
// hand-out of its products, never together with the INFO lock or a
// per-service lock: its holders take neither while they hold it, and
// nobody takes it while holding one of them. The one lock held around it
// is the export lock of the export method, taken first:
//     export lock  ->  generation lock
// The mkcert tool takes the generation lock itself, so CRT recreate does
// not hold it while the tool runs.
//
// A certificate set's server request goes to the same path as the request
// a CSR method left for export ("/usr/zeph/etc/ssl/.gen/server.csr"). While
// a set is made (Use::kCertificateSet) that pending request is kept aside
// and put back afterwards, so that the export still hands out the request
// that belongs to the key beside it. A request kept aside by a process
// that died stays aside and is put back by the next set generation.
//
// Thread-safety: a flock(2) lock on an open file description of its own,
// so it excludes threads of one process and processes alike. Not
// reentrant: a holder that asks again waits for itself until the time-out.
// One object belongs to one thread.
#ifndef ZEPH_MODULE_MKCERT_GENERATION_LOCK_H_
#define ZEPH_MODULE_MKCERT_GENERATION_LOCK_H_

#include "module/archive/file_lock.h"
#include "zeph/export.h"

namespace ZEPH {
namespace cert {

constexpr char kGenerationLockFile[] = "/tmp/zephcertificate_gen.lock";
constexpr int kGenerationLockSeconds = 600;

class ZEPH_EXPORT GenerationLock {
 public:
  enum class Use {
    kWorkFiles,       // the CSR methods, signing, the export of products
    kCertificateSet,  // making a set: the pending request is kept aside
  };

  explicit GenerationLock(Use use) : use_(use) {}
  // Releases a lock still held, as Unlock does.
  ~GenerationLock();
  GenerationLock(const GenerationLock&) = delete;
  GenerationLock& operator=(const GenerationLock&) = delete;

  // Takes the lock, waiting at most kGenerationLockSeconds. False, after
  // logging "Failed to lock [<path>]" with the platform's last error, when
  // it could not be had; nothing is held then.
  // REQUIRES: this object holds nothing.
  bool Lock();

  // For Use::kCertificateSet, puts a request kept aside back (a set's own
  // request in its place is removed); then releases the lock. Nothing
  // happens when nothing is held.
  void Unlock();

 private:
  const Use use_;
  ScopedFileLock lock_;
};

}  // namespace cert
}  // namespace ZEPH

#endif  // ZEPH_MODULE_MKCERT_GENERATION_LOCK_H_
