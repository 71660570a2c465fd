// libFuzzer target over loading history: the input's tail is one history file, of one of the
// over-time or instance tables, in a directory of its own; the store reads it back (countRows,
// loadRows, loadInterval) and, for an over-time table, COverTimeTrees builds rows from it as a
// restart does.
//
// Beyond not crashing, it checks:
// - countRows counts the file's whole records exactly when the walk reaches its interval;
// - loadRows copies min(count, max_rows) records, never more than countRows said, and they are
//   the file's first bytes; loadInterval returns exactly the file's records when it holds whole
//   ones, and nothing (the file set aside) when it does not;
// - the trees never hold more rows than the file has records.
//
// Input: three header bytes, then the file.
//   byte 0: the table (its stem and record size)
//   byte 1: max_rows for loadRows
//   byte 2: bits 0-2 how many intervals the walk starts after the file's, bits 3-7 how many
//           intervals it covers

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

#include "core/analyzer/analysis/over_time_trees.h"
#include "core/analyzer/rows/rows.h"
#include "core/history/history_file_name.h"
#include "core/history/history_store.h"
#include "core/layouts/table_layouts.h"
#include "tests/fuzz/fuzz_support.h"

namespace {

void Check(bool ok, const char* what) {
  if (!ok) {
    fuzzing::Fail("history_fuzz", what);
  }
}

struct Table {
  const char* stem;
  size_t record_size;
  bool over_time;  // COverTimeTrees loads it
};

#define Q7_FUZZ_OVER_TIME(name, Row, keys, Tree, EXPORT) \
  {"q7" #name, sizeof(Row::LayoutType), true},
#define Q7_FUZZ_INSTANCE(name) {"q7" #name, sizeof(kq7_q7##name##_data_t), false},
constexpr Table kTables[] = {
    Q7_ANALYZER_TABLES(Q7_FUZZ_OVER_TIME, Q7_NO_SUMMARY, Q7_NO_CURRENT, Q7_FUZZ_INSTANCE)};
#undef Q7_FUZZ_INSTANCE
#undef Q7_FUZZ_OVER_TIME
constexpr size_t kTableCount = sizeof(kTables) / sizeof(kTables[0]);

// A five-minute interval start; the walk steps back from up to seven intervals later.
constexpr int64_t kIntervalSeconds = 300;
constexpr int64_t kInterval = 1700000100;

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzzing::QuietTraces("history_fuzz_trace.log");
  fuzzing::ScratchDirectory();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 3) {
    return 0;
  }
  const Table& table = kTables[data[0] % kTableCount];
  const size_t max_rows = data[1];
  const int after = data[2] & 7;
  const int intervals = data[2] >> 3;
  const uint8_t* file = data + 3;
  const size_t file_size = size - 3;

  history::HistoryStore store(fuzzing::ScratchDirectory() + "/");
  const std::string path = store.pathOf(kInterval, table.stem);
  Check(history::IntervalOfStoreFile(std::filesystem::path(path).filename().string()) == kInterval,
        "the store's own file name is not recognised");
  fuzzing::WriteWholeFile(path, file, file_size);

  const size_t rs = table.record_size;
  const size_t whole = file_size / rs;
  const int64_t last = kInterval + after * kIntervalSeconds;
  const size_t counted = store.countRows(table.stem, last, intervals, kIntervalSeconds, rs);
  Check(counted == (after < intervals ? whole : 0), "countRows miscounts the file's records");

  // Exactly max_rows records of room, so a copy past it shows.
  std::vector<std::byte> out(max_rows * rs);
  const size_t loaded =
      store.loadRows(table.stem, last, intervals, kIntervalSeconds, rs, max_rows, out.data());
  Check(loaded <= counted, "loadRows returns more rows than countRows counted");
  Check(loaded == std::min(counted, max_rows), "loadRows misses records");
  Check(loaded == 0 || std::memcmp(out.data(), file, loaded * rs) == 0,
        "loadRows returns other bytes than the file's");

  // A file that is not whole records is damaged: loadInterval sets it aside and reads nothing.
  const std::vector<std::byte> records = store.loadInterval(kInterval, table.stem, rs);
  Check(records.size() == (file_size % rs == 0 ? whole * rs : 0),
        "loadInterval returns a part record, misses records or keeps a damaged file");
  Check(records.empty() || std::memcmp(records.data(), file, records.size()) == 0,
        "loadInterval returns other bytes than the file's");

  if (table.over_time) {
    COverTimeTrees trees;
    trees.load(store, kInterval);
    Check(trees.totalRows() >= 0 && static_cast<size_t>(trees.totalRows()) <= whole,
          "the trees hold more rows than the file has records");
  }
  std::filesystem::remove(path);
  std::filesystem::remove(path + ".bad");
  return 0;
}
