#pragma once

// IntervalCache: the over-time trees processing updates, and the cache. A transaction of a
// past interval (still within the summary period) is counted into that interval's rows: its
// saved rows are loaded into fresh trees, which take the current trees' place while the
// current interval's wait aside, and are saved back when the cache is left.
//
// Thread safety: none of its own; the analyzer's tree lock guards every call.

#include <memory>

#include "core/analyzer/analysis/over_time_trees.h"

namespace history {
class HistoryStore;
}  // namespace history

class IntervalCache {
 public:
  // history: where a cached interval's rows are loaded from and saved to (not owned).
  explicit IntervalCache(history::HistoryStore& history);

  // The trees processing updates: the cache's while one is active.
  COverTimeTrees& trees() { return *trees_; }
  // The current interval's trees whether or not a cache is swapped in.
  COverTimeTrees& currentIntervalTrees() { return active_ ? *saved_ : *trees_; }
  bool active() const { return active_; }
  // The interval the cache holds (meaningful while active).
  long interval() const { return interval_; }

  // Sets the current trees aside and swaps in fresh trees loaded with interval's saved rows.
  // currentInterval only names the current interval in the trace.
  void activate(long interval, long currentInterval);
  // Saves the cache's rows and puts the current interval's trees back. Traced as an error when
  // no cache is active.
  void deactivate(long currentInterval);
  // Saves the cache's rows, staying active.
  void flush();
  // Puts the current interval's trees back without saving the cache.
  void discard();

  // Loads interval's saved rows into the current trees (start of a run; no cache active).
  void loadCurrent(long interval);
  // Makes fresh the current trees (a rollover; no cache active) and returns the old ones.
  std::unique_ptr<COverTimeTrees> replaceCurrent(std::unique_ptr<COverTimeTrees> fresh);

 private:
  history::HistoryStore& history_;
  std::unique_ptr<COverTimeTrees> trees_;  // what processing updates
  std::unique_ptr<COverTimeTrees> saved_;  // the current interval's while a cache is active
  bool active_ = false;
  long interval_ = 0;
};
