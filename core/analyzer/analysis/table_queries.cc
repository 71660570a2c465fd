// The analyzer's side of sampling: rows of the current interval's over-time trees plus the
// summary period's history, summaries folded from them (the history's part kept between
// queries, summary_fold.h), instance rows from the instance files, and current-status rows.

#include <algorithm>
#include <cstring>
#include <memory>
#include <vector>

#include "core/analyzer/analysis/summary_fold.h"
#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/rows/rows.h"
#include "core/config/cconfig.h"
#include "core/history/history_store.h"
#include "core/history/instance_file.h"
#include "core/runtime/clog.h"
#include "framework/clock.h"

namespace {

// History rows to load: the count capped at MAX_ROWS, with the trace when it is cut.
size_t Capped(size_t rows) {
  if (rows > static_cast<size_t>(MAX_ROWS)) {
    CLOG::min("Too many rows %d > MAX_ROWS(%d), will return MAX_ROWS", static_cast<int>(rows),
              MAX_ROWS);
    return MAX_ROWS;
  }
  return rows;
}

template <class Layout>
void StampSampleTime(Layout* rows, int count, time_t now) {
  char text[17];
  TimeSince70ToMordel(now, text);
  for (int i = 0; i < count; ++i) {
    memcpy(rows[i].sampletime, text, sizeof(rows[i].sampletime));
  }
}

// Current-status conversions: every column of the current-status layout from the over-time
// column of the same name (the layouts differ only by aggby).
#define Q7_COPY_COLUMN(kind, name, width) memcpy(&to.name, &from.name, sizeof(to.name));

}  // namespace

#define Q7_DEFINE_CONVERSION(cs, ot, COLUMNS)                                                \
  void q7_convert_##ot##_to_##cs(const kq7_q7##ot##_data_t& from, kq7_q7##cs##_data_t& to) { \
    COLUMNS(Q7_COPY_COLUMN)                                                                  \
  }
Q7_ANALYZER_TABLES(Q7_NO_OVER_TIME, Q7_NO_SUMMARY, Q7_DEFINE_CONVERSION, Q7_NO_INSTANCE)
#undef Q7_DEFINE_CONVERSION
#undef Q7_COPY_COLUMN

int CDPXAnalyzer::summaryIntervals() {
  return CConfig::getSummaryInterval() * 60 / CConfig::getOverTimeInterval();
}

namespace {

// The summary period's history before the current interval, as the queries read it.
struct HistoryWindow {
  history::HistoryStore& store;
  long interval;  // start of the current interval
  long length;    // seconds in an interval
  int intervals;  // intervals in the summary period
};

// A query of over-time rows: tree's rows (the current interval's), then, unless currentOnly,
// the history of stem before the current interval; the first limit of them.
template <class OverTimeRow>
typename OverTimeRow::LayoutType* OverTimeRows(TSAVLTree& tree, const char* stem,
                                               const HistoryWindow& history, const char* where,
                                               int sampleType, int* count, bool currentOnly,
                                               size_t limit) {
  using Layout = typename OverTimeRow::LayoutType;
  CLOG::enter(2, "%s(%d,--,%d)", where, sampleType, currentOnly ? 1 : 0);
  *count = 0;
  if (sampleType != 3) {
    CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
    return nullptr;
  }
  const long from = history.interval - history.length;
  // Only the rows wanted are copied: this runs under the tree lock, which processing waits for.
  const size_t current = std::min(static_cast<size_t>(tree.getSize()), limit);
  const size_t historyRows =
      currentOnly || current == limit
          ? 0
          : std::min(Capped(history.store.countRows(stem, from, history.intervals, history.length,
                                                    sizeof(Layout))),
                     limit - current);
  if (historyRows + current == 0) {
    CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
    return nullptr;
  }
  auto rows = std::make_unique<Layout[]>(historyRows + current);
  std::vector<TreeNode*> nodes;
  getTreeNodes(tree, nodes);
  for (size_t i = 0; i < nodes.size() && i < current; ++i) {
    static_cast<OverTimeRow*>(nodes[i])->getQ7Struct(rows[i]);
  }
  size_t loaded = 0;
  if (historyRows > 0) {
    loaded = history.store.loadRows(stem, from, history.intervals, history.length, sizeof(Layout),
                                    historyRows, rows.get() + current);
  }
  *count = static_cast<int>(current + loaded);
  CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
  return rows.release();
}

// The row class and tree of each over-time layout.
template <class Layout>
struct OverTimeOf;
#define Q7_OVER_TIME_OF(name, OverTimeRow, keys, Tree, EXPORT)  \
  template <>                                                   \
  struct OverTimeOf<kq7_q7##name##_data_t> {                    \
    using Row = OverTimeRow;                                    \
    static constexpr OverTimeTable kTree = OverTimeTable::Tree; \
  };
