// sm3logs: the collector's capture process for web-server access logs. It reads a log (one
// file, or a live log followed across rotation) and writes one .sm3 record per logged request,
// a page directly followed by its objects, into the writer's FIFO or a file.

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "collector/accesslog/commit_points.h"
#include "collector/accesslog/log_exchange.h"
#include "collector/accesslog/log_follower.h"
#include "collector/accesslog/log_format.h"
#include "collector/capture/page_assembler.h"
#include "collector/capture/record_builder.h"
#include "collector/capture/record_output.h"
#include "collector/common/process.h"

namespace {

constexpr char kFooter[] = R"(
Formats (--format): combined (nginx and Apache's default; time stamp = end of request),
  nginx-timed (combined + $request_time $upstream_response_time), nginx-timed-vhost ($host
  first), apache-timed (combined + %D; Apache's %t is the start), apache-timed-vhost ("%v:%p"
  first). Or --log-format in GoAccess's notation with --date-format and --time-format. The
  README shows the nginx log_format and Apache LogFormat lines for each.
Sources: --read FILE reads one file to its end; --follow FILE tails a live log across rename
  rotation and copytruncate, keeping its position in --state, so a restart neither skips nor
  repeats a line (without a state it starts at the end of the log, or at its start with
  --from-start). The position is also saved every second up to the last line whose record is
  out, so after a crash only the lines of that second and of views still open are read again.
Records: total response time = the logged request time; server time = the upstream time
  where logged, else the request time; network = the rest. Pages and objects by the URL's
  extension (.css .js .png ... are objects), objects after their page when their Referer names
  it, any other request a page of its own. The URL host is the virtual host, else --host.
Lines that do not fit the format are counted and skipped; the first few are quoted.
Exit status: 0 done (also after SIGINT or SIGTERM), 1 the input or output cannot be used, 2 bad
  command line.)";

constexpr int kUsageError = 2;
constexpr int kQuotedBadLines = 5;
// How often a followed log's position is saved while running: what a crash repeats at most,
// beyond the lines still held in open views.
constexpr std::chrono::seconds kCommitInterval(1);

using Clock = std::chrono::steady_clock;

capture::Micros WallMicros() {
  return std::chrono::duration_cast<std::chrono::microseconds>(
             std::chrono::system_clock::now().time_since_epoch())
      .count();
}

std::string HostName() {
  char name[256] = "";
  ::gethostname(name, sizeof(name) - 1);
  return name;
}

// The host's own address: its first up, non-loopback IPv4 (else IPv6) interface address.
capture::IpAddress OwnAddress() {
  capture::IpAddress best;
  best.bytes = {127, 0, 0, 1};
  struct ifaddrs* list = nullptr;
  if (getifaddrs(&list) != 0) {
    return best;
  }
  bool found_v6 = false;
  for (const struct ifaddrs* i = list; i != nullptr; i = i->ifa_next) {
    if (i->ifa_addr == nullptr || (i->ifa_flags & IFF_UP) == 0 ||
        (i->ifa_flags & IFF_LOOPBACK) != 0) {
      continue;
    }
    if (i->ifa_addr->sa_family == AF_INET) {
      capture::IpAddress a;
      std::memcpy(a.bytes.data(), &reinterpret_cast<sockaddr_in*>(i->ifa_addr)->sin_addr, 4);
      best = a;
      break;
    }
    if (i->ifa_addr->sa_family == AF_INET6 && !found_v6) {
      capture::IpAddress a;
      a.v6 = true;
      std::memcpy(a.bytes.data(), &reinterpret_cast<sockaddr_in6*>(i->ifa_addr)->sin6_addr, 16);
      best = a;
      found_v6 = true;
    }
  }
  freeifaddrs(list);
  return best;
}

bool ParseAddress(const std::string& text, capture::IpAddress* address) {
  *address = capture::IpAddress{};
  if (inet_pton(AF_INET, text.c_str(), address->bytes.data()) == 1) {
    return true;
  }
  address->v6 = true;
  return inet_pton(AF_INET6, text.c_str(), address->bytes.data()) == 1;
}

// Lines in, records out, with the counters of both.
class LogPipeline {
 public:
  LogPipeline(const accesslog::LogFormat& format, accesslog::ServerSide server,
              capture::RecordSink* sink, capture::CaptureStats* stats,
              const std::string& collector_id)
      : format_(format),
        server_(std::move(server)),
        builder_(Q7_PRODUCT_VERSION, collector_id),
        pages_(&builder_, sink, stats) {}

