// End-to-end throughput of the agent on one collector file: sm3gen writes 10^6 records (pages
// followed by their embedded objects), and a static data file monitor reads them into the
// analyzer thread, which matches 10 transaction and 3 client patterns and fills the over-time
// trees. Prints transactions per second, the peak resident memory, the floor set by reading the
// same file with cat, the CPU each of the two threads used, and then the latency of a summary
// and an over-time sample of the transaction table.
//
// How cost grows: --patterns N adds per-site and per-path transaction patterns up to N in all
// (longer than the operator's ten, so they come first in matching order), and --keys N gives
// every record one of N URLs, so the trees hold that many distinct transaction keys and more.
//
// --checkpoint-seconds N takes a checkpoint every N seconds (none by default) and prints how
// long the analyzer spent on them.
//
// Usage: bench_q7bench [--records N] [--patterns N] [--keys N] [--checkpoint-seconds N]

#include <dirent.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <string>
#include <thread>

#include "collector/sm3gen/file_mode.h"
#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/dpx_data_file_monitor.h"
#include "core/config/cconfig.h"
#include "framework/trace.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr uint64_t kSeed = 20261123;
constexpr double kRate = 1e6;  // records per second of traffic time: 10^6 records span 1 s
// The run must end in the interval it starts in: a rollover would save and empty the trees.
constexpr long kIntervalMarginSeconds = 60;

double Seconds(Clock::time_point from, Clock::time_point to) {
  return std::chrono::duration<double>(to - from).count();
}

// Writes the records with sm3gen in a child process: its ground truth (a map of every URL)
// would otherwise count in this process's peak resident memory.
bool Generate(const std::string& path, int64_t records, int64_t start, int64_t keys) {
  const pid_t child = fork();
  if (child == 0) {
    sm3gen::FileJob job;
    job.out_path = path;
    job.records = records;
    job.model.seed = kSeed;
    job.model.start = start;
    job.model.rate = kRate;
    job.model.sites = 8;  // every site of the catalog, so each site pattern sees traffic
    job.model.url_keys = keys;
    std::string error;
    const bool ok = sm3gen::RunFileMode(job, &error);
    if (!ok) {
      std::fprintf(stderr, "sm3gen: %s\n", error.c_str());
    }
    _exit(ok ? 0 : 1);
  }
  int status = 0;
  return child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status) &&
         WEXITSTATUS(status) == 0;
}

// Patterns an operator would write for the catalog's sites. Longer patterns are matched first,
// so the per-site ones take their pages and the last two take what is left.
void AddPatterns(CDPXAnalyzer& analyzer) {
  struct Tx {
    const char *id, *app, *appPattern, *tx, *txPattern;
    int16_t ownApp, ownTx;
  };
  const Tx patterns[] = {
      {"shopcheckout", "Shop", "www.shop.example", "Checkout", "/shop/checkout*", 0, 0},
      {"shopcart", "Shop", "www.shop.example", "Cart", "/shop/cart*", 0, 0},
      {"shop", "Shop", "*shop.example", "", "*", 0, 1},
      {"newsarticles", "News", "news.example.org", "Articles", "/articles/*.html", 0, 0},
      {"news", "News", "news.example.org", "", "*", 0, 1},
      {"reports", "Intranet", "intranet.corp.example", "Reports", "/ReportServer/*", 0, 0},
      {"intranet", "Intranet", "intranet.corp.example", "", "*", 0, 1},
      {"payments", "Payments", "api.payments.example.com", "", "/v1/*", 0, 1},
      {"apis", "", "*", "API calls", "*/api/*", 1, 0},
      {"all", "", "*", "", "*", 1, 1},
  };
  for (const Tx& p : patterns) {
    if (!analyzer.newTransactionPattern(p.id, p.app, p.appPattern, p.tx, p.txPattern, p.ownApp,
                                        p.ownTx, 0, 100, 2000, 50)) {
      std::fprintf(stderr, "transaction pattern %s refused\n", p.id);
    }
  }
  // The office networks by subnet, home workers under one name; data-centre and IPv6 clients
  // match none and keep their own addresses.
  analyzer.newClientPattern("office", "Head office", "*", "10.1.*", 2);
  analyzer.newClientPattern("branches", "Branches", "*", "10.20.*", 2);
  analyzer.newClientPattern("home", "Home workers", "*", "192.168.*", 0);
}

