// Owners for file descriptors and stdio streams.
//
// UniqueFd closes its descriptor when it goes out of scope; UniqueFile
// fcloses its stream. Both are move-only and give up ownership with
// release(). Open descriptors with O_CLOEXEC (and streams with mode "e") so
// that child processes inherit nothing.
#ifndef ZEPH_UNIQUE_FD_H_
#define ZEPH_UNIQUE_FD_H_

#include <stdio.h>
#include <unistd.h>

#include <memory>

namespace ZEPH {

class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) reset(other.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() { reset(); }

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  explicit operator bool() const { return valid(); }

  // Gives up ownership and returns the descriptor.
  int release() {
    int fd = fd_;
    fd_ = -1;
    return fd;
  }
  void reset(int fd = -1) {
    if (fd_ >= 0) ::close(fd_);
    fd_ = fd;
  }

 private:
  int fd_ = -1;
};

struct FileCloser {
  void operator()(FILE* f) const {
    if (f != nullptr) ::fclose(f);
  }
};
using UniqueFile = std::unique_ptr<FILE, FileCloser>;

}  // namespace ZEPH

#endif  // ZEPH_UNIQUE_FD_H_
