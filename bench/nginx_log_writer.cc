#include "bench/nginx_log_writer.h"

#include <fmt/format.h>

#include <cstdio>
#include <ctime>
#include <iterator>
#include <memory>
#include <string_view>

#include "bench/nginx_traffic.h"

namespace bench {
namespace {

constexpr Micros kSecond = 1000000;
constexpr std::string_view kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                        "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};

// Lines of the nginx-timed format, the time stamp of a second formatted once.
class LineWriter {
 public:
  // base: added to the traffic's times to place them in time. out may be null: then only the
  // summary is kept.
  LineWriter(Micros base, std::FILE* out) : base_(base), out_(out) {}

  void Write(const LoggedRequest& r) {
    const int64_t stamp = (base_ + r.end) / kSecond;
    if (summary_.lines == 0) {
      summary_.first_unix = stamp;
    }
    summary_.last_unix = stamp;
    ++summary_.lines;
    if (out_ == nullptr) {
      return;
    }
    if (stamp != stamp_second_) {
      stamp_second_ = stamp;
      const std::time_t t = static_cast<std::time_t>(stamp);
      std::tm tm{};
      gmtime_r(&t, &tm);
      stamp_text_ =
          fmt::format("{:02}/{}/{:04}:{:02}:{:02}:{:02} +0000", tm.tm_mday, kMonths[tm.tm_mon],
                      tm.tm_year + 1900, tm.tm_hour, tm.tm_min, tm.tm_sec);
    }
    line_.clear();
    fmt::format_to(std::back_inserter(line_),
                   "{} - - [{}] \"{} {} {}\" {} {} \"{}\" \"{}\" {}.{:03} ", r.client, stamp_text_,
                   r.method, r.path, r.http2 ? "HTTP/2.0" : "HTTP/1.1", r.status, r.bytes,
                   r.referer, r.agent, r.request_ms / 1000, r.request_ms % 1000);
    if (r.upstream_ms < 0) {
      line_ += "-\n";
    } else {
      fmt::format_to(std::back_inserter(line_), "{}.{:03}\n", r.upstream_ms / 1000,
                     r.upstream_ms % 1000);
    }
    summary_.bytes += line_.size();
    std::fwrite(line_.data(), 1, line_.size(), out_);
  }

  LogSummary* summary() { return &summary_; }

 private:
  const Micros base_;
  std::FILE* const out_;
  LogSummary summary_;
  int64_t stamp_second_ = INT64_MIN;
  std::string stamp_text_;
  std::string line_;
};

struct FileCloser {
  void operator()(std::FILE* f) const { std::fclose(f); }
};

}  // namespace

bool WriteNginxLog(const LogShape& shape, const std::string& path, LogSummary* summary,
                   std::string* error) {
  // A first pass without output measures how long the traffic lasts, so that the second can
  // end it at end_unix: the model's choices do not depend on where it lies in time.
  LineWriter dry(0, nullptr);
  GenerateTraffic(shape.lines, shape.seed, [&dry](const LoggedRequest& r) { dry.Write(r); });
  const Micros base = shape.end_unix * kSecond - (dry.summary()->last_unix * kSecond + kSecond - 1);
  std::unique_ptr<std::FILE, FileCloser> out(std::fopen(path.c_str(), "w"));
  if (out == nullptr) {
    *error = fmt::format("cannot write {}", path);
    return false;
  }
  std::setvbuf(out.get(), nullptr, _IOFBF, 1 << 20);
  LineWriter writer(base, out.get());
  const uint64_t visits = GenerateTraffic(shape.lines, shape.seed,
                                          [&writer](const LoggedRequest& r) { writer.Write(r); });
  if (std::fflush(out.get()) != 0 || std::ferror(out.get())) {
    *error = fmt::format("write error on {}", path);
    return false;
  }
  *summary = *writer.summary();
  summary->visits = visits;
  return true;
}

}  // namespace bench
