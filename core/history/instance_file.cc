#include "core/history/instance_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <cassert>
#include <cerrno>
#include <cstring>
#include <utility>

#include "core/history/history_file_name.h"
#include "core/runtime/clog.h"

namespace history {

namespace {

// Large enough that a busy interval costs few writes, small enough to lose little on a crash.
constexpr size_t kBufferBytes = 64 * 1024;

}  // namespace

InstanceFile::InstanceFile(std::string directory, std::string stem, size_t record_size)
    : directory_(std::move(directory)), stem_(std::move(stem)), record_size_(record_size) {
  assert(record_size_ > 0 && "instance records must have a size");
  pending_.reserve(kBufferBytes + record_size_);
}

InstanceFile::~InstanceFile() {
  flush();
}

bool InstanceFile::append(int64_t interval, const void* record) {
  bool ok = true;
  if (interval != interval_) {
    ok = switchTo(interval);
  }
  if (!fd_.valid()) {
    // The failed open was traced once; the records of this interval are only counted.
    ++dropped_;
    return false;
  }
  const std::byte* bytes = static_cast<const std::byte*>(record);
  pending_.insert(pending_.end(), bytes, bytes + record_size_);
  if (pending_.size() >= kBufferBytes) {
    ok = flush() && ok;
  }
  return ok;
}

bool InstanceFile::flush() {
  static const char* const kWhere = "InstanceFile::flush";
  if (pending_.empty()) {
    return true;
  }
  const size_t records = pending_.size() / record_size_;
  const bool written = fd_.valid() && fw::WriteAll(fd_.get(), pending_.data(), pending_.size());
  if (written) {
    committed_ += static_cast<off_t>(pending_.size());
    pending_.clear();
    return true;
  }
  const int saved = errno;
  const std::string path = directory_ + "/" + IntervalFileName(interval_, stem_);
  // Whatever part of the buffer reached the file would misalign every later record.
  if (fd_.valid() && ::ftruncate(fd_.get(), committed_) != 0) {
    CLOG::error("%s cannot cut %s back to %lld bytes: %s", kWhere, path.c_str(),
                static_cast<long long>(committed_), std::strerror(errno));
  }
  CLOG::error("%s dropped %zu records for %s: %s", kWhere, records, path.c_str(),
              std::strerror(saved));
  dropped_ += records;
  pending_.clear();
  return false;
}

bool InstanceFile::switchTo(int64_t interval) {
  static const char* const kWhere = "InstanceFile::switchTo";
  const bool flushed = flush();
  fd_.reset();
  committed_ = 0;
  interval_ = interval;
  if (interval < 0) {
    CLOG::error("%s negative interval start %lld for %s", kWhere, static_cast<long long>(interval),
                stem_.c_str());
    return false;
  }
  const std::string path = directory_ + "/" + IntervalFileName(interval, stem_);
  fw::UniqueFd fd = fw::OpenCreatingParent(path, O_WRONLY | O_CREAT | O_APPEND);
  const off_t size = fd.valid() ? fw::FileSize(fd.get()) : -1;
  if (size < 0) {
    CLOG::error("%s cannot open %s: %s", kWhere, path.c_str(), std::strerror(errno));
    return false;
  }
  const off_t whole = size - size % static_cast<off_t>(record_size_);
  if (whole != size) {
    if (::ftruncate(fd.get(), whole) != 0) {
      CLOG::error("%s cannot cut the partial record off %s: %s", kWhere, path.c_str(),
                  std::strerror(errno));
      return false;
    }
    CLOG::error("%s cut a partial record of %lld bytes off %s", kWhere,
                static_cast<long long>(size - whole), path.c_str());
  }
  fd_ = std::move(fd);
  committed_ = whole;
  return flushed;
}

}  // namespace history
