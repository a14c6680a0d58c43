#include "module/mkcert/generation_lock.h"

#include <errno.h>
#include <stdio.h>
#include <unistd.h>

#include <string>

#include "module/common/log.h"
#include "module/common/paths.h"
#include "zeph/qlibc_file.h"
#include "zeph/qlibc_lock.h"
#include "zeph/root.h"

namespace ZEPH {
namespace cert {
namespace {

std::string PendingRequest() { return RootPath(kServerCsr); }
std::string KeptRequest() { return RootPath(kServerCsr) + ".kept"; }

// Moves the CSR methods' request out of the way of a set's request. One
// already kept aside (its keeper died) is the pending one and stays.
void KeepPendingRequest() {
  const std::string kept = KeptRequest();
  if (QLIBCFileExist(kept.c_str())) return;
  const std::string pending = PendingRequest();
  if (rename(pending.c_str(), kept.c_str()) != 0 && errno != ENOENT) {
    MKCERT_LOG("Failed to move %s to %s [%d]", pending.c_str(), kept.c_str(),
               errno);
  }
}

// Puts the kept request back over the set's request, or removes the set's
// request when nothing was pending: it belongs to no key left for export.
void RestorePendingRequest() {
  const std::string pending = PendingRequest();
  const std::string kept = KeptRequest();
  if (rename(kept.c_str(), pending.c_str()) == 0) return;
  if (errno != ENOENT) {
    MKCERT_LOG("Failed to move %s to %s [%d]", kept.c_str(), pending.c_str(),
               errno);
    return;
  }
  if (unlink(pending.c_str()) != 0 && errno != ENOENT) {
    MKCERT_LOG("Failed to remove %s [%d]", pending.c_str(), errno);
  }
}

}  // namespace

GenerationLock::~GenerationLock() { Unlock(); }

bool GenerationLock::Lock() {
  const std::string path = RootPath(kGenerationLockFile);
  if (!lock_.Lock(path, QLIBC_LOCK_EXCLUSIVE, kGenerationLockSeconds)) {
    MKCERT_LOG_LIBERR("Failed to lock [%s]", path.c_str());
    return false;
  }
  if (use_ == Use::kCertificateSet) KeepPendingRequest();
  return true;
}

void GenerationLock::Unlock() {
  if (!lock_.held()) return;
  if (use_ == Use::kCertificateSet) RestorePendingRequest();
  if (!lock_.Unlock()) {
    MKCERT_LOG("Failed to unlock %s", RootPath(kGenerationLockFile).c_str());
  }
}

}  // namespace cert
}  // namespace ZEPH
