#include "core/runtime/cvel_thread.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <functional>
#include <string>
#include <thread>

#include "core/runtime/cvel_error_stack.h"
#include "core/runtime/cvel_status.h"
#include "core/runtime/cvel_thread_library.h"
#include "framework/trace.h"
#include "tests/support/test_util.h"

namespace {

// Runs a function as the thread body.
class FunctionThread : public CvelThread {
 public:
  explicit FunctionThread(std::function<void(FunctionThread&)> body, const char* name = nullptr)
      : CvelThread(name), body_(std::move(body)) {}

 protected:
  void Run() override { body_(*this); }

 private:
  std::function<void(FunctionThread&)> body_;
};

std::string LastErrorLocation() {
  CvelErrorStack stack;
  CvelErrorManager::GetStack(stack);
  return stack.GetFirstFunction();
}

// A thread object destroyed without being started ends its waiting system thread and never runs
// the body (destroying the start event under the waiting thread used to hang).
TEST(CvelThreadTest, DestroyingAnUnstartedThreadEndsIt) {
  std::atomic<bool> ran{false};
  {
    FunctionThread thread([&ran](FunctionThread&) { ran = true; });
  }
  EXPECT_FALSE(ran.load());
}

// A thread runs once: the second Start is refused and recorded.
TEST(CvelThreadTest, SecondStartGivesBadState) {
  std::atomic<int> runs{0};
  FunctionThread thread([&](FunctionThread&) { ++runs; });
  EXPECT_EQ(CvelThread::kStateCreated, thread.GetState());
  EXPECT_EQ(cvel::kOk, thread.Start());
  EXPECT_EQ(cvel::kThreadBadState, thread.Start());
  long code = 0;
  EXPECT_EQ(cvel::kOk, CvelErrorManager::GetError(&code));
  EXPECT_EQ(cvel::kThreadBadState, code);
  EXPECT_EQ("CvelThread::Start()", LastErrorLocation());
  EXPECT_EQ(cvel::kOk, thread.Join());
  EXPECT_EQ(1, runs.load());
  EXPECT_EQ(CvelThread::kStateFinished, thread.GetState());
}

// A finished thread is not joined again, so repeated Joins are safe.
TEST(CvelThreadTest, JoinOfFinishedThreadReturnsAtOnce) {
  FunctionThread thread([](FunctionThread&) {});
  ASSERT_EQ(cvel::kOk, thread.Start());
  ASSERT_TRUE(q7test::PollUntil([&] { return thread.GetState() == CvelThread::kStateFinished; },
                                std::chrono::seconds(10)));
  EXPECT_EQ(cvel::kOk, thread.Join());
  EXPECT_EQ(cvel::kOk, thread.Join());
}

// Joining itself is refused with the deadlock code; the owner's Join still works.
TEST(CvelThreadTest, JoinItselfGivesDeadlock) {
  std::atomic<long> inner{0};
  FunctionThread thread([&](FunctionThread& self) { inner = self.Join(); });
  ASSERT_EQ(cvel::kOk, thread.Start());
  EXPECT_EQ(cvel::kOk, thread.Join());
  EXPECT_EQ(cvel::kJoinDeadlock, inner.load());
}

// Names are cut to 33 characters and are what the thread and the trace facility see.
TEST(CvelThreadTest, NamesAreKeptTo33Characters) {
  const std::string forty(40, 'n');
  std::string seen_by_library;
  std::string seen_by_trace;
  FunctionThread named(
      [&](FunctionThread&) {
        char name[CvelThreadLibrary::kNameSize];
        if (CvelThreadLibrary::GetCurrentThreadName(name) == cvel::kOk) {
          seen_by_library = name;
        }
        seen_by_trace = fw::ThreadName();
      },
      forty.c_str());
  FunctionThread unnamed([](FunctionThread&) {});
  EXPECT_EQ(forty.substr(0, 33), named.GetName());
  EXPECT_STREQ("Unnamed", unnamed.GetName());
  ASSERT_EQ(cvel::kOk, named.Start());
  ASSERT_EQ(cvel::kOk, unnamed.Start());
  CvelThread* threads[] = {&named, &unnamed};
  EXPECT_EQ(cvel::kOk, CvelThreadLibrary::JoinAll(threads, 2));
  EXPECT_EQ(forty.substr(0, 33), seen_by_library);
  EXPECT_EQ(forty.substr(0, 33), seen_by_trace);
}

// Operations that the state or the calling thread forbid, and the unsupported priorities.
TEST(CvelThreadTest, StateAndThreadRulesOfOperations) {
  std::atomic<bool> release{false};
  std::atomic<long> own_give_way{1};
  FunctionThread thread([&](FunctionThread& self) {
    own_give_way = self.GiveWay();
    while (!release) {
      std::this_thread::yield();
    }
  });
  TThreadPriority priority = kThreadPriorityNormal;
  EXPECT_EQ(cvel::kThreadBadState, thread.Terminate());  // not running yet
  EXPECT_EQ(cvel::kThreadBadState, thread.GiveWay());
  EXPECT_EQ(cvel::kPriorityUnsupported, thread.SetPriority(kThreadPriorityHigh));
  ASSERT_EQ(cvel::kOk, thread.Start());
  EXPECT_EQ(cvel::kGiveWayWrongThread, thread.GiveWay());
  EXPECT_EQ(cvel::kPriorityUnsupported, thread.GetPriority(&priority));
  unsigned long id = 0;
  EXPECT_EQ(cvel::kOk, thread.GetID(&id));
  unsigned long mine = 0;
  EXPECT_EQ(cvel::kOk, CvelThreadLibrary::GetCurrentThreadID(&mine));
  EXPECT_FALSE(CvelThreadLibrary::SameThreadIDs(id, mine));
  release = true;
  EXPECT_EQ(cvel::kOk, thread.Join());
  EXPECT_EQ(cvel::kOk, own_give_way.load());
  EXPECT_EQ(cvel::kThreadBadState, thread.SetPriority(kThreadPriorityHigh));
  EXPECT_EQ(cvel::kThreadBadState, thread.Terminate());
}

// Each started thread has its own, fresh error stack.
TEST(CvelThreadTest, ThreadsHaveTheirOwnErrorStack) {
  CvelErrorManager::SetError(-1, "Main()");
  long inner_before = 1;
  long inner_after = 0;
  FunctionThread thread([&](FunctionThread&) {
    CvelErrorManager::GetError(&inner_before);
    CvelErrorManager::SetError(-2, "Inner()");
    CvelErrorManager::GetError(&inner_after);
  });
  ASSERT_EQ(cvel::kOk, thread.Start());
  ASSERT_EQ(cvel::kOk, thread.Join());
  EXPECT_EQ(0, inner_before);
  EXPECT_EQ(-2, inner_after);
  long code = 0;
  CvelErrorManager::GetError(&code);
  EXPECT_EQ(-1, code);
  EXPECT_EQ("Main()", LastErrorLocation());
}

// Threads not started through CvelThread have no stack until they register one.
TEST(CvelThreadTest, ForeignThreadsRegisterTheirStack) {
  std::thread foreign([] {
    long code = 0;
    EXPECT_EQ(cvel::kErrorStackMissing, CvelErrorManager::GetError(&code));
    EXPECT_EQ(cvel::kOk, CvelErrorManager::RegisterThread());
    EXPECT_EQ(cvel::kErrorStackExists, CvelErrorManager::RegisterThread());
    EXPECT_EQ(cvel::kOk, CvelErrorManager::SetError(-7, "Foreign()"));
    EXPECT_EQ(cvel::kOk, CvelErrorManager::UnregisterThread());
    EXPECT_EQ(cvel::kErrorStackMissing, CvelErrorManager::UnregisterThread());
  });
  foreign.join();
}

}  // namespace
