#pragma once

// Names of the files in the history directory. An interval's rows of one table live in
// "<interval start>_1_<stem>.dat" (start in seconds since 1970, "1" the record format); while
// such a file is being replaced its new contents sit in ".<interval start>_1_<stem>.dat.tmp",
// which no reader asks for and cleanup still recognises by its interval.
//
// Thread safety: plain functions.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace history {

// The record format written by this code; files of other formats are never read or removed.
inline constexpr int kFormatVersion = 1;

// "<interval_start>_1_<stem>.dat". interval_start must not be negative.
std::string IntervalFileName(int64_t interval_start, std::string_view stem);

// ".<interval_start>_1_<stem>.dat.tmp".
std::string TemporaryFileName(int64_t interval_start, std::string_view stem);

// The interval start of a name produced by either function above (with a non-empty stem), or
// nullopt for every other name, including other format versions.
std::optional<int64_t> IntervalOfStoreFile(std::string_view name);

}  // namespace history
