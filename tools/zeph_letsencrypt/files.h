// File and directory operations of zeph-letsencrypt.
//
// The tool is one thread; these are still reentrant (no static state).
// Every call sets errno on failure.
#ifndef ZEPH_TOOLS_ZEPH_LETSENCRYPT_FILES_H_
#define ZEPH_TOOLS_ZEPH_LETSENCRYPT_FILES_H_

#include <sys/types.h>

#include <string>

namespace ZEPH {
namespace letsencrypt {

// The whole content of `path` into `out`; false (errno set) when it cannot
// be read.
bool ReadWhole(const std::string& path, std::string* out);

// Makes `path` hold exactly `content` with `mode`: written to a new file
// beside it, synced, then renamed over it, so that a reader sees the old
// file or the new one, never a part. False when any step fails; the
// temporary file is then gone and `path` untouched.
bool WriteWhole(const std::string& path, const std::string& content,
                mode_t mode);

// Makes the directory `path` with `mode` unless a directory is there.
// False when it cannot be made or something else is in its place.
bool MakeDir(const std::string& path, mode_t mode);

// Removes `path` and everything below it. Symbolic links are removed, never
// followed. True when nothing is left (also when nothing was there).
bool RemoveTree(const std::string& path);

// Puts the directory `staging` in the place of the directory `target` in
// one step: afterwards `target` names what `staging` held and `staging`
// names the old `target` (in the fallback below it may be gone instead,
// already removed). Uses renameat2(RENAME_EXCHANGE); on a file
// system without it, two renames with `target` absent for the moment
// between them (and moved back if the second fails). False, with both
// directories as they were, when the exchange cannot be made.
bool ExchangeDirs(const std::string& staging, const std::string& target);

}  // namespace letsencrypt
}  // namespace ZEPH

#endif  // ZEPH_TOOLS_ZEPH_LETSENCRYPT_FILES_H_
