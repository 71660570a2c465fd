#pragma once

// TvelQueue<T>: a fixed-capacity blocking FIFO ring shared between threads.
//
// Producers (any number) block in Put while the queue is full; the consumer waits in Get with a
// timeout so that it can do periodic work when nothing arrives. Items are copied by value; the
// array is allocated once at construction and nothing is allocated afterwards. The agent uses
// one TvelQueue<_TYPED_TRANSACTION> of 2048 items between the data file readers and the
// analyzer.
//
// Blocking goes through two manual-reset events, not-empty and not-full, which are signalled
// and reset only under the queue mutex. A thread woken by them re-checks the count under the
// mutex and waits again if another thread got there first.
//
// Ownership: the destructor frees the array but not what queued items point to; the consumer
// empties the queue before destroying it. The queue must outlive every thread using it.
//
// Thread safety: Put from any thread; Get from the consumer (one thread in the agent, though
// several are safe); IsFull and IsEmpty from any thread, as unlocked hints.

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <new>

#include "core/runtime/cvel_event.h"
#include "core/runtime/cvel_mutex.h"
#include "core/runtime/cvel_status.h"
#include "framework/thread_annotations.h"

namespace tvel_internal {

// The queue's invariants guard against programming errors: they stop the process in every build.
inline void Check(bool holds, const char* text) {
  if (!holds) {
    std::fprintf(stderr, "Assertion failed: %s\n", text);
    std::abort();
  }
}

}  // namespace tvel_internal

template <typename T>
class TvelQueue {
 public:
  // The ceiling of the default queue; a queue never grows past its construction capacity.
  static constexpr unsigned long kMaxItems = 2048;

  TvelQueue() : TvelQueue(kMaxItems) {}
  // An allocation failure leaves capacity 0: the queue then counts as full for ever.
  explicit TvelQueue(unsigned long capacity)
      : v_items(new (std::nothrow) T[capacity]),
        v_currentmaxitem(v_items != nullptr ? capacity : 0) {
    // A queue without room is full from the start, so producers sleep instead of spinning.
    if (v_currentmaxitem == 0) {
      v_notfull.Reset();
    }
  }

  // Frees the array under the queue mutex. Queued items are dropped, not deleted.
  ~TvelQueue() {
    CvelMutexLock lock(v_queuemutex);
    Flush();
    v_items.reset();
  }

  TvelQueue(const TvelQueue&) = delete;
  TvelQueue& operator=(const TvelQueue&) = delete;

  // Copies item in, waiting as long as the queue is full: 0, or an event or mutex status.
  long Put(const T& item) {
    for (;;) {
      long status = v_notfull.Wait();
      bool stored = false;
      if (status == cvel::kOk) {
        CvelMutexLock lock(v_queuemutex);
        if (!IsFull()) {
          status = PutImpl(item);
          stored = true;
        } else {
          tvel_internal::Check(v_numofitems.load() == v_currentmaxitem,
                               "v_numofitems == v_currentmaxitem");
        }
      }
      if (status != cvel::kOk || stored) {
        return status;
      }
    }
  }

  // Takes the oldest item, waiting at most timeout_millis for one (whole seconds, so up to one
  // second less): 0, -132 on timeout with item untouched, or another event status.
  long Get(T& item, long timeout_millis) {
    for (;;) {
      const long status = v_notempty.Wait(timeout_millis);
      if (status != cvel::kOk) {
        return status;
      }
      CvelMutexLock lock(v_queuemutex);
      if (!IsEmpty()) {
        GetImpl(item);
        return cvel::kOk;
      }
    }
  }

  // Copies items[0..n) in, in order, waiting whenever the queue is full as Put does, and
  // filling what room there is under one lock with one wake-up of the consumer: 0, or an event
  // or mutex status with *stored (when not null) the number that went in before it.
  long PutBatch(const T* items, unsigned long n, unsigned long* stored = nullptr) {
    unsigned long done = 0;
    long status = cvel::kOk;
    while (done < n && status == cvel::kOk) {
      status = v_notfull.Wait();
      if (status != cvel::kOk) {
        break;
      }
      CvelMutexLock lock(v_queuemutex);
      unsigned long count = v_numofitems.load();
      if (count == v_currentmaxitem) {
        continue;
      }
      for (; done < n && count < v_currentmaxitem; ++done, ++count) {
        v_tail = static_cast<long>((static_cast<unsigned long>(v_tail + 1)) % v_currentmaxitem);
        v_items[v_tail] = items[done];
      }
      v_numofitems.store(count);
      status = v_notempty.Signal();
      if (count == v_currentmaxitem && status == cvel::kOk) {
        status = v_notfull.Reset();
      }
    }
    if (stored != nullptr) {
      *stored = done;
    }
    return status;
  }

