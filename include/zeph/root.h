// The root prefix.
//
// Every fixed appliance path (/usr/zeph/..., /usr/local/..., /usr/libexec/...,
// the lock files in /tmp, /proc/sys/kernel/zeph_mac_address1) is resolved
// below the directory named by the environment variable ZEPH_ROOT. When the
// variable is unset, empty or "/", paths are used as they stand: the real
// appliance. The system programs /usr/bin/openssl, /usr/bin/7z, /bin/cp,
// /bin/rm and /bin/mkdir are never prefixed.
//
// Thread-safety: safe to call from any thread as long as nobody changes the
// environment concurrently (the product only sets ZEPH_ROOT before it starts
// threads).
#ifndef ZEPH_ROOT_H_
#define ZEPH_ROOT_H_

#include <string>

#include "zeph/export.h"

namespace ZEPH {

// The root directory without a trailing slash; empty for the real root "/".
ZEPH_EXPORT std::string RootDir();

// `path` (absolute, starting with "/") below the root. A relative path is
// returned unchanged.
ZEPH_EXPORT std::string RootPath(const std::string& path);

}  // namespace ZEPH

#endif  // ZEPH_ROOT_H_
