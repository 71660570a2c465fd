#pragma once

// fw::Mutex: std::mutex as a capability the thread-safety analysis knows, so that fields say
// GUARDED_BY(mutex_) and a Clang build checks every access; libstdc++'s std::mutex carries no
// annotations. It is locked only through a MutexLock, and waited on through a CondVar, which
// takes the mutex its caller holds:
//
//   fw::MutexLock lock(mutex_);
//   ready_.Wait(mutex_, [this]() REQUIRES(mutex_) { return !queue_.empty(); });
//
// A predicate runs with the mutex held; it says so with REQUIRES, since the analysis checks a
// lambda's body on its own. Predicates must not throw.
//
// Thread safety: as std::mutex and std::condition_variable. The mutex is not recursive.

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <utility>

#include "framework/thread_annotations.h"

namespace fw {

class CAPABILITY("mutex") Mutex {
 public:
  // constexpr, so a Mutex at namespace scope is ready before any dynamic initialisation runs.
  constexpr Mutex() noexcept = default;

  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

 private:
  friend class MutexLock;
  friend class CondVar;  // sleeps on mu_ while the caller's MutexLock keeps owning it

  void Lock() ACQUIRE() { mu_.lock(); }
  void Unlock() RELEASE() { mu_.unlock(); }

  std::mutex mu_;
};

// Holds a Mutex for the lifetime of a scope. The mutex must outlive the lock.
class SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex& mu) ACQUIRE(mu) : mu_(mu) { mu_.Lock(); }
  ~MutexLock() RELEASE() { mu_.Unlock(); }

  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

 private:
  Mutex& mu_;
};

// A condition variable for a Mutex. Each wait releases the mutex while it sleeps and holds it
// again before it returns, as std::condition_variable does with a unique_lock.
class CondVar {
 public:
  CondVar() = default;

  CondVar(const CondVar&) = delete;
  CondVar& operator=(const CondVar&) = delete;

  // Sleeps until pred() is true.
  template <typename Predicate>
  void Wait(Mutex& mu, Predicate pred) REQUIRES(mu) {
    std::unique_lock<std::mutex> lock(mu.mu_, std::adopt_lock);
    cv_.wait(lock, std::move(pred));
    lock.release();  // the caller's MutexLock unlocks
  }

  // Sleeps until pred() is true or timeout has passed. Returns pred() as it was last seen.
  template <typename Rep, typename Period, typename Predicate>
  bool WaitFor(Mutex& mu, const std::chrono::duration<Rep, Period>& timeout, Predicate pred)
      REQUIRES(mu) {
    std::unique_lock<std::mutex> lock(mu.mu_, std::adopt_lock);
    const bool result = cv_.wait_for(lock, timeout, std::move(pred));
    lock.release();
    return result;
  }

  void NotifyOne() noexcept { cv_.notify_one(); }
  void NotifyAll() noexcept { cv_.notify_all(); }

 private:
  std::condition_variable cv_;
};

}  // namespace fw
