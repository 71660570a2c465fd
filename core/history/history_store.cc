#include "core/history/history_store.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <optional>
#include <system_error>
#include <utility>
#include <vector>

#include "core/history/history_file_name.h"
#include "core/runtime/clog.h"
#include "core/runtime/set_aside.h"
#include "framework/atomic_file.h"
#include "framework/file_io.h"
#include "framework/status.h"

namespace history {

namespace {

// An open history file and the number of whole records it holds.
struct RecordFile {
  fw::UniqueFd fd;
  size_t records = 0;
};

// Opens a file for reading its records. A missing file is an empty one, silently; other
// failures and a trailing partial record are traced with `where` and the path.
RecordFile OpenRecords(const std::string& path, size_t record_size, const char* where) {
  RecordFile file;
  file.fd.reset(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!file.fd.valid()) {
    if (errno != ENOENT) {
      CLOG::error("%s cannot open %s: %s", where, path.c_str(), std::strerror(errno));
    }
    return file;
  }
  const off_t size = fw::FileSize(file.fd.get());
  if (size < 0) {
    CLOG::error("%s cannot examine %s: %s", where, path.c_str(), std::strerror(errno));
    file.fd.reset();
    return file;
  }
  const size_t bytes = static_cast<size_t>(size);
  file.records = bytes / record_size;
  if (bytes % record_size != 0) {
    CLOG::error(
        "%s %s holds %zu bytes, not a whole number of %zu-byte records; ignoring the last %zu",
        where, path.c_str(), bytes, record_size, bytes % record_size);
  }
  return file;
}

// Reads up to max_records whole records from the start of an open file; returns how many.
size_t ReadRecords(const RecordFile& file, size_t record_size, size_t max_records, std::byte* out,
                   const std::string& path, const char* where) {
  const size_t wanted = std::min(file.records, max_records);
  if (wanted == 0) {
    return 0;
  }
  const ssize_t got = fw::ReadAt(file.fd.get(), out, wanted * record_size, 0);
  if (got < 0) {
    CLOG::error("%s cannot read %s: %s", where, path.c_str(), std::strerror(errno));
    return 0;
  }
  // The file may have shrunk since it was measured; only whole records count.
  return static_cast<size_t>(got) / record_size;
}

// False when a read over `intervals` intervals has nothing to do; nonsense arguments are traced.
bool ValidWalk(int intervals, int64_t interval_seconds, size_t record_size, const char* where) {
  if (record_size == 0) {
    CLOG::error("%s record size 0", where);
    return false;
  }
  if (intervals > 1 && interval_seconds <= 0) {
    CLOG::error("%s interval length %lld over %d intervals", where,
                static_cast<long long>(interval_seconds), intervals);
    return false;
  }
  return intervals > 0;
}

std::atomic<uint64_t> g_generation{0};
// Nanoseconds every store has spent writing interval files.
std::atomic<uint64_t> g_writeNanos{0};

// Called once a change is in place, so that a reader seeing the new value reads the change.
void Advance() {
  g_generation.fetch_add(1, std::memory_order_release);
}

}  // namespace

double HistoryStore::writeSeconds() {
  return static_cast<double>(g_writeNanos.load()) / 1e9;
}

uint64_t HistoryStore::generation() {
  return g_generation.load(std::memory_order_acquire);
}

HistoryStore::HistoryStore(std::string directory) : directory_(std::move(directory)) {
  while (directory_.size() > 1 && directory_.back() == '/') {
    directory_.pop_back();
  }
}

std::string HistoryStore::pathOf(int64_t interval, std::string_view stem) const {
  return directory_ + "/" + IntervalFileName(interval, stem);
}

bool HistoryStore::saveInterval(int64_t interval, std::string_view stem, const void* records,
                                size_t record_size, size_t count) const {
  return saveIntervalInPieces(interval, stem, record_size, count,
                              [records, record_size](size_t first, size_t n, void* out) {
                                memcpy(out, static_cast<const char*>(records) + first * record_size,
                                       n * record_size);
                              });
}

bool HistoryStore::saveIntervalInPieces(int64_t interval, std::string_view stem, size_t record_size,
                                        size_t count, const RecordFill& fill) const {
  static const char* const kWhere = "HistoryStore::saveInterval";
  const auto started = std::chrono::steady_clock::now();
  struct Timed {
    std::chrono::steady_clock::time_point started;
    ~Timed() {
      g_writeNanos += static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::nanoseconds>(
                                                std::chrono::steady_clock::now() - started)
                                                .count());
    }
  } timed{started};
  if (interval < 0) {
    CLOG::error("%s negative interval start %lld for %.*s", kWhere,
                static_cast<long long>(interval), static_cast<int>(stem.size()), stem.data());
    return false;
  }
  const std::string path = pathOf(interval, stem);
  if (count == 0) {
    if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
      CLOG::error("%s cannot remove %s: %s", kWhere, path.c_str(), std::strerror(errno));
      return false;
    }
    Advance();
    return true;
  }
  // A fixed temporary name, so that cleanup recognises what a crash left behind.
  fw::ReplaceOptions options;
  options.temp_path = directory_ + "/" + TemporaryFileName(interval, stem);
  const auto produce = [&](const fw::ContentSink& sink) {
    std::vector<char> piece(record_size * std::min(count, kPieceRecords));
    for (size_t first = 0; first < count; first += kPieceRecords) {
      const size_t n = std::min(kPieceRecords, count - first);
      std::fill(piece.begin(), piece.end(), 0);  // padding and unset columns write as zeros
      fill(first, n, piece.data());
      if (!sink(std::string_view(piece.data(), n * record_size))) {
        return false;
      }
    }
    return true;
  };
  if (fw::ReplaceFileInPieces(path, produce, options) != fw::kOk) {
    Advance();  // a failure late in the replacement may still have put the file in place
    CLOG::error("%s cannot write %s: %s", kWhere, path.c_str(), std::strerror(errno));
    return false;
  }
  Advance();
  CLOG::med("%s wrote %zu records to %s", kWhere, count, path.c_str());
  return true;
}

