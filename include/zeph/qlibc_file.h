// File tests and small file operations of the utility library.
//
// Thread-safety: safe from any thread.
#ifndef ZEPH_QLIBC_FILE_H_
#define ZEPH_QLIBC_FILE_H_

#include <stdio.h>

#include "zeph/export.h"

extern "C" {

// Nonzero when `path` exists (a dangling symbolic link does not).
ZEPH_EXPORT int QLIBCFileExist(const char* path);

// Nonzero when `path` is a directory (following symbolic links).
ZEPH_EXPORT int QLIBCFileCheckDir(const char* path);

// Removes a leading UTF-8 byte-order mark (EF BB BF) from the file in place,
// keeping its inode, owner and mode. 0 on success, also when the file has
// no mark; a file without a mark is only read, never opened for writing, so
// read-only files without a mark pass. -1 when it cannot be read, or has a
// mark and cannot be written.
ZEPH_EXPORT int QLIBCFileUTF8BomStrip(const char* path);

// Reads one line (with its "\n", if any) of at most size - 1 characters into
// `buf` and terminates it. Null at end of file or on a read error, or when
// `size` is below 2.
ZEPH_EXPORT char* QLIBCFgets(char* buf, int size, FILE* f);

}  // extern "C"

#endif  // ZEPH_QLIBC_FILE_H_
