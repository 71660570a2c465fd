#include "core/analyzer/analysis/interval_cache.h"

#include <utility>

#include "core/runtime/clog.h"

IntervalCache::IntervalCache(history::HistoryStore& history)
    : history_(history), trees_(std::make_unique<COverTimeTrees>()) {}

void IntervalCache::activate(long interval, long currentInterval) {
  CLOG::med("Activating cache for interval[%d] where currentTimePeriod[%d]",
            static_cast<int>(interval), static_cast<int>(currentInterval));
  saved_ = std::move(trees_);
  trees_ = std::make_unique<COverTimeTrees>();
  CLOG::med("Loading cache for interval[%d]", static_cast<int>(interval));
  trees_->load(history_, interval);
  interval_ = interval;
  active_ = true;
}

void IntervalCache::deactivate(long currentInterval) {
  if (!active_) {
    CLOG::min("Error: Attempting to deactivate cache when one is not active");
    return;
  }
  CLOG::med("Deactivating cache for interval[%d] where currentTimePeriod[%d]",
            static_cast<int>(interval_), static_cast<int>(currentInterval));
  CLOG::med("Saving cache for interval[%d]", static_cast<int>(interval_));
  trees_->save(history_, interval_);
  trees_ = std::move(saved_);
  active_ = false;
}

void IntervalCache::flush() {
  if (active_) {
    CLOG::med("Saving cache for interval[%d]", static_cast<int>(interval_));
    trees_->save(history_, interval_);
  }
}

void IntervalCache::discard() {
  if (active_) {
    trees_ = std::move(saved_);
    active_ = false;
  }
}

void IntervalCache::loadCurrent(long interval) {
  trees_->load(history_, interval);
  active_ = false;
}

std::unique_ptr<COverTimeTrees> IntervalCache::replaceCurrent(
    std::unique_ptr<COverTimeTrees> fresh) {
  std::swap(trees_, fresh);
  return fresh;
}
