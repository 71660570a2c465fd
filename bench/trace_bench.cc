// Cost of tracing on hot paths: a disabled trace must be close to free, since the
// per-transaction code traces at detail and flow classes that production masks switch off.

#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "framework/trace.h"

namespace {

constexpr char kUnit[] = "analyzer";

void BM_TraceDisabled(benchmark::State& state) {
  fw::TraceConfigure("*=ERROR", nullptr);
  int i = 0;
  for (auto _ : state) {
    Q7_TRACE(kUnit, fw::kTraceDetail, "transaction %d of %s", ++i, "example.com");
  }
}
BENCHMARK(BM_TraceDisabled);

void BM_FlowScopeDisabled(benchmark::State& state) {
  fw::TraceConfigure("*=ERROR", nullptr);
  for (auto _ : state) {
    Q7_FLOW(kUnit);
    benchmark::ClobberMemory();
  }
}
BENCHMARK(BM_FlowScopeDisabled);

void BM_TraceEnabledToFile(benchmark::State& state) {
  char tmpl[] = "/tmp/q7bench-XXXXXX";
  if (mkdtemp(tmpl) == nullptr) {
    state.SkipWithError("mkdtemp failed");
    return;
  }
  const std::string dir = tmpl;
  fw::TraceOpen(dir + "/trace.log", 64 * 1024 * 1024, 2, nullptr);
  fw::TraceConfigure("*=ALL", nullptr);
  int i = 0;
  for (auto _ : state) {
    Q7_TRACE(kUnit, fw::kTraceDetail, "transaction %d of %s", ++i, "example.com");
  }
  fw::TraceClose();
  fw::TraceConfigure("*=ERROR", nullptr);
  const std::string cleanup = "rm -rf " + dir;
  if (std::system(cleanup.c_str()) != 0) {
    state.SkipWithError("cleanup failed");
  }
}
BENCHMARK(BM_TraceEnabledToFile);

}  // namespace
