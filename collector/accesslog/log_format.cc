#include "collector/accesslog/log_format.h"

#include <fmt/core.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <ctime>
#include <iterator>
#include <limits>
#include <utility>

namespace accesslog {

struct LogFormat::Cursor {
  const char* begin;
  const char* p;
  const char* end;

  size_t column() const { return static_cast<size_t>(p - begin) + 1; }
  size_t left() const { return static_cast<size_t>(end - p); }
};

struct LogFormat::TimeParts {
  int year = -1;
  int month = 0;  // 1..12
  int day = 0;    // 1..31
  int hour = 0;
  int minute = 0;
  int second = 0;
  int64_t fraction_us = 0;
  bool has_zone = false;
  int zone_seconds = 0;  // east of UTC
  bool has_epoch = false;
  int64_t epoch_us = 0;
};

namespace {

enum class Number { kOk, kNotNumber, kOutOfRange };

bool IsDigit(char c) {
  return c >= '0' && c <= '9';
}
bool IsBlank(char c) {
  return c == ' ' || c == '\t';
}

int HexValue(char c) {
  if (IsDigit(c)) {
    return c - '0';
  }
  if (c >= 'a' && c <= 'f') {
    return c - 'a' + 10;
  }
  if (c >= 'A' && c <= 'F') {
    return c - 'A' + 10;
  }
  return -1;
}

// A character shown in a reason: printable as itself, anything else as \xHH.
std::string Shown(char c) {
  const auto u = static_cast<unsigned char>(c);
  if (u >= 0x20 && u < 0x7f) {
    return std::string(1, c);
  }
  return fmt::format("\\x{:02x}", u);
}

bool Fail(std::string* reason, std::string text) {
  if (reason != nullptr) {
    *reason = std::move(text);
  }
  return false;
}

Number ParseUnsigned(std::string_view text, uint64_t max, uint64_t* out) {
  if (text.empty()) {
    return Number::kNotNumber;
  }
  uint64_t value = 0;
  for (char c : text) {
    if (!IsDigit(c)) {
      return Number::kNotNumber;
    }
    const uint64_t digit = static_cast<uint64_t>(c - '0');
    if (value > (max - digit) / 10) {
      return Number::kOutOfRange;
    }
    value = value * 10 + digit;
  }
  *out = value;
  return Number::kOk;
}

// "I" or "I.F" in some unit, as an integer count of 10^-scale of that unit. Fraction digits
// beyond the scale are dropped.
Number ParseDecimal(std::string_view text, int scale, int64_t* out) {
  const size_t dot = text.find('.');
  const std::string_view whole = text.substr(0, dot);
  uint64_t value = 0;
  constexpr uint64_t kMax = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
  const Number n = ParseUnsigned(whole, kMax, &value);
  if (n != Number::kOk) {
    return n;
  }
  std::string_view fraction;
  if (dot != std::string_view::npos) {
    fraction = text.substr(dot + 1);
    if (fraction.empty()) {
      return Number::kNotNumber;
    }
  }
  for (int i = 0; i < scale; ++i) {
    if (value > kMax / 10) {
      return Number::kOutOfRange;
    }
    value *= 10;
  }
  uint64_t part = 0;
  uint64_t unit = 1;
  for (int i = scale - 1; i > 0; --i) {
    unit *= 10;
  }
  for (size_t i = 0; i < fraction.size(); ++i) {
    if (!IsDigit(fraction[i])) {
      return Number::kNotNumber;
    }
    if (static_cast<int>(i) < scale) {
      part += static_cast<uint64_t>(fraction[i] - '0') * unit;
      unit /= 10;
    }
  }
  if (value > kMax - part) {
    return Number::kOutOfRange;
  }
  *out = static_cast<int64_t>(value + part);
  return Number::kOk;
}

bool NumberFail(Number n, std::string_view name, std::string* reason) {
  return Fail(reason, n == Number::kNotNumber ? fmt::format("{} is not a number", name)
                                              : fmt::format("{} out of range", name));
}

// The closing quote of a quoted field: a '"' not escaped by an odd run of backslashes, as
// Apache writes \" and \\ inside quotes.
const char* FindClosingQuote(const char* start, const char* end) {
  const char* p = start;
  while (p < end) {
    const void* found = std::memchr(p, '"', static_cast<size_t>(end - p));
    if (found == nullptr) {
      return nullptr;
    }
    const char* quote = static_cast<const char*>(found);
    const char* run = quote;
    while (run > start && run[-1] == '\\') {
      --run;
    }
    if (((quote - run) & 1) == 0) {
      return quote;
    }
    p = quote + 1;
  }
  return nullptr;
}

// Appends text with \" \\ (Apache) and \xHH (nginx) decoded; other backslashes stay.
void AppendUnescaped(std::string_view text, std::string* out) {
  size_t i = 0;
  while (i < text.size()) {
    const size_t slash = text.find('\\', i);
    if (slash == std::string_view::npos) {
      out->append(text.substr(i));
      return;
    }
    out->append(text.substr(i, slash - i));
    i = slash + 1;
    if (i < text.size() && (text[i] == '"' || text[i] == '\\')) {
      out->push_back(text[i]);
      ++i;
    } else if (i + 2 < text.size() && text[i] == 'x' && HexValue(text[i + 1]) >= 0 &&
               HexValue(text[i + 2]) >= 0) {
      out->push_back(static_cast<char>(HexValue(text[i + 1]) * 16 + HexValue(text[i + 2])));
      i += 3;
    } else {
      out->push_back('\\');
    }
  }
}

// RFC 9110 token characters, which a method is made of.
bool IsTokenChar(char c) {
  if (IsDigit(c) || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z')) {
    return true;
  }
  return c != 0 && std::strchr("!#$%&'*+-.^_`|~", c) != nullptr;
}

bool IsProtocol(std::string_view text) {
  constexpr std::string_view kPrefix = "HTTP/";
  if (text.size() <= kPrefix.size() || text.substr(0, kPrefix.size()) != kPrefix) {
    return false;
  }
  for (char c : text.substr(kPrefix.size())) {
    if (!IsDigit(c) && c != '.') {
      return false;
    }
  }
  return true;
}

bool ParseRequestLine(std::string_view text, LogEntry* entry, std::string* reason) {
  const size_t first = text.find(' ');
  const size_t last = text.rfind(' ');
  if (first == std::string_view::npos || last <= first + 1 || first == 0) {
    return Fail(reason, "request is not \"METHOD TARGET PROTOCOL\"");
  }
  const std::string_view method = text.substr(0, first);
  for (char c : method) {
    if (!IsTokenChar(c)) {
      return Fail(reason, "request method is not a token");
    }
  }
  const std::string_view protocol = text.substr(last + 1);
  if (!IsProtocol(protocol)) {
    return Fail(reason, "request protocol is not HTTP/n");
  }
  entry->method.assign(method);
  AppendUnescaped(text.substr(first + 1, last - first - 1), &entry->target);
  entry->protocol.assign(protocol);
  return true;
}

// Apache's vhost_combined writes "host:port"; the port says nothing about the site.
std::string_view HostWithoutPort(std::string_view host) {
  const size_t colon = host.rfind(':');
  if (colon == std::string_view::npos || colon + 1 == host.size()) {
    return host;
  }
  for (char c : host.substr(colon + 1)) {
    if (!IsDigit(c)) {
      return host;
    }
  }
  const std::string_view name = host.substr(0, colon);
  // A bare IPv6 address has no port to remove; "[2001:db8::1]:443" keeps its brackets.
  if (name.find(':') != std::string_view::npos && !name.ends_with(']')) {
    return host;
  }
  return name;
}

bool IsPrintableWord(std::string_view text) {
  if (text.empty()) {
    return false;
  }
  for (char c : text) {
    if (c <= ' ' || c >= 0x7f) {
      return false;
    }
  }
  return true;
}

// nginx's $upstream_response_time: values separated by ", " (servers tried in turn) or " : "
// (internal redirects), each a time in seconds or '-' for a server that gave no reply.
bool ParseUpstream(const char*& p, const char* end, int64_t* sum_us, std::string* reason) {
  int64_t sum = -1;
  while (true) {
    const char* start = p;
    while (p < end && (IsDigit(*p) || *p == '.')) {
      ++p;
    }
    if (p == start) {
      if (p < end && *p == '-') {
        ++p;
      } else {
        return Fail(reason, "upstream time is not a number");
      }
    } else {
      int64_t value = 0;
      const Number n =
          ParseDecimal(std::string_view(start, static_cast<size_t>(p - start)), 6, &value);
      if (n != Number::kOk) {
        return NumberFail(n, "upstream time", reason);
      }
      if (sum < 0) {
        sum = 0;
      }
      if (value > std::numeric_limits<int64_t>::max() - sum) {
        return NumberFail(Number::kOutOfRange, "upstream time", reason);
      }
      sum += value;
    }
    const std::string_view rest(p, static_cast<size_t>(end - p));
    if (rest.starts_with(", ")) {
      p += 2;
    } else if (rest.starts_with(" : ")) {
      p += 3;
    } else {
      break;
    }
  }
  *sum_us = sum;
  return true;
}

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

bool ReadDigits(const char*& p, const char* end, int min_digits, int max_digits, int* value) {
  int digits = 0;
  int v = 0;
  while (digits < max_digits && p < end && IsDigit(*p)) {
    v = v * 10 + (*p - '0');
    ++p;
    ++digits;
  }
  *value = v;
  return digits >= min_digits;
}

bool ReadZone(const char*& p, const char* end, int* seconds) {
  if (p < end && (*p == 'Z' || *p == 'z')) {
    ++p;
    *seconds = 0;
    return true;
  }
  if (p == end || (*p != '+' && *p != '-')) {
    return false;
  }
  const int sign = (*p == '-') ? -1 : 1;
  ++p;
  int hours = 0;
  int minutes = 0;
  if (!ReadDigits(p, end, 2, 2, &hours)) {
    return false;
  }
  if (p < end && *p == ':') {
    ++p;
  }
  if (!ReadDigits(p, end, 2, 2, &minutes) || hours > 23 || minutes > 59) {
    return false;
  }
  *seconds = sign * (hours * 3600 + minutes * 60);
  return true;
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

constexpr std::array<std::string_view, 5> kPresetNames = {
    "combined", "nginx-timed", "nginx-timed-vhost", "apache-timed", "apache-timed-vhost"};

}  // namespace

bool LogFormat::ToMicros(const TimeParts& t, int64_t* out, std::string* reason) {
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
    std::tm tm{};
    tm.tm_year = t.year - 1900;
    tm.tm_mon = t.month - 1;
    tm.tm_mday = t.day;
    tm.tm_hour = t.hour;
    tm.tm_min = t.minute;
    tm.tm_sec = t.second;
    tm.tm_isdst = -1;
    const std::time_t local = std::mktime(&tm);
    if (local == static_cast<std::time_t>(-1) && tm.tm_year != 69) {
      return Fail(reason, "local time out of range");
    }
    seconds = static_cast<int64_t>(local);
  }
  *out = seconds * 1000000 + t.fraction_us;
  return true;
}

bool LogFormat::CompileTimeFormat(std::string_view format, std::string_view what,
                                  std::vector<TimeStep>* steps, std::string* error) {
  auto add = [steps](TimeKind kind, char literal = 0) { steps->push_back({kind, literal}); };
  for (size_t i = 0; i < format.size(); ++i) {
    const char c = format[i];
    if (c != '%') {
      add(IsBlank(c) ? TimeKind::kBlanks : TimeKind::kLiteral, c);
      continue;
    }
    if (++i == format.size()) {
      return Fail(error, fmt::format("{} format ends with '%'", what));
    }
    static constexpr std::pair<char, TimeKind> kSimple[] = {
        {'Y', TimeKind::kYear4},        {'y', TimeKind::kYear2},      {'m', TimeKind::kMonth},
        {'b', TimeKind::kMonthName},    {'B', TimeKind::kMonthName},  {'h', TimeKind::kMonthName},
        {'d', TimeKind::kDay},          {'e', TimeKind::kDayBlank},   {'H', TimeKind::kHour},
        {'M', TimeKind::kMinute},       {'S', TimeKind::kSecond},     {'z', TimeKind::kZone},
        {'s', TimeKind::kEpochSeconds}, {'f', TimeKind::kEpochMicros}};
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
      CompileTimeFormat(shorthand->second, what, steps, error);
      continue;
    }
    switch (format[i]) {
      case '%':
        add(TimeKind::kLiteral, '%');
        break;
      default:
        return Fail(error, fmt::format("{} format: unsupported %{}", what, Shown(format[i])));
    }
  }
  return true;
}

