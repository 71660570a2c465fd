#include "collector/accesslog/log_follower.h"

#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "collector/common/process.h"

namespace accesslog {
namespace {

using collector::ErrnoText;
using collector::UniqueFd;

constexpr size_t kChunkBytes = 64 << 10;

// Reads up to `size` bytes from offset 0; fewer only at the end of the file.
bool ReadHead(int fd, size_t size, std::string* head) {
  head->assign(size, '\0');
  size_t got = 0;
  while (got < size) {
    const ssize_t n = ::pread(fd, head->data() + got, size - got, static_cast<off_t>(got));
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      return false;
    }
    if (n == 0) {
      break;
    }
    got += static_cast<size_t>(n);
  }
  head->resize(got);
  return true;
}

// Opens a log for reading. O_NONBLOCK so that a FIFO put at the path cannot hang the open.
// True with *fd left empty when nothing is at path.
bool OpenLog(const std::string& path, UniqueFd* fd, struct stat* st, std::string* error) {
  UniqueFd opened(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  if (!opened.valid()) {
    if (errno == ENOENT) {
      return true;
    }
    *error = ErrnoText(path);
    return false;
  }
  if (::fstat(opened.get(), st) != 0) {
    *error = ErrnoText(path);
    return false;
  }
  *fd = std::move(opened);
  return true;
}

}  // namespace

LogFollower::LogFollower(std::string path, FollowOptions options)
    : path_(std::move(path)), options_(std::move(options)), chunk_(kChunkBytes) {}

bool LogFollower::Start(std::string* error) {
  if (options_.one_shot) {
    return StartOneShot(error);
  }
  FollowState saved;
  bool have_saved = false;
  if (!options_.state_path.empty()) {
    std::string why;
    switch (LoadFollowState(options_.state_path, &saved, &why)) {
      case StateLoad::kLoaded:
        have_saved = true;
        break;
      case StateLoad::kMissing:
        break;
      case StateLoad::kSetAside:
        ++stats_.state_set_aside;
        Note(why);
        break;
      case StateLoad::kFailed:
        *error = why;
        return false;
    }
  }
  if (have_saved && saved.log_path != path_) {
    Note(fmt::format("state file {} belongs to {}, not {}; not used", options_.state_path,
                     saved.log_path, path_));
    have_saved = false;
  }
  if (!have_saved) {
    return OpenPath(!options_.from_start, error);
  }
  // Until a file is open, Commit leaves the saved position alone.
  last_saved_ = saved.position;
  saved_once_ = true;
  bool opened = false;
  if (!OpenIfSaved(path_, saved.position, &opened, error)) {
    return false;
  }
  if (opened) {
    Note(fmt::format("resuming {} at offset {}", path_, consumed_));
    return true;
  }
  const std::string rotated = path_ + options_.rotated_suffix;
  if (!OpenIfSaved(rotated, saved.position, &opened, error)) {
    return false;
  }
  if (opened) {
    Note(fmt::format("{} was rotated while stopped; finishing {} from offset {}", path_, rotated,
                     consumed_));
    return true;
  }
  Note(fmt::format("the file last read at {} is gone; reading the current one from 0", path_));
  return OpenPath(/*at_end=*/false, error);
}

bool LogFollower::StartOneShot(std::string* error) {
  UniqueFd fd;
  struct stat st {};
  if (!OpenLog(path_, &fd, &st, error)) {
    return false;
  }
  if (!fd.valid()) {
    errno = ENOENT;
    *error = ErrnoText(path_);
    return false;
  }
  Adopt(std::move(fd), st, 0);
  return true;
}

bool LogFollower::OpenIfSaved(const std::string& path, const FilePosition& saved, bool* opened,
                              std::string* error) {
  *opened = false;
  UniqueFd fd;
  struct stat st {};
  if (!OpenLog(path, &fd, &st, error)) {
    return false;
  }
  // The inode and the head decide, not st_dev: device numbers are handed out at mount time and
  // may differ after a reboot, which would replay the whole file.
  if (!fd.valid() || static_cast<uint64_t>(st.st_ino) != saved.ino ||
      static_cast<uint64_t>(st.st_size) < saved.offset) {
    return true;
  }
  std::string head;
  if (!ReadHead(fd.get(), saved.head_len, &head)) {
    *error = ErrnoText(path);
    return false;
  }
  if (head.size() != saved.head_len || (saved.head_len != 0 && HashHead(head) != saved.head_hash)) {
    return true;
  }
  Adopt(std::move(fd), st, saved.offset);
  head_len_ = saved.head_len;
  head_hash_ = saved.head_hash;
  *opened = true;
  return true;
}

bool LogFollower::OpenPath(bool at_end, std::string* error) {
  UniqueFd fd;
  struct stat st {};
  if (!OpenLog(path_, &fd, &st, error)) {
    return false;
  }
  if (!fd.valid()) {
    return true;
  }
  Adopt(std::move(fd), st, 0);
  if (at_end && st.st_size > 0) {
    uint64_t offset = 0;
    if (!LastLineStart(static_cast<uint64_t>(st.st_size), &offset, error)) {
      return false;
    }
    Note(fmt::format("no saved position; starting {} at offset {} of {}", path_, offset,
                     st.st_size));
  }
  return true;
}

void LogFollower::Adopt(UniqueFd fd, const struct stat& st, uint64_t offset) {
  fd_ = std::move(fd);
  dev_ = static_cast<uint64_t>(st.st_dev);
  ino_ = static_cast<uint64_t>(st.st_ino);
  head_len_ = 0;
  head_hash_ = 0;
  quiet_polls_ = 0;
  ResetReading(offset);
}

bool LogFollower::LastLineStart(uint64_t size, uint64_t* offset, std::string* error) {
  // Starting at the start of the last line keeps a line being written whole; looking further
  // back than the longest line we keep is pointless.
  uint64_t end = size;
  const uint64_t floor =
      size > options_.max_line_bytes + 1 ? size - options_.max_line_bytes - 1 : 0;
  while (end > floor) {
    const size_t want = static_cast<size_t>(std::min<uint64_t>(chunk_.size(), end - floor));
    const uint64_t from = end - want;
    const ssize_t n = ::pread(fd_.get(), chunk_.data(), want, static_cast<off_t>(from));
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      *error = ErrnoText(path_);
      return false;
    }
    if (static_cast<size_t>(n) != want) {
      break;  // shrank under us; start at the end below
    }
    for (size_t i = want; i > 0; --i) {
      if (chunk_[i - 1] == '\n') {
        *offset = from + i;
        ResetReading(*offset);
        return true;
      }
    }
    end = from;
  }
  *offset = floor == 0 && end == 0 ? 0 : size;
  ResetReading(*offset);
  // No line start within reach: what ends the current line is dropped, as for any long line.
  skipping_ = *offset != 0;
  return true;
}

