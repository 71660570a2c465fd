#include "collector/accesslog/log_format.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>
#include <random>
#include <string>
#include <string_view>
#include <vector>

namespace accesslog {
namespace {

// 2000-10-10 13:55:36 UTC, the stamp most lines below carry.
constexpr int64_t kOct10 = 971186136LL * 1000000;

// Sets TZ for one test and puts the old value back.
class ScopedTimeZone {
 public:
  explicit ScopedTimeZone(const char* zone) {
    const char* old = std::getenv("TZ");
    had_ = old != nullptr;
    old_ = had_ ? old : "";
    setenv("TZ", zone, 1);
    tzset();
  }
  ~ScopedTimeZone() {
    had_ ? setenv("TZ", old_.c_str(), 1) : unsetenv("TZ");
    tzset();
  }

 private:
  bool had_;
  std::string old_;
};

// Compiles a preset or a custom format once; Ok/Bad parse a line and keep the entry and reason.
class LogFormatTest : public testing::Test {
 protected:
  void UsePreset(std::string_view name) {
    std::string error;
    format_ = LogFormat::Preset(name, &error);
    ASSERT_TRUE(format_) << error;
  }
  void UseFormat(std::string_view log, std::string_view date, std::string_view time,
                 bool start = false) {
    std::string error;
    format_ = LogFormat::Compile(log, date, time, start, &error);
    ASSERT_TRUE(format_) << error;
  }
  bool Ok(std::string_view line) {
    const bool ok = format_->Parse(line, &entry_, &reason_);
    EXPECT_TRUE(ok) << reason_ << "\n  line: " << line;
    return ok;
  }
  // Returns the reason a line is refused ("" if it parsed).
  std::string Bad(std::string_view line) {
    reason_.clear();
    return format_->Parse(line, &entry_, &reason_) ? std::string() : reason_;
  }