Q7_ANALYZER_TABLES(Q7_OVER_TIME_OF, Q7_NO_SUMMARY, Q7_NO_CURRENT, Q7_NO_INSTANCE)
#undef Q7_OVER_TIME_OF

// A summary query's share of the current interval: its over-time rows as layout rows with only
// the columns a fold reads (getFoldColumns: the rest costs most of a layout row), their keys
// and their order by key. With a limit, only the rows of the first limit keys are taken.
template <class SummaryRow, class OverTimeRow>
struct CurrentRows {
  using Layout = typename SummaryRow::OverTimeLayoutType;

  std::unique_ptr<Layout[]> rows;
  size_t count = 0;
  SummaryKeys<SummaryRow> keys;      // of rows; empty until ordered
  std::vector<std::uint32_t> order;  // indexes of rows by key, once ordered
  size_t treeRows = 0;               // rows in the tree

  // Under the tree lock.
  void take(TSAVLTree& tree, size_t limit) {
    std::vector<TreeNode*> nodes;
    getTreeNodes(tree, nodes);
    treeRows = nodes.size();
    std::vector<const OverTimeRow*> taken(nodes.size());
    for (size_t i = 0; i < nodes.size(); ++i) {
      taken[i] = static_cast<const OverTimeRow*>(nodes[i]);
    }
    if (limit < taken.size()) {
      const SummaryKeys<SummaryRow> allKeys(taken.data(), taken.size());
      const std::vector<std::uint32_t> allOrder = allKeys.order();
      std::vector<const OverTimeRow*> first;
      size_t distinct = 0;
      for (size_t i = 0; i < allOrder.size(); ++i) {
        const std::string_view key = allKeys[allOrder[i]];
        if (i == 0 || key != allKeys[allOrder[i - 1]]) {
          if (distinct == limit) {
            break;
          }
          ++distinct;
        }
        first.push_back(taken[allOrder[i]]);
        keys.add(key);
        order.push_back(static_cast<std::uint32_t>(order.size()));
      }
      taken = std::move(first);
    }
    count = taken.size();
    rows.reset(new Layout[count]);
    for (size_t i = 0; i < count; ++i) {
      taken[i]->getFoldColumns(rows[i]);
    }
  }

  // Without the lock, after take.
  void orderByKey() {
    if (order.size() != count) {
      keys = SummaryKeys<SummaryRow>(rows.get(), count);
      order = keys.order();
    }
  }
};

// The history rows of stem in the window, as many as a query loads (MAX_ROWS at most).
template <class Layout>
std::unique_ptr<Layout[]> HistoryRows(const char* stem, const HistoryWindow& history,
                                      size_t* count) {
  const long from = history.interval - history.length;
  const size_t rows = Capped(
      history.store.countRows(stem, from, history.intervals, history.length, sizeof(Layout)));
  *count = 0;
  if (rows == 0) {
    return nullptr;
  }
  // Not value-initialised: the load overwrites what it returns, and that is megabytes.
  std::unique_ptr<Layout[]> out(new Layout[rows]);
  *count = history.store.loadRows(stem, from, history.intervals, history.length, sizeof(Layout),
                                  rows, out.get());
  return out;
}

