#include "core/history/history_file_name.h"

#include <charconv>

namespace history {

namespace {

constexpr std::string_view kSuffix = ".dat";
constexpr std::string_view kTempPrefix = ".";
constexpr std::string_view kTempSuffix = ".tmp";

bool StripPrefix(std::string_view& text, std::string_view prefix) {
  if (!text.starts_with(prefix)) {
    return false;
  }
  text.remove_prefix(prefix.size());
  return true;
}

bool StripSuffix(std::string_view& text, std::string_view suffix) {
  if (!text.ends_with(suffix)) {
    return false;
  }
  text.remove_suffix(suffix.size());
  return true;
}

}  // namespace

std::string IntervalFileName(int64_t interval_start, std::string_view stem) {
  std::string name = std::to_string(interval_start);
  name += '_';
  name += std::to_string(kFormatVersion);
  name += '_';
  name += stem;
  name += kSuffix;
  return name;
}

std::string TemporaryFileName(int64_t interval_start, std::string_view stem) {
  return std::string(kTempPrefix) + IntervalFileName(interval_start, stem) +
         std::string(kTempSuffix);
}

std::optional<int64_t> IntervalOfStoreFile(std::string_view name) {
  if (StripPrefix(name, kTempPrefix) && !StripSuffix(name, kTempSuffix)) {
    return std::nullopt;
  }
  if (!StripSuffix(name, kSuffix)) {
    return std::nullopt;
  }
  // What is left is "<digits>_<version>_<stem>".
  const size_t digits = name.find_first_not_of("0123456789");
  if (digits == 0 || digits == std::string_view::npos) {
    return std::nullopt;
  }
  int64_t start = 0;
  const auto [end, ec] = std::from_chars(name.data(), name.data() + digits, start);
  if (ec != std::errc() || end != name.data() + digits) {
    return std::nullopt;
  }
  name.remove_prefix(digits);
  const std::string version = "_" + std::to_string(kFormatVersion) + "_";
  if (!StripPrefix(name, version) || name.empty()) {
    return std::nullopt;
  }
  return start;
}

}  // namespace history