  void Line(std::string_view line) {
    ++lines_;
    if (line.empty() || line == "\n" || line == "\r\n") {
      return;
    }
    if (!format_.Parse(line, &entry_, &reason_)) {
      ++bad_;
      if (bad_ <= kQuotedBadLines) {
        const std::string_view shown = line.substr(0, std::min<size_t>(line.size(), 200));
        std::fprintf(stderr, "sm3logs: line %llu skipped (%s): \"%.*s\"%s\n",
                     static_cast<unsigned long long>(lines_), reason_.c_str(),
                     static_cast<int>(shown.size() - (shown.back() == '\n' ? 1 : 0)), shown.data(),
                     line.size() > 200 ? " ..." : "");
      }
      return;
    }
    accesslog::ToExchange(entry_, server_, &exchange_);
    exchange_.sequence = lines_;
    pages_.OnExchange(exchange_);
  }
  void Advance(capture::Micros now) { pages_.Advance(now); }
  void Flush() { pages_.Flush(); }
  // The number of the oldest line whose record is still held in a view; UINT64_MAX: none.
  uint64_t OldestHeld() const { return pages_.OldestHeld(); }
  uint64_t lines() const { return lines_; }
  uint64_t bad() const { return bad_; }

 private:
  const accesslog::LogFormat& format_;
  const accesslog::ServerSide server_;
  capture::RecordBuilder builder_;
  capture::PageAssembler pages_;
  accesslog::LogEntry entry_;
  capture::HttpExchange exchange_;
  std::string reason_;
  uint64_t lines_ = 0;
  uint64_t bad_ = 0;
};

void PrintStats(const char* label, const LogPipeline& logs, const capture::CaptureStats& s,
                const accesslog::FollowStats& f) {
  std::fprintf(
      stderr,
      "sm3logs: %slines=%llu bad_lines=%llu records=%llu pages=%llu objects=%llu "
      "orphan_objects=%llu records_lost=%llu rotations=%llu truncations=%llu "
      "long_lines=%llu\n",
      label, static_cast<unsigned long long>(logs.lines()),
      static_cast<unsigned long long>(logs.bad()), static_cast<unsigned long long>(s.records),
      static_cast<unsigned long long>(s.pages), static_cast<unsigned long long>(s.objects),
      static_cast<unsigned long long>(s.orphan_objects),
      static_cast<unsigned long long>(s.records_lost), static_cast<unsigned long long>(f.rotations),
      static_cast<unsigned long long>(f.truncations),
      static_cast<unsigned long long>(f.long_lines));
  std::fflush(stderr);
}

}  // namespace

