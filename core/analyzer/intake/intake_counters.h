#pragma once

// IntakeCounters: what the intake has read since the agent started, and where it is reading
// now, for the agent's status endpoint and for tests that need to know the tables are final.
//
// Written by the data file monitors' threads (one at a time, but a static monitor and the live
// one may overlap at a rename), read by any thread. The counts are atomics; the file and its
// offset change together, under the mutex.

#include <atomic>
#include <cstdint>
#include <string>

#include "framework/mutex.h"

class IntakeCounters {
 public:
  struct Snapshot {
    int64_t recordsRead = 0;      // records taken from files, whether queued or not
    int64_t recordsUnparsed = 0;  // of those, records that are not a transaction
    int64_t outliersDropped = 0;  // of those, transactions over the outlier limit
    std::string file;             // the file being read; empty before the first
    long long offset = 0;         // its bytes consumed
  };

  void recordRead() { recordsRead_.fetch_add(1, std::memory_order_relaxed); }
  void recordUnparsed() { recordsUnparsed_.fetch_add(1, std::memory_order_relaxed); }
  void outlierDropped() { outliersDropped_.fetch_add(1, std::memory_order_relaxed); }
  void reading(const std::string& file, long long offset) {
    fw::MutexLock lock(mutex_);
    file_ = file;
    offset_ = offset;
  }

  Snapshot snapshot() const {
    Snapshot s;
    s.recordsRead = recordsRead_.load(std::memory_order_relaxed);
    s.recordsUnparsed = recordsUnparsed_.load(std::memory_order_relaxed);
    s.outliersDropped = outliersDropped_.load(std::memory_order_relaxed);
    fw::MutexLock lock(mutex_);
    s.file = file_;
    s.offset = offset_;
    return s;
  }

 private:
  std::atomic<int64_t> recordsRead_{0};
  std::atomic<int64_t> recordsUnparsed_{0};
  std::atomic<int64_t> outliersDropped_{0};
  mutable fw::Mutex mutex_;
  std::string file_ GUARDED_BY(mutex_);
  long long offset_ GUARDED_BY(mutex_) = 0;
};
