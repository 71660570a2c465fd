#pragma once

// CvelEvent: an event flag with auto- or manual-reset semantics over a POSIX condition.
//
// Auto-reset (mode 1): Signal wakes one waiter and leaves the event cleared; a signal with no
// waiter is lost. Manual-reset (any other mode, 0 here): Signal wakes every waiter and sets the
// event, so later waits return at once until Reset.
//
// A waiter checks the flag once and waits on the condition once: there is no loop against
// spurious wake-ups, and a woken waiter does not re-check the flag. Callers that need a
// condition (the transaction queue) re-check their own state under their own lock.
//
// The timed wait's deadline is taken in whole seconds of the real-time clock, so it may end up
// to one second early (a wait of under a second may time out at once).
//
// Thread safety: every operation may be called from any thread; all of them run under the
// event's own mutex. The event must outlive its waiters.

#include <pthread.h>

#include "core/runtime/cvel_mutex.h"
#include "framework/thread_annotations.h"

enum TEventMode { kEventManualReset = 0, kEventAutoReset = 1 };

class CvelEvent {
 public:
  // Manual-reset, not signalled.
  CvelEvent();
  CvelEvent(TEventMode mode, bool initially_signalled);
  ~CvelEvent();

  CvelEvent(const CvelEvent&) = delete;
  CvelEvent& operator=(const CvelEvent&) = delete;

  bool IsInitialized() const { return initialized_; }

  // 0 once signalled (at once when the flag is set; auto-reset clears it), -130 or -133.
  long Wait();
  // As Wait, -132 when the deadline passes.
  long Wait(long milliseconds);
  // Wakes one (auto-reset) or all (manual-reset, and sets the flag) waiters: 0, -130 or -134.
  long Signal();
  // Wakes one (auto-reset) or all (manual-reset) waiters and clears the flag.
  long Pulse();
  // Clears the flag.
  long Reset();

 private:
  long WaitUntil(const struct timespec* deadline, const char* location);
  long Wake(bool set_flag, const char* location);

  const TEventMode mode_;
  bool initialized_ = false;  // the condition exists; set once by the constructor
  pthread_cond_t condition_;
  CvelMutex mutex_;
  bool signalled_ GUARDED_BY(mutex_);
};