void LogFollower::ResetReading(uint64_t offset) {
  consumed_ = offset;
  read_offset_ = offset;
  partial_.clear();
  skipping_ = false;
}

bool LogFollower::Poll(const LineFn& on_line, std::string* error) {
  caught_up_ = true;
  if (at_end_) {
    return true;
  }
  if (!fd_.valid()) {
    if (options_.one_shot) {
      *error = path_ + ": not open";
      return false;
    }
    if (!OpenPath(/*at_end=*/false, error)) {
      return false;
    }
    if (!fd_.valid()) {
      return true;
    }
    Note(fmt::format("{} appeared; reading it from 0", path_));
  }
  size_t budget = options_.max_poll_bytes;
  bool switched = false;
  for (;;) {
    if (!options_.one_shot && !CheckTruncation(error)) {
      return false;
    }
    const uint64_t before = stats_.bytes_read;
    switch (ReadAvailable(on_line, &budget, error)) {
      case ReadResult::kError:
        return false;
      case ReadResult::kBudget:
        caught_up_ = false;
        return true;
      case ReadResult::kEnd:
        break;
    }
    if (options_.one_shot) {
      FlushTail(on_line);
      at_end_ = true;
      fd_.reset();
      return true;
    }
    if (switched) {
      return true;  // one move per poll: a log rotated again at once waits for the next
    }
    if (!FollowRotation(on_line, stats_.bytes_read - before, &budget, &switched, error)) {
      return false;
    }
    if (!switched) {
      return true;
    }
  }
}

bool LogFollower::FollowRotation(const LineFn& on_line, uint64_t read_this_poll, size_t* budget,
                                 bool* switched, std::string* error) {
  *switched = false;
  struct stat st {};
  if (::stat(path_.c_str(), &st) != 0) {
    if (errno == ENOENT) {
      return true;  // between the rename and the create: the old file may still grow
    }
    *error = ErrnoText(path_);
    return false;
  }
  if (static_cast<uint64_t>(st.st_dev) == dev_ && static_cast<uint64_t>(st.st_ino) == ino_) {
    quiet_polls_ = 0;
    return true;
  }
  if (st.st_size == 0) {
    // The server may not have reopened its log yet and still write to the old file.
    quiet_polls_ = read_this_poll > 0 ? 0 : quiet_polls_ + 1;
    if (quiet_polls_ < options_.rotate_wait_polls) {
      return true;
    }
  }
  // Whatever is at the path now is what we move to; its own fstat is what we remember.
  UniqueFd next;
  if (!OpenLog(path_, &next, &st, error)) {
    return false;
  }
  if (!next.valid()) {
    return true;
  }
  // Lines written to the old file just before the server reopened its log may have arrived
  // since the read that found its end.
  switch (ReadAvailable(on_line, budget, error)) {
    case ReadResult::kError:
      return false;
    case ReadResult::kBudget:
      caught_up_ = false;
      return true;
    case ReadResult::kEnd:
      break;
  }
  FlushTail(on_line);
  Adopt(std::move(next), st, 0);
  ++stats_.rotations;
  Note(fmt::format("{} was rotated; reading the new file from 0", path_));
  *switched = true;
  return true;
}

