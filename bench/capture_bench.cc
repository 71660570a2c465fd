// Throughput of sm3capture on a capture file, against tshark on the same file. The bench writes
// itself a pcap of realistic HTTP/1.1 (many clients on keep-alive connections: handshakes,
// pages of 10-60 KB, style sheets, scripts and images, some 304s and chunked replies, MSS-sized
// segments, delayed ACKs and FIN closes), then runs `sm3capture --read FILE --out OUT` several
// times pinned to one CPU and reports the median run: packets/s, Mbit/s of captured bytes,
// exchanges/s, wall and CPU seconds and peak resident memory. tshark's HTTP dissection
// (`-Y http -T fields -e http.time`) runs once on the same CPU for comparison. The records
// written must number the exchanges generated.
//
// The capture is kept in /tmp under a name made of its parameters, so later runs reuse it.
//
// Usage: bench_capture [--packets N] [--runs N] [--cpu N]

#include <fcntl.h>
#include <fmt/format.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <memory>
#include <queue>
#include <random>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "bench/http_traffic_writer.h"
#include "collector/capture/testing/packet_builder.h"

namespace {

using bench::kTrafficSeed;
using bench::kTrafficVersion;
using capture::testing::PcapWriter;
using Totals = bench::TrafficTotals;

bool ReadTotals(const std::string& path, Totals* totals) {
  std::ifstream in(path);
  std::map<std::string, uint64_t*> fields = totals->Fields();
  std::string key;
  uint64_t value = 0;
  size_t seen = 0;
  while (in >> key >> value) {
    if (auto it = fields.find(key); it != fields.end()) {
      *it->second = value;
      ++seen;
    }
  }
  return seen == fields.size();
}

// The capture for these parameters, generated unless an earlier run left it.
bool PrepareCapture(uint64_t packets, std::string* path, Totals* totals) {
  *path = fmt::format("/tmp/q7capbench_p{}_v{}_s{}.pcap", packets, kTrafficVersion, kTrafficSeed);
  const std::string info = *path + ".info";
  if (std::filesystem::exists(*path) && ReadTotals(info, totals)) {
    std::printf("reusing %s\n", path->c_str());
    return true;
  }
  std::printf("writing %s ...\n", path->c_str());
  std::fflush(stdout);
  const std::string temp = *path + ".tmp";
  std::string error;
  std::unique_ptr<PcapWriter> writer = PcapWriter::Open(temp, capture::testing::FileFormat::kPcap,
                                                        capture::testing::kLinkEthernet, &error);
  if (writer == nullptr) {
    std::fprintf(stderr, "bench_capture: %s\n", error.c_str());
    return false;
  }
  *totals = bench::WriteHttpTraffic(writer.get(), packets);
  if (!writer->Close()) {
    std::fprintf(stderr, "bench_capture: %s: write failed\n", temp.c_str());
    return false;
  }
  std::filesystem::rename(temp, *path);
  // The info file last: its presence says the capture is complete.
  {
    std::ofstream out(info + ".tmp");
    for (const auto& [key, value] : totals->Fields()) {
      out << key << ' ' << *value << '\n';
    }
  }
  std::filesystem::rename(info + ".tmp", info);
  return true;
}

struct RunResult {
  bool ok = false;
  int exit_code = -1;
  double wall = 0;  // seconds
  double cpu = 0;   // user + system seconds
  long peak_rss_kb = 0;
};

double Seconds(const timeval& tv) {
  return tv.tv_sec + tv.tv_usec / 1e6;
}

// Runs argv pinned to cpu with stdout and stderr sent to the given files, and measures it.
RunResult RunPinned(const std::vector<std::string>& argv, int cpu, const std::string& out_path,
                    const std::string& err_path) {
  RunResult result;
  const auto start = std::chrono::steady_clock::now();
  const pid_t child = ::fork();
  if (child < 0) {
    return result;
  }
  if (child == 0) {
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(cpu, &set);
    ::sched_setaffinity(0, sizeof(set), &set);
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
  int status = 0;
  rusage usage{};
  if (::wait4(child, &status, 0, &usage) != child) {
    return result;
  }
  result.wall = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  result.cpu = Seconds(usage.ru_utime) + Seconds(usage.ru_stime);
  result.peak_rss_kb = usage.ru_maxrss;
  result.exit_code = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  result.ok = result.exit_code == 0;
  return result;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// Lines of path that hold a record ("<tag>...") or, for tshark, any non-empty value.
uint64_t CountLines(const std::string& path, bool records_only) {
  std::FILE* file = std::fopen(path.c_str(), "r");
  if (file == nullptr) {
    return 0;
  }
  uint64_t count = 0;
  bool line_start = true;
  bool counted = false;
  char buffer[1 << 16];
  size_t n = 0;
  while ((n = std::fread(buffer, 1, sizeof(buffer), file)) > 0) {
    for (size_t i = 0; i < n; ++i) {
      const char c = buffer[i];
      if (c == '\n') {
        line_start = true;
        counted = false;
        continue;
      }
      if (!counted && (records_only ? line_start && c == '<' : true)) {
        ++count;
        counted = true;
      }
      line_start = false;
    }
  }
  std::fclose(file);
  return count;
}

// The value of "key=N" in sm3capture's summary line, or -1.
long long SummaryValue(const std::string& summary, const std::string& key) {
  const size_t at = summary.find(" " + key + "=");
  return at == std::string::npos ? -1 : std::atoll(summary.c_str() + at + key.size() + 2);
}

std::string SummaryLine(const std::string& stderr_text) {
  const size_t at = stderr_text.rfind("sm3capture: packets=");
  if (at == std::string::npos) {
    return "";
  }
  return stderr_text.substr(at, stderr_text.find('\n', at) - at);
}

void PrintRow(const char* tool, const RunResult& run, const Totals& totals) {
  std::printf("%-12s %9.3f %9.3f %12.0f %9.1f %12.0f %12.1f\n", tool, run.wall, run.cpu,
              totals.packets / run.wall, totals.bytes * 8 / run.wall / 1e6,
              totals.exchanges / run.wall, run.peak_rss_kb / 1024.0);
}

int ChooseCpu(int wanted) {
  cpu_set_t set;
  CPU_ZERO(&set);
  if (::sched_getaffinity(0, sizeof(set), &set) != 0) {
    return 0;
  }
  if (wanted >= 0 && CPU_ISSET(wanted, &set)) {
    return wanted;
  }
  for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu) {
    if (CPU_ISSET(cpu, &set)) {
      return cpu;
    }
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  uint64_t packets = 1000000;
  int runs = 3;
  int cpu = 0;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--packets") == 0 && i + 1 < argc) {
      packets = std::strtoull(argv[++i], nullptr, 10);
    } else if (std::strcmp(argv[i], "--runs") == 0 && i + 1 < argc) {
      runs = std::atoi(argv[++i]);
    } else if (std::strcmp(argv[i], "--cpu") == 0 && i + 1 < argc) {
      cpu = std::atoi(argv[++i]);
    } else {
      std::fprintf(stderr, "usage: %s [--packets N] [--runs N] [--cpu N]\n", argv[0]);
      return 2;
    }
  }
  if (packets == 0 || runs <= 0) {
    std::fprintf(stderr, "bench_capture: --packets and --runs must be positive\n");
    return 2;
  }
  cpu = ChooseCpu(cpu);

  std::string capture_path;
  Totals totals;
  if (!PrepareCapture(packets, &capture_path, &totals)) {
    return 1;
  }
  std::printf(
      "capture: %llu packets, %.1f MB captured, %.1f s of traffic, %llu connections, "
      "%llu exchanges (%llu pages, %llu objects; %llu 304s, %llu chunked), "
      "%.1f packets per exchange\n",
      static_cast<unsigned long long>(totals.packets), totals.bytes / 1e6, totals.duration_us / 1e6,
      static_cast<unsigned long long>(totals.connections),
      static_cast<unsigned long long>(totals.exchanges),
      static_cast<unsigned long long>(totals.pages),
      static_cast<unsigned long long>(totals.objects),
      static_cast<unsigned long long>(totals.not_modified),
      static_cast<unsigned long long>(totals.chunked),
      static_cast<double>(totals.packets) / std::max<uint64_t>(totals.exchanges, 1));
  std::printf("every run pinned to CPU %d\n\n", cpu);
  std::fflush(stdout);

  const std::string work = fmt::format("/tmp/q7capbench_run_{}", ::getpid());
  const std::string out = work + ".sm3";
  const std::string err = work + ".err";
  std::vector<RunResult> results;
  for (int run = 0; run < runs; ++run) {
    RunResult result =
        RunPinned({SM3CAPTURE_PATH, "--read", capture_path, "--out", out}, cpu, "/dev/null", err);
    if (!result.ok) {
      std::fprintf(stderr, "bench_capture: sm3capture exited with %d:\n%s\n", result.exit_code,
                   ReadFile(err).c_str());
      return 1;
    }
    results.push_back(result);
  }
  std::vector<RunResult> by_wall = results;
  std::sort(by_wall.begin(), by_wall.end(),
            [](const RunResult& a, const RunResult& b) { return a.wall < b.wall; });
  const RunResult median = by_wall[by_wall.size() / 2];
  const std::string summary = SummaryLine(ReadFile(err));
  const uint64_t records = CountLines(out, true);

  RunResult tshark;
  uint64_t tshark_values = 0;
  const bool have_tshark = ::access("/usr/bin/tshark", X_OK) == 0;
  if (have_tshark) {
    std::printf("tshark: one run, this takes a while ...\n\n");
    std::fflush(stdout);
    const std::string tshark_out = work + ".tshark";
    tshark = RunPinned({"/usr/bin/tshark", "-n", "-r", capture_path, "-Y", "http", "-T", "fields",
                        "-e", "http.time"},
                       cpu, tshark_out, err);
    tshark_values = CountLines(tshark_out, false);
    std::remove(tshark_out.c_str());
  }

  std::printf("%-12s %9s %9s %12s %9s %12s %12s\n", "", "wall s", "cpu s", "packets/s", "Mbit/s",
              "exchanges/s", "peak RSS MB");
  PrintRow("sm3capture", median, totals);
  if (have_tshark && tshark.ok) {
    PrintRow("tshark", tshark, totals);
  }
  std::printf("\nsm3capture wall seconds of the %d runs:", runs);
  for (const RunResult& r : results) {
    std::printf(" %.3f", r.wall);
  }
  std::printf(" (median shown)\n");
  if (!have_tshark) {
    std::printf("tshark is not installed: no comparison\n");
  } else if (!tshark.ok) {
    std::printf("tshark exited with %d: no comparison\n", tshark.exit_code);
  } else {
    std::printf(
        "tshark / sm3capture: %.1fx the wall time, %.1fx the CPU time; tshark matched "
        "%llu replies (http.time values)\n",
        tshark.wall / median.wall, tshark.cpu / median.cpu,
        static_cast<unsigned long long>(tshark_values));
  }
  std::printf("sm3capture: %s\n", summary.empty() ? "(no summary line on stderr)"
                                                  : summary.c_str() + std::strlen("sm3capture: "));
  const bool match = records == totals.exchanges;
  std::printf("records written: %llu, exchanges generated: %llu, summary exchanges=%lld: %s\n",
              static_cast<unsigned long long>(records),
              static_cast<unsigned long long>(totals.exchanges), SummaryValue(summary, "exchanges"),
              match ? "ok" : "MISMATCH");
  std::remove(out.c_str());
  std::remove(err.c_str());
  return match ? 0 : 1;
}