  std::optional<LogFormat> format_;
  LogEntry entry_;
  std::string reason_;
};

using CombinedTest = LogFormatTest;

// A default nginx/Apache combined line fills every field it carries, and the stamp is the end.
TEST_F(CombinedTest, ReadsEveryField) {
  UsePreset("combined");
  ASSERT_TRUE(Ok(R"(192.0.2.7 - frank [10/Oct/2000:13:55:36 +0000] "GET /a/b.png?x=1&y=2 )"
                 R"L(HTTP/1.1" 200 2326 "http://example.com/start.html" "Mozilla/5.0 (X11)")L"));
  EXPECT_EQ(entry_.client, "192.0.2.7");
  EXPECT_EQ(entry_.client_port, 0);
  EXPECT_EQ(entry_.vhost, "");
  EXPECT_EQ(entry_.method, "GET");
  EXPECT_EQ(entry_.target, "/a/b.png?x=1&y=2");
  EXPECT_EQ(entry_.protocol, "HTTP/1.1");
  EXPECT_EQ(entry_.status, 200);
  EXPECT_EQ(entry_.body_bytes, 2326u);
  EXPECT_EQ(entry_.referer, "http://example.com/start.html");
  EXPECT_EQ(entry_.user_agent, "Mozilla/5.0 (X11)");
  EXPECT_EQ(entry_.time_us, kOct10);
  EXPECT_FALSE(entry_.time_is_start);
  EXPECT_EQ(entry_.request_time_us, -1);
  EXPECT_EQ(entry_.upstream_time_us, -1);
  EXPECT_EQ(entry_.server_address, "");
}

// '-' stands for no bytes, no Referer and no User-Agent; a user name may hold blanks.
TEST_F(CombinedTest, DashesAreEmpty) {
  UsePreset("combined");
  ASSERT_TRUE(Ok(R"(10.0.0.1 - john smith [10/Oct/2000:13:55:36 +0000] "HEAD / HTTP/1.0" 304 - )"
                 R"("-" "-")"));
  EXPECT_EQ(entry_.body_bytes, 0u);
  EXPECT_EQ(entry_.referer, "");
  EXPECT_EQ(entry_.user_agent, "");
  EXPECT_EQ(entry_.status, 304);
}

// Apache escapes quotes as \" and backslashes as \\; nginx writes \x22 and \x5C.
TEST_F(CombinedTest, EscapedQuotesAreDecoded) {
  UsePreset("combined");
  ASSERT_TRUE(Ok(R"(::1 - - [10/Oct/2000:13:55:36 +0000] "GET /q?s=\"a\" HTTP/1.1" 200 5 )"
                 R"("-" "Agent \"quoted\" back\\")"));
  EXPECT_EQ(entry_.target, "/q?s=\"a\"");
  EXPECT_EQ(entry_.user_agent, "Agent \"quoted\" back\\");
  ASSERT_TRUE(Ok(R"(::1 - - [10/Oct/2000:13:55:36 +0000] "GET /q?s=\x22a\x22 HTTP/2.0" 200 5 )"
                 R"("http://r/\x5Cx" "nginx \x22ua\x22 \q")"));
  EXPECT_EQ(entry_.target, "/q?s=\"a\"");
  EXPECT_EQ(entry_.protocol, "HTTP/2.0");
  EXPECT_EQ(entry_.referer, "http://r/\\x");
  EXPECT_EQ(entry_.user_agent, "nginx \"ua\" \\q");  // an unknown escape stays as written
}

// IPv6 clients keep their colons, including a zone-less v4-mapped form.
TEST_F(CombinedTest, Ipv6Clients) {
  UsePreset("combined");
  ASSERT_TRUE(Ok(R"(2001:db8::ff00:42:8329 - - [10/Oct/2000:13:55:36 +0000] "GET / HTTP/1.1" )"
                 R"(200 1 "-" "-")"));
  EXPECT_EQ(entry_.client, "2001:db8::ff00:42:8329");
  ASSERT_TRUE(Ok(R"(::ffff:192.0.2.1 - - [10/Oct/2000:13:55:36 +0000] "GET / HTTP/1.1" )"
                 R"(200 1 "-" "-")"));
  EXPECT_EQ(entry_.client, "::ffff:192.0.2.1");
}

// Fields after the format's end (a timed line read as combined) and CRLF endings are tolerated,
// and one entry reused across lines keeps nothing from the previous line.
TEST_F(CombinedTest, TrailingTextAndReuse) {
  UsePreset("combined");
  ASSERT_TRUE(Ok(R"(1.2.3.4 - - [10/Oct/2000:13:55:36 +0000] "GET / HTTP/1.1" 200 9 "r" "u" )"
                 "0.100 0.050\r\n"));
  EXPECT_EQ(entry_.request_time_us, -1);
  ASSERT_TRUE(Ok(R"(1.2.3.4 - - [10/Oct/2000:13:55:36 +0000] "GET /x HTTP/1.1" 200 9 "-" "-")"));
  EXPECT_EQ(entry_.referer, "");
  EXPECT_EQ(entry_.user_agent, "");
  EXPECT_EQ(entry_.target, "/x");
}

using NginxTimedTest = LogFormatTest;

// $request_time and $upstream_response_time are seconds with milliseconds.
TEST_F(NginxTimedTest, RequestAndUpstreamTimes) {
  UsePreset("nginx-timed");
  ASSERT_TRUE(Ok(R"(192.0.2.7 - - [10/Oct/2000:13:55:36 +0000] "POST /api HTTP/1.1" 201 17 )"
                 R"("-" "curl/7.88" 0.123 0.120)"));
  EXPECT_EQ(entry_.request_time_us, 123000);
  EXPECT_EQ(entry_.upstream_time_us, 120000);
  EXPECT_FALSE(entry_.time_is_start);
}

// Static files have no upstream ('-'); retries and redirects log lists whose sum is taken.
TEST_F(NginxTimedTest, UpstreamDashAndLists) {
  UsePreset("nginx-timed");
  const std::string head =
      R"(192.0.2.7 - - [10/Oct/2000:13:55:36 +0000] "GET / HTTP/1.1" 200 1 "-" "-" 2.5 )";
  ASSERT_TRUE(Ok(head + "-"));
  EXPECT_EQ(entry_.request_time_us, 2500000);
  EXPECT_EQ(entry_.upstream_time_us, -1);
  ASSERT_TRUE(Ok(head + "0.010, 0.020"));
  EXPECT_EQ(entry_.upstream_time_us, 30000);
  ASSERT_TRUE(Ok(head + "0.010, 0.020 : 0.005"));
  EXPECT_EQ(entry_.upstream_time_us, 35000);
  ASSERT_TRUE(Ok(head + "-, 0.004 extra"));  // a server that never answered, then trailing text
  EXPECT_EQ(entry_.upstream_time_us, 4000);
  EXPECT_EQ(Bad(head + "0.010, x"), "upstream time is not a number");
  EXPECT_EQ(Bad(head), "upstream time is not a number");
}

// $host comes first in the vhost variant.
TEST_F(NginxTimedTest, VirtualHost) {
  UsePreset("nginx-timed-vhost");
  ASSERT_TRUE(Ok(R"(shop.example.com 192.0.2.7 - - [10/Oct/2000:13:55:36 +0000] )"
                 R"("GET / HTTP/1.1" 200 1 "-" "-" 0.001 0.001)"));
  EXPECT_EQ(entry_.vhost, "shop.example.com");
  EXPECT_EQ(entry_.client, "192.0.2.7");
  EXPECT_EQ(entry_.request_time_us, 1000);
}

using ApacheTimedTest = LogFormatTest;

// %D is microseconds and Apache's %t is when the request started.
TEST_F(ApacheTimedTest, MicrosecondsAndStartStamp) {
  UsePreset("apache-timed");
  ASSERT_TRUE(Ok(R"(192.0.2.7 - - [10/Oct/2000:13:55:36 +0000] "GET / HTTP/1.1" 200 45 "-" )"
                 R"("Wget/1.21" 123456)"));
  EXPECT_EQ(entry_.request_time_us, 123456);
  EXPECT_EQ(entry_.upstream_time_us, -1);
  EXPECT_TRUE(entry_.time_is_start);
  EXPECT_EQ(entry_.time_us, kOct10);
}

// vhost_combined puts "host:port" first; the port is not part of the host.
TEST_F(ApacheTimedTest, VirtualHostWithPort) {
  UsePreset("apache-timed-vhost");
  ASSERT_TRUE(Ok(R"(www.example.org:443 2001:db8::1 - - [10/Oct/2000:13:55:36 +0000] )"
                 R"("GET / HTTP/1.1" 200 45 "-" "-" 987)"));
  EXPECT_EQ(entry_.vhost, "www.example.org");
  EXPECT_EQ(entry_.client, "2001:db8::1");
  EXPECT_EQ(entry_.request_time_us, 987);
  ASSERT_TRUE(Ok(R"([2001:db8::7]:8443 ::1 - - [10/Oct/2000:13:55:36 +0000] )"
                 R"("GET / HTTP/1.1" 200 45 "-" "-" 987)"));
  EXPECT_EQ(entry_.vhost, "[2001:db8::7]");
  ASSERT_TRUE(Ok(R"(2001:db8::7 ::1 - - [10/Oct/2000:13:55:36 +0000] )"
                 R"("GET / HTTP/1.1" 200 45 "-" "-" 987)"));
  EXPECT_EQ(entry_.vhost, "2001:db8::7");  // no port: the last group is part of the address
}

using TimeStampTest = LogFormatTest;

// The logged offset is applied: local 13:55:36 at -0700 is 20:55:36 UTC, at +0530 08:25:36.
TEST_F(TimeStampTest, ZoneOffsets) {
  UsePreset("combined");
  const auto line = [](std::string_view stamp) {
    return "1.2.3.4 - - [" + std::string(stamp) + R"(] "GET / HTTP/1.1" 200 1 "-" "-")";
  };
  ASSERT_TRUE(Ok(line("10/Oct/2000:13:55:36 -0700")));
  EXPECT_EQ(entry_.time_us, kOct10 + 7 * 3600 * 1000000LL);
  ASSERT_TRUE(Ok(line("10/Oct/2000:13:55:36 +0530")));
  EXPECT_EQ(entry_.time_us, kOct10 - (5 * 3600 + 30 * 60) * 1000000LL);
  ASSERT_TRUE(Ok(line("01/Jan/2024:00:00:00 +0100")));  // crosses back into the previous year
  EXPECT_EQ(entry_.time_us, 1704063600LL * 1000000);
  ASSERT_TRUE(Ok(line("29/Feb/2024:12:00:00 +0000")));
  EXPECT_EQ(entry_.time_us, 1709208000LL * 1000000);
}

// Our date arithmetic agrees with timegm over a wide spread of dates.
TEST_F(TimeStampTest, AgreesWithTimegm) {
  UseFormat("%d %t", "%Y-%m-%d", "%H:%M:%S%z");
  std::mt19937 random(7);
  for (int i = 0; i < 2000; ++i) {
    std::tm tm{};
    tm.tm_year = 70 + static_cast<int>(random() % 130);
    tm.tm_mon = static_cast<int>(random() % 12);
    tm.tm_mday = 1 + static_cast<int>(random() % 28);
    tm.tm_hour = static_cast<int>(random() % 24);
    tm.tm_min = static_cast<int>(random() % 60);
    tm.tm_sec = static_cast<int>(random() % 60);
    char text[64];
    std::strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S+0000", &tm);
    ASSERT_TRUE(Ok(text));
    EXPECT_EQ(entry_.time_us, static_cast<int64_t>(timegm(&tm)) * 1000000) << text;
  }
}

// Without a logged zone the stamp is local time.
TEST_F(TimeStampTest, LocalTimeWithoutZone) {
  const ScopedTimeZone zone("XYZ3");  // POSIX: three hours west of UTC, no tzdata needed
  UseFormat("%h %^[%d:%t %^]", "%d/%b/%Y", "%H:%M:%S");
  ASSERT_TRUE(Ok("1.2.3.4 - - [10/Oct/2000:10:55:36 +9999]"));
  EXPECT_EQ(entry_.time_us, kOct10);
}

// Local stamps across a change to summer time, each minute on its own: 01:59:59 CET and
// 03:00:00 CEST are one second apart.
TEST_F(TimeStampTest, LocalTimeAcrossDaylightSaving) {
  const ScopedTimeZone zone("CET-1CEST,M3.5.0,M10.5.0/3");
  UseFormat("%h [%d:%t]", "%d/%b/%Y", "%H:%M:%S");
  constexpr int64_t kSecond = 1000000;
  ASSERT_TRUE(Ok("1.2.3.4 [29/Mar/2026:01:59:30]"));
  EXPECT_EQ(entry_.time_us, 1774745970 * kSecond);
  ASSERT_TRUE(Ok("1.2.3.4 [29/Mar/2026:01:59:59]"));
  EXPECT_EQ(entry_.time_us, 1774745999 * kSecond);
  ASSERT_TRUE(Ok("1.2.3.4 [29/Mar/2026:03:00:00]"));
  EXPECT_EQ(entry_.time_us, 1774746000 * kSecond);
  ASSERT_TRUE(Ok("1.2.3.4 [29/Mar/2026:01:59:59]"));  // back to a minute seen before
  EXPECT_EQ(entry_.time_us, 1774745999 * kSecond);
}

// Seconds since 1970 with a fraction ($msec), ISO 8601 with "+02:00", and microseconds (%f).
TEST_F(TimeStampTest, OtherStampShapes) {
  UseFormat("%x %h", "%s", "%s");
  ASSERT_TRUE(Ok("971186136.250 10.0.0.1"));
  EXPECT_EQ(entry_.time_us, kOct10 + 250000);
  UseFormat("%dT%t %h", "%Y-%m-%d", "%T%z");
  ASSERT_TRUE(Ok("2000-10-10T15:55:36+02:00 10.0.0.1"));
  EXPECT_EQ(entry_.time_us, kOct10);
  UseFormat("%x %h", "%f", "%f");
  ASSERT_TRUE(Ok("971186136000001 10.0.0.1"));
  EXPECT_EQ(entry_.time_us, kOct10 + 1);
  UseFormat("%d|%h", "%e %B %Y %z", "");  // full month names, any case
  ASSERT_TRUE(Ok("10 october 2000 +0000|10.0.0.1"));
  EXPECT_EQ(entry_.time_us, kOct10 - (13 * 3600 + 55 * 60 + 36) * 1000000LL);
  UseFormat("%x|%h", "%F", "%T %z");  // %x joins the two formats with a blank
  ASSERT_TRUE(Ok("2000-10-10 13:55:36 Z|10.0.0.1"));
  EXPECT_EQ(entry_.time_us, kOct10);
}

using CustomFormatTest = LogFormatTest;

// GoAccess's vhost notation with %T and the zone skipped by %^.
TEST_F(CustomFormatTest, GoAccessVhostFormat) {
  const ScopedTimeZone zone("UTC0");
  UseFormat(R"(%v %h %^[%d:%t %^] "%r" %s %b %T)", "%d/%b/%Y", "%H:%M:%S", true);
  ASSERT_TRUE(Ok(R"(example.net 203.0.113.9 - - [10/Oct/2000:13:55:36 +0000] )"
                 R"("DELETE /item/7 HTTP/1.1" 204 - 0.5)"));
  EXPECT_EQ(entry_.vhost, "example.net");
  EXPECT_EQ(entry_.method, "DELETE");
  EXPECT_EQ(entry_.status, 204);
  EXPECT_EQ(entry_.request_time_us, 500000);
  EXPECT_EQ(entry_.time_us, kOct10);
  EXPECT_TRUE(entry_.time_is_start);
}

// Separate method/path/query/protocol fields, %L, %n, %A, %{port}h and %~.
TEST_F(CustomFormatTest, SplitRequestAndOtherUnits) {
  UseFormat("%d %h:%{port}h %A %m %U %q %H %~%s %L %n", "%F", "");
  ASSERT_TRUE(Ok("2000-10-10 10.0.0.1:51234 10.0.0.2 GET /p a=1 HTTP/1.1   200 12.5 7000"));
  EXPECT_EQ(entry_.client_port, 51234);
  EXPECT_EQ(entry_.server_address, "10.0.0.2");
  EXPECT_EQ(entry_.target, "/p?a=1");
  EXPECT_EQ(entry_.protocol, "HTTP/1.1");
  EXPECT_EQ(entry_.request_time_us, 7);  // the last time field wins: 7000 ns
  UseFormat("%d %L", "%F", "");
  ASSERT_TRUE(Ok("2000-10-10 12.5"));
  EXPECT_EQ(entry_.request_time_us, 12500);
}

// Formats that cannot work are refused when compiled, with the reason.
TEST_F(CustomFormatTest, CompileErrors) {
  const auto error = [](std::string_view log, std::string_view date = "%d/%b/%Y",
                        std::string_view time = "%T") {
    std::string reason;
    EXPECT_FALSE(LogFormat::Compile(log, date, time, false, &reason));
    return reason;
  };
  EXPECT_EQ(error("%h %Q [%d]"), "unknown specifier %Q at position 4");
  EXPECT_EQ(error("%h %{foo}h [%d]"), "unknown specifier %{foo}h at position 4");
  EXPECT_NE(error("%h%s [%d]"), "");  // two fields with nothing to tell them apart
  EXPECT_EQ(error("%h %s"), "log format has no date (%d or %x)");
  EXPECT_EQ(error("[%d] %"), "log format ends with '%'");
  EXPECT_EQ(error("[%d]", "%d/%b"), "date format needs a year, a month and a day (or %s or %f)");
  EXPECT_EQ(error("[%d]", "%d/%Q/%Y"), "date format: unsupported %Q");
  std::string reason;
  EXPECT_FALSE(LogFormat::Preset("nginx", &reason));
  EXPECT_EQ(reason, "unknown log format \"nginx\"");
  for (std::string_view name : LogFormat::PresetNames()) {
    EXPECT_TRUE(LogFormat::Preset(name, &reason)) << name << ": " << reason;
  }
}

using BadLineTest = LogFormatTest;

// Each way a line can be wrong is refused with a reason naming it.
TEST_F(BadLineTest, ReasonsNameTheProblem) {
  UsePreset("nginx-timed");
  const std::string good =
      R"(1.2.3.4 - - [10/Oct/2000:13:55:36 +0000] "GET / HTTP/1.1" 200 9 "-" "-" 0.1 0.1)";
  ASSERT_TRUE(Ok(good));
  const auto with = [&](std::string_view from, std::string_view to) {
    std::string line = good;
    line.replace(line.find(from), from.size(), to);
    return Bad(line);
  };
  EXPECT_EQ(with(" 200 ", " 2x0 "), "status is not a number");
  EXPECT_EQ(with(" 200 ", " 2000 "), "status out of range");
  EXPECT_EQ(with(" 9 ", " 99999999999999999999 "), "body bytes out of range");
  EXPECT_EQ(with(" 9 ", " -1 "), "body bytes is not a number");
  EXPECT_EQ(with("Oct", "Okt"), "bad month name at column 17");
  EXPECT_EQ(with("10/Oct", "31/Feb"), "date has no such day");
  EXPECT_EQ(with("10/Oct/2000", "29/Feb/2023"), "date has no such day");  // not a leap year
  EXPECT_EQ(with("13:55", "25:55"), "hour out of range at column 26");
  EXPECT_EQ(with("+0000", "UTC"), "bad zone offset at column 35");
  EXPECT_EQ(with("[10", "10"), "missing '[' after column 9");
  EXPECT_EQ(with("] \"GET", "]\"GET"), "expected ' ' at column 41");
  EXPECT_EQ(with("\"GET / HTTP/1.1\"", "\"-\""), "request is not \"METHOD TARGET PROTOCOL\"");
  EXPECT_EQ(with("GET / HTTP/1.1", "\\x16\\x03\\x01 / HTTP/1.1"), "request method is not a token");
  EXPECT_EQ(with("HTTP/1.1", "SIP/2.0"), "request protocol is not HTTP/n");
  EXPECT_EQ(with("0.1 0.1", "0.1s 0.1"), "request time is not a number");
  EXPECT_EQ(with(" \"-\" 0.1", " \"- 0.1"), "missing '\"' after column 70");
  EXPECT_EQ(with("1.2.3.4", "1.2\x01.4"), "bad client address");
  EXPECT_EQ(Bad(""), "missing ' ' after column 1");
  EXPECT_EQ(Bad("1.2.3.4 - - [10/Oct/2000:13:55:36 +0000] \"GET / HTTP/1.1\" 200"),
            "missing ' ' after column 59");  // a line cut short
}

// Huge lines, NULs, unterminated escapes and random damage never crash or read past the line
// (run under AddressSanitizer, which sees reads past the copy's end).
TEST_F(BadLineTest, HostileInputNeverCrashes) {
  UsePreset("nginx-timed-vhost");
  EXPECT_NE(Bad(std::string(1 << 20, 'A')), "");
  EXPECT_NE(Bad("h 1.2.3.4 - - [10/Oct/2000:13:55:36 +0000] \"" + std::string(1 << 20, '\\')), "");
  EXPECT_NE(Bad(std::string("h 1.2.3.4\0 - - [", 17)), "");
  const std::string good = R"(h 1.2.3.4 - u [10/Oct/2000:13:55:36 +0000] "GET /\x22 HTTP/1.1" )"
                           R"(200 9 "r\\" "u\"" 0.1 0.2, 0.3)";
  ASSERT_TRUE(Ok(good));
  std::mt19937 random(42);
  for (int i = 0; i < 20000; ++i) {
    std::string line = good;
    for (int edits = 1 + static_cast<int>(random() % 4); edits > 0; --edits) {
      const size_t at = random() % line.size();
      switch (random() % 3) {
        case 0:
          line[at] = static_cast<char>(random());
          break;
        case 1:
          line.erase(at, 1 + random() % 8);
          break;
        default:
          line.resize(at);
          break;
      }
      if (line.empty()) {
        break;
      }
    }
    // An exact-size heap block, so that AddressSanitizer catches a read past the end.
    const std::vector<char> copy(line.begin(), line.end());
    if (!format_->Parse(std::string_view(copy.data(), copy.size()), &entry_, &reason_)) {
      EXPECT_FALSE(reason_.empty());
    }
  }
}

}  // namespace
}  // namespace accesslog
