#pragma once

// TimeFormat: a date or a time-of-day format in strftime notation, compiled once, that reads its
// part of a log line's time stamp in place; ToMicros turns the parts read into a time.
//
// Elements: %Y %y %m %d %e %b (Jan..Dec; full names too; also %B %h) %H %M %S %z (zone offset)
// %T %F %D %R, %s (seconds since 1970, a fraction allowed), %f (microseconds since 1970), %%
// and literal characters; a blank matches any run of blanks.
//
// Thread safety: a TimeFormat is immutable once compiled; Read may be called from any number
// of threads at once. ToMicros keeps a per-thread cache of the last local minute it converted,
// so a change of TZ while running applies from the next minute of log time.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace accesslog {

// The date and time read so far from one line.
struct TimeParts {
  int year = -1;
  int month = 0;  // 1..12
  int day = 0;    // 1..31
  int hour = 0;
  int minute = 0;
  int second = 0;
  bool has_zone = false;
  int zone_seconds = 0;  // east of UTC
  bool has_epoch = false;
  int64_t epoch_us = 0;
};

class TimeFormat {
 public:
  // Compiles a format; `what` ("date", "time") names it in the error. nullopt with *error
  // (when non-null) for an element it does not know.
  static std::optional<TimeFormat> Compile(std::string_view format, std::string_view what,
                                           std::string* error);
  // A date and a time in one field: date, blanks, time; or the date alone when both were
  // compiled from the same text (as "%s" or "%f" for both).
  static TimeFormat Joined(const TimeFormat& date, const TimeFormat& time, bool same_text);
  // An empty format, which reads nothing.
  TimeFormat() = default;

  // True when the format reads a year, a month and a day, or seconds since 1970.
  bool HasWholeDate() const;

  // Reads the format at p, advancing it and never reading at or past end, into *parts. False
  // with a short reason naming the column (counted from line_begin) when the text does not fit.
  bool Read(const char* line_begin, const char*& p, const char* end, TimeParts* parts,
            std::string* reason) const;

 private:
  enum class Kind : uint8_t {
    kLiteral,
    kBlanks,
    kYear4,
    kYear2,
    kMonth,
    kMonthName,
    kDay,
    kDayBlank,
    kHour,
    kMinute,
    kSecond,
    kZone,
    kEpochSeconds,
    kEpochMicros,
  };
  struct Step {
    Kind kind = Kind::kLiteral;
    char literal = 0;
  };

  bool CompileInto(std::string_view format, std::string_view what, std::string* error);

  std::vector<Step> steps_;
};

// Microseconds since 1970-01-01 UTC of the parts read. A stamp with neither a zone nor an epoch
// is in this host's local time zone (the one the server ran in). False with *reason for a date
// that does not exist ("31 Feb") or a local time out of range.
bool ToMicros(const TimeParts& parts, int64_t* micros, std::string* reason);

}  // namespace accesslog