// Patterns that a site with many applications would add: per-site ones for hosts that are not
// in the traffic, per-path ones for hosts that are (which the shop's and the news site's pages
// must be tried against), with leading, inner and trailing wildcards and lengths from 20 to 60.
void AddScalingPatterns(CDPXAnalyzer& analyzer, int total) {
  static const char* const kWords[] = {"catalog", "account", "search",  "img",   "static",
                                       "orders",  "profile", "reports", "admin", "export"};
  for (int i = 0; total - i > 10; ++i) {
    const std::string word = kWords[i % 10];
    const std::string n = std::to_string(i);
    std::string app;
    std::string tx;
    switch (i % 6) {
      case 0:
        app = "www.site" + n + ".example.net";
        tx = "/" + word + "/*";
        break;
      case 1:
        app = "*.site" + n + ".example.net";
        tx = "*/" + word + "/*.jsp";
        break;
      case 2:
        app = "api" + n + ".example.net";
        tx = "/api/v" + std::to_string(i % 3) + "/" + word + "*";
        break;
      case 3:
        app = "www.shop.example";
        tx = "/shop/" + word + n + "/*";
        break;
      case 4:
        app = "news.example.org";
        tx = "/articles/" + n + "/*" + word + "*.html";
        break;
      default:
        app = "*" + word + n + ".example.com";
        tx = "*/" + word + "/*";
        break;
    }
    const std::string id = "scale" + n;
    if (!analyzer.newTransactionPattern(id.c_str(), ("App" + n).c_str(), app.c_str(),
                                        ("Tx" + n).c_str(), tx.c_str(), 0, 0, 0, 100, 2000, 50)) {
      std::fprintf(stderr, "transaction pattern %s refused\n", id.c_str());
    }
  }
}

// Resident memory now, in bytes.
long long ResidentBytes() {
  std::ifstream statm("/proc/self/statm");
  long long pages = 0;
  long long resident = 0;
  statm >> pages >> resident;
  return resident * sysconf(_SC_PAGESIZE);
}

// The peak resident memory so far (VmHWM), in bytes.
long long PeakResidentBytes() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmHWM:", 0) == 0) {
      return std::atoll(line.c_str() + 6) * 1024;
    }
  }
  return 0;
}

// CPU seconds of this process's threads by name, as last seen. Read while the threads run,
// since a thread's figures go with it.
void SampleThreadCpu(std::map<std::string, double>* cpu) {
  static const double kTicks = static_cast<double>(sysconf(_SC_CLK_TCK));
  DIR* tasks = opendir("/proc/self/task");
  if (tasks == nullptr) {
    return;
  }
  while (const dirent* task = readdir(tasks)) {
    if (task->d_name[0] == '.') {
      continue;
    }
    std::ifstream in(std::string("/proc/self/task/") + task->d_name + "/stat");
    std::string line;
    std::getline(in, line);
    // pid (comm) state ...: utime and stime are the 12th and 13th fields after the name.
    const size_t open = line.find('(');
    const size_t close = line.rfind(')');
    if (open == std::string::npos || close == std::string::npos) {
      continue;
    }
    const std::string name = line.substr(open + 1, close - open - 1);
    const char* p = line.c_str() + close + 2;
    for (int field = 0; field < 11 && p != nullptr; ++field) {
      p = std::strchr(p, ' ');
      p = p != nullptr ? p + 1 : nullptr;
    }
    unsigned long user = 0;
    unsigned long system = 0;
    if (p != nullptr && std::sscanf(p, "%lu %lu", &user, &system) == 2) {
      (*cpu)[name] = (user + system) / kTicks;
    }
  }
  closedir(tasks);
}

// Seconds for `cat file > /dev/null`, the second of two runs so the cache is warm.
double CatSeconds(const std::string& file) {
  const std::string command = "cat '" + file + "' > /dev/null";
  double seconds = 0;
  for (int run = 0; run < 2; ++run) {
    const auto start = Clock::now();
    if (std::system(command.c_str()) != 0) {
      std::fprintf(stderr, "%s failed\n", command.c_str());
    }
    seconds = Seconds(start, Clock::now());
  }
  return seconds;
}

}  // namespace