bool LogFormat::CompileSpecifier(std::string_view log_format, size_t* i, Kind* kind,
                                 std::string* error) {
  const size_t at = (*i)++;  // the '%'
  if (*i == log_format.size()) {
    return Fail(error, "log format ends with '%'");
  }
  if (log_format[*i] == '{') {
    const size_t close = log_format.find('}', *i);
    if (close == std::string_view::npos || close + 1 >= log_format.size()) {
      return Fail(error, fmt::format("unterminated %{{...}} at position {}", at + 1));
    }
    const std::string_view name = log_format.substr(*i + 1, close - *i - 1);
    const char letter = log_format[close + 1];
    *i = close + 1;
    if (name == "port" && letter == 'h') {
      *kind = Kind::kClientPort;
    } else if (name == "upstream" && letter == 'T') {
      *kind = Kind::kUpstream;
    } else {
      return Fail(error, fmt::format("unknown specifier %{{{}}}{} at position {}", name,
                                     Shown(letter), at + 1));
    }
    return true;
  }
  static constexpr std::pair<char, Kind> kLetters[] = {
      {'h', Kind::kClient},     {'v', Kind::kVhost},    {'A', Kind::kServerAddress},
      {'r', Kind::kRequest},    {'m', Kind::kMethod},   {'U', Kind::kPath},
      {'q', Kind::kQuery},      {'H', Kind::kProtocol}, {'s', Kind::kStatus},
      {'b', Kind::kBytes},      {'B', Kind::kBytes},    {'R', Kind::kReferer},
      {'u', Kind::kUserAgent},  {'T', Kind::kSeconds},  {'L', Kind::kMillis},
      {'D', Kind::kMicros},     {'n', Kind::kNanos},    {'d', Kind::kDate},
      {'t', Kind::kTime},       {'x', Kind::kDateTime}, {'z', Kind::kZone},
      {'~', Kind::kSkipBlanks}, {'^', Kind::kIgnore},   {'e', Kind::kIgnore},
      {'C', Kind::kIgnore},     {'K', Kind::kIgnore},   {'k', Kind::kIgnore},
      {'M', Kind::kIgnore}};
  const char letter = log_format[*i];
  const auto* found = std::find_if(std::begin(kLetters), std::end(kLetters),
                                   [letter](const auto& entry) { return entry.first == letter; });
  if (found == std::end(kLetters)) {
    return Fail(error, fmt::format("unknown specifier %{} at position {}", Shown(letter), at + 1));
  }
  *kind = found->second;
  return true;
}

