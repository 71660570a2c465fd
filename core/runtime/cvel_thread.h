#pragma once

// CvelThread: a POSIX thread whose body is the subclass's Run().
//
// The constructor creates the system thread at once; it waits on a start event until Start()
// releases it, so a thread object runs at most once. State: 3 (not initialised: creation failed;
// every operation but GetState gives -106) -> 0 (created, waiting) -> 1 (running, after Start)
// -> 2 (finished, after Run returns or after Terminate).
//
// The started thread has an error stack of its own (freed when Run returns) and is named for
// CvelThreadLibrary::GetCurrentThreadName and for trace records. Names keep at most 33
// characters; "Unnamed" when none is given.
//
// Ownership and lifetime: the object must stay alive until Run has returned, and must be
// started before it is destroyed (an unstarted thread would wait forever on a destroyed event).
// The destructor neither waits for Run nor cancels it; it releases the system thread when nobody
// joined it.
//
// Thread safety: Start, Join, Terminate, Detach and the getters may be called from any thread
// (usually the owner); GiveWay only from the object's own thread. The state is an atomic written
// by the owner and by the started thread.

#include <pthread.h>

#include <atomic>

#include "core/runtime/cvel_event.h"
#include "core/runtime/cvel_thread_library.h"

// Accepted and ignored: priorities are not supported (-2).
enum TThreadPriority {
  kThreadPriorityLowest,
  kThreadPriorityLow,
  kThreadPriorityNormal,
  kThreadPriorityHigh,
  kThreadPriorityHighest
};

class CvelThread {
 public:
  static constexpr int kStateCreated = 0;
  static constexpr int kStateRunning = 1;
  static constexpr int kStateFinished = 2;
  static constexpr int kStateNotInitialized = 3;

  CvelThread();
  explicit CvelThread(const char* name);
  explicit CvelThread(bool detached);
  CvelThread(const char* name, bool detached);
  virtual ~CvelThread();

  CvelThread(const CvelThread&) = delete;
  CvelThread& operator=(const CvelThread&) = delete;

  // The thread's name; owned by the object.
  const char* GetName() const { return name_; }
  // The system handle: 0 or -106.
  long GetID(unsigned long* id) const;
  // Releases the waiting thread into Run: 0, or -106 unless the state is 0.
  long Start();
  long SetPriority(TThreadPriority priority);
  long GetPriority(TThreadPriority* priority);
  // Waits for Run to return. 0 at once when the thread has finished; -109 when a thread joins
  // itself, -110 on other failures (a detached thread), -106 when not initialised.
  long Join();
  // Cancels a running thread (-106 otherwise) and marks it finished even if that failed (-112).
  long Terminate();
  int GetState() const { return state_.load(); }
  // Yields the processor; only a running thread, on itself (-106 / -111).
  long GiveWay();
  long Detach();

 protected:
  // The thread body. Runs once, on the new thread, after Start.
  virtual void Run() = 0;

 private:
  void Create(const char* name, bool detached);
  static void* StartRoutine(void* self);

  pthread_t id_{};  // valid unless the state is 3; set by the constructor
  std::atomic<int> state_{kStateNotInitialized};
  CvelEvent start_event_{kEventManualReset, false};
  char name_[CvelThreadLibrary::kNameSize] = {};  // set by the constructor, then read-only
  bool detached_ = false;                         // set by the constructor
  // True once the system thread has been joined or detached, so that the destructor releases
  // it exactly once.
  std::atomic<bool> released_{false};
  // Set by the started thread once Run has returned (unlike state 2, which Terminate also sets).
  std::atomic<bool> body_returned_{false};
  // Set by the destructor of a thread that was never started: the thread wakes and ends
  // without running the body.
  std::atomic<bool> abandoned_{false};
};
