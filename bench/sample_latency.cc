// Latency of GET /api/v1/tables/Q7TXSM as an operator's tool sees it, with the analyzer
// processing transactions all the while. 10^4 distinct transaction rows in the current
// interval, and
//   - 288 intervals of history of the same keys (more rows than MAX_ROWS, so the query loads
//     its cap): the whole sample (10^4 rows), and its first 100 rows (?limit=100);
//   - MAX_ROWS history rows of as many keys: a sample of 25 000 rows.
// Prints the median and 99th percentile of 200 calls of each. With --idle the analyzer processes
// nothing meanwhile.

#include <httplib.h>
#include <stdlib.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "core/analyzer/analysis/table_queries.h"
#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/testing/transaction_builder.h"
#include "core/config/cconfig.h"
#include "core/history/history_store.h"
#include "framework/clock.h"
#include "framework/http_server.h"
#include "framework/trace.h"
#include "q7tema/exported_tables.h"
#include "q7tema/row_query.h"

namespace {

constexpr int kKeys = 10000;
constexpr int kHistoryIntervals = 288;
constexpr int kRowsPerInterval = 100;  // 28 800 in all: over MAX_ROWS
constexpr int kCalls = 200;

// --idle: no transactions are processed while measuring, for the figure without contention.
bool gIdle = false;

// The longest a scenario takes, set up and measured.
constexpr long kScenarioSeconds = 90;

// What the history holds.
enum class History {
  kSameKeys,  // earlier intervals' rows of the current keys
  kMaxRows,   // MAX_ROWS rows, each of a key of its own (the current ones among them)
};

CDPXTransaction Page(int key) {
  return TransactionBuilder()
      .host("site" + std::to_string(key % 20) + ".example")
      .url("/shop/item/" + std::to_string(key))
      .client("10.1." + std::to_string(key % 7) + "." + std::to_string(key % 11))
      .time(time(nullptr))
      .responseTime(100 + key % 400)
      .serverTime(40)
      .status(key % 50 == 0 ? 500 : 200)
      .build();
}

// Calls path kCalls times and prints the median and 99th percentile, with what the answers
// held.
void Measure(httplib::Client& client, const std::string& path, const char* label,
             const std::atomic<long>& queued) {
  std::vector<double> millis;
  size_t bytes = 0;
  size_t rows = 0;
  const long queuedBefore = queued.load();
  for (int call = 0; call < kCalls; ++call) {
    const auto start = std::chrono::steady_clock::now();
    auto res = client.Get(path.c_str());
    const auto end = std::chrono::steady_clock::now();
    if (!res || res->status != 200) {
      std::fprintf(stderr, "call %d of %s failed\n", call, path.c_str());
      continue;
    }
    bytes = res->body.size();
    rows = static_cast<size_t>(std::count(res->body.begin(), res->body.end(), '{')) - 1;
    millis.push_back(std::chrono::duration<double, std::milli>(end - start).count());
  }
  if (millis.empty()) {
    return;
  }
  std::sort(millis.begin(), millis.end());
  const double median = millis[millis.size() / 2];
  const double p99 = millis[std::min(millis.size() - 1, millis.size() * 99 / 100)];
  std::printf(
      "GET %s%s: %zu calls, median %.1f ms, p99 %.1f ms (%zu rows, %.1f MB a reply; %ld "
      "transactions processed meanwhile)\n",
      path.c_str(), label, millis.size(), median, p99, rows, bytes / 1e6,
      queued.load() - queuedBefore);
}

// A rollover amid a scenario would change the history measured (the ended interval joins it):
// when the current interval ends too soon, start in the next one.
void WaitForAFreshInterval() {
  const long length = static_cast<long>(CConfig::getOverTimeInterval()) * 60;
  const long left = length - static_cast<long>(time(nullptr)) % length;
  if (left < kScenarioSeconds) {
    std::this_thread::sleep_for(std::chrono::seconds(left + 1));
  }
}

// One analyzer with the current keys and the history asked for, its summary served by server
// while it processes transactions; measures each path.
void Run(History kind, const std::vector<std::string>& paths, const char* label,
         fw::HttpServer& server) {
  WaitForAFreshInterval();
  char dirName[] = "/tmp/q7bench-sample-XXXXXX";
  const std::string dir = mkdtemp(dirName);
  {
    CDPXAnalyzer analyzer({dir + "/dpx", dir + "/state", "", "", ""});
    analyzer.newTransactionPattern("all", "All", "*", "All", "*", 1, 1, 0, 100, 300, 99);
    analyzer.startRun();
    short level = 0;
    for (int key = 0; key < kKeys; ++key) {
      CDPXTransaction t = Page(key);
      analyzer.processTransaction(t, &level);
    }
    // History as rollovers would have saved it, made of the current rows.
    int count = 0;
    std::unique_ptr<kq7_q7txot_data_t[]> current(analyzer.get_tbltxot(3, &count));
    const long interval = analyzer.getCurrentOverTimeInterval();
    for (int i = 1; i <= kHistoryIntervals; ++i) {
      std::vector<kq7_q7txot_data_t> rows(
          current.get() + (i * kRowsPerInterval) % (count - 100),
          current.get() + (i * kRowsPerInterval) % (count - 100) + kRowsPerInterval);
      if (kind == History::kMaxRows) {
        // Row n is current row n, or past the current rows a copy under a transaction name
        // of its own.
        if ((i - 1) * kRowsPerInterval >= MAX_ROWS) {
          break;
        }
        for (int r = 0; r < kRowsPerInterval; ++r) {
          const int n = (i - 1) * kRowsPerInterval + r;
          kq7_q7txot_data_t& row = rows[static_cast<size_t>(r)];
          row = current[n % count];
          if (n >= count) {
            const std::string name(row.transactn, strnlen(row.transactn, sizeof(row.transactn)));
            std::snprintf(row.transactn, sizeof(row.transactn), "%.100s#%d", name.c_str(),
                          n / count);
          }
        }
      }
      analyzer.historyStore().saveInterval(interval - 300L * i, "q7txot", rows.data(),
                                           sizeof(rows[0]), rows.size());
    }
    q7tema::SetLimitedRowQuery<kq7_q7txsm_data_t>([&analyzer](int type, size_t limit, int* n) {
      return analyzer.get_tbltxsm(type, n, limit);
    });

    // The analyzer keeps processing: its thread consumes what a producer keeps queueing.
    analyzer.Start();
    std::atomic<bool> stop{false};
    std::atomic<long> queued{0};
    std::thread producer([&] {
      for (int key = 0; !stop.load() && !gIdle; key = (key + 1) % kKeys) {
        if (analyzer.add({TRANSACTION_KIND_DPX, new CDPXTransaction(Page(key))})) {
          ++queued;
        }
      }
    });
    httplib::Client client("http://" + server.bound_address());
    client.set_read_timeout(60);
    for (const std::string& path : paths) {
      Measure(client, path, label, queued);
    }
    stop = true;
    producer.join();
    analyzer.Shutdown();
    analyzer.Join();
    q7tema::SetRowQuery<kq7_q7txsm_data_t>({});
  }
  std::filesystem::remove_all(dir);
}

}  // namespace

int main(int argc, char** argv) {
  gIdle = argc > 1 && std::strcmp(argv[1], "--idle") == 0;
  std::string error;
  fw::TraceOpen("/tmp/q7bench-sample-trace.log", 1 << 20, 1, &error);
  kq7_q7txsm_init();
  fw::HttpServer server;
  if (server.Start("127.0.0.1:0", &error) != 0) {
    std::fprintf(stderr, "cannot start the HTTP server: %s\n", error.c_str());
    return 1;
  }
  Run(History::kSameKeys, {"/api/v1/tables/Q7TXSM", "/api/v1/tables/Q7TXSM?limit=100"}, "", server);
  Run(History::kMaxRows, {"/api/v1/tables/Q7TXSM"}, " (MAX_ROWS history rows of as many keys)",
      server);
  server.Stop();
  return 0;
}
