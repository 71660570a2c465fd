// What the latency API and /metrics read: the latency books (the current interval's, or the
// summary period's merged from the saved intervals and kept between queries until the history
// changes) and the request metrics.

#include <memory>

#include "core/analyzer/analysis/summary_fold.h"
#include "core/analyzer/dpx_analyzer.h"
#include "core/config/cconfig.h"
#include "core/history/history_store.h"

LatencyBook CDPXAnalyzer::getLatency(bool summary) {
  LatencyBook current;
  LatencyBook unsavedBooks;
  std::shared_ptr<const LatencyBook> past;
  HistoryCache<LatencyBook>::Key key;
  {
    CvelMutexLock lock(treeMutex);
    cache->flush();
    current = cache->currentIntervalTrees().latency();
    if (summary) {
      const long length = CConfig::getOverTimeIntervalSeconds();
      const int intervals = summaryIntervals();
      key = {getCurrentOverTimeInterval() - length, length, intervals,
             history::HistoryStore::generation()};
      past = summaryFolds->latency.find(key);
      if (past == nullptr) {
        auto merged = std::make_shared<LatencyBook>();
        for (int i = intervals - 1; i >= 0; --i) {
          const long interval = key.from - static_cast<long>(i) * length;
          if (interval >= 0) {
            merged->load(*history, interval);
          }
        }
        past = merged;
      }
      for (const auto& [interval, trees] : unsaved) {
        unsavedBooks.merge(trees->latency());
      }
    }
  }
  if (!summary) {
    return current;
  }
  summaryFolds->latency.store(key, past);
  LatencyBook book = *past;
  book.merge(unsavedBooks);
  book.merge(current);
  return book;
}

RequestMetrics CDPXAnalyzer::getRequestMetrics() const {
  CvelMutexLock lock(treeMutex);
  return *requestMetrics;
}
