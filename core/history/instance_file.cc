#include "core/history/instance_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <cassert>
#include <cerrno>
#include <cstring>
#include <utility>

#include "core/history/history_file_name.h"
#include "core/runtime/clog.h"
#include "framework/file_io.h"

namespace history {

namespace {

// Large enough that a busy interval costs few writes, small enough to lose little on a crash.
constexpr size_t kBufferBytes = 64 * 1024;

}  // namespace

InstanceFile::InstanceFile(std::string directory, std::string stem, size_t record_size)
    : directory_(std::move(directory)), stem_(std::move(stem)), record_size_(record_size) {
  assert(record_size_ > 0 && "instance records must have a size");
}

InstanceFile::~InstanceFile() {
  flush();
}

bool InstanceFile::append(int64_t interval, const void* record) {
  static const char* const kWhere = "InstanceFile::append";
  if (interval < 0) {
    CLOG::error("%s negative interval start %lld for %s", kWhere, static_cast<long long>(interval),
                stem_.c_str());
    ++dropped_;
    return false;
  }
  if (held_bytes_ + record_size_ > kMaxHeldBytes) {
    if (dropped_++ == 0 || dropped_ % 10000 == 0) {
      CLOG::error("%s %zu bytes of %s records are held back unwritten; %llu records dropped",
                  kWhere, held_bytes_, stem_.c_str(), static_cast<unsigned long long>(dropped_));
    }
    return false;
  }
  interval_ = interval;
  if (pending_.empty() || pending_.back().interval != interval) {
    pending_.push_back({interval, {}});
    pending_.back().bytes.reserve(kBufferBytes + record_size_);
  }
  const std::byte* bytes = static_cast<const std::byte*>(record);
  pending_.back().bytes.insert(pending_.back().bytes.end(), bytes, bytes + record_size_);
  held_bytes_ += record_size_;
  // A failing disk is tried again at the next flush, not at every record.
  if (pending_.back().bytes.size() >= kBufferBytes && !failing_) {
    return flush();
  }
  return true;
}

bool InstanceFile::flush() {
  static const char* const kWhere = "InstanceFile::flush";
  size_t written = 0;
  size_t recordsWritten = 0;
  for (; written < pending_.size(); ++written) {
    std::string path;
    if (!write(pending_[written], &path)) {
      if (!failing_) {
        CLOG::error("%s cannot write %s: %s; holding %zu records to write later", kWhere,
                    path.c_str(), std::strerror(errno), held_bytes_ / record_size_);
      }
      failing_ = true;
      break;
    }
    held_bytes_ -= pending_[written].bytes.size();
    recordsWritten += pending_[written].bytes.size() / record_size_;
  }
  pending_.erase(pending_.begin(), pending_.begin() + static_cast<std::ptrdiff_t>(written));
  if (failing_ && pending_.empty()) {
    failing_ = false;
    CLOG::min("%s %s records are written again (%zu caught up)", kWhere, stem_.c_str(),
              recordsWritten);
  }
  return pending_.empty();
}

bool InstanceFile::write(const Pending& pending, std::string* path) const {
  static const char* const kWhere = "InstanceFile::write";
  *path = directory_ + "/" + IntervalFileName(pending.interval, stem_);
  if (pending.bytes.empty()) {
    return true;
  }
  fw::UniqueFd fd = fw::OpenCreatingParent(*path, O_WRONLY | O_CREAT | O_APPEND);
  const off_t size = fd.valid() ? fw::FileSize(fd.get()) : -1;
  if (size < 0) {
    return false;
  }
  const off_t whole = size - size % static_cast<off_t>(record_size_);
  if (whole != size) {
    if (::ftruncate(fd.get(), whole) != 0) {
      return false;
    }
    CLOG::error("%s cut a partial record of %lld bytes off %s", kWhere,
                static_cast<long long>(size - whole), path->c_str());
  }
  if (fw::WriteAll(fd.get(), pending.bytes.data(), pending.bytes.size())) {
    return true;
  }
  // Whatever part of the records reached the file would misalign every later record.
  const int saved = errno;
  if (::ftruncate(fd.get(), whole) != 0) {
    CLOG::error("%s cannot cut %s back to %lld bytes: %s", kWhere, path->c_str(),
                static_cast<long long>(whole), std::strerror(errno));
  }
  errno = saved;
  return false;
}

}  // namespace history
