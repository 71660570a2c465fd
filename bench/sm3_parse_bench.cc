// Records parsed per second on one thread: a 32 KiB chunk of typical page records (about 600
// bytes each) cut into records, and each record parsed into a transaction and given its
// identity, as a data file monitor does.

#include <benchmark/benchmark.h>

#include <string>

#include "core/analyzer/intake/sm3_framing.h"
#include "core/analyzer/intake/sm3_parser.h"
#include "core/analyzer/intake/transaction_identity.h"
#include "tests/support/sm3_lines.h"

namespace {

std::string TypicalRecord(int i) {
  const std::string n = std::to_string(i);
  return q7test::Record(
      1, q7test::PageLine(
             {{15, std::to_string(80 + i % 900)},
              {23, "/shop/catalog/category-" + n + "/items/index.jsp?id=" + n + "&sort=price"},
              {24, "https://www.shop.example/shop/catalog/category-" + n + "/"},
              {25,
               "Mozilla/5.0 (X11; Linux x86_64) AppleWebKit/537.36 (KHTML, like Gecko) "
               "Chrome/124.0.0.0 Safari/537.36"},
              {26, "Apache/2.4.57 (Debian) OpenSSL/3.0.11"},
              {41, "/shop/catalog/category-" + n + "/items/"},
              {42, "index.jsp"},
              {43, "id=" + n + "&sort=price"},
              {45, "Catalog - category " + n + " - Example Shop, the best prices on everything"}}));
}

// Whole records filling one read buffer.
std::string Chunk(int* records) {
  std::string chunk;
  *records = 0;
  for (int i = 0;; ++i) {
    const std::string record = TypicalRecord(i);
    if (chunk.size() + record.size() > static_cast<size_t>(MAX_BUFFER)) {
      break;
    }
    chunk += record;
    ++*records;
  }
  return chunk;
}

class CountingSink : public CSM3RecordSink {
 public:
  bool processSM3Line(char*, int) override { return true; }
};

class ParsingSink : public CSM3RecordSink {
 public:
  explicit ParsingSink(bool identity) : identity_(identity) {}
  bool processSM3Line(char* line, int recordType) override {
    auto t = createDPXTransaction(line, recordType);
    if (identity_ && t) {
      t->setRecordType(recordType);
      doUUIDs(*t, &previous_, &counter_, &pageSeen_);
    }
    benchmark::DoNotOptimize(t.get());
    return true;
  }

 private:
  bool identity_;
  CUUID previous_;
  int64_t counter_ = initialInstanceCounter();
  bool pageSeen_ = true;
};

template <typename Sink>
void RunChunk(benchmark::State& state, Sink& sink) {
  int records = 0;
  const std::string chunk = Chunk(&records);
  std::string work;
  for (auto _ : state) {
    work = chunk;  // the pass blanks NUL bytes in place, so each pass gets a fresh copy
    benchmark::DoNotOptimize(
        processDPXContents(work.data(), static_cast<long>(work.size()), false, sink));
  }
  state.SetItemsProcessed(state.iterations() * records);
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(chunk.size()));
  state.counters["record_bytes"] = static_cast<double>(chunk.size()) / records;
}

void BM_FramingOnly(benchmark::State& state) {
  CountingSink sink;
  RunChunk(state, sink);
}
BENCHMARK(BM_FramingOnly);

void BM_FramingAndParsing(benchmark::State& state) {
  ParsingSink sink(false);
  RunChunk(state, sink);
}
BENCHMARK(BM_FramingAndParsing);

void BM_FramingParsingAndIdentity(benchmark::State& state) {
  ParsingSink sink(true);
  RunChunk(state, sink);
}
BENCHMARK(BM_FramingParsingAndIdentity);

}  // namespace
