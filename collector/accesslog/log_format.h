#pragma once

// LogFormat: reads one web server access-log line into a LogEntry, following a format written in
// GoAccess's --log-format notation, with its --date-format and --time-format in strftime
// notation. A format is compiled once and then parses any number of lines in a single pass,
// without regular expressions and without allocating beyond the LogEntry's own strings.
//
// Log-format specifiers (each field ends at the literal character that follows it in the format;
// a field at the end of the format takes the rest of the line, or for numbers and addresses the
// text up to the next blank):
//   %h client address (IPv4, IPv6 or host name)     %v virtual host, "host" or "host:port"
//   %r request line "METHOD TARGET PROTOCOL"        %m method   %U path   %q query string
//   %H protocol ("HTTP/1.1")                        %s status   %b body bytes ('-' reads as 0)
//   %R Referer ('-' reads as empty)                 %u User-Agent ('-' reads as empty)
//   %T request time in seconds ("0.123")            %D request time in microseconds
//   %L request time in milliseconds ("12.5")        %n request time in nanoseconds
//   %d date, per the date format                    %t time of day, per the time format
//   %x date and time as one field: the date format, a blank, then the time format (or only the
//      date format when both formats are the same, as for "%s" or "%f")
//   %e user id, %C cache status, %K %k %M (TLS, MIME type), %^ any field: read and ignored
//   %~ skips blanks                                 %% a literal '%'
// Our additions to that notation:
//   %z zone offset ("+0200", "-07:00", "Z")         %A server address
//   %{port}h client port                            %{upstream}T upstream (server) time in
//      seconds: nginx's $upstream_response_time, '-' or a list for retries, "0.010, 0.020" or
//      "0.010 : 0.020", whose values are added up
// %U and %q together build the target; %q must come after %U.
//
// Date and time formats: see time_format.h. %d, %t, %x and %z are read by their own syntax rather
// than up to a delimiter. A time stamp without a zone is this host's local time.
//
// Quoted fields (a field that ends at '"') may hold quotes escaped as \" (Apache) or \x22
// (nginx). %R, %u and the request target are unescaped (\" \\ \xHH); other fields are kept
// as written. Text after the last element of the format is ignored, so a line with extra
// trailing fields still parses.
//
// Thread safety: a LogFormat is immutable once compiled; Parse may be called from any number of
// threads at once, each with its own LogEntry.

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "collector/accesslog/time_format.h"

namespace accesslog {

// What one log line tells about one request. Strings reuse their capacity from line to line.
struct LogEntry {
  std::string client;             // %h as written: "192.0.2.7", "2001:db8::1", a host name
  uint16_t client_port = 0;       // 0 when not logged
  std::string vhost;              // virtual host, a ":port" after it removed; empty when not logged
  std::string method;             // "GET"
  std::string target;             // path and query as logged, unescaped ("/a/b.html?x=1")
  std::string protocol;           // "HTTP/1.1"
  int status = 0;                 // 0..999
  uint64_t body_bytes = 0;        // response body bytes; '-' is 0
  std::string referer;            // empty for '-' or not logged
  std::string user_agent;         // empty for '-' or not logged
  int64_t time_us = 0;            // the logged time stamp, microseconds since 1970-01-01 UTC
  bool time_is_start = false;     // time_us is when the request started (else when it ended)
  int64_t request_time_us = -1;   // time to serve the request; -1 when not logged
  int64_t upstream_time_us = -1;  // sum of upstream response times; -1 when not logged or '-'
  std::string server_address;     // %A; empty when not logged
};

class LogFormat {
 public:
  // Compiles a format in GoAccess's notation (see above). date_format and time_format are used
  // by %d, %t and %x; time_is_start says whether the logged time stamp is the request's start
  // (Apache's %t) or its end (nginx's $time_local). A format needs a date (%d or %x).
  // Returns nullopt and sets *error (when error is non-null) if the format is not valid.
  static std::optional<LogFormat> Compile(std::string_view log_format, std::string_view date_format,
                                          std::string_view time_format, bool time_is_start,
                                          std::string* error);