// A query of instance rows: the instance files (flushed first) of stem over the summary
// period, the current interval's included.
template <class Layout>
Layout* InstanceRows(const char* stem, history::InstanceFile& pages, history::InstanceFile& objects,
                     const HistoryWindow& history, const char* where, int sampleType, int* count) {
  CLOG::enter(2, "%s(%d,--)", where, sampleType);
  *count = 0;
  if (sampleType != 3) {
    CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
    return nullptr;
  }
  pages.flush();
  objects.flush();
  const size_t records = Capped(history.store.countRows(stem, history.interval, history.intervals,
                                                        history.length, sizeof(Layout)));
  if (records < 1) {
    CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
    return nullptr;
  }
  auto rows = std::make_unique<Layout[]>(records);
  *count =
      static_cast<int>(history.store.loadRows(stem, history.interval, history.intervals,
                                              history.length, sizeof(Layout), records, rows.get()));
  CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
  return rows.release();
}

}  // namespace

template <class Layout, class Inner>
Layout* CDPXAnalyzer::lockedQuery(Inner inner, int* count) {
  const time_t now = fw::Now();
  Layout* rows;
  {
    CvelMutexLock lock(treeMutex);
    cache->flush();
    rows = inner();
  }
  // Stamped once the lock is released: sampling must not hold up processing for it.
  StampSampleTime(rows, *count, now);
  return rows;
}

template <class SummaryRow>
typename SummaryRow::LayoutType* CDPXAnalyzer::summaryQuery(
    const char* stem, HistoryCache<HistoryFold<SummaryRow>>& folds, const char* where,
    int sampleType, int* count, size_t limit) {
  using Layout = typename SummaryRow::LayoutType;
  using OverTimeLayout = typename SummaryRow::OverTimeLayoutType;
  using OverTime = OverTimeOf<OverTimeLayout>;
  const time_t now = fw::Now();
  CLOG::enter(2, "%s(%d,--)", where, sampleType);
  *count = 0;
  if (sampleType != 3) {
    CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
    return nullptr;
  }
  CurrentRows<SummaryRow, typename OverTime::Row> current;
  std::shared_ptr<const HistoryFold<SummaryRow>> folded;
  std::unique_ptr<OverTimeLayout[]> historyRows;
  size_t historyCount = 0;
  typename SummaryFoldCache<SummaryRow>::Key key;
  {
    CvelMutexLock lock(treeMutex);
    cache->flush();
    current.take(cache->currentIntervalTrees().tree(OverTime::kTree), limit);
    const HistoryWindow window{*history, getCurrentOverTimeInterval(),
                               CConfig::getOverTimeIntervalSeconds(), summaryIntervals()};
    // The generation is read before the files: a change after it makes the next query refold.
    key = {window.interval - window.length, window.length, window.intervals,
           history::HistoryStore::generation()};
    folded = folds.find(key);
    if (folded == nullptr) {
      historyRows = HistoryRows<OverTimeLayout>(stem, window, &historyCount);
    }
  }
  // Ordering, folding and merging work on copies: processing need not wait for them.
  if (folded == nullptr) {
    folded = std::make_shared<const HistoryFold<SummaryRow>>(historyRows.get(), historyCount);
    historyRows.reset();
    folds.store(key, folded);
  }
  if (current.treeRows + folded->size() == 0) {
    CLOG::max("%s, no current data.", where);
    CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
    return nullptr;
  }
  CLOG::max("%s, current data present.", where);
  current.orderByKey();
  Layout* rows = nullptr;
  const size_t room = std::min(current.count + folded->size(), limit);
  if (room > 0) {
    std::unique_ptr<Layout[]> merged(new Layout[room]);
    *count = static_cast<int>(
        folded->merge(current.rows.get(), current.keys, current.order, limit, merged.get()));
    StampSampleTime(merged.get(), *count, now);
    rows = merged.release();
  }
  CLOG::exit(2, "%s(%d,%d)", where, sampleType, *count);
  return rows;
}

// ---- The named queries. ----

// The public query over each inner one: the inner query under the tree lock, then the sample
// time. Extra arguments go to the inner query after sampleType and count.
#define Q7_LOCKED_QUERY(name, ...)                                                 \
  kq7_q7##name##_data_t* CDPXAnalyzer::get_tbl##name(int sampleType, int* count) { \
    return lockedQuery<kq7_q7##name##_data_t>(                                     \
        [&]() REQUIRES(treeMutex) {                                                \
          return i_get_tbl##name(sampleType, count __VA_OPT__(, ) __VA_ARGS__);    \
        },                                                                         \
        count);                                                                    \
  }