int main(int argc, char** argv) {
  collector::RestoreStopSignals();
  CLI::App app{"sm3logs: web-server access-log lines as .sm3 collector records", "sm3logs"};
  app.footer(kFooter);

  std::string format_name;
  std::string log_format;
  std::string date_format = "%d/%b/%Y";
  std::string time_format = "%H:%M:%S";
  bool time_is_start = false;
  std::string read_path;
  std::string follow_path;
  accesslog::FollowOptions follow;
  std::string out_path;
  std::string fifo_path;
  std::string pid_path;
  std::string server_address;
  accesslog::ServerSide server;
  std::string collector_id = HostName();
  int stats_seconds = 0;

  auto* format_option = app.add_option("--format", format_name, "A named format (see below)");
  auto* log_format_option =
      app.add_option("--log-format", log_format, "A format in GoAccess's --log-format notation");
  format_option->excludes(log_format_option);
  app.add_option("--date-format", date_format, "With --log-format: the date's strftime format")
      ->capture_default_str();
  app.add_option("--time-format", time_format, "With --log-format: the time's strftime format")
      ->capture_default_str();
  app.add_flag("--time-is-start", time_is_start,
               "With --log-format: the time stamp is the request's start, not its end");
  auto* read_option = app.add_option("--read", read_path, "Read this log file once");
  auto* follow_option = app.add_option("--follow", follow_path, "Follow this live log");
  read_option->excludes(follow_option);
  app.add_option("--state", follow.state_path,
                 "With --follow: keep the position here (written atomically)");
  app.add_flag("--from-start", follow.from_start,
               "With --follow and no state: begin at the log's start, not its end");
  auto* out_option =
      app.add_option("-o,--out", out_path, "Write records to this file (\"-\": standard output)");
  auto* fifo_option = app.add_option("--fifo", fifo_path, "Write records into the writer's FIFO");
  out_option->excludes(fifo_option);
  app.add_option("--host", server.host, "URL host name when the log has no virtual host");
  app.add_option("--server-address", server_address,
                 "The server's address (default: this host's own)");
  app.add_option("--server-port", server.port, "The server's port (default: 0, not known)");
  app.add_option("--collector-id", collector_id, "Collector ID field (default: the host name)");
  app.add_option("--pid-file", pid_path, "Keep this pid file while running");
  app.add_option("--stats", stats_seconds,
                 "With --follow: print the counters every this many seconds")
      ->check(CLI::NonNegativeNumber);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? 0 : kUsageError;
  }
  if (read_path.empty() == follow_path.empty()) {
    std::fprintf(stderr, "sm3logs: give one of --read and --follow (see --help)\n");
    return kUsageError;
  }
  if (out_path.empty() == fifo_path.empty()) {
    std::fprintf(stderr, "sm3logs: give one of --out and --fifo (see --help)\n");
    return kUsageError;
  }
  if (format_name.empty() == log_format.empty()) {
    std::fprintf(stderr, "sm3logs: give one of --format and --log-format (see --help)\n");
    return kUsageError;
  }
  std::string error;
  const std::optional<accesslog::LogFormat> format =
      format_name.empty() ? accesslog::LogFormat::Compile(log_format, date_format, time_format,
                                                          time_is_start, &error)
                          : accesslog::LogFormat::Preset(format_name, &error);
  if (!format) {
    std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
    return kUsageError;
  }
  if (server_address.empty()) {
    server.address = OwnAddress();
  } else if (!ParseAddress(server_address, &server.address)) {
    std::fprintf(stderr, "sm3logs: --server-address %s is not an IPv4 or IPv6 address\n",
                 server_address.c_str());
    return kUsageError;
  }

  collector::InstallStopHandlers();
  capture::CaptureStats stats;
  std::unique_ptr<capture::RecordOutput> output =
      capture::OpenRecordOutput(out_path, fifo_path, &stats, &error);
  if (output == nullptr) {
    std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
    return 1;
  }
  const bool one_shot = !read_path.empty();
  follow.one_shot = one_shot;
  accesslog::LogFollower follower(one_shot ? read_path : follow_path, follow);
  if (!follower.Start(&error)) {
    std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
    return 1;
  }
  collector::PidFile pid_file;
  if (!pid_file.Write(pid_path, &error)) {
    std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
    return 1;
  }
  LogPipeline logs(*format, server, output.get(), &stats, collector_id);
  const auto on_line = [&logs](std::string_view line) { logs.Line(line); };

  int status = 0;
  Clock::time_point next_stats = Clock::now() + std::chrono::seconds(stats_seconds);
  // While following, the position is saved every second up to the last line whose record has
  // left the process, so that a crash repeats little and skips nothing.
  accesslog::CommitPoints commit_points;
  Clock::time_point next_commit = Clock::now() + kCommitInterval;
  while (!collector::StopRequested()) {
    if (!follower.Poll(on_line, &error)) {
      std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
      if (one_shot) {
        status = 1;
        break;
      }
    }
    if (!one_shot) {
      commit_points.Reached(logs.lines(), follower.position());
    }
    for (const std::string& note : follower.TakeNotes()) {
      std::fprintf(stderr, "sm3logs: %s\n", note.c_str());
    }
    if (one_shot && follower.at_end()) {
      break;
    }
    // Lines already read wait for the reader rather than be lost; a live log waits too.
    const bool pumped = capture::PumpOutput(output.get(), /*wait=*/true, &error);
    if (!pumped) {
      std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
      status = 1;
      break;
    }
    if (!one_shot) {
      logs.Advance(WallMicros());
      if (Clock::now() >= next_commit && output->Drained()) {
        next_commit = Clock::now() + kCommitInterval;
        const std::optional<accesslog::FilePosition> safe =
            commit_points.TakeSafe(logs.OldestHeld());
        if (safe && !follower.CommitAt(*safe, &error)) {
          std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
        }
      }
      if (stats_seconds > 0 && Clock::now() >= next_stats) {
        next_stats = Clock::now() + std::chrono::seconds(stats_seconds);
        PrintStats("stats: ", logs, stats, follower.stats());
      }
      if (follower.caught_up()) {
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
      }
    }
  }
  // Every view still open is written before the position is saved: what the state says was
  // read has reached the output.
  logs.Flush();
  if (!output->Finish(Clock::now() + std::chrono::seconds(1), &error)) {
    std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
    status = 1;
  }
  if (!one_shot && !follower.Commit(&error)) {
    std::fprintf(stderr, "sm3logs: %s\n", error.c_str());
    status = 1;
  }
  PrintStats("", logs, stats, follower.stats());
  return status;
}
