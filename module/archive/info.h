// The INFO catalogue of the certificate archive and its lock.
//
// INFO ("<archive>/INFO") is a JSON object: certificate id -> entry
//   {"desc": string, "services": [service objects], "user_deletable": bool}
// Entries may carry other members; writers keep them. INFO is always
// replaced whole: the new document is written to "<archive>/INFO.temp" and
// renamed onto INFO, so a reader without the lock sees the old or the new
// catalogue, never a part of one, even when the writer dies half-way.
//
// The INFO lock "/tmp/zephcertificate_info.lock" serialises every
// read-modify-write of INFO. Each user takes it in its own mode and with its
// own wait (the kInfoLock* constants below) and releases it at every exit.
// It is never held together with another lock. Readers that only read INFO
// once (the certificate list, GetServiceList, GenCrtChecksum) take no lock.
//
// Every path is taken below ZEPH_ROOT (zeph/root.h); log lines show the
// prefixed paths.
//
// Thread-safety: all functions are safe from any thread and process; the
// lock does the serialising.
#ifndef ZEPH_MODULE_ARCHIVE_INFO_H_
#define ZEPH_MODULE_ARCHIVE_INFO_H_

#include <json/json.h>

#include <string>

#include "zeph/export.h"
#include "zeph/qlibc_lock.h"

namespace ZEPH {
namespace cert {

// How one user takes the INFO lock: mode (QLIBC_LOCK_*) and wait in seconds.
struct InfoLockUse {
  int mode;
  int seconds;
};

// SetCrtProperty (both overloads) changes descriptions and flags.
constexpr InfoLockUse kInfoLockSetProperty = {QLIBC_LOCK_EXCLUSIVE, 10};
// DropCertInfo removes an entry.
constexpr InfoLockUse kInfoLockDrop = {QLIBC_LOCK_EXCLUSIVE, 10};
// DeployCrt moves service bindings between entries.
constexpr InfoLockUse kInfoLockDeploy = {QLIBC_LOCK_EXCLUSIVE, 30};
// GetServiceCertID looks a binding up.
constexpr InfoLockUse kInfoLockServiceLookup = {QLIBC_LOCK_SHARED, 30};

// The prefixed paths of INFO, its scratch file and its lock.
ZEPH_EXPORT std::string InfoPath();
ZEPH_EXPORT std::string InfoTempPath();
ZEPH_EXPORT std::string InfoLockPath();

// Reads INFO whole into `info`. True when INFO exists, parses and its root
// is an object. When INFO is absent and `absent_is_empty` is true, `info`
// becomes an empty object and the result is true as well (the creating
// writer's choice); with false an absent INFO is a failure like a broken
// one. On failure `info` is left unchanged and the platform's last error
// tells why. Logs nothing: each caller words its own "Broken" line.
ZEPH_EXPORT bool ReadCertInfo(Json::Value& info, bool absent_is_empty);

}  // namespace cert
}  // namespace ZEPH

// Replaces INFO by `info`: writes a copy to INFO.temp (a leftover one is
// overwritten), then renames it onto INFO. True on success. False when
// INFO.temp cannot be written ("Failed to write [<document>] to [<temp>].")
// or the rename fails ("Failed to move <temp> to <INFO>"); INFO keeps its
// old content in both cases.
// REQUIRES: the caller holds the INFO lock exclusively; two writers at once
// would share INFO.temp.
ZEPH_EXPORT bool WriteCertInfo(const Json::Value& info);

// Removes the entry `id` of a certificate that no service uses, under the
// INFO lock (kInfoLockDrop). True when the entry is gone, also when INFO
// never held it (INFO is then not rewritten). False, with INFO unchanged,
// when:
//   - the lock cannot be had ("Lock list file [<lock>] failed");
//   - INFO is absent, does not parse or is not an object ("Broken [<INFO>].")
//     - an absent INFO is not created;
//   - the entry is not an object with an empty "services" array ("Wrong
//     info: [<id>]"): an entry that still serves something is never removed;
//   - writing fails ("Failed to write [<INFO>].").
// When the entry is gone, the certificate's directory loses its
// "fullchain.pem" before the lock is released, so that it is no longer a
// valid certificate that a concurrent writer could catalogue again; the
// caller removes the directory next.
ZEPH_EXPORT bool DropCertInfo(const std::string& id);

#endif  // ZEPH_MODULE_ARCHIVE_INFO_H_
