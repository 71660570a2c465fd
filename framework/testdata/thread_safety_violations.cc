// Misuses the thread-safety analysis must report, each marked with the warning it expects. Never
// built into a target: the framework's CMake runs clang -verify on it, so annotations that stop
// reaching the compiler (or a misuse it stops reporting) fail a unit test.

// Line breaks would split the expectations.
// clang-format off

#include "core/runtime/cvel_mutex.h"
#include "framework/mutex.h"

class Counter {
 public:
  int UnguardedRead() const {
    return count_;  // expected-warning {{reading variable 'count_' requires holding mutex 'mutex_'}}
  }
  void UnlockedCall() {
    BumpLocked();  // expected-warning {{calling function 'BumpLocked' requires holding mutex 'mutex_' exclusively}}
  }
  void WaitWithoutLock() {
    changed_.Wait(mutex_, [this]() REQUIRES(mutex_) { return ready_; });  // expected-warning {{requires holding mutex 'mutex_' exclusively}}
  }
  void UnannotatedPredicate() {
    fw::MutexLock lock(mutex_);
    changed_.Wait(mutex_, [this] { return ready_; });  // expected-warning {{reading variable 'ready_' requires holding mutex 'mutex_'}}
  }
  void Reset() EXCLUDES(mutex_) {
    fw::MutexLock lock(mutex_);
    count_ = 0;
  }
  void ResetLocked() {
    fw::MutexLock lock(mutex_);
    Reset();  // expected-warning {{cannot call function 'Reset' while mutex 'mutex_' is held}}
  }

 private:
  void BumpLocked() REQUIRES(mutex_) { ++count_; }

  mutable fw::Mutex mutex_;
  fw::CondVar changed_;
  int count_ GUARDED_BY(mutex_) = 0;
  bool ready_ GUARDED_BY(mutex_) = false;
};

class Queue {
 public:
  void Guarded() {
    CvelMutexLock lock(mutex_);
    ++size_;
  }
  void UnguardedWrite() {
    size_ = 0;  // expected-warning {{writing variable 'size_' requires holding mutex 'mutex_' exclusively}}
  }
  void LeftLocked() {
    mutex_.Lock();  // expected-note {{mutex acquired here}}
  }  // expected-warning {{mutex 'mutex_' is still held at the end of function}}

 private:
  CvelMutex mutex_;
  int size_ GUARDED_BY(mutex_) = 0;
};
// clang-format on