// The window of history the queries read.
#define Q7_HISTORY_WINDOW                                                          \
  HistoryWindow {                                                                  \
    *history, getCurrentOverTimeInterval(), CConfig::getOverTimeIntervalSeconds(), \
        summaryIntervals()                                                         \
  }
// An over-time table: its tree and row class; a summary: its row class, folded from the
// current rows of its over-time table and that table's history; instance rows from the
// instance files.
#define Q7_OVER_TIME(ot, OverTimeRow, keys, Tree, EXPORT)                                        \
  kq7_q7##ot##_data_t* CDPXAnalyzer::i_get_tbl##ot(int sampleType, int* count, bool currentOnly, \
                                                   size_t limit) {                               \
    return OverTimeRows<OverTimeRow>(cache->currentIntervalTrees().tree(OverTimeTable::Tree),    \
                                     "q7" #ot, Q7_HISTORY_WINDOW, "i_get_tbl" #ot, sampleType,   \
                                     count, currentOnly, limit);                                 \
  }                                                                                              \
  kq7_q7##ot##_data_t* CDPXAnalyzer::get_tbl##ot(int sampleType, int* count, size_t limit) {     \
    return lockedQuery<kq7_q7##ot##_data_t>(                                                     \
        [&]() REQUIRES(treeMutex) { return i_get_tbl##ot(sampleType, count, false, limit); },    \
        count);                                                                                  \
  }
#define Q7_SUMMARY(sm, SummaryRow, keys, ot)                                                 \
  kq7_q7##sm##_data_t* CDPXAnalyzer::get_tbl##sm(int sampleType, int* count, size_t limit) { \
    return summaryQuery<SummaryRow>("q7" #ot, summaryFolds->sm, "i_get_tbl" #sm, sampleType, \
                                    count, limit);                                           \
  }
#define Q7_INSTANCE(name)                                                                        \
  kq7_q7##name##_data_t* CDPXAnalyzer::i_get_tbl##name(int sampleType, int* count) {             \
    return InstanceRows<kq7_q7##name##_data_t>("q7" #name, *instanceFile, *subInstanceFile,      \
                                               Q7_HISTORY_WINDOW, "i_get_tbl" #name, sampleType, \
                                               count);                                           \
  }                                                                                              \
  Q7_LOCKED_QUERY(name)

#define Q7_CURRENT_STATUS(cs, ot, COLUMNS)                                                   \
  kq7_q7##cs##_data_t* CDPXAnalyzer::get_tbl##cs(int sampleType, int* count, size_t limit) { \
    CLOG::enter(2, "%s(%d,--)", "get_tbl" #cs, sampleType);                                  \
    const time_t now = fw::Now();                                                            \
    int overTimeCount = 0;                                                                   \
    std::unique_ptr<kq7_q7##ot##_data_t[]> overTime;                                         \
    {                                                                                        \
      CvelMutexLock lock(treeMutex);                                                         \
      cache->flush();                                                                        \
      overTime.reset(i_get_tbl##ot(sampleType, &overTimeCount, true, limit));                \
    }                                                                                        \
    *count = 0;                                                                              \
    kq7_q7##cs##_data_t* rows = nullptr;                                                     \
    if (overTime && overTimeCount > 0) {                                                     \
      rows = new kq7_q7##cs##_data_t[overTimeCount];                                         \
      for (int i = 0; i < overTimeCount; ++i) {                                              \
        q7_convert_##ot##_to_##cs(overTime[i], rows[i]);                                     \
      }                                                                                      \
      *count = overTimeCount;                                                                \
      StampSampleTime(rows, *count, now);                                                    \
    }                                                                                        \
    CLOG::exit(2, "%s(%d,%d)", "get_tbl" #cs, sampleType, *count);                           \
    return rows;                                                                             \
  }
Q7_ANALYZER_TABLES(Q7_OVER_TIME, Q7_SUMMARY, Q7_CURRENT_STATUS, Q7_INSTANCE)
#undef Q7_CURRENT_STATUS
#undef Q7_INSTANCE
#undef Q7_SUMMARY
#undef Q7_OVER_TIME
#undef Q7_LOCKED_QUERY
#undef Q7_HISTORY_WINDOW
