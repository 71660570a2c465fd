#pragma once

// UniqueFd: sole owner of a file descriptor, closed on destruction. Move-only.
//
// Thread safety: none; like any value, one thread uses an instance at a time.

#include <unistd.h>

#include <utility>

namespace collector {

class UniqueFd {
 public:
  UniqueFd() = default;
  // Takes ownership of fd; -1 means none.
  explicit UniqueFd(int fd) : fd_(fd) {}
  ~UniqueFd() { reset(); }

  UniqueFd(UniqueFd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) {
      reset(std::exchange(other.fd_, -1));
    }
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  // Gives up ownership without closing; returns the descriptor.
  int release() { return std::exchange(fd_, -1); }
  // Closes the descriptor held, if any, and takes fd.
  void reset(int fd = -1) {
    if (fd_ >= 0) {
      ::close(fd_);
    }
    fd_ = fd;
  }

 private:
  int fd_ = -1;
};

}  // namespace collector
