// Directory operations of the certificate archive and the service
// directories.
//
// The staging pattern built on these: CleanDir a work directory (the
// target's name + ".temp"), fill it, MoveDir it onto the target; on any
// failure RemoveDir the work directory.
//
// External work is done by the system's own "/bin/rm" and "/bin/cp" (never
// below ZEPH_ROOT), run without a shell through QLIBCExec, so no path is
// ever interpreted. Paths are absolute, without a trailing "/", and used as
// given (callers pass prefixed paths).
//
// Each operation returns true on success and writes its own log line on
// failure; nothing throws.
//
// Thread-safety: the operations take no lock. Callers hold the per-service
// lock (service directories) or work on names no other request uses.
#ifndef ZEPH_MODULE_ARCHIVE_DIR_OPS_H_
#define ZEPH_MODULE_ARCHIVE_DIR_OPS_H_

#include <sys/types.h>

#include <string>

#include "zeph/export.h"

// Deletes the directory tree `path` ("/bin/rm" "-rf" path). False when
// `path` is not a directory ("<path> is not a valid directory"; a missing
// directory is a failure) or rm fails ("Failed to remove <path> [errno]").
ZEPH_EXPORT bool RemoveDir(const std::string& path);

// Makes `path` an empty directory with permission bits exactly `mode`
// (missing parents are made too). An existing directory is removed first;
// a plain file of that name is not removed, so creation then fails. False
// when rm fails ("Failed to remove <path> [errno]") or the directory cannot
// be made ("Failed to create <path>").
ZEPH_EXPORT bool CleanDir(const std::string& path, mode_t mode);

// Makes directory `src` appear as `dst`, replacing whatever `dst` was, with
// a backup of the old `dst` in `dst` + ".bak" until the move has succeeded:
//   1. `src` must be a directory, else false ("<src> is not a valid
//      directory").
//   2. `src` == `dst`: true at once, nothing touched (debug line "skip move
//      directory, due to source equals to destination [<dst>]").
//   3. A stale `dst.bak` is removed. If that fails, the stale backup is
//      taken for the only good copy: the restore steps (7) replace `dst` by
//      it, and the result is false.
//   4. An existing `dst` is copied to `dst.bak` ("/bin/cp" "-arp": owners,
//      modes and times kept). If that fails, false with nothing changed.
//   5. `dst` is removed; 6. `src` is renamed onto `dst`, then `dst.bak` is
//      removed (a failure there is logged only; the result stays true).
//   7. After a failure in 3, 5 or 6: `dst` is removed and `dst.bak` renamed
//      back onto it; the result is false even when that succeeds.
// On false `src` is left for the caller to remove. If the restore itself
// fails, `dst` may be missing while `dst.bak` holds the old contents.
// Between steps 5 and 6 the name `dst` briefly does not exist.
ZEPH_EXPORT bool MoveDir(const std::string& src, const std::string& dst);

// Copies `src_dir`/`name` to `dst_dir`/`name` ("/bin/cp" "-f"), then makes
// the copy mode 0400 and hands it to `uid`:`gid`. cp's exit status is not
// used; instead:
//   - cp cannot be run: false ("Failed to copy [<source>]." with the
//     platform error);
//   - the target exists but is not as long as the source (a copy cut short,
//     e.g. on a full disk), or the source cannot be stat'ed to tell: the
//     target is removed, false ("Failed to copy [<source>].");
//   - no target (cp refused the copy) or chmod/chown fails: false ("Failed
//     to chmod chown. [<target>]").
// So a true result means a copy as long as its source. Used by the
// deployment into services.
bool CopyCertFile(const std::string& src_dir, const std::string& dst_dir,
                  const std::string& name, uid_t uid, gid_t gid);

#endif  // ZEPH_MODULE_ARCHIVE_DIR_OPS_H_
