#pragma once

// CvelMutex: a default (non-recursive) POSIX mutex with status codes instead of exceptions.
//
// Construction initialises the thread library if needed. If the system mutex cannot be
// initialised, every later operation returns -120 (cvel::kMutexNotInitialized). Failures are
// recorded in the calling thread's error stack under "CvelMutex::Lock()" and so on.
//
// Thread safety: Lock, Unlock and TryLock may be called from any thread; Unlock only by the
// thread holding the lock. The object must outlive every thread that uses it. Prefer
// CvelMutexLock over explicit Lock/Unlock pairs. Fields it guards say GUARDED_BY; the analysis
// counts the mutex as held after Lock even when Lock fails (only a broken mutex does).

#include <pthread.h>

#include "framework/thread_annotations.h"

class CvelEvent;

class CAPABILITY("mutex") CvelMutex {
 public:
  CvelMutex();
  ~CvelMutex();

  CvelMutex(const CvelMutex&) = delete;
  CvelMutex& operator=(const CvelMutex&) = delete;

  bool IsInitialized() const { return initialized_; }

  // Blocks until the mutex is held: 0, -120 or -122.
  long Lock() ACQUIRE();
  // 0, -120 or -123.
  long Unlock() RELEASE();
  // Takes the mutex if free: 0; -124 when someone holds it; -120 or -122 on failure. Test it
  // against a literal (TryLock() == 0): the analysis does not see through cvel::kOk.
  long TryLock() TRY_ACQUIRE(0);

 private:
  friend class CvelEvent;  // waits on its condition with the native mutex

  bool initialized_ = false;  // set once by the constructor
  pthread_mutex_t mutex_;
};

// Holds a CvelMutex for the lifetime of a scope. The mutex must outlive the guard.
class SCOPED_CAPABILITY CvelMutexLock {
 public:
  explicit CvelMutexLock(CvelMutex& mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_.Lock(); }
  ~CvelMutexLock() RELEASE() { mutex_.Unlock(); }

  CvelMutexLock(const CvelMutexLock&) = delete;
  CvelMutexLock& operator=(const CvelMutexLock&) = delete;

 private:
  CvelMutex& mutex_;
};