  // A format by name (see PresetNames):
  //
  // "combined": nginx's predefined "combined", Apache's "combined"; the stamp is the end
  // (nginx). For Apache logs, whose %t is the start, prefer "apache-timed".
  //   nginx:  log_format combined '$remote_addr - $remote_user [$time_local] '
  //                               '"$request" $status $body_bytes_sent '
  //                               '"$http_referer" "$http_user_agent"';
  //   Apache: LogFormat "%h %l %u %t \"%r\" %>s %b \"%{Referer}i\" \"%{User-Agent}i\"" combined
  //
  // "nginx-timed": combined with the request and upstream times; the stamp is the end.
  //   log_format timed '$remote_addr - $remote_user [$time_local] '
  //                    '"$request" $status $body_bytes_sent '
  //                    '"$http_referer" "$http_user_agent" '
  //                    '$request_time $upstream_response_time';
  //
  // "nginx-timed-vhost": the same, after the virtual host.
  //   log_format timed_vhost '$host $remote_addr - $remote_user [$time_local] '
  //                          '"$request" $status $body_bytes_sent '
  //                          '"$http_referer" "$http_user_agent" '
  //                          '$request_time $upstream_response_time';
  //
  // "apache-timed": combined with %D (microseconds); the stamp is the start.
  //   LogFormat "%h %l %u %t \"%r\" %>s %b \"%{Referer}i\" \"%{User-Agent}i\" %D" timed
  //
  // "apache-timed-vhost": the same after "host:port", as in Apache's vhost_combined.
  //   LogFormat "%v:%p %h %l %u %t \"%r\" %>s %b \"%{Referer}i\" \"%{User-Agent}i\" %D" vtimed
  //
  // Returns nullopt and sets *error (when non-null) for an unknown name.
  static std::optional<LogFormat> Preset(std::string_view name, std::string* error);

  // The names Preset accepts, for help texts.
  static std::span<const std::string_view> PresetNames();

  // Parses one line (a trailing "\n" or "\r\n" is ignored) into *entry, overwriting all its
  // fields. Returns false for a line that does not fit the format, with a short reason in
  // *reason (when non-null), such as "expected '\"' at column 17" or "status is not a number";
  // *entry is then partly filled and should be ignored. Never reads outside line.
  bool Parse(std::string_view line, LogEntry* entry, std::string* reason) const;

  bool time_is_start() const { return time_is_start_; }

 private:
  // What a format step reads. Fields marked "direct" are parsed from the line by their own
  // syntax; the others take the text up to their delimiter.
  enum class Kind : uint8_t {
    kLiteral,        // matches literal exactly
    kSkipBlanks,     // %~
    kIgnore,         // %^ %e %C %K %k %M
    kClient,         // %h
    kClientPort,     // %{port}h
    kVhost,          // %v
    kServerAddress,  // %A
    kRequest,        // %r
    kMethod,         // %m
    kPath,           // %U
    kQuery,          // %q
    kProtocol,       // %H
    kStatus,         // %s
    kBytes,          // %b
    kReferer,        // %R
    kUserAgent,      // %u
    kSeconds,        // %T
    kMillis,         // %L
    kMicros,         // %D
    kNanos,          // %n
    kUpstream,       // %{upstream}T, direct
    kDate,           // %d, direct
    kTime,           // %t, direct
    kDateTime,       // %x, direct
    kZone,           // %z, direct
  };

  struct Step {
    Kind kind = Kind::kLiteral;
    bool delimited = false;  // the field ends at `delimiter`; else at the end of the line
    char delimiter = 0;
    std::string literal;  // kLiteral only
  };

  struct Cursor;  // the line and the read position

  LogFormat() = default;

  // Reads the specifier at log_format[*i] (a '%'), leaving *i on its last character.
  static bool CompileSpecifier(std::string_view log_format, size_t* i, Kind* kind,
                               std::string* error);
  // Sets where each text field ends; checks that the format has a date.
  bool ResolveDelimiters(std::string* error);
  bool CompileTimeFormats(std::string_view date_format, std::string_view time_format,
                          std::string* error);
  bool ParseField(const Step& step, Cursor* cursor, LogEntry* entry, std::string* reason) const;
  static bool StoreField(Kind kind, std::string_view text, LogEntry* entry, std::string* reason);

  std::vector<Step> steps_;
  TimeFormat date_;
  TimeFormat time_;
  TimeFormat date_time_;  // for %x
  bool time_is_start_ = false;
};

}  // namespace accesslog
