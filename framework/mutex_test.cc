// CondVar's waits hand the caller's held Mutex to the condition variable and back. Run under
// TSan too, which reports a mutex unlocked twice or left locked.

#include "framework/mutex.h"

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

namespace fw {
namespace {

using namespace std::chrono_literals;

struct Shared {
  Mutex mutex;
  CondVar changed;
  int value GUARDED_BY(mutex) = 0;
};

// A waiter sleeps through values that do not satisfy it and wakes holding the mutex, so what it
// writes afterwards is ordered with the other thread's writes.
TEST(CondVarTest, WaitReturnsWithTheMutexOnceThePredicateHolds) {
  Shared shared;
  std::thread counter([&shared] {
    for (int i = 0; i < 3; ++i) {
      MutexLock lock(shared.mutex);
      ++shared.value;
      shared.changed.NotifyAll();
    }
  });
  {
    MutexLock lock(shared.mutex);
    shared.changed.Wait(shared.mutex, [&shared]() REQUIRES(shared.mutex) {
      return shared.value == 3;
    });
    shared.value = 10;
  }
  counter.join();
  MutexLock lock(shared.mutex);
  EXPECT_EQ(10, shared.value);
}

// WaitFor answers false when the time passes first, true at once when the predicate holds, and
// leaves the mutex free for others once the caller's lock ends.
TEST(CondVarTest, WaitForAnswersWhetherThePredicateHeld) {
  Shared shared;
  {
    MutexLock lock(shared.mutex);
    const auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(shared.changed.WaitFor(shared.mutex, 20ms, [&shared]() REQUIRES(shared.mutex) {
      return shared.value == 1;
    }));
    EXPECT_GE(std::chrono::steady_clock::now() - start, 20ms);
    shared.value = 1;
    EXPECT_TRUE(shared.changed.WaitFor(shared.mutex, 1h, [&shared]() REQUIRES(shared.mutex) {
      return shared.value == 1;
    }));
  }
  std::thread other([&shared] {
    MutexLock lock(shared.mutex);
    shared.value = 2;
  });
  other.join();
  MutexLock lock(shared.mutex);
  EXPECT_EQ(2, shared.value);
}

}  // namespace
}  // namespace fw
