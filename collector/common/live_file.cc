#include "collector/common/live_file.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <charconv>
#include <cstdio>
#include <filesystem>

#include "collector/common/process.h"

namespace collector {
namespace {

constexpr std::string_view kSuffix = ".sm3";

}  // namespace

LiveFile::LiveFile(LiveFileOptions options) : options_(std::move(options)) {}

std::string LiveFile::live_path() const {
  return options_.dir + "/" + options_.stem + std::string(kSuffix);
}

int64_t LiveFile::HighestNumber() const {
  int64_t highest = 0;
  std::error_code ec;
  const std::string prefix = options_.stem + "-";
  for (const auto& entry : std::filesystem::directory_iterator(options_.dir, ec)) {
    const std::string name = entry.path().filename().string();
    if (!name.starts_with(prefix) || !name.ends_with(kSuffix)) {
      continue;
    }
    const std::string_view digits =
        std::string_view(name).substr(prefix.size(), name.size() - prefix.size() - kSuffix.size());
    int64_t number = 0;
    const auto [end, result] =
        std::from_chars(digits.data(), digits.data() + digits.size(), number);
    if (!digits.empty() && result == std::errc() && end == digits.data() + digits.size()) {
      highest = std::max(highest, number);
    }
  }
  return highest;
}

bool LiveFile::Open(Clock::time_point now, std::string* error) {
  std::error_code ec;
  std::filesystem::create_directories(options_.dir, ec);
  if (ec) {
    *error = options_.dir + ": " + ec.message();
    return false;
  }
  next_number_ = HighestNumber() + 1;
  const std::string path = live_path();
  fd_.reset(::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644));
  if (!fd_.valid()) {
    *error = ErrnoText(path);
    return false;
  }
  struct stat st {};
  if (::fstat(fd_.get(), &st) != 0) {
    *error = ErrnoText(path);
    return false;
  }
  size_ = static_cast<uint64_t>(st.st_size);
  since_ = now;
  return true;
}

bool LiveFile::Append(std::string_view record, Clock::time_point now, std::string* error) {
  if (options_.roll_bytes > 0 && size() > 0 && size() + record.size() > options_.roll_bytes) {
    if (!Flush(error) || !Roll(now, error)) {
      return false;
    }
  }
  if (size() == 0) {
    since_ = now;
  }
  batch_.append(record);
  return true;
}

bool LiveFile::Flush(std::string* error) {
  size_t done = 0;
  while (done < batch_.size()) {
    const ssize_t n = ::write(fd_.get(), batch_.data() + done, batch_.size() - done);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      *error = ErrnoText(live_path()) + "; " + std::to_string(batch_.size()) +
               " bytes of records dropped";
      // A reader must never see a record cut short.
      if (::ftruncate(fd_.get(), static_cast<off_t>(size_)) != 0) {
        *error += "; cannot cut the file back";
      }
      batch_.clear();
      return false;
    }
    done += static_cast<size_t>(n);
  }
  size_ += batch_.size();
  batch_.clear();
  return true;
}

bool LiveFile::Tick(Clock::time_point now, std::string* error) {
  if (options_.roll_seconds <= 0 || size() == 0 ||
      now - since_ < std::chrono::seconds(options_.roll_seconds)) {
    return true;
  }
  return Flush(error) && Roll(now, error);
}

bool LiveFile::Roll(Clock::time_point now, std::string* error) {
  const std::string live = live_path();
  std::string target;
  struct stat st {};
  do {
    char number[24];
    std::snprintf(number, sizeof(number), "-%04lld", static_cast<long long>(next_number_++));
    target = options_.dir + "/" + options_.stem + number + std::string(kSuffix);
  } while (::lstat(target.c_str(), &st) == 0);
  if (::rename(live.c_str(), target.c_str()) != 0) {
    *error = ErrnoText(live + " -> " + target);
    return false;
  }
  // Create the new live file before anything else: the agent re-reads the renamed file on
  // every look while the live name is missing.
  UniqueFd fresh(::open(live.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644));
  if (!fresh.valid()) {
    *error = ErrnoText(live);
    return false;
  }
  fd_ = std::move(fresh);
  size_ = 0;
  since_ = now;
  ++rolled_;
  return true;
}

}  // namespace collector
