// System services of the appliance: event log, users, directories, units.
//
// Thread-safety: all routines are safe from any thread and from several
// processes at once.
#ifndef ZEPH_SYSTEM_H_
#define ZEPH_SYSTEM_H_

#include <sys/types.h>

#include <string>

#include "zeph/export.h"

extern "C" {

// Appends one event to the appliance's event log,
// <root>/var/log/zeph/events.jsonl: one JSON object a line with the members
// "time" (seconds since the epoch), "type", "level", "message_id" and
// "text1" .. "text4" (null pointers are written as empty strings). The
// append happens under an exclusive lock on the log file, so lines of
// concurrent writers never mix. The directory is made when missing.
// 0 on success, -1 on failure (last error set).
ZEPH_EXPORT int ZEPHLogSet1(int type, int level, unsigned int message_id,
                            const char* text1, const char* text2,
                            const char* text3, const char* text4);

// The user and group ids of user `user`, from the password database
// (reentrant lookup). 0 on success; -1 for an unknown user or a lookup
// failure (last error QLIBC_ERR_NOT_FOUND or QLIBC_ERR_IO).
ZEPH_EXPORT int ZEPHUserGetUGID(const char* user, uid_t* uid, gid_t* gid);

// Makes directory `path` with permission bits exactly `mode` (the umask does
// not apply to the last component).
//   owner:         user name to hand the new directories to, or null;
//   make_parents:  nonzero: missing parents are made too (mode 0755);
//   parents_mode:  nonzero: parents made get `mode` as well;
//   reserved:      must be 0.
// An existing directory is left as it is and counts as success. 0 on
// success, -1 on failure (a component that is not a directory, no
// permission, ...; last error set).
ZEPH_EXPORT int ZEPHFSMkdirP(const char* path, const char* owner,
                             int make_parents, int parents_mode, int reserved,
                             mode_t mode);

}  // extern "C"

// Asks systemd to reload `unit`. Only on the real root ("/") of a machine
// that runs systemd; under any other root, or without systemd, nothing is
// done and the result is false. True when systemctl reported success.
ZEPH_EXPORT bool ZEPHSystemdReload(const std::string& unit);

#endif  // ZEPH_SYSTEM_H_
