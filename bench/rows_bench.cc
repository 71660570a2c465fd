// The aggregate row's two hot operations: adding one transaction to an over-time row (done for
// seven tables per page) and folding one exported over-time row into a summary row (done for
// every history row a summary query reads), plus the copy into a table row.

#include <benchmark/benchmark.h>

#include <cstdio>

#include "core/analyzer/rows/rows.h"
#include "core/analyzer/testing/transaction_builder.h"

namespace {

CDPXTransaction Transaction() {
  return TransactionBuilder()
      .url("/shop/catalog/items/index.jsp")
      .responseTime(230)
      .serverTime(80)
      .networkTime(40)
      .loadTime(120)
      .minThreshold(500)
      .build();
}

void BM_RowUpdate(benchmark::State& state) {
  CDPXTransaction t = Transaction();
  CTransactionOverTime row(t);
  for (auto _ : state) {
    row.Update(t);
    benchmark::DoNotOptimize(row.getCommon().totreq);
  }
}
BENCHMARK(BM_RowUpdate);

void BM_SummaryFold(benchmark::State& state) {
  CDPXTransaction t = Transaction();
  CTransactionOverTime row(t);
  for (int i = 0; i < 50; ++i) {
    row.Update(t);
  }
  kq7_q7txot_data_t layout;
  row.getQ7Struct(layout);
  CTransactionSummary summary(layout);
  for (auto _ : state) {
    summary.Update(layout);
    benchmark::DoNotOptimize(summary.getCommon().totreq);
  }
}
BENCHMARK(BM_SummaryFold);

void BM_TableRowCopy(benchmark::State& state) {
  CDPXTransaction t = Transaction();
  CTransactionOverTime row(t);
  row.Update(t);
  kq7_q7txot_data_t layout;
  for (auto _ : state) {
    row.getQ7Struct(layout);
    benchmark::DoNotOptimize(layout.totreq);
  }
}
BENCHMARK(BM_TableRowCopy);

}  // namespace
