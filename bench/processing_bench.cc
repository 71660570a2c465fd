// Transactions through processTransaction alone (no file reading), with 1, 10 and 100
// transaction patterns, and the resident memory that 10^5 distinct transaction keys take.

#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/testing/transaction_builder.h"
#include "framework/trace.h"

namespace {

struct TempDir {
  TempDir() {
    char name[] = "/tmp/q7bench-XXXXXX";
    path = mkdtemp(name);
  }
  ~TempDir() { std::filesystem::remove_all(path); }
  std::string path;
};

std::unique_ptr<CDPXAnalyzer> NewAnalyzer(const TempDir& dir) {
  auto analyzer = std::make_unique<CDPXAnalyzer>(
      CDPXAnalyzer::Paths{dir.path + "/dpx", dir.path + "/state", "", "", ""});
  analyzer->startRun();
  return analyzer;
}

CDPXTransaction Page(const std::string& host, const std::string& url, const char* client) {
  return TransactionBuilder()
      .host(host)
      .url(url)
      .client(client)
      .time(time(nullptr))
      .responseTime(180)
      .serverTime(60)
      .build();
}

long ResidentBytes() {
  long pages = 0;
  long resident = 0;
  if (FILE* f = fopen("/proc/self/statm", "r")) {
    if (fscanf(f, "%ld %ld", &pages, &resident) != 2) {
      resident = 0;
    }
    fclose(f);
  }
  return resident * sysconf(_SC_PAGESIZE);
}

// Transactions of 20 sites x 50 URLs x 5 clients. All but one of the patterns are more specific
// (longer, so matched first) and miss; the last, a catch-all, takes every transaction: each
// transaction is matched against every pattern.
void BM_ProcessTransaction(benchmark::State& state) {
  std::string error;
  fw::TraceOpen("/tmp/q7bench-trace.log", 1 << 20, 1, &error);
  TempDir dir;
  auto analyzer = NewAnalyzer(dir);
  const int patterns = static_cast<int>(state.range(0));
  for (int i = 1; i < patterns; ++i) {
    const std::string name = "Site" + std::to_string(i);
    const std::string path = "/only-" + std::to_string(i) + "/*";
    analyzer->newTransactionPattern(name.c_str(), name.c_str(), "site*.example", "Pages",
                                    path.c_str(), 0, 1, 0, 100, 500, 99);
  }
  analyzer->newTransactionPattern("all", "All", "*", "Pages", "*", 1, 1, 0, 100, 500, 99);
  std::vector<CDPXTransaction> transactions;
  const char* clients[] = {"10.1.2.3", "10.1.2.4", "10.1.3.9", "10.2.0.1", "2001:db8::7"};
  for (int i = 0; i < 1000; ++i) {
    transactions.push_back(Page("site" + std::to_string(i % 20) + ".example",
                                "/shop/item-" + std::to_string(i % 50) + ".jsp", clients[i % 5]));
  }
  short level = 0;
  size_t next = 0;
  for (auto _ : state) {
    CDPXTransaction t = transactions[next];
    analyzer->processTransaction(t, &level);
    next = (next + 1) % transactions.size();
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ProcessTransaction)->Arg(1)->Arg(10)->Arg(100);

// Resident memory per 10^5 distinct transaction keys (each key also makes its own rows in the
// application, client and pairing tables where those differ).
void BM_MemoryPer100kKeys(benchmark::State& state) {
  std::string error;
  fw::TraceOpen("/tmp/q7bench-trace.log", 1 << 20, 1, &error);
  for (auto _ : state) {
    TempDir dir;
    auto analyzer = NewAnalyzer(dir);
    analyzer->newTransactionPattern("all", "All", "*", "Pages", "*", 1, 1, 0, 100, 500, 99);
    const long before = ResidentBytes();
    short level = 0;
    for (int i = 0; i < 100000; ++i) {
      CDPXTransaction t = Page("shop.example", "/item/" + std::to_string(i), "10.1.2.3");
      analyzer->processTransaction(t, &level);
    }
    state.counters["MiB_per_100k_keys"] =
        static_cast<double>(ResidentBytes() - before) / (1024.0 * 1024.0);
  }
}
BENCHMARK(BM_MemoryPer100kKeys)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace
