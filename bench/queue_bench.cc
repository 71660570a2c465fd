// Transaction queue throughput: one producer thread puts, the benchmark thread gets.

#include <benchmark/benchmark.h>

#include <cstdint>
#include <thread>

#include "core/runtime/tvel_queue.h"
#include "core/runtime/typed_transaction.h"

namespace {

void BM_QueuePutGetTwoThreads(benchmark::State& state) {
  const auto capacity = static_cast<unsigned long>(state.range(0));
  constexpr int64_t kBatch = 100000;
  TvelQueue<_TYPED_TRANSACTION> queue(capacity);
  int64_t items = 0;
  for (auto _ : state) {
    std::thread producer([&queue] {
      for (int64_t i = 0; i < kBatch; ++i) {
        queue.Put(_TYPED_TRANSACTION{5, nullptr});
      }
    });
    _TYPED_TRANSACTION item;
    for (int64_t i = 0; i < kBatch; ++i) {
      queue.Get(item, 5000);
      benchmark::DoNotOptimize(item);
    }
    producer.join();
    items += kBatch;
  }
  state.SetItemsProcessed(items);
}
BENCHMARK(BM_QueuePutGetTwoThreads)
    ->Arg(16)
    ->Arg(2048)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace
