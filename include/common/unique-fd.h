// Owning one file descriptor for the length of a scope.
//
// A UniqueFd closes its descriptor when it ends, so every return path of a
// function that opens a file, a socket or a lock releases it without a
// close() on each path. -1 means "no descriptor"; a default UniqueFd holds
// none. Ownership moves and is never shared: there is no copy.
//
// close() is not retried: on Linux the descriptor is gone after the first
// call whatever it answers, and a second call could close a descriptor that
// another thread has just opened under the same number. Code that must know
// whether the last write reached the file calls close() itself on
// release().
//
// Threading: a UniqueFd is used by one thread at a time.
#ifndef PLOVO_COMMON_UNIQUE_FD_H
#define PLOVO_COMMON_UNIQUE_FD_H

#include <unistd.h>

namespace Plovo {

class UniqueFd {
 public:
  UniqueFd() = default;
  // Takes fd, which may be -1.
  explicit UniqueFd(int fd) : fd_(fd) {}
  ~UniqueFd() { reset(); }
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) reset(other.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  explicit operator bool() const { return valid(); }

  // Gives the descriptor up without closing it; the owner then holds none.
  int release() {
    int fd = fd_;
    fd_ = -1;
    return fd;
  }
  // Closes the descriptor held, if any, and takes fd (default: none).
  void reset(int fd = -1) {
    if (fd_ >= 0 && fd_ != fd) ::close(fd_);
    fd_ = fd;
  }

 private:
  int fd_ = -1;
};

}  // namespace Plovo

#endif