bool LogFollower::CheckTruncation(std::string* error) {
  struct stat st {};
  if (::fstat(fd_.get(), &st) != 0) {
    *error = ErrnoText(path_);
    return false;
  }
  bool truncated = static_cast<uint64_t>(st.st_size) < read_offset_;
  if (!truncated && !HeadChanged(&truncated, error)) {
    return false;
  }
  if (truncated) {
    ++stats_.truncations;
    Note(fmt::format("{} shrank or changed below offset {} (now {} bytes); reading it from 0",
                     path_, read_offset_, st.st_size));
    ResetReading(0);
    head_len_ = 0;
    head_hash_ = 0;
  }
  return true;
}

bool LogFollower::HeadChanged(bool* changed, std::string* error) {
  *changed = false;
  if (head_len_ == 0) {
    return true;
  }
  std::string head;
  if (!ReadHead(fd_.get(), head_len_, &head)) {
    *error = ErrnoText(path_);
    return false;
  }
  *changed = head.size() != head_len_ || HashHead(head) != head_hash_;
  return true;
}

bool LogFollower::UpdateHead(std::string* error) {
  const auto want = static_cast<uint32_t>(std::min<uint64_t>(kHeadBytes, consumed_));
  if (want <= head_len_) {
    return true;
  }
  std::string head;
  if (!ReadHead(fd_.get(), want, &head)) {
    *error = ErrnoText(path_);
    return false;
  }
  if (head.size() == want) {  // else it shrank meanwhile, which the next poll notices
    head_len_ = want;
    head_hash_ = HashHead(head);
  }
  return true;
}

LogFollower::ReadResult LogFollower::ReadAvailable(const LineFn& on_line, size_t* budget,
                                                   std::string* error) {
  while (*budget > 0) {
    const size_t want = std::min(chunk_.size(), *budget);
    const ssize_t n = ::pread(fd_.get(), chunk_.data(), want, static_cast<off_t>(read_offset_));
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      *error = ErrnoText(path_);
      return ReadResult::kError;
    }
    if (n == 0) {
      return UpdateHead(error) ? ReadResult::kEnd : ReadResult::kError;
    }
    const uint64_t at = read_offset_;
    read_offset_ += static_cast<uint64_t>(n);
    *budget -= static_cast<size_t>(n);
    stats_.bytes_read += static_cast<uint64_t>(n);
    TakeBytes(std::string_view(chunk_.data(), static_cast<size_t>(n)), at, on_line);
  }
  return UpdateHead(error) ? ReadResult::kBudget : ReadResult::kError;
}

void LogFollower::TakeBytes(std::string_view bytes, uint64_t at, const LineFn& on_line) {
  size_t pos = 0;
  while (pos < bytes.size()) {
    const void* found = std::memchr(bytes.data() + pos, '\n', bytes.size() - pos);
    if (found == nullptr) {
      const std::string_view rest = bytes.substr(pos);
      if (skipping_) {
        return;
      }
      if (partial_.size() + rest.size() > options_.max_line_bytes) {
        skipping_ = true;
        partial_.clear();
      } else {
        partial_.append(rest);
      }
      return;
    }
    const size_t end = static_cast<size_t>(static_cast<const char*>(found) - bytes.data());
    const std::string_view piece = bytes.substr(pos, end - pos);
    pos = end + 1;
    consumed_ = at + pos;
    if (skipping_ || partial_.size() + piece.size() > options_.max_line_bytes) {
      ++stats_.long_lines;
      skipping_ = false;
      partial_.clear();
    } else if (partial_.empty()) {
      Emit(piece, on_line);
    } else {
      partial_.append(piece);
      Emit(partial_, on_line);
      partial_.clear();
    }
  }
}

void LogFollower::Emit(std::string_view line, const LineFn& on_line) {
  ++stats_.lines;
  on_line(line);
}

void LogFollower::FlushTail(const LineFn& on_line) {
  consumed_ = read_offset_;
  if (skipping_) {
    ++stats_.long_lines;
  } else if (!partial_.empty()) {
    ++stats_.unterminated_lines;
    Emit(partial_, on_line);
  }
  partial_.clear();
  skipping_ = false;
}

bool LogFollower::Commit(std::string* error) {
  if (!fd_.valid()) {
    return true;
  }
  return UpdateHead(error) && CommitAt(position(), error);
}

bool LogFollower::CommitAt(const FilePosition& at, std::string* error) {
  if (options_.state_path.empty() || options_.one_shot || at.ino == 0) {
    return true;
  }
  if (saved_once_ && at == last_saved_) {
    return true;
  }
  if (!SaveFollowState(options_.state_path, FollowState{path_, at}, error)) {
    return false;
  }
  last_saved_ = at;
  saved_once_ = true;
  ++stats_.commits;
  return true;
}

FilePosition LogFollower::position() const {
  if (!fd_.valid()) {
    return FilePosition{};
  }
  return FilePosition{dev_, ino_, consumed_, head_len_, head_hash_};
}

std::vector<std::string> LogFollower::TakeNotes() {
  return std::exchange(notes_, {});
}

void LogFollower::Note(std::string text) {
  notes_.push_back(std::move(text));
}

}  // namespace accesslog