  // Takes up to max of the oldest items into out[0..) in order, waiting as Get does: the count
  // taken (at least 1; 0 only when max is 0), or Get's status when nothing was (statuses are
  // negative). One lock and
  // one wake-up of the producers serve the whole batch.
  long GetBatch(T* out, unsigned long max, long timeout_millis) {
    if (max == 0) {
      return 0;
    }
    for (;;) {
      const long status = v_notempty.Wait(timeout_millis);
      if (status != cvel::kOk) {
        return status;
      }
      CvelMutexLock lock(v_queuemutex);
      const unsigned long queued = v_numofitems.load();
      if (queued == 0) {
        continue;
      }
      const unsigned long n = queued < max ? queued : max;
      for (unsigned long i = 0; i < n; ++i) {
        out[i] = v_items[v_head];
        v_head = (v_head + 1) % v_currentmaxitem;
      }
      v_numofitems.store(queued - n);
      if (queued == n) {
        v_notempty.Reset();
      }
      v_notfull.Signal();
      return static_cast<long>(n);
    }
  }

  bool IsFull() const { return v_numofitems.load(std::memory_order_relaxed) == v_currentmaxitem; }
  bool IsEmpty() const { return v_numofitems.load(std::memory_order_relaxed) == 0; }
  // Items queued now; from any thread, a moment's figure.
  long Size() const { return v_numofitems.load(std::memory_order_relaxed); }

  // Rewinds the indices and wakes producers without touching the count. Only the destructor may
  // call it: the queue is inconsistent afterwards.
  void Flush() REQUIRES(v_queuemutex) {
    v_head = 0;
    v_tail = 0;
    v_notfull.Signal();
    v_notempty.Reset();
  }

 private:
  long PutImpl(const T& item) REQUIRES(v_queuemutex) {
    tvel_internal::Check(v_numofitems.load() < v_currentmaxitem, "v_numofitems < v_currentmaxitem");
    v_tail = static_cast<long>((static_cast<unsigned long>(v_tail + 1)) % v_currentmaxitem);
    v_items[v_tail] = item;
    const unsigned long count = v_numofitems.load() + 1;
    v_numofitems.store(count);
    long status = v_notempty.Signal();
    if (count == v_currentmaxitem) {
      status = v_notfull.Reset();
    }
    return status;
  }

  // Requires a non-empty queue.
  void GetImpl(T& item) REQUIRES(v_queuemutex) {
    item = v_items[v_head];
    v_head = (v_head + 1) % v_currentmaxitem;
    const unsigned long count = v_numofitems.load() - 1;
    v_numofitems.store(count);
    if (count == 0) {
      v_notempty.Reset();
    }
    v_notfull.Signal();  // every blocked producer wakes and re-checks under the mutex
  }

  // Items queued; written under v_queuemutex, read unlocked by IsFull/IsEmpty.
  std::atomic<unsigned long> v_numofitems{0};
  std::unique_ptr<T[]> v_items GUARDED_BY(v_queuemutex);  // v_currentmaxitem slots
  unsigned long v_head GUARDED_BY(v_queuemutex) = 0;      // next slot to read
  long v_tail GUARDED_BY(v_queuemutex) = -1;              // last slot written
  CvelEvent v_notempty{kEventManualReset, false};         // set while an item is queued
  CvelEvent v_notfull{kEventManualReset, true};           // set while there is room
  CvelMutex v_unusedmutex;               // part of the queue's layout; nothing takes it
  const unsigned long v_currentmaxitem;  // slots in v_items; 0 when allocation failed
  CvelMutex v_queuemutex;                // also serialises the count's writes
};