bool LogFormat::ResolveDelimiters(std::string* error) {
  bool has_date = false;
  for (size_t s = 0; s < steps_.size(); ++s) {
    Step& step = steps_[s];
    switch (step.kind) {
      case Kind::kLiteral:
      case Kind::kSkipBlanks:
      case Kind::kUpstream:
      case Kind::kZone:
      case Kind::kTime:
        continue;
      case Kind::kDate:
      case Kind::kDateTime:
        has_date = true;
        continue;
      default:
        break;
    }
    if (s + 1 < steps_.size()) {
      if (steps_[s + 1].kind != Kind::kLiteral) {
        return Fail(error, fmt::format("field {} of the log format must be followed by a "
                                       "literal character or end the format",
                                       s + 1));
      }
      step.delimited = true;
      step.delimiter = steps_[s + 1].literal[0];
    }
  }
  return has_date || Fail(error, "log format has no date (%d or %x)");
}

bool LogFormat::CompileTimeFormats(std::string_view date_format, std::string_view time_format,
                                   std::string* error) {
  if (!CompileTimeFormat(date_format, "date", &date_steps_, error) ||
      !CompileTimeFormat(time_format, "time", &time_steps_, error)) {
    return false;
  }
  date_time_steps_ = date_steps_;
  if (date_format != time_format) {
    date_time_steps_.push_back({TimeKind::kBlanks, ' '});
    date_time_steps_.insert(date_time_steps_.end(), time_steps_.begin(), time_steps_.end());
  }
  // Every format must give a whole date, or seconds since 1970.
  bool year = false;
  bool month = false;
  bool day = false;
  for (const TimeStep& t : date_time_steps_) {
    year |= t.kind == TimeKind::kYear4 || t.kind == TimeKind::kYear2;
    month |= t.kind == TimeKind::kMonth || t.kind == TimeKind::kMonthName;
    day |= t.kind == TimeKind::kDay || t.kind == TimeKind::kDayBlank;
    if (t.kind == TimeKind::kEpochSeconds || t.kind == TimeKind::kEpochMicros) {
      year = month = day = true;
    }
  }
  return (year && month && day) ||
         Fail(error, "date format needs a year, a month and a day (or %s or %f)");
}

