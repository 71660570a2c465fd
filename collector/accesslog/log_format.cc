#include "collector/accesslog/log_format.h"

#include <fmt/core.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <iterator>
#include <utility>

#include "collector/accesslog/text_reading.h"

namespace accesslog {

struct LogFormat::Cursor {
  const char* begin;
  const char* p;
  const char* end;

  size_t column() const { return static_cast<size_t>(p - begin) + 1; }
  size_t left() const { return static_cast<size_t>(end - p); }
};

namespace {

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

constexpr std::array<std::string_view, 5> kPresetNames = {
    "combined", "nginx-timed", "nginx-timed-vhost", "apache-timed", "apache-timed-vhost"};

}  // namespace

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
  std::optional<TimeFormat> date = TimeFormat::Compile(date_format, "date", error);
  std::optional<TimeFormat> time = TimeFormat::Compile(time_format, "time", error);
  if (!date || !time) {
    return false;
  }
  date_ = std::move(*date);
  time_ = std::move(*time);
  date_time_ = TimeFormat::Joined(date_, time_, date_format == time_format);
  // Every format must give a whole date, or seconds since 1970.
  return date_time_.HasWholeDate() ||
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
        ok = date_.Read(cursor.begin, cursor.p, cursor.end, &time, reason);
        break;
      case Kind::kTime:
        ok = time_.Read(cursor.begin, cursor.p, cursor.end, &time, reason);
        break;
      case Kind::kDateTime:
        ok = date_time_.Read(cursor.begin, cursor.p, cursor.end, &time, reason);
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
