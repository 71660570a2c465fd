// Latency of GET /api/v1/tables/Q7TXSM as an operator's tool sees it: 10^4 distinct
// transaction rows in the current interval, 288 intervals of history (more rows than MAX_ROWS,
// so the query loads its cap), and the analyzer processing transactions all the while.
// Prints the median and 99th percentile of 200 calls.

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

#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/testing/transaction_builder.h"
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

}  // namespace

int main() {
  std::string error;
  fw::TraceOpen("/tmp/q7bench-sample-trace.log", 1 << 20, 1, &error);
  char dirName[] = "/tmp/q7bench-sample-XXXXXX";
  const std::string dir = mkdtemp(dirName);

  CDPXAnalyzer analyzer({dir + "/dpx", dir + "/state", ""});
  analyzer.newTransactionPattern("all", "All", "*", "All", "*", 1, 1, 0, 100, 300, 99);
  analyzer.startRun();
  short level = 0;
  for (int key = 0; key < kKeys; ++key) {
    CDPXTransaction t = Page(key);
    analyzer.processTransaction(t, &level);
  }
  // History: earlier intervals' rows of the same keys, as a rollover would have saved them.
  int count = 0;
  std::unique_ptr<kq7_q7txot_data_t[]> current(analyzer.get_tbltxot(3, &count));
  const long interval = analyzer.getCurrentOverTimeInterval();
  for (int i = 1; i <= kHistoryIntervals; ++i) {
    std::vector<kq7_q7txot_data_t> rows(
        current.get() + (i * kRowsPerInterval) % (count - 100),
        current.get() + (i * kRowsPerInterval) % (count - 100) + kRowsPerInterval);
    analyzer.historyStore().saveInterval(interval - 300L * i, "q7txot", rows.data(),
                                         sizeof(rows[0]), rows.size());
  }

  kq7_q7txsm_init();
  q7tema::SetRowQuery<kq7_q7txsm_data_t>(
      [&analyzer](int type, int* n) { return analyzer.get_tbltxsm(type, n); });
  fw::HttpServer server;
  if (server.Start("127.0.0.1:0", &error) != 0) {
    std::fprintf(stderr, "cannot start the HTTP server: %s\n", error.c_str());
    return 1;
  }

  // The analyzer keeps processing: its thread consumes what a producer keeps queueing.
  analyzer.Start();
  std::atomic<bool> stop{false};
  std::atomic<long> queued{0};
  std::thread producer([&] {
    for (int key = 0; !stop.load(); key = (key + 1) % kKeys) {
      if (analyzer.add({TRANSACTION_KIND_DPX, new CDPXTransaction(Page(key))})) {
        ++queued;
      }
    }
  });

  httplib::Client client("http://" + server.bound_address());
  client.set_read_timeout(60);
  std::vector<double> millis;
  size_t bytes = 0;
  size_t rows = 0;
  for (int call = 0; call < kCalls; ++call) {
    const auto start = std::chrono::steady_clock::now();
    auto res = client.Get("/api/v1/tables/Q7TXSM");
    const auto end = std::chrono::steady_clock::now();
    if (!res || res->status != 200) {
      std::fprintf(stderr, "call %d failed\n", call);
      continue;
    }
    bytes = res->body.size();
    rows = static_cast<size_t>(std::count(res->body.begin(), res->body.end(), '{')) - 1;
    millis.push_back(std::chrono::duration<double, std::milli>(end - start).count());
  }
  stop = true;
  producer.join();
  analyzer.Shutdown();
  analyzer.Join();
  server.Stop();

  std::sort(millis.begin(), millis.end());
  const double median = millis[millis.size() / 2];
  const double p99 = millis[std::min(millis.size() - 1, millis.size() * 99 / 100)];
  std::printf(
      "GET /api/v1/tables/Q7TXSM: %zu calls, median %.1f ms, p99 %.1f ms (%zu rows, %.1f MB a "
      "reply; %ld transactions processed meanwhile)\n",
      millis.size(), median, p99, rows, bytes / 1e6, queued.load());
  std::filesystem::remove_all(dir);
  return 0;
}
