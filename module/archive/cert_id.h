// Certificate ids and the confinement of paths to the certificate roots.
//
// A certificate id names a directory of the certificate archive
// "/usr/zeph/etc/certificate/_archive". Ids the module makes are six letters
// and digits drawn by mkdtemp(3). An id is never empty and never holds "/"
// or ".", so no id can name anything outside the archive. A certificate
// directory is valid when it holds "privkey.pem", "cert.pem" and
// "fullchain.pem".
//
// All paths are taken below ZEPH_ROOT (zeph/root.h).
//
// Thread-safety: all functions are safe from any thread and process.
#ifndef ZEPH_MODULE_ARCHIVE_CERT_ID_H_
#define ZEPH_MODULE_ARCHIVE_CERT_ID_H_

#include <string>

#include "zeph/export.h"

namespace ZEPH {
namespace cert {

// The prefixed archive directory, without a trailing slash.
ZEPH_EXPORT std::string ArchiveDir();

// The prefixed directory of certificate `id`: ArchiveDir() + "/" + id.
// Does not check the id.
ZEPH_EXPORT std::string CrtDir(const std::string& id);

// Makes a new, empty certificate directory (mode 0700) with a fresh id, by
// mkdtemp(3) on ArchiveDir() + "/XXXXXX". On success stores the directory's
// path in `path` and its id in `id` and returns true. On failure returns
// false with errno set and both outputs untouched; logs nothing, the caller
// reports it.
ZEPH_EXPORT bool MakeCrtDir(std::string& path, std::string& id);

}  // namespace cert
}  // namespace ZEPH

// The id of the certificate directory that the existing directory `path`
// lies in: "<archive>/Ab3xYz" and "<archive>/Ab3xYz/sub" both give "Ab3xYz".
// Empty when `path` is empty, is not below "<archive>/", or is not an
// existing directory (a file gives ""). The id is not validated.
ZEPH_EXPORT std::string GetCrtId(const std::string& path);

// True when `id` could name a directory of the archive at all: not empty,
// no "/", no "." and no NUL byte, so that it can neither climb out of the archive ("..")
// nor name the archive itself ("."). Ids read back from the catalogue or
// from DEFAULT pass this before any path is made of them.
ZEPH_EXPORT bool IsCrtIdName(const std::string& id);

// True when `id` names a valid certificate directory. False without looking
// at the disk for an empty id and for one holding "/" or "."; false without
// a log line when the directory is missing; false with "Lack of necessary
// files in cert dir [<dir>]" when one of the three files is missing.
ZEPH_EXPORT bool IsCrtIdValid(const std::string& id);

// True when `base` (and, if `name` is not empty, `base` + "/" + `name`),
// taken relative to a certificate root, resolves (realpath(3), symbolic
// links followed) to an existing path strictly inside it: the root is
// "/usr/local/etc/certificate/" when `local` is true, else
// "/usr/zeph/etc/certificate/". `name` must resolve strictly inside the
// resolved base. An empty `base` is false; the root itself is false.
// Used by other components of the appliance, linked or looked up with
// dlsym (c_names.h); nothing in this module calls it.
ZEPH_EXPORT bool IsCrtPathValid(bool local, const std::string& base,
                                const std::string& name);

#endif  // ZEPH_MODULE_ARCHIVE_CERT_ID_H_
