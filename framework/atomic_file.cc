#include "framework/atomic_file.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "framework/status.h"

namespace fw {
namespace {

std::string ParentOf(const std::string& path) {
  const std::string parent = std::filesystem::path(path).parent_path().string();
  return parent.empty() ? "." : parent;
}

bool WriteAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t n = ::write(fd, bytes.data(), bytes.size());
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      if (n == 0) {
        errno = EIO;
      }
      return false;
    }
    bytes.remove_prefix(static_cast<size_t>(n));
  }
  return true;
}

// Creates the temporary file, and the directories above it when they are missing.
int CreateTemp(std::string* temp, bool unique) {
  const auto create = [&] {
    if (unique) {
      return ::mkostemp(temp->data(), O_CLOEXEC);
    }
    return ::open(temp->c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  };
  const std::string pattern = *temp;
  int fd = create();
  if (fd < 0 && errno == ENOENT) {
    std::error_code ec;
    std::filesystem::create_directories(ParentOf(pattern), ec);
    *temp = pattern;  // mkostemp rewrote the X's
    fd = create();
    if (fd < 0 && ec) {
      errno = ec.value();
    }
  }
  return fd;
}

// The crash-test hook: the path fragment named by Q7_KILL_DURING_WRITE, read once.
const std::string& KillDuringWrite() {
  static const std::string fragment = [] {
    const char* value = std::getenv("Q7_KILL_DURING_WRITE");
    return std::string(value != nullptr ? value : "");
  }();
  return fragment;
}

}  // namespace

int ReplaceFile(const std::string& path, std::string_view contents, const ReplaceOptions& options,
                ReplaceResult* result, std::string* error) {
  return ReplaceFileInPieces(
      path, [contents](const ContentSink& sink) { return sink(contents); }, options, result, error);
}

int ReplaceFileInPieces(const std::string& path,
                        const std::function<bool(const ContentSink&)>& produce,
                        const ReplaceOptions& options, ReplaceResult* result, std::string* error) {
  ReplaceResult local;
  ReplaceResult& r = result != nullptr ? *result : local;
  r = ReplaceResult{};
  const bool unique = options.temp_path.empty();
  std::string temp = unique ? path + ".tmp.XXXXXX" : options.temp_path;
  const auto fail = [&](ReplaceStep step) {
    r.failed = step;
    r.error_number = errno;
    if (error != nullptr) {
      *error = "cannot write " + path + ": " + std::strerror(r.error_number);
    }
    if (step != ReplaceStep::kCreate) {
      ::unlink(temp.c_str());
    }
    errno = r.error_number;
    return kIoError;
  };

  const int fd = CreateTemp(&temp, unique);
  if (fd < 0) {
    return fail(ReplaceStep::kCreate);
  }
  struct stat st {};
  // Without the fsync before the rename, a power cut could leave the new name pointing at
  // blocks that were never written. The time is taken before the rename, which keeps it, so a
  // later write by someone else is never mistaken for this one.
  errno = 0;
  const bool killMidway =
      !KillDuringWrite().empty() && path.find(KillDuringWrite()) != std::string::npos;
  bool written = ::fchmod(fd, options.mode) == 0 &&
                 produce([fd, killMidway](std::string_view piece) {
                   if (killMidway) {
                     // Half the first piece reaches the file, then the process dies.
                     WriteAll(fd, piece.substr(0, piece.size() / 2));
                     ::raise(SIGKILL);
                   }
                   return WriteAll(fd, piece);
                 }) &&
                 ::fsync(fd) == 0 && ::fstat(fd, &st) == 0;
  const int saved = errno;
  written = ::close(fd) == 0 && written;
  if (!written) {
    errno = saved != 0 ? saved : (errno != 0 ? errno : EIO);
    return fail(ReplaceStep::kWrite);
  }
  r.modified = st.st_mtim;
  if (::rename(temp.c_str(), path.c_str()) != 0) {
    return fail(ReplaceStep::kRename);
  }
  const int dir = ::open(ParentOf(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dir >= 0) {
    ::fsync(dir);  // best effort: makes the rename itself durable
    ::close(dir);
  }
  return kOk;
}

std::string SetFileAside(const std::string& path) {
  const std::string aside = path + ".bad";
  if (::rename(path.c_str(), aside.c_str()) != 0) {
    return "";
  }
  return aside;
}

}  // namespace fw