std::optional<LogFormat> LogFormat::Compile(std::string_view log_format,
                                            std::string_view date_format,
                                            std::string_view time_format, bool time_is_start,
                                            std::string* error) {
  LogFormat format;
  format.time_is_start_ = time_is_start;
  for (size_t i = 0; i < log_format.size(); ++i) {
    const char c = log_format[i];
    if (c == '%' && (i + 1 == log_format.size() || log_format[i + 1] != '%')) {
      Kind kind = Kind::kIgnore;
      if (!CompileSpecifier(log_format, &i, &kind, error)) {
        return std::nullopt;
      }
      format.steps_.push_back({kind, false, 0, {}});
      continue;
    }
    i += (c == '%') ? 1 : 0;  // "%%"
    if (format.steps_.empty() || format.steps_.back().kind != Kind::kLiteral) {
      format.steps_.push_back({});
    }
    format.steps_.back().literal.push_back(c);
  }
  if (!format.ResolveDelimiters(error) ||
      !format.CompileTimeFormats(date_format, time_format, error)) {
    return std::nullopt;
  }
  return format;
}

std::optional<LogFormat> LogFormat::Preset(std::string_view name, std::string* error) {
  constexpr std::string_view kCombined = R"(%h %^[%d:%t %z] "%r" %s %b "%R" "%u")";
  constexpr std::string_view kDate = "%d/%b/%Y";
  constexpr std::string_view kTime = "%H:%M:%S";
  std::string format;
  bool start = false;
  if (name == "combined") {
    format = kCombined;
  } else if (name == "nginx-timed") {
    format = fmt::format("{} %T %{{upstream}}T", kCombined);
  } else if (name == "nginx-timed-vhost") {
    format = fmt::format("%v {} %T %{{upstream}}T", kCombined);
  } else if (name == "apache-timed") {
    format = fmt::format("{} %D", kCombined);
    start = true;
  } else if (name == "apache-timed-vhost") {
    format = fmt::format("%v {} %D", kCombined);
    start = true;
  } else {
    Fail(error, fmt::format("unknown log format \"{}\"", name));
    return std::nullopt;
  }
  return Compile(format, kDate, kTime, start, error);
}

