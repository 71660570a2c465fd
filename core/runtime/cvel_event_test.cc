#include "core/runtime/cvel_event.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include "core/runtime/cvel_error_stack.h"
#include "core/runtime/cvel_status.h"

namespace {

using Clock = std::chrono::steady_clock;

// A signalled manual-reset event lets every wait through until Reset; Pulse clears it.
TEST(CvelEventTest, ManualResetStaysSignalledUntilReset) {
  CvelEvent event(kEventManualReset, false);
  ASSERT_TRUE(event.IsInitialized());
  EXPECT_EQ(cvel::kOk, event.Signal());
  EXPECT_EQ(cvel::kOk, event.Wait(1500));
  EXPECT_EQ(cvel::kOk, event.Wait());
  EXPECT_EQ(cvel::kOk, event.Reset());
  EXPECT_EQ(cvel::kEventTimeout, event.Wait(0));
  EXPECT_EQ(cvel::kOk, event.Signal());
  EXPECT_EQ(cvel::kOk, event.Pulse());
  EXPECT_EQ(cvel::kEventTimeout, event.Wait(0));
}

// An auto-reset event is consumed by one wait, and a signal nobody waits for is lost.
TEST(CvelEventTest, AutoResetIsConsumedAndLostWithoutWaiter) {
  CvelEvent initially_set(kEventAutoReset, true);
  EXPECT_EQ(cvel::kOk, initially_set.Wait(1500));
  EXPECT_EQ(cvel::kEventTimeout, initially_set.Wait(0));

  CvelEvent unset(kEventAutoReset, false);
  EXPECT_EQ(cvel::kOk, unset.Signal());
  EXPECT_EQ(cvel::kEventTimeout, unset.Wait(0));
}

// The timed wait ends with -132, recorded under its location, within its whole-second bound.
TEST(CvelEventTest, TimedWaitTimesOut) {
  CvelEvent event(kEventManualReset, false);
  const auto start = Clock::now();
  EXPECT_EQ(cvel::kEventTimeout, event.Wait(1500));
  EXPECT_LT(Clock::now() - start, std::chrono::seconds(5));
  CvelErrorStack stack;
  ASSERT_EQ(cvel::kOk, CvelErrorManager::GetStack(stack));
  EXPECT_EQ(cvel::kEventTimeout, stack.GetErrorCode());
  EXPECT_STREQ("CvelEvent::Wait(long)", stack.GetFirstFunction());
}

// A manual-reset Signal wakes every blocked waiter.
TEST(CvelEventTest, ManualSignalWakesAllWaiters) {
  CvelEvent event(kEventManualReset, false);
  std::atomic<int> woken{0};
  std::vector<std::thread> waiters;
  for (int i = 0; i < 4; ++i) {
    waiters.emplace_back([&] {
      if (event.Wait() == cvel::kOk) {
        ++woken;
      }
    });
  }
  EXPECT_EQ(cvel::kOk, event.Signal());
  for (std::thread& waiter : waiters) {
    waiter.join();
  }
  EXPECT_EQ(4, woken.load());
}

// An auto-reset Signal releases a blocked waiter (signals sent before it blocks are lost, so
// keep signalling until it is through).
TEST(CvelEventTest, AutoSignalWakesWaiter) {
  CvelEvent event(kEventAutoReset, false);
  std::atomic<bool> woken{false};
  std::thread waiter([&] { woken = event.Wait() == cvel::kOk; });
  const auto deadline = Clock::now() + std::chrono::seconds(10);
  while (!woken && Clock::now() < deadline) {
    event.Signal();
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  waiter.join();
  EXPECT_TRUE(woken.load());
}

}  // namespace
