#include "core/history/state_file.h"

#include <fcntl.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <utility>

#include "core/runtime/clog.h"
#include "framework/atomic_file.h"
#include "framework/file_io.h"
#include "framework/status.h"

namespace history {

namespace {

constexpr std::string_view kLastQueryPrefix = "LastHistoricalQueryTime.";

}  // namespace

StateFile::StateFile(std::string path) : path_(std::move(path)) {}

bool StateFile::load() {
  static const char* const kWhere = "StateFile::load";
  last_query_.clear();
  other_lines_.clear();
  fw::UniqueFd fd(::open(path_.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    if (errno == ENOENT) {
      return true;
    }
    CLOG::error("%s cannot open %s: %s", kWhere, path_.c_str(), std::strerror(errno));
    return false;
  }
  const off_t size = fw::FileSize(fd.get());
  std::string text(size > 0 ? static_cast<size_t>(size) : 0, '\0');
  const ssize_t got = size < 0 ? -1 : fw::ReadAt(fd.get(), text.data(), text.size(), 0);
  if (got < 0) {
    CLOG::error("%s cannot read %s: %s", kWhere, path_.c_str(), std::strerror(errno));
    return false;
  }
  text.resize(static_cast<size_t>(got));

  std::string_view rest = text;
  while (!rest.empty()) {
    const size_t end = rest.find('\n');
    std::string_view line = rest.substr(0, end);
    rest.remove_prefix(end == std::string_view::npos ? rest.size() : end + 1);
    // Every trailing CR: a line kept with one would be written back as a line that reads
    // without it.
    while (line.ends_with('\r')) {
      line.remove_suffix(1);
    }
    if (line.empty()) {
      continue;
    }
    const size_t equals = line.find('=');
    if (!line.starts_with(kLastQueryPrefix) || equals == std::string_view::npos) {
      other_lines_.emplace_back(line);
      continue;
    }
    const std::string_view table =
        line.substr(kLastQueryPrefix.size(), equals - kLastQueryPrefix.size());
    const std::string_view value = line.substr(equals + 1);
    int64_t seconds = 0;
    const auto [ptr, ec] = std::from_chars(value.data(), value.data() + value.size(), seconds);
    if (table.empty() || ec != std::errc() || ptr != value.data() + value.size()) {
      CLOG::error("%s skipping bad line in %s: %.*s", kWhere, path_.c_str(),
                  static_cast<int>(line.size()), line.data());
      continue;
    }
    last_query_[std::string(table)] = seconds;
  }
  return true;
}

bool StateFile::save() const {
  std::string text;
  for (const std::string& line : other_lines_) {
    text += line;
    text += '\n';
  }
  for (const auto& [table, seconds] : last_query_) {
    text += kLastQueryPrefix;
    text += table;
    text += '=';
    text += std::to_string(seconds);
    text += '\n';
  }
  if (fw::ReplaceFile(path_, text, {0644, path_ + ".tmp"}) != fw::kOk) {
    CLOG::error("StateFile::save cannot write %s: %s", path_.c_str(), std::strerror(errno));
    return false;
  }
  return true;
}

std::optional<int64_t> StateFile::getLastHistoricalQueryTime(std::string_view table) const {
  const auto it = last_query_.find(table);
  if (it == last_query_.end()) {
    return std::nullopt;
  }
  return it->second;
}

void StateFile::setLastHistoricalQueryTime(std::string_view table, int64_t seconds) {
  last_query_.insert_or_assign(std::string(table), seconds);
}

}  // namespace history