int main(int argc, char** argv) {
  int64_t records = 1000000;
  int patterns = 10;
  int64_t keys = 0;
  int checkpointSeconds = 0;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--records") == 0 && i + 1 < argc) {
      records = std::atoll(argv[++i]);
    } else if (std::strcmp(argv[i], "--patterns") == 0 && i + 1 < argc) {
      patterns = std::atoi(argv[++i]);
    } else if (std::strcmp(argv[i], "--keys") == 0 && i + 1 < argc) {
      keys = std::atoll(argv[++i]);
    } else if (std::strcmp(argv[i], "--checkpoint-seconds") == 0 && i + 1 < argc) {
      checkpointSeconds = std::atoi(argv[++i]);
    } else {
      std::fprintf(stderr,
                   "usage: %s [--records N] [--patterns N] [--keys N] [--checkpoint-seconds N]\n",
                   argv[0]);
      return 2;
    }
  }
  if (records <= 0 || patterns < 10 || keys < 0 || checkpointSeconds < 0) {
    std::fprintf(stderr,
                 "--records must be positive, --patterns at least 10, --keys and "
                 "--checkpoint-seconds >= 0\n");
    return 2;
  }

  // No '.' or '-' in the directory: file names are cut at them to order data files.
  char dirName[] = "/tmp/q7benchXXXXXX";
  if (mkdtemp(dirName) == nullptr) {
    std::perror("mkdtemp");
    return 1;
  }
  const std::string dir = dirName;
  std::string error;
  fw::TraceConfigure("*=ERROR", &error);
  fw::TraceOpen(dir + "/trace.log", 64 << 20, 1, &error);
  CConfig::setBaseDirectory(dir.c_str());
  CConfig::setDpxDataDirectory((dir + "/data").c_str());

  const long interval = CConfig::getOverTimeInterval() * 60L;
  long now = time(nullptr);
  if (interval - now % interval < kIntervalMarginSeconds) {
    std::printf("waiting %ld s for the next over-time interval\n", interval - now % interval + 1);
    std::fflush(stdout);
    std::this_thread::sleep_for(std::chrono::seconds(interval - now % interval + 1));
    now = time(nullptr);
  }
  // Stamped a few seconds back, never before the interval's start.
  const std::string file = std::string(CConfig::getDpxDataDirectory()) + "/traffic.sm3";
  if (!Generate(file, records, std::max(now - 5, now - now % interval), keys)) {
    std::fprintf(stderr, "cannot write %s\n", file.c_str());
    std::filesystem::remove_all(dir);
    return 1;
  }
  const auto fileBytes = static_cast<long long>(std::filesystem::file_size(file));

  // No data directory: the one monitor below is the only reader, as the bench measures it.
  CConfig::setCheckpointSeconds(checkpointSeconds);
  CDPXAnalyzer analyzer({CConfig::getDpxOdiDataDirectory(), dir + "/q7state.properties", "",
                         checkpointSeconds > 0 ? dir + "/q7checkpoint.dat" : "", ""});
  AddPatterns(analyzer);
  AddScalingPatterns(analyzer, patterns);
  const long long residentBefore = ResidentBytes();
  analyzer.Start();

  CDPXDataFileMonitor monitor(file.c_str(), 0);
  monitor.setStatic();
  monitor.setSink(&analyzer);
  const auto started = Clock::now();
  monitor.Start();
  std::map<std::string, double> cpu;
  Clock::time_point readAll;  // when the monitor last moved its offset
  Clock::time_point finished;
  long long offset = 0;
  long done = 0;
  long lastDone = -1;
  Clock::time_point lastChange = started;
  // Polls that found the queue empty: often, and the analyzer waits for the monitor; seldom,
  // and the monitor waits for room in the queue.
  int polls = 0;
  int emptyPolls = 0;
  // Until every record is processed (or nothing more arrives) and the monitor has stopped.
  constexpr Clock::time_point kNever{};
  for (int turn = 0; finished == kNever || !monitor.isCompleted(); ++turn) {
    const auto t = Clock::now();
    if (monitor.getLastProcessedOffset() != offset) {
      offset = monitor.getLastProcessedOffset();
      readAll = t;
    }
    if (finished == kNever) {
      done = analyzer.getTransactionsProcessed() + analyzer.getTransactionsIgnored();
      if (done >= records) {
        finished = t;
      } else if (done != lastDone) {
        lastDone = done;
        lastChange = t;
      } else if (monitor.isCompleted() && Seconds(lastChange, t) > 2) {
        finished = lastChange;  // nothing more is coming
      }
      ++polls;
      emptyPolls += analyzer.getQueueDepthHint() == 0 ? 1 : 0;
    }
    if (turn % 5 == 0) {
      SampleThreadCpu(&cpu);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  SampleThreadCpu(&cpu);
  monitor.Join();
  const long long peakIngesting = PeakResidentBytes();
  analyzer.Shutdown();
  analyzer.Join();

  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  const double seconds = Seconds(started, finished);
  const double catSeconds = CatSeconds(file);
  std::printf("records: %lld in %.1f MB; transactions processed %d, ignored %d\n",
              static_cast<long long>(records), fileBytes / 1e6, analyzer.getTransactionsProcessed(),
              analyzer.getTransactionsIgnored());
  if (done < records) {
    std::printf("WARNING: only %ld of %lld records reached the analyzer\n", done,
                static_cast<long long>(records));
  }
  std::printf("throughput: %.0f transactions/s, %.2f us per transaction (%.2f s)\n", done / seconds,
              seconds * 1e6 / done, seconds);
  long rows = 0;
  analyzer.visitTrees([&rows](const COverTimeTrees& trees) { rows = trees.totalRows(); });
  std::printf("patterns: %d transaction, 3 client; URLs: %s\n", patterns,
              keys > 0 ? std::to_string(keys).c_str() : "the model's");
  std::printf(
      "peak resident memory: %.1f MiB (%.1f MiB while ingesting, the rest saving the interval at "
      "the stop); rows held %ld, %.0f bytes per row while ingesting, above the %.1f MiB at start\n",
      usage.ru_maxrss / 1024.0, peakIngesting / 1048576.0, rows,
      rows > 0 ? static_cast<double>(peakIngesting - residentBefore) / rows : 0.0,
      residentBefore / 1048576.0);
  std::printf("floor (cat, warm cache): %.0f MB/s, %.0f records/s\n", fileBytes / 1e6 / catSeconds,
              records / catSeconds);
  std::printf(
      "monitor read the file in %.2f s; thread CPU: monitor %.2f s, analyzer %.2f s; queue "
      "found empty in %.0f%% of polls\n",
      Seconds(started, readAll), cpu["DPXDataFileMoni"], cpu["Analyzer"],
      100.0 * emptyPolls / std::max(polls, 1));
  if (checkpointSeconds > 0) {
    const CDPXAnalyzer::CheckpointStats& stats = analyzer.getCheckpointStats();
    std::printf(
        "checkpoints every %d s: %lld written; longest analyzer pause (rows copied) %lld ms, "
        "longest write %lld ms\n",
        checkpointSeconds, stats.written.load(), stats.longestCopyMillis.load(),
        stats.longestWriteMillis.load());
  }
  if (analyzer.getRolloverCount() > 0) {
    std::printf("note: an over-time interval ended during the run\n");
  }

  int summaryRows = 0;
  auto start = Clock::now();
  delete[] analyzer.get_tbltxsm(3, &summaryRows);
  const double summaryMillis = Seconds(start, Clock::now()) * 1e3;
  int overTimeRows = 0;
  start = Clock::now();
  delete[] analyzer.get_tbltxot(3, &overTimeRows);
  const double overTimeMillis = Seconds(start, Clock::now()) * 1e3;
  std::printf("sample Q7TXSM: %.1f ms, %d rows; sample Q7TXOT: %.1f ms, %d rows\n", summaryMillis,
              summaryRows, overTimeMillis, overTimeRows);

  fw::TraceFlush();
  std::ifstream trace(dir + "/trace.log");
  const auto traceRecords =
      std::count(std::istreambuf_iterator<char>(trace), std::istreambuf_iterator<char>(), '\n');
  std::printf("trace records written: %ld\n", static_cast<long>(traceRecords));
  fw::TraceClose();
  std::filesystem::remove_all(dir);
  return 0;
}
