// A race on one access log between GoAccess (Debian's /usr/bin/goaccess) and our pipeline:
// sm3logs turning the log into .sm3 records and a fresh q7agent aggregating them into its
// tables. The bench writes itself a seeded nginx-timed log (see nginx_log_writer.h), then
//  - runs GoAccess on it to a JSON report, timing it and taking its peak resident memory;
//  - starts q7agent in a temporary home whose data directory holds an empty live .sm3 file,
//    then runs `sm3logs --read LOG --out` into that file; the agent tails it as it grows. The
//    clock runs from the start of sm3logs until the agent's tables count every record (polled
//    over its HTTP API);
//  - compares the answers: per URL path, hits and the average and maximum time served, and the
//    counts per status class, between GoAccess's report and the agent's Q7TXSM (pages) and
//    Q7SUBTXSM (objects) summaries. Exit status 1 on a disagreement beyond the agent's
//    whole-millisecond rounding;
//  - says what each reports that the other does not.
//
// GoAccess runs as Debian sets it up (its /etc/goaccess/goaccess.conf applies), with every
// item of every panel in the report. Our run waits for the next 5-minute interval when the
// current one is nearly over: the agent's summaries must be read before its first rollover.
// The log is kept in /tmp under a name made of its parameters and reused by later runs while
// its time stamps are recent enough for the agent's 24-hour summary.
//
// Usage: bench_logs_race [--lines N] [--seed N] [--keep DIR]
//   --keep DIR  work in DIR (new or empty; no '.' or '-' in its path) and leave GoAccess's
//               report, the records and the agent's home (trace, history) there.

#include <fcntl.h>
#include <fmt/format.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "bench/nginx_log_writer.h"
#include "bench/race_agent.h"
#include "bench/url_figures.h"
#include "tests/agent_process.h"

