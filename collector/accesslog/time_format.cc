#include "collector/accesslog/time_format.h"

#include <fmt/core.h>

#include <algorithm>
#include <array>
#include <ctime>
#include <iterator>
#include <utility>

#include "collector/accesslog/text_reading.h"

namespace accesslog {
namespace {

constexpr std::array<std::string_view, 12> kMonthNames = {
    "january", "february", "march",     "april",   "may",      "june",
    "july",    "august",   "september", "october", "november", "december"};

char Lower(char c) {
  return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c;
}

// A month name, abbreviated ("Oct") or full ("October"), any case; 0 if there is none.
int ReadMonthName(const char*& p, const char* end) {
  if (end - p < 3) {
    return 0;
  }
  for (size_t m = 0; m < kMonthNames.size(); ++m) {
    const std::string_view name = kMonthNames[m];
    if (Lower(p[0]) != name[0] || Lower(p[1]) != name[1] || Lower(p[2]) != name[2]) {
      continue;
    }
    size_t length = 3;
    while (length < name.size() && static_cast<size_t>(end - p) > length &&
           Lower(p[length]) == name[length]) {
      ++length;
    }
    p += (length == name.size()) ? length : 3;
    return static_cast<int>(m) + 1;
  }
  return 0;
}

bool IsLeapYear(int y) {
  return (y % 4 == 0 && y % 100 != 0) || y % 400 == 0;
}

int DaysInMonth(int year, int month) {
  static constexpr std::array<int, 12> kDays = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  return (month == 2 && IsLeapYear(year)) ? 29 : kDays[static_cast<size_t>(month - 1)];
}

// Days from 1970-01-01 to a proleptic Gregorian date (Howard Hinnant's days_from_civil).
int64_t DaysFromCivil(int64_t y, int m, int d) {
  y -= (m <= 2) ? 1 : 0;
  const int64_t era = (y >= 0 ? y : y - 399) / 400;
  const int64_t yoe = y - era * 400;
  const int64_t doy = (153 * (m > 2 ? m - 3 : m + 9) + 2) / 5 + d - 1;
  const int64_t doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + doe - 719468;
}

// Seconds since 1970 of a local date and time. mktime reads the zone rules on every call
// (glibc stats /etc/localtime when TZ is unset), far slower than the rest of a line; the
// offset cannot change within a minute, so the start of the last minute asked for is kept.
bool LocalSeconds(const TimeParts& t, int64_t* seconds) {
  struct Minute {
    int64_t key = -1;
    int64_t start = 0;
  };
  thread_local Minute cached;
  const int64_t key =
      (((static_cast<int64_t>(t.year) * 13 + t.month) * 32 + t.day) * 24 + t.hour) * 60 + t.minute;
  if (key != cached.key) {
    std::tm tm{};
    tm.tm_year = t.year - 1900;
    tm.tm_mon = t.month - 1;
    tm.tm_mday = t.day;
    tm.tm_hour = t.hour;
    tm.tm_min = t.minute;
    tm.tm_sec = 0;
    tm.tm_isdst = -1;
    const std::time_t local = std::mktime(&tm);
    if (local == static_cast<std::time_t>(-1) && tm.tm_year != 69) {
      return false;
    }
    cached = {key, static_cast<int64_t>(local)};
  }
  *seconds = cached.start + t.second;
  return true;
}

}  // namespace

std::optional<TimeFormat> TimeFormat::Compile(std::string_view format, std::string_view what,
                                              std::string* error) {
  TimeFormat compiled;
  if (!compiled.CompileInto(format, what, error)) {
    return std::nullopt;
  }
  return compiled;
}

TimeFormat TimeFormat::Joined(const TimeFormat& date, const TimeFormat& time, bool same_text) {
  TimeFormat joined = date;
  if (!same_text) {
    joined.steps_.push_back({Kind::kBlanks, ' '});
    joined.steps_.insert(joined.steps_.end(), time.steps_.begin(), time.steps_.end());
  }
  return joined;
}

bool TimeFormat::HasWholeDate() const {
  bool year = false;
  bool month = false;
  bool day = false;
  for (const Step& t : steps_) {
    year |= t.kind == Kind::kYear4 || t.kind == Kind::kYear2;
    month |= t.kind == Kind::kMonth || t.kind == Kind::kMonthName;
    day |= t.kind == Kind::kDay || t.kind == Kind::kDayBlank;
    if (t.kind == Kind::kEpochSeconds || t.kind == Kind::kEpochMicros) {
      return true;
    }
  }
  return year && month && day;
}

bool TimeFormat::CompileInto(std::string_view format, std::string_view what, std::string* error) {
  auto add = [this](Kind kind, char literal = 0) { steps_.push_back({kind, literal}); };
  for (size_t i = 0; i < format.size(); ++i) {
    const char c = format[i];
    if (c != '%') {
      add(IsBlank(c) ? Kind::kBlanks : Kind::kLiteral, c);
      continue;
    }
    if (++i == format.size()) {
      return Fail(error, fmt::format("{} format ends with '%'", what));
    }
    static constexpr std::pair<char, Kind> kSimple[] = {
        {'Y', Kind::kYear4},        {'y', Kind::kYear2},      {'m', Kind::kMonth},
        {'b', Kind::kMonthName},    {'B', Kind::kMonthName},  {'h', Kind::kMonthName},
        {'d', Kind::kDay},          {'e', Kind::kDayBlank},   {'H', Kind::kHour},
        {'M', Kind::kMinute},       {'S', Kind::kSecond},     {'z', Kind::kZone},
        {'s', Kind::kEpochSeconds}, {'f', Kind::kEpochMicros}};
    static constexpr std::pair<char, std::string_view> kShorthands[] = {
        {'T', "%H:%M:%S"}, {'R', "%H:%M"}, {'F', "%Y-%m-%d"}, {'D', "%m/%d/%y"}};
    const auto is = [&format, i](const auto& entry) { return entry.first == format[i]; };
    if (const auto* simple = std::find_if(std::begin(kSimple), std::end(kSimple), is);
        simple != std::end(kSimple)) {
      add(simple->second);
      continue;
    }
    if (const auto* shorthand = std::find_if(std::begin(kShorthands), std::end(kShorthands), is);
        shorthand != std::end(kShorthands)) {
      CompileInto(shorthand->second, what, error);
      continue;
    }
    switch (format[i]) {
      case '%':
        add(Kind::kLiteral, '%');
        break;
      default:
        return Fail(error, fmt::format("{} format: unsupported %{}", what, Shown(format[i])));
    }
  }
  return true;
}

bool TimeFormat::Read(const char* line_begin, const char*& p, const char* end, TimeParts* t,
                      std::string* reason) const {
  for (const Step& step : steps_) {
    const auto column = static_cast<size_t>(p - line_begin) + 1;
    int value = 0;
    auto number = [&](int min_digits, int max_digits, int low, int high, std::string_view name,
                      int* out) {
      if (!ReadDigits(p, end, min_digits, max_digits, &value)) {
        return Fail(reason, fmt::format("expected {} at column {}", name, column));
      }
      if (value < low || value > high) {
        return Fail(reason, fmt::format("{} out of range at column {}", name, column));
      }
      *out = value;
      return true;
    };
    bool ok = true;
    switch (step.kind) {
      case Kind::kLiteral:
        if (p == end || *p != step.literal) {
          return Fail(reason,
                      fmt::format("expected '{}' at column {}", Shown(step.literal), column));
        }
        ++p;
        break;
      case Kind::kBlanks:
        while (p < end && IsBlank(*p)) {
          ++p;
        }
        break;
      case Kind::kYear4:
        ok = number(4, 4, 0, 9999, "year", &t->year);
        break;
      case Kind::kYear2:
        ok = number(2, 2, 0, 99, "year", &t->year);
        t->year += t->year < 69 ? 2000 : 1900;
        break;
      case Kind::kMonth:
        ok = number(1, 2, 1, 12, "month", &t->month);
        break;
      case Kind::kMonthName:
        t->month = ReadMonthName(p, end);
        if (t->month == 0) {
          return Fail(reason, fmt::format("bad month name at column {}", column));
        }
        break;
      case Kind::kDayBlank:
        if (p < end && *p == ' ') {
          ++p;
        }
        ok = number(1, 2, 1, 31, "day", &t->day);
        break;
      case Kind::kDay:
        ok = number(1, 2, 1, 31, "day", &t->day);
        break;
      case Kind::kHour:
        ok = number(1, 2, 0, 23, "hour", &t->hour);
        break;
      case Kind::kMinute:
        ok = number(1, 2, 0, 59, "minute", &t->minute);
        break;
      case Kind::kSecond:
        ok = number(1, 2, 0, 60, "second", &t->second);
        break;
      case Kind::kZone:
        if (!ReadZone(p, end, &t->zone_seconds)) {
          return Fail(reason, fmt::format("bad zone offset at column {}", column));
        }
        t->has_zone = true;
        break;
      case Kind::kEpochSeconds:
      case Kind::kEpochMicros: {
        const bool seconds = step.kind == Kind::kEpochSeconds;
        const char* start = p;
        while (p < end && (IsDigit(*p) || (seconds && *p == '.'))) {
          ++p;
        }
        const Number n = ParseDecimal(std::string_view(start, static_cast<size_t>(p - start)),
                                      seconds ? 6 : 0, &t->epoch_us);
        if (n != Number::kOk) {
          return NumberFail(n, fmt::format("time stamp at column {}", column), reason);
        }
        t->has_epoch = true;
        break;
      }
    }
    if (!ok) {
      return false;
    }
  }
  return true;
}

bool ToMicros(const TimeParts& t, int64_t* out, std::string* reason) {
  if (t.has_epoch) {
    *out = t.epoch_us;
    return true;
  }
  if (t.day > DaysInMonth(t.year, t.month)) {
    return Fail(reason, "date has no such day");
  }
  int64_t seconds = 0;
  if (t.has_zone) {
    seconds = DaysFromCivil(t.year, t.month, t.day) * 86400 + t.hour * 3600 + t.minute * 60 +
              t.second - t.zone_seconds;
  } else {
    // Without a logged zone the stamp is in the zone the server ran in: take ours.
    if (!LocalSeconds(t, &seconds)) {
      return Fail(reason, "local time out of range");
    }
  }
  *out = seconds * 1000000;
  return true;
}

}  // namespace accesslog