std::span<const std::string_view> LogFormat::PresetNames() {
  return kPresetNames;
}

bool LogFormat::ParseTimeSteps(const std::vector<TimeStep>& steps, Cursor* cursor, TimeParts* t,
                               std::string* reason) {
  const char*& p = cursor->p;
  const char* end = cursor->end;
  for (const TimeStep& step : steps) {
    const size_t column = cursor->column();
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
      case TimeKind::kLiteral:
        if (p == end || *p != step.literal) {
          return Fail(reason,
                      fmt::format("expected '{}' at column {}", Shown(step.literal), column));
        }
        ++p;
        break;
      case TimeKind::kBlanks:
        while (p < end && IsBlank(*p)) {
          ++p;
        }
        break;
      case TimeKind::kYear4:
        ok = number(4, 4, 0, 9999, "year", &t->year);
        break;
      case TimeKind::kYear2:
        ok = number(2, 2, 0, 99, "year", &t->year);
        t->year += t->year < 69 ? 2000 : 1900;
        break;
      case TimeKind::kMonth:
        ok = number(1, 2, 1, 12, "month", &t->month);
        break;
      case TimeKind::kMonthName:
        t->month = ReadMonthName(p, end);
        if (t->month == 0) {
          return Fail(reason, fmt::format("bad month name at column {}", column));
        }
        break;
      case TimeKind::kDayBlank:
        if (p < end && *p == ' ') {
          ++p;
        }
        ok = number(1, 2, 1, 31, "day", &t->day);
        break;
      case TimeKind::kDay:
        ok = number(1, 2, 1, 31, "day", &t->day);
        break;
      case TimeKind::kHour:
        ok = number(1, 2, 0, 23, "hour", &t->hour);
        break;
      case TimeKind::kMinute:
        ok = number(1, 2, 0, 59, "minute", &t->minute);
        break;
      case TimeKind::kSecond:
        ok = number(1, 2, 0, 60, "second", &t->second);
        break;
      case TimeKind::kZone:
        if (!ReadZone(p, end, &t->zone_seconds)) {
          return Fail(reason, fmt::format("bad zone offset at column {}", column));
        }
        t->has_zone = true;
        break;
      case TimeKind::kEpochSeconds:
      case TimeKind::kEpochMicros: {
        const bool seconds = step.kind == TimeKind::kEpochSeconds;
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

bool LogFormat::StoreField(Kind kind, std::string_view text, LogEntry* entry, std::string* reason) {
  const bool dash = text == "-";
  uint64_t value = 0;
  Number n = Number::kOk;
  switch (kind) {
    case Kind::kIgnore:
      return true;
    case Kind::kClient:
      if (!IsPrintableWord(text)) {
        return Fail(reason, "bad client address");
      }
      entry->client.assign(text);
      return true;
    case Kind::kClientPort:
      n = ParseUnsigned(text, 65535, &value);
      if (n != Number::kOk) {
        return NumberFail(n, "client port", reason);
      }
      entry->client_port = static_cast<uint16_t>(value);
      return true;
    case Kind::kVhost:
      entry->vhost.assign(dash ? std::string_view() : HostWithoutPort(text));
      return true;
    case Kind::kServerAddress:
      entry->server_address.assign(dash ? std::string_view() : text);
      return true;
    case Kind::kRequest:
      return ParseRequestLine(text, entry, reason);
    case Kind::kMethod:
      entry->method.assign(text);
      return true;
    case Kind::kPath:
      AppendUnescaped(text, &entry->target);
      return true;
    case Kind::kQuery:
      if (!text.empty() && !dash) {
        if (text[0] != '?') {
          entry->target.push_back('?');
        }
        AppendUnescaped(text, &entry->target);
      }
      return true;
    case Kind::kProtocol:
      entry->protocol.assign(text);
      return true;
    case Kind::kStatus:
      n = ParseUnsigned(text, 999, &value);
      if (n != Number::kOk) {
        return NumberFail(n, "status", reason);
      }
      entry->status = static_cast<int>(value);
      return true;
    case Kind::kBytes:
      n = dash ? Number::kOk : ParseUnsigned(text, std::numeric_limits<uint64_t>::max(), &value);
      if (n != Number::kOk) {
        return NumberFail(n, "body bytes", reason);
      }
      entry->body_bytes = value;
      return true;
    case Kind::kReferer:
      if (!dash) {
        AppendUnescaped(text, &entry->referer);
      }
      return true;
    case Kind::kUserAgent:
      if (!dash) {
        AppendUnescaped(text, &entry->user_agent);
      }
      return true;
    case Kind::kSeconds:
    case Kind::kMillis:
    case Kind::kMicros: {
      const int scale = kind == Kind::kSeconds ? 6 : kind == Kind::kMillis ? 3 : 0;
      n = ParseDecimal(text, scale, &entry->request_time_us);
      return n == Number::kOk || NumberFail(n, "request time", reason);
    }
    case Kind::kNanos:
      n = ParseDecimal(text, 0, &entry->request_time_us);
      entry->request_time_us /= 1000;
      return n == Number::kOk || NumberFail(n, "request time", reason);
    default:
      return true;  // the direct kinds never get here
  }
}

bool LogFormat::ParseField(const Step& step, Cursor* cursor, LogEntry* entry,
                           std::string* reason) const {
  const char* start = cursor->p;
  const char* stop = cursor->end;
  if (step.delimited) {
    if (step.delimiter == '"') {
      stop = FindClosingQuote(start, cursor->end);
    } else if (cursor->left() == 0) {
      stop = nullptr;  // memchr must not see the null data of an empty line
    } else {
      stop = static_cast<const char*>(std::memchr(start, step.delimiter, cursor->left()));
    }
    if (stop == nullptr) {
      return Fail(reason, fmt::format("missing '{}' after column {}", Shown(step.delimiter),
                                      cursor->column()));
    }
  } else {
    switch (step.kind) {
      case Kind::kIgnore:
      case Kind::kVhost:
      case Kind::kRequest:
      case Kind::kMethod:
      case Kind::kPath:
      case Kind::kQuery:
      case Kind::kProtocol:
      case Kind::kReferer:
      case Kind::kUserAgent:
        break;  // free text: the rest of the line
      default:
        // A number or an address at the end of the format stops at a blank, so that fields
        // added after it do not spoil it.
        stop = start;
        while (stop < cursor->end && !IsBlank(*stop)) {
          ++stop;
        }
    }
  }
  cursor->p = stop;
  return StoreField(step.kind, std::string_view(start, static_cast<size_t>(stop - start)), entry,
                    reason);
}

bool LogFormat::Parse(std::string_view line, LogEntry* entry, std::string* reason) const {
  if (!line.empty() && line.back() == '\n') {
    line.remove_suffix(1);
  }
  if (!line.empty() && line.back() == '\r') {
    line.remove_suffix(1);
  }
  entry->client.clear();
  entry->client_port = 0;
  entry->vhost.clear();
  entry->method.clear();
  entry->target.clear();
  entry->protocol.clear();
  entry->status = 0;
  entry->body_bytes = 0;
  entry->referer.clear();
  entry->user_agent.clear();
  entry->time_us = 0;
  entry->time_is_start = time_is_start_;
  entry->request_time_us = -1;
  entry->upstream_time_us = -1;
  entry->server_address.clear();

  Cursor cursor{line.data(), line.data(), line.data() + line.size()};
  TimeParts time;
  for (const Step& step : steps_) {
    bool ok = true;
    switch (step.kind) {
      case Kind::kLiteral:
        for (char c : step.literal) {
          if (cursor.p == cursor.end || *cursor.p != c) {
            return Fail(reason,
                        fmt::format("expected '{}' at column {}", Shown(c), cursor.column()));
          }
          ++cursor.p;
        }
        break;
      case Kind::kSkipBlanks:
        while (cursor.p < cursor.end && IsBlank(*cursor.p)) {
          ++cursor.p;
        }
        break;
      case Kind::kUpstream:
        ok = ParseUpstream(cursor.p, cursor.end, &entry->upstream_time_us, reason);
        break;
      case Kind::kDate:
        ok = ParseTimeSteps(date_steps_, &cursor, &time, reason);
        break;
      case Kind::kTime:
        ok = ParseTimeSteps(time_steps_, &cursor, &time, reason);
        break;
      case Kind::kDateTime:
        ok = ParseTimeSteps(date_time_steps_, &cursor, &time, reason);
        break;
      case Kind::kZone:
        ok = ReadZone(cursor.p, cursor.end, &time.zone_seconds) ||
             Fail(reason, fmt::format("bad zone offset at column {}", cursor.column()));
        time.has_zone = true;
        break;
      default:
        ok = ParseField(step, &cursor, entry, reason);
    }
    if (!ok) {
      return false;
    }
  }
  return ToMicros(time, &entry->time_us, reason);
}

}  // namespace accesslog
