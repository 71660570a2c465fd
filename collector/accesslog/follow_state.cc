#include "collector/accesslog/follow_state.h"

#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <charconv>

#include "collector/common/process.h"
#include "collector/common/unique_fd.h"

namespace accesslog {
namespace {

using collector::ErrnoText;
using collector::UniqueFd;

constexpr std::string_view kMagic = "q7-follow-state 1";
// A real state file is well under 200 bytes plus the path; anything much bigger is not ours.
constexpr size_t kMaxStateBytes = 8192;

template <typename T>
bool ParseNumber(std::string_view text, int base, T* value) {
  const auto [end, result] = std::from_chars(text.data(), text.data() + text.size(), *value, base);
  return !text.empty() && result == std::errc() && end == text.data() + text.size();
}

std::string DirectoryOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) {
    return ".";
  }
  return slash == 0 ? "/" : path.substr(0, slash);
}

bool WriteAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t n = ::write(fd, bytes.data(), bytes.size());
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      return false;
    }
    bytes.remove_prefix(static_cast<size_t>(n));
  }
  return true;
}

// Reads at most limit + 1 bytes, so the caller can tell an oversized file from a full one.
bool ReadSmallFile(int fd, size_t limit, std::string* text) {
  text->clear();
  char chunk[4096];
  while (text->size() <= limit) {
    const ssize_t n = ::read(fd, chunk, sizeof(chunk));
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      return false;
    }
    if (n == 0) {
      break;
    }
    text->append(chunk, static_cast<size_t>(n));
  }
  return true;
}

}  // namespace

uint64_t HashHead(std::string_view bytes) {
  uint64_t hash = 14695981039346656037ull;
  for (const char c : bytes) {
    hash ^= static_cast<unsigned char>(c);
    hash *= 1099511628211ull;
  }
  return hash;
}

std::string FormatFollowState(const FollowState& state) {
  const FilePosition& p = state.position;
  return fmt::format("{}\npath {}\ndev {}\nino {}\noffset {}\nhead {} {:016x}\n", kMagic,
                     state.log_path, p.dev, p.ino, p.offset, p.head_len, p.head_hash);
}

bool ParseFollowState(std::string_view text, FollowState* state, std::string* error) {
  FollowState parsed;
  FilePosition& p = parsed.position;
  enum Seen : unsigned { kPath = 1, kDev = 2, kIno = 4, kOffset = 8, kHead = 16, kAll = 31 };
  unsigned seen = 0;
  int line_number = 0;
  while (!text.empty()) {
    const size_t end = text.find('\n');
    if (end == std::string_view::npos) {
      *error = fmt::format("line {} has no line end", line_number + 1);
      return false;
    }
    const std::string_view line = text.substr(0, end);
    text.remove_prefix(end + 1);
    ++line_number;
    if (line_number == 1) {
      if (line != kMagic) {
        *error = "first line is not \"" + std::string(kMagic) + "\"";
        return false;
      }
      continue;
    }
    const size_t space = line.find(' ');
    const std::string_view key = line.substr(0, space);
    const std::string_view value =
        space == std::string_view::npos ? std::string_view() : line.substr(space + 1);
    unsigned bit = 0;
    bool ok = false;
    if (key == "path") {
      bit = kPath;
      parsed.log_path = std::string(value);
      ok = !value.empty();
    } else if (key == "dev") {
      bit = kDev;
      ok = ParseNumber(value, 10, &p.dev);
    } else if (key == "ino") {
      bit = kIno;
      ok = ParseNumber(value, 10, &p.ino);
    } else if (key == "offset") {
      bit = kOffset;
      ok = ParseNumber(value, 10, &p.offset);
    } else if (key == "head") {
      bit = kHead;
      const size_t gap = value.find(' ');
      ok = gap != std::string_view::npos && ParseNumber(value.substr(0, gap), 10, &p.head_len) &&
           ParseNumber(value.substr(gap + 1), 16, &p.head_hash) && p.head_len <= kHeadBytes;
    }
    if (bit == 0 || (seen & bit) != 0 || !ok) {
      *error = fmt::format("line {} (\"{}\") is unknown, repeated or malformed", line_number,
                           line.substr(0, 80));
      return false;
    }
    seen |= bit;
  }
  if (seen != kAll) {
    *error = line_number == 0 ? std::string("empty") : std::string("a key is missing");
    return false;
  }
  if (p.head_len > p.offset) {
    *error = "head covers more bytes than the offset";
    return false;
  }
  *state = std::move(parsed);
  return true;
}

StateLoad LoadFollowState(const std::string& path, FollowState* state, std::string* error) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    if (errno == ENOENT) {
      return StateLoad::kMissing;
    }
    *error = ErrnoText(path);
    return StateLoad::kFailed;
  }
  std::string text;
  if (!ReadSmallFile(fd.get(), kMaxStateBytes, &text)) {
    *error = ErrnoText(path);
    return StateLoad::kFailed;
  }
  std::string why;
  if (text.size() <= kMaxStateBytes && ParseFollowState(text, state, &why)) {
    return StateLoad::kLoaded;
  }
  if (text.size() > kMaxStateBytes) {
    why = "larger than any state file";
  }
  const std::string bad = path + ".bad";
  if (::rename(path.c_str(), bad.c_str()) != 0) {
    *error = fmt::format("state file {} unusable ({}); setting it aside failed: {}", path, why,
                         ErrnoText(bad));
  } else {
    *error = fmt::format("state file {} unusable ({}); set aside as {}", path, why, bad);
  }
  return StateLoad::kSetAside;
}

bool SaveFollowState(const std::string& path, const FollowState& state, std::string* error) {
  if (state.log_path.find('\n') != std::string::npos) {
    *error = "log path holds a line end; its state cannot be saved";
    return false;
  }
  const std::string temp = path + ".tmp";
  {
    UniqueFd fd(::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    // fchmod as well: a temporary file left by an older run keeps its mode through O_CREAT.
    // The fsync comes before the rename, or a power loss could leave the new name on blocks
    // never written.
    if (!fd.valid() || ::fchmod(fd.get(), 0600) != 0 ||
        !WriteAll(fd.get(), FormatFollowState(state)) || ::fsync(fd.get()) != 0) {
      *error = ErrnoText(temp);
      ::unlink(temp.c_str());
      return false;
    }
  }
  if (::rename(temp.c_str(), path.c_str()) != 0) {
    *error = ErrnoText(path);
    ::unlink(temp.c_str());
    return false;
  }
  // Without this the rename itself may not survive a crash, and the old position would return.
  const std::string dir = DirectoryOf(path);
  UniqueFd dir_fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir_fd.valid() || ::fsync(dir_fd.get()) != 0) {
    *error = ErrnoText(dir);
    return false;
  }
  return true;
}

}  // namespace accesslog
