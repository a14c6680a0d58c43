// Whole reads and writes on file descriptors.
//
// read(2) and write(2) may move fewer bytes than asked and may be
// interrupted; these loop until everything is moved, retrying on EINTR.
//
// Thread-safety: safe from any thread (each call uses only its arguments).
#ifndef ZEPH_FD_IO_H_
#define ZEPH_FD_IO_H_

#include <sys/types.h>

#include <string>

#include "zeph/export.h"

namespace ZEPH {

// Writes all `size` bytes of `data` to `fd`. False on an error (errno set).
ZEPH_EXPORT bool WriteAll(int fd, const char* data, size_t size);
ZEPH_EXPORT bool WriteAll(int fd, const std::string& data);

// Writes all `size` bytes at `offset` with pwrite(2). False on an error.
ZEPH_EXPORT bool WriteAllAt(int fd, const char* data, size_t size, off_t offset);

// Appends everything `fd` yields until end of file to `out`. False on an
// error (errno set); `out` then holds what was read before it.
ZEPH_EXPORT bool ReadAll(int fd, std::string& out);

}  // namespace ZEPH

#endif  // ZEPH_FD_IO_H_
