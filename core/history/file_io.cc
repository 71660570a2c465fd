#include "core/history/file_io.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "core/runtime/misc.h"

namespace history {

namespace {

std::string ParentOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) {
    return ".";
  }
  return slash == 0 ? "/" : path.substr(0, slash);
}

// Best effort: a failure leaves the rename possibly undone after a power loss, never a
// half-written file, so it is not reported.
void SyncDirectory(const std::string& dir) {
  UniqueFd fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (fd.valid()) {
    ::fsync(fd.get());
  }
}

}  // namespace

UniqueFd& UniqueFd::operator=(UniqueFd&& other) noexcept {
  if (this != &other) {
    reset(other.release());
  }
  return *this;
}

int UniqueFd::release() {
  const int fd = fd_;
  fd_ = -1;
  return fd;
}

void UniqueFd::reset(int fd) {
  if (fd_ >= 0) {
    // close(2) may fail with EINTR on Linux, but the descriptor is released either way.
    ::close(fd_);
  }
  fd_ = fd;
}

UniqueFd OpenCreatingParent(const std::string& path, int flags, mode_t mode) {
  UniqueFd fd(::open(path.c_str(), flags | O_CLOEXEC, mode));
  if (!fd.valid() && errno == ENOENT && (flags & O_CREAT) != 0) {
    if (CMisc::mkdirs(ParentOf(path).c_str()) == 0) {
      fd.reset(::open(path.c_str(), flags | O_CLOEXEC, mode));
    }
  }
  return fd;
}

bool WriteAll(int fd, const void* data, size_t size) {
  const char* p = static_cast<const char*>(data);
  while (size > 0) {
    const ssize_t n = ::write(fd, p, size);
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      return false;
    }
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

ssize_t ReadAt(int fd, void* out, size_t size, off_t offset) {
  char* p = static_cast<char*>(out);
  size_t done = 0;
  while (done < size) {
    const ssize_t n = ::pread(fd, p + done, size - done, offset + static_cast<off_t>(done));
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      return -1;
    }
    if (n == 0) {
      break;
    }
    done += static_cast<size_t>(n);
  }
  return static_cast<ssize_t>(done);
}

off_t FileSize(int fd) {
  struct stat st;
  if (::fstat(fd, &st) != 0) {
    return -1;
  }
  return st.st_size;
}

bool ReplaceFileContents(const std::string& path, const std::string& temp_path, const void* data,
                         size_t size) {
  bool ok = false;
  {
    UniqueFd fd = OpenCreatingParent(temp_path, O_WRONLY | O_CREAT | O_TRUNC);
    // Without the fsync before the rename, a power loss could leave the new name pointing at
    // blocks that were never written.
    ok = fd.valid() && WriteAll(fd.get(), data, size) && ::fsync(fd.get()) == 0;
  }
  if (ok && ::rename(temp_path.c_str(), path.c_str()) == 0) {
    SyncDirectory(ParentOf(path));
    return true;
  }
  const int saved = errno;
  ::unlink(temp_path.c_str());
  errno = saved;
  return false;
}

}  // namespace history
