// UniqueFd: the owner of a kernel file descriptor, so that no reader sees a hand-written close.
#pragma once

#include <unistd.h>

#include <utility>

namespace platform {

// A file descriptor that is closed when it goes out of scope; -1 holds nothing.
class UniqueFd {
 public:
  UniqueFd() = default;
  // UniqueFd takes ownership of `fd` (-1 for none).
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) reset(std::exchange(other.fd_, -1));
    return *this;
  }
  ~UniqueFd() { reset(); }

  // get borrows the descriptor (-1 when none); the conversion is true when one is held.
  int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }
  // Closes the descriptor held, if any, and holds `fd` instead.
  void reset(int fd = -1) {
    if (fd_ >= 0) ::close(fd_);
    fd_ = fd;
  }
  // release hands the descriptor (or -1) to the caller, who must close it; none is held after.
  int release() { return std::exchange(fd_, -1); }

 private:
  int fd_ = -1;
};

}  // namespace platform