namespace {

using bench::AgentHome;
using bench::FinalRecord;
using bench::FindFinalRecord;
using bench::Sample;
using bench::SumColumn;
using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

// Part of the cached log's name: change it whenever the traffic model changes.
constexpr int kLogVersion = 1;
constexpr uint64_t kDefaultSeed = 20261126;
// A reused log must still lie inside the agent's 24-hour summary when the run ends.
constexpr int64_t kReuseSeconds = 12 * 3600;
constexpr char kGoAccessPath[] = "/usr/bin/goaccess";
// nginx-timed in GoAccess's notation: %T gives the time served; the upstream time is skipped.
constexpr char kGoAccessFormat[] = R"(%h %^[%d:%t %^] "%r" %s %b "%R" "%u" %T %^)";
// The agent's averages are whole milliseconds truncated per row, on both the response time and
// the load time subtracted from it.
constexpr double kAverageToleranceMs = 1.0;
// The agent's over-time interval (its default, 5 minutes).
constexpr int64_t kIntervalSeconds = 300;

double Since(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}
double Seconds(const timeval& tv) {
  return static_cast<double>(tv.tv_sec) + static_cast<double>(tv.tv_usec) / 1e6;
}

// What a process used.
struct Usage {
  int exit_code = -1;
  double wall = 0;  // seconds
  double cpu = 0;   // user + system seconds
  long peak_rss_kb = 0;
};

// A child process with its output in files, measured by wait4.
class Child {
 public:
  Child(const std::vector<std::string>& argv, const std::string& out_path,
        const std::string& err_path)
      : start_(Clock::now()) {
    pid_ = ::fork();
    if (pid_ == 0) {
      const int out = ::open(out_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      const int err = ::open(err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      if (out < 0 || err < 0) {
        ::_exit(126);
      }
      ::dup2(out, STDOUT_FILENO);
      ::dup2(err, STDERR_FILENO);
      std::vector<char*> args;
      for (const std::string& arg : argv) {
        args.push_back(const_cast<char*>(arg.c_str()));
      }
      args.push_back(nullptr);
      ::execv(args[0], args.data());
      ::_exit(127);
    }
  }
  ~Child() {
    if (pid_ > 0 && !usage_) {
      ::kill(pid_, SIGKILL);
      Wait();
    }
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  // The usage once the process ended; nullopt while it runs (block: wait for it).
  std::optional<Usage> Poll(bool block = false) {
    if (usage_ || pid_ <= 0) {
      return usage_;
    }
    int status = 0;
    rusage used{};
    if (::wait4(pid_, &status, block ? 0 : WNOHANG, &used) != pid_) {
      return std::nullopt;
    }
    Usage u;
    u.wall = Since(start_);
    u.cpu = Seconds(used.ru_utime) + Seconds(used.ru_stime);
    u.peak_rss_kb = used.ru_maxrss;
    u.exit_code = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    usage_ = u;
    return usage_;
  }
  Usage Wait() { return *Poll(true); }

 private:
  pid_t pid_ = -1;
  Clock::time_point start_;
  std::optional<Usage> usage_;
};

// Peak resident memory (VmHWM) and CPU seconds of a running process, from /proc.
Usage ProcUsage(pid_t pid) {
  Usage u;
  std::ifstream status(fmt::format("/proc/{}/status", pid));
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmHWM:", 0) == 0) {
      u.peak_rss_kb = std::atol(line.c_str() + 6);
    }
  }
  const std::string stat = q7test::readFile(fmt::format("/proc/{}/stat", pid));
  const size_t paren = stat.rfind(')');
  if (paren != std::string::npos) {
    // Fields after the command: state is field 3, utime and stime are fields 14 and 15.
    std::istringstream fields(stat.substr(paren + 2));
    std::string skip;
    for (int field = 3; field < 14; ++field) {
      fields >> skip;
    }
    long utime = 0;
    long stime = 0;
    fields >> utime >> stime;
    u.cpu = static_cast<double>(utime + stime) / static_cast<double>(::sysconf(_SC_CLK_TCK));
  }
  return u;
}

// The log for these parameters: reused when an earlier run left it recent enough.
bool PrepareLog(uint64_t lines, uint64_t seed, std::string* path, bench::LogSummary* summary) {
  *path = fmt::format("/tmp/q7logsrace_n{}_s{}_v{}.log", lines, seed, kLogVersion);
  const std::string info = *path + ".info";
  std::ifstream in(info);
  std::map<std::string, int64_t> saved;
  std::string key;
  int64_t value = 0;
  while (in >> key >> value) {
    saved[key] = value;
  }
  const int64_t now = std::time(nullptr);
  if (std::filesystem::exists(*path) && saved.size() == 5 &&
      saved["last_unix"] > now - kReuseSeconds) {
    summary->lines = static_cast<uint64_t>(saved["lines"]);
    summary->visits = static_cast<uint64_t>(saved["visits"]);
    summary->bytes = static_cast<uint64_t>(saved["bytes"]);
    summary->first_unix = saved["first_unix"];
    summary->last_unix = saved["last_unix"];
    std::printf("reusing %s\n", path->c_str());
    return true;
  }
  std::printf("writing %s ...\n", path->c_str());
  std::fflush(stdout);
  const auto start = Clock::now();
  const std::string temp = *path + ".tmp";
  std::string error;
  if (!bench::WriteNginxLog({lines, seed, now}, temp, summary, &error)) {
    std::fprintf(stderr, "bench_logs_race: %s\n", error.c_str());
    return false;
  }
  std::filesystem::rename(temp, *path);
  {
    // The info file last: its presence says the log is complete.
    std::ofstream out(info + ".tmp");
    out << "lines " << summary->lines << "\nvisits " << summary->visits << "\nbytes "
        << summary->bytes << "\nfirst_unix " << summary->first_unix << "\nlast_unix "
        << summary->last_unix << "\n";
  }
  std::filesystem::rename(info + ".tmp", info);
  std::printf("written in %.1f s\n", Since(start));
  return true;
}

// Reads the whole file once, so that neither contender pays for the disk.
void WarmPageCache(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::vector<char> buffer(1 << 20);
  while (in.read(buffer.data(), static_cast<std::streamsize>(buffer.size())) || in.gcount() > 0) {
  }
}

std::string Clock24(int64_t unix_seconds) {
  const std::time_t t = static_cast<std::time_t>(unix_seconds);
  std::tm tm{};
  gmtime_r(&t, &tm);
  return fmt::format("{:02}:{:02}:{:02}", tm.tm_hour, tm.tm_min, tm.tm_sec);
}

// The value of "key=N" in sm3logs's final counters line, or -1.
long long Counter(const std::string& text, const std::string& key) {
  const size_t line = text.rfind("sm3logs: lines=");
  if (line == std::string::npos) {
    return -1;
  }
  const size_t at = text.find(" " + key + "=", line);
  return at == std::string::npos ? -1 : std::atoll(text.c_str() + at + key.size() + 2);
}

// The top entries of a GoAccess panel as "name hits, ...", skipping the site's own name.
std::string TopItems(const nlohmann::json& report, const char* panel, size_t count) {
  std::string text;
  size_t shown = 0;
  for (const nlohmann::json& item : report[panel]["data"]) {
    const std::string name = item.value("data", std::string());
    if (name == bench::kLogHost || shown == count) {
      continue;
    }
    text += fmt::format("{}{} {}", shown++ == 0 ? "" : ", ", name,
                        item["hits"]["count"].get<uint64_t>());
  }
  return text;
}

size_t Rows(const nlohmann::json& sample) {
  return sample.is_object() ? sample["rows"].size() : 0;
}

// What each tool reports that the other cannot, with this run's figures.
void PrintOnlyOneSide(const nlohmann::json& report, const std::string& address,
                      size_t object_pairs) {
  if (report.is_object()) {
    const nlohmann::json& general = report["general"];
    std::printf("\nonly GoAccess reports:\n");
    std::printf("  unique visitors: %llu (address, day and user agent together; 4xx left out)\n",
                general.value("unique_visitors", 0ULL));
    std::printf("  user agents read as OS and browser: %zu OS families (%s), %zu browsers (%s)\n",
                report["os"]["data"].size(), TopItems(report, "os", 3).c_str(),
                report["browsers"]["data"].size(), TopItems(report, "browsers", 3).c_str());
    std::printf("  referring sites: %s (the agent reads a Referer only to find an object's page)\n",
                TopItems(report, "referring_sites", 3).c_str());
    std::printf(
        "  hits by hour of the log's own time stamps: %s; the agent counts a record older "
        "than its current interval into that interval\n",
        TopItems(report, "visit_time", 4).c_str());
    std::printf(
        "  a not-found panel: %llu URLs answered 404, listed apart (the agent counts 404s "
        "per URL row)\n",
        general.value("unique_not_found", 0ULL));
  }
  const nlohmann::json app = Sample(address, "Q7APPSM");
  if (Rows(app) != 1) {
    return;
  }
  const nlohmann::json& a = app["rows"][0];
  const auto i = [&a](const char* column) { return a.value(column, 0LL); };
  std::printf("\nonly the agent reports:\n");
  std::printf(
      "  page views: %lld pages with %lld objects each on average (%lld bytes); a view "
      "takes %lld ms on average = server %lld + network %lld + objects' load %lld\n",
      i("totreq"), i("objcnt"), i("objsize"), i("oatime"), i("servtime"), i("netwtime"),
      i("loadtime"));
  std::printf(
      "  which objects each page pulls, with their own times: %zu (object, page) rows in "
      "Q7SUBTXSM\n",
      object_pairs);
  std::printf(
      "  against a threshold (2000 ms here): %lld slow and %lld failed pages, "
      "availability %.3f %%, rank %lld, per application and per transaction\n",
      i("slowreq"), i("failreq"), static_cast<double>(i("pcavail")) / 1000.0, i("rank"));
  std::printf(
      "  pairings: %zu clients, %zu client x server and %zu client x application rows, "
      "%zu server(s)\n",
      Rows(Sample(address, "Q7CLNTSM")), Rows(Sample(address, "Q7CLNTSRV")),
      Rows(Sample(address, "Q7CLNTAPP")), Rows(Sample(address, "Q7SRVSM")));
  std::printf(
      "  5-minute over-time rows kept 24 h (Q7APPOT: %zu now) and situations on patterns "
      "(Q7TXPTNS: %zu), live while the log grows\n",
      Rows(Sample(address, "Q7APPOT")), Rows(Sample(address, "Q7TXPTNS")));
}

void PrintUsage(const char* who, const Usage& u, uint64_t lines) {
  std::printf("%-34s %8.2f %8.2f %12.0f %12.1f\n", who, u.wall, u.cpu,
              static_cast<double>(lines) / u.wall, static_cast<double>(u.peak_rss_kb) / 1024.0);
}

struct Options {
  uint64_t lines = 1000000;
  uint64_t seed = kDefaultSeed;
  std::string keep;
};

bool ParseOptions(int argc, char** argv, Options* options) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--lines") == 0 && i + 1 < argc) {
      options->lines = std::strtoull(argv[++i], nullptr, 10);
    } else if (std::strcmp(argv[i], "--seed") == 0 && i + 1 < argc) {
      options->seed = std::strtoull(argv[++i], nullptr, 10);
    } else if (std::strcmp(argv[i], "--keep") == 0 && i + 1 < argc) {
      options->keep = argv[++i];
    } else {
      return false;
    }
  }
  return options->lines > 0;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (!ParseOptions(argc, argv, &options)) {
    std::fprintf(stderr, "usage: %s [--lines N] [--seed N] [--keep DIR]\n", argv[0]);
    return 2;
  }
  std::string log_path;
  bench::LogSummary log;
  if (!PrepareLog(options.lines, options.seed, &log_path, &log)) {
    return 1;
  }
  std::printf("log: %llu lines, %.1f MB, %llu visits, %s to %s UTC, host %s\n",
              static_cast<unsigned long long>(log.lines), static_cast<double>(log.bytes) / 1e6,
              static_cast<unsigned long long>(log.visits), Clock24(log.first_unix).c_str(),
              Clock24(log.last_unix).c_str(), bench::kLogHost);

  // Where the report, the records and the agent's home go. The data directory's path must hold
  // no '.' or '-', which the agent's file order would misread.
  std::string work = options.keep;
  std::unique_ptr<q7test::ScratchDir> scratch;
  if (work.empty()) {
    scratch = std::make_unique<q7test::ScratchDir>();
    work = scratch->path();
  } else {
    work = std::filesystem::absolute(work).lexically_normal().string();
    if (work.find_first_of(".-") != std::string::npos) {
      std::fprintf(stderr, "bench_logs_race: --keep %s: no '.' or '-' in the path, please\n",
                   work.c_str());
      return 2;
    }
    std::error_code ec;
    if (std::filesystem::exists(work) && !std::filesystem::is_empty(work, ec)) {
      // An agent home left there would start from its saved state.
      std::fprintf(stderr, "bench_logs_race: --keep %s: not empty\n", work.c_str());
      return 2;
    }
    std::filesystem::create_directories(work);
  }
  WarmPageCache(log_path);

  // GoAccess first, on its own.
  std::optional<Usage> goaccess;
  const std::string report_path = work + "/goaccess.json";
  const bool have_goaccess = ::access(kGoAccessPath, X_OK) == 0;
  if (have_goaccess) {
    std::printf("GoAccess: running ...\n");
    std::fflush(stdout);
    Child child({kGoAccessPath, log_path, std::string("--log-format=") + kGoAccessFormat,
                 "--date-format=%d/%b/%Y", "--time-format=%T", "--max-items=1000000",
                 "--no-progress", "-o", report_path},
                work + "/goaccess.out", work + "/goaccess.err");
    goaccess = child.Wait();
    if (goaccess->exit_code != 0) {
      std::printf("GoAccess exited with %d: %s\n", goaccess->exit_code,
                  q7test::readFile(work + "/goaccess.err").c_str());
      goaccess.reset();
    }
  } else {
    std::printf("GoAccess is not installed (%s): running ours only; `make deps` installs it\n",
                kGoAccessPath);
  }

  // Ours: the agent up and waiting on an empty live file, then sm3logs into it.
  AgentHome home(work);
  std::string error;
  if (!home.Prepare(&error)) {
    std::fprintf(stderr, "bench_logs_race: %s\n", error.c_str());
    return 1;
  }
  const std::string records_path = home.data() + "/access.sm3";
  std::ofstream(records_path).close();
  // Everything must happen inside one over-time interval: at a rollover the agent moves its
  // trees to history, and a summary query loads at most 25000 history rows, far fewer than
  // this log's (object, page) pairs.
  const int64_t margin = 30 + static_cast<int64_t>(100.0 * static_cast<double>(log.lines) / 1e6);
  if (const int64_t left = kIntervalSeconds - std::time(nullptr) % kIntervalSeconds;
      left < margin) {
    std::printf("waiting %lld s for the next 5-minute interval\n", static_cast<long long>(left));
    std::fflush(stdout);
    const int64_t next = std::time(nullptr) + left;
    q7test::waitFor([next] { return std::time(nullptr) >= next; }, std::chrono::seconds(left + 5));
  }
  const int64_t interval = std::time(nullptr) / kIntervalSeconds;
  const auto agent_start = Clock::now();
  const std::string address = home.Start();
  if (address.empty()) {
    std::fprintf(stderr, "bench_logs_race: the agent did not start:\n%s\n", home.Trace().c_str());
    return 1;
  }
  const double agent_startup = Since(agent_start);
  std::printf(
      "ours: running sm3logs and a fresh q7agent concurrently (the agent tails the .sm3 "
      "file as sm3logs writes it) ...\n");
  std::fflush(stdout);

  const auto race_start = Clock::now();
  Child sm3logs({SM3LOGS_PATH, "--format", "nginx-timed", "--host", bench::kLogHost, "--read",
                 log_path, "--out", records_path},
                work + "/sm3logs.out", work + "/sm3logs.err");
  std::optional<Usage> sm3logs_usage;
  long long pages = -1;
  long long objects = -1;
  std::optional<FinalRecord> final;
  int64_t pages_counted = 0;
  Usage agent_usage;
  double ours = 0;
  // Polled every 50 ms: a sample takes the analyzer's lock, so polling harder slows the agent.
  const auto deadline = Clock::now() + std::chrono::minutes(10);
  bool complete = false;
  while (!complete && Clock::now() < deadline) {
    if (!sm3logs_usage) {
      sm3logs_usage = sm3logs.Poll();
      if (sm3logs_usage) {
        const std::string counters = q7test::readFile(work + "/sm3logs.err");
        pages = Counter(counters, "pages");
        objects = Counter(counters, "objects");
        final = FindFinalRecord(records_path);
        if (sm3logs_usage->exit_code != 0 || !final) {
          break;
        }
      }
    }
    pages_counted = SumColumn(Sample(address, "Q7APPSM"), "totreq");
    if (sm3logs_usage && pages_counted >= pages) {
      complete = !final->object ||
                 SumColumn(Sample(address, "Q7SUBTXSM", "?where=transactn%20EQ%20" + final->url),
                           "totreq") >= final->url_objects;
    }
    if (complete) {
      ours = Since(race_start);
      agent_usage = ProcUsage(home.pid());
    } else {
      std::this_thread::sleep_for(50ms);
    }
  }
  if (!sm3logs_usage || sm3logs_usage->exit_code != 0) {
    std::fprintf(stderr, "bench_logs_race: sm3logs failed:\n%s\n",
                 q7test::readFile(work + "/sm3logs.err").c_str());
    return 1;
  }
  if (!complete) {
    std::fprintf(stderr,
                 "bench_logs_race: the agent's tables hold %lld of %lld pages after 10 minutes\n",
                 static_cast<long long>(pages_counted), pages);
    return 1;
  }
  agent_usage.wall = ours;

  std::printf("\n%-34s %8s %8s %12s %12s\n", "", "wall s", "cpu s", "lines/s", "peak RSS MB");
  if (goaccess) {
    PrintUsage("GoAccess (report written)", *goaccess, log.lines);
  }
  PrintUsage("sm3logs (records written)", *sm3logs_usage, log.lines);
  PrintUsage("q7agent (tables complete)", agent_usage, log.lines);
  Usage both = agent_usage;
  both.cpu += sm3logs_usage->cpu;
  both.peak_rss_kb += sm3logs_usage->peak_rss_kb;
  PrintUsage("ours: sm3logs start to tables", both, log.lines);
  std::printf(
      "(ours' peak RSS is the sum of both processes; the agent started %.2f s before the "
      "clock, and its tables lagged sm3logs' exit by %.2f s)\n",
      agent_startup, ours - sm3logs_usage->wall);
  if (goaccess) {
    std::printf("GoAccess / ours: %.2fx the wall time (target: at least 2x)\n",
                goaccess->wall / ours);
  }
  std::printf("sm3logs: %s", q7test::readFile(work + "/sm3logs.err").c_str());

  // The answers, compared.
  const nlohmann::json page_rows = Sample(address, "Q7TXSM");
  const nlohmann::json object_rows = Sample(address, "Q7SUBTXSM");
  const bool one_interval = std::time(nullptr) / kIntervalSeconds == interval;
  const bench::LogFigures agent = bench::FromAgent(page_rows, object_rows);
  const int64_t pages_in = SumColumn(page_rows, "totreq");
  const int64_t objects_in = SumColumn(object_rows, "totreq");
  std::printf(
      "\nrecords: sm3logs wrote %lld pages and %lld objects; the agent's tables count %lld "
      "and %lld\n",
      pages, objects, static_cast<long long>(pages_in), static_cast<long long>(objects_in));
  int status = pages_in == pages && objects_in == objects ? 0 : 1;
  const nlohmann::json report =
      goaccess ? nlohmann::json::parse(q7test::readFile(report_path), nullptr, false)
               : nlohmann::json();
  if (goaccess) {
    const bench::LogFigures theirs = bench::FromGoAccess(report);
    const bench::Comparison c = bench::Compare(theirs, agent, kAverageToleranceMs);
    std::printf(
        "cross-check, GoAccess's report against Q7TXSM (pages, %zu rows) + Q7SUBTXSM "
        "(objects, %zu rows):\n",
        page_rows["rows"].size(), object_rows["rows"].size());
    std::printf("  requests        GoAccess %llu, agent %llu\n",
                static_cast<unsigned long long>(theirs.hits),
                static_cast<unsigned long long>(agent.hits));
    std::printf("  URL paths       %llu (GoAccess %zu, agent %zu)\n",
                static_cast<unsigned long long>(c.urls), theirs.urls.size(), agent.urls.size());
    std::printf("  hits            %llu agree\n", static_cast<unsigned long long>(c.hits_agree));
    std::printf("  average time    %llu agree within %.0f ms\n",
                static_cast<unsigned long long>(c.avg_agree), kAverageToleranceMs);
    std::printf(
        "  maximum time    %llu agree exactly; %llu pages higher on our side by their "
        "objects' load time\n",
        static_cast<unsigned long long>(c.max_agree),
        static_cast<unsigned long long>(c.max_with_load));
    std::printf("  status          ");
    for (const auto& [key, count] : theirs.statuses) {
      std::printf("%s %llu/%llu  ", key.c_str(), static_cast<unsigned long long>(count),
                  static_cast<unsigned long long>(agent.statuses.at(key)));
    }
    std::printf("(GoAccess/agent): %llu of %zu agree\n",
                static_cast<unsigned long long>(c.statuses_agree), theirs.statuses.size());
    std::printf("  disagreements   %zu\n", c.disagreements.size());
    for (size_t i = 0; i < c.disagreements.size() && i < 20; ++i) {
      std::printf("    %s\n", c.disagreements[i].c_str());
    }
    status = c.disagreements.empty() ? status : 1;
  }

  PrintOnlyOneSide(report, address, Rows(object_rows));
  if (!one_interval) {
    std::printf(
        "\nan over-time interval ended during the run: the summaries may have lost "
        "history rows, so the comparison does not count\n");
    status = 1;
  }

  if (!home.Stop()) {
    std::fprintf(stderr, "bench_logs_race: the agent did not stop within 15 s\n");
  }
  return status;
}