size_t HistoryStore::countRows(std::string_view stem, int64_t last_interval, int intervals,
                               int64_t interval_seconds, size_t record_size) const {
  static const char* const kWhere = "HistoryStore::countRows";
  if (!ValidWalk(intervals, interval_seconds, record_size, kWhere)) {
    return 0;
  }
  size_t total = 0;
  for (int i = 0; i < intervals; ++i) {
    const int64_t start = last_interval - i * interval_seconds;
    if (start < 0) {
      break;
    }
    total += OpenRecords(pathOf(start, stem), record_size, kWhere).records;
  }
  return total;
}

size_t HistoryStore::loadRows(std::string_view stem, int64_t last_interval, int intervals,
                              int64_t interval_seconds, size_t record_size, size_t max_rows,
                              void* out) const {
  static const char* const kWhere = "HistoryStore::loadRows";
  if (!ValidWalk(intervals, interval_seconds, record_size, kWhere)) {
    return 0;
  }
  std::byte* next = static_cast<std::byte*>(out);
  size_t loaded = 0;
  for (int i = 0; i < intervals && loaded < max_rows; ++i) {
    const int64_t start = last_interval - i * interval_seconds;
    if (start < 0) {
      break;
    }
    const std::string path = pathOf(start, stem);
    const RecordFile file = OpenRecords(path, record_size, kWhere);
    const size_t got = ReadRecords(file, record_size, max_rows - loaded, next, path, kWhere);
    loaded += got;
    next += got * record_size;
  }
  return loaded;
}

std::vector<std::byte> HistoryStore::loadInterval(int64_t interval, std::string_view stem,
                                                  size_t record_size) const {
  static const char* const kWhere = "HistoryStore::loadInterval";
  std::vector<std::byte> records;
  if (!ValidWalk(1, 0, record_size, kWhere)) {
    return records;
  }
  const std::string path = pathOf(interval, stem);
  const RecordFile file = OpenRecords(path, record_size, kWhere);
  if (file.fd.valid() && static_cast<size_t>(fw::FileSize(file.fd.get())) % record_size != 0) {
    // Interval files are only ever replaced whole: this one is damaged or not ours, and its
    // records cannot be trusted to be rows.
    if (SetAsideTraced("History file", path, "not a whole number of records")) {
      Advance();
    }
    return records;
  }
  records.resize(file.records * record_size);
  const size_t got = ReadRecords(file, record_size, file.records, records.data(), path, kWhere);
  records.resize(got * record_size);
  return records;
}

int HistoryStore::cleanupOldFiles(int64_t now, int64_t summary_seconds) const {
  const int64_t oldest_kept = now - summary_seconds;
  return removeFiles([oldest_kept](int64_t start) { return start < oldest_kept; },
                     "HistoryStore::cleanupOldFiles");
}

int HistoryStore::removeIntervalsAfter(int64_t last_kept) const {
  return removeFiles([last_kept](int64_t start) { return start > last_kept; },
                     "HistoryStore::removeIntervalsAfter");
}

int HistoryStore::removeFiles(const std::function<bool(int64_t)>& remove, const char* where) const {
  namespace fs = std::filesystem;
  int removed = 0;
  std::error_code ec;
  fs::directory_iterator it(directory_, ec);
  if (ec) {
    if (ec != std::errc::no_such_file_or_directory) {
      CLOG::error("%s cannot list %s: %s", where, directory_.c_str(), ec.message().c_str());
    }
    return 0;
  }
  for (; !ec && it != fs::directory_iterator(); it.increment(ec)) {
    const std::string name = it->path().filename().string();
    const std::optional<int64_t> start = IntervalOfStoreFile(name);
    if (!start || !remove(*start)) {
      continue;
    }
    // A directory or link that happens to carry such a name is not ours.
    std::error_code type_ec;
    if (it->symlink_status(type_ec).type() != fs::file_type::regular) {
      continue;
    }
    const std::string path = it->path().string();
    if (::unlink(path.c_str()) != 0) {
      CLOG::error("%s cannot remove %s: %s", where, path.c_str(), std::strerror(errno));
      continue;
    }
    Advance();
    CLOG::med("%s removed %s", where, path.c_str());
    ++removed;
  }
  if (ec) {
    CLOG::error("%s listing %s stopped: %s", where, directory_.c_str(), ec.message().c_str());
  }
  return removed;
}

bool HistoryStore::truncateInterval(int64_t interval, std::string_view stem, off_t bytes) const {
  const std::string path = pathOf(interval, stem);
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) {
    if (errno == ENOENT && bytes == 0) {
      return true;
    }
    CLOG::error("%s cannot examine %s: %s", "HistoryStore::truncateInterval", path.c_str(),
                std::strerror(errno));
    return false;
  }
  if (st.st_size <= bytes) {
    return true;  // nothing was written after that length
  }
  if (::truncate(path.c_str(), bytes) != 0) {
    CLOG::error("%s cannot cut %s back to %lld bytes: %s", "HistoryStore::truncateInterval",
                path.c_str(), static_cast<long long>(bytes), std::strerror(errno));
    return false;
  }
  Advance();
  CLOG::min("%s cut %s back from %lld to %lld bytes", "HistoryStore::truncateInterval",
            path.c_str(), static_cast<long long>(st.st_size), static_cast<long long>(bytes));
  return true;
}

}  // namespace history
