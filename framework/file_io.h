#pragma once

// Small POSIX file helpers shared by the history files, the state file and the file manager:
// an owning file descriptor, and whole-buffer reads and writes that survive short transfers and
// EINTR. Whole files are replaced with fw::ReplaceFile (framework/atomic_file.h).
//
// Nothing here traces; failures come back as results with errno set by the failing call, so the
// caller can name the file it was working on.
//
// Thread safety: plain functions; a UniqueFd is used by one thread at a time.

#include <sys/types.h>

#include <cstddef>
#include <string>

namespace fw {

// Owns one file descriptor and closes it on destruction. -1 means "none".
class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  ~UniqueFd() { reset(); }
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept;
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  // Gives up ownership without closing.
  int release();
  // Closes the descriptor held, if any, and takes fd.
  void reset(int fd = -1);

 private:
  int fd_ = -1;
};

// open(2) with O_CLOEXEC added. When the parent directory is missing, creates it (and its
// parents) and tries once more, so a fresh installation needs no separate set-up step.
UniqueFd OpenCreatingParent(const std::string& path, int flags, mode_t mode = 0644);

// Writes all `size` bytes at the file's current offset. False on the first failing write.
bool WriteAll(int fd, const void* data, size_t size);

// Reads up to `size` bytes from `offset`, stopping early only at end of file. Returns the
// bytes read, or -1 on a read error.
ssize_t ReadAt(int fd, void* out, size_t size, off_t offset);

// Size of the open file, or -1 when fstat fails.
off_t FileSize(int fd);

}  // namespace fw
