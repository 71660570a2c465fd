#include "core/runtime/cvel_thread.h"

#include <sched.h>

#include <cerrno>
#include <cstdio>

#include "core/runtime/cvel_error_stack.h"
#include "core/runtime/cvel_status.h"
#include "framework/trace.h"

namespace {

constexpr char kUnit[] = "runtime";

long Fail(long code, const char* location) {
  CvelErrorManager::SetError(code, location);
  return code;
}

}  // namespace

CvelThread::CvelThread() {
  Create(nullptr, false);
}
CvelThread::CvelThread(const char* name) {
  Create(name, false);
}
CvelThread::CvelThread(bool detached) {
  Create(nullptr, detached);
}
CvelThread::CvelThread(const char* name, bool detached) {
  Create(name, detached);
}

void CvelThread::Create(const char* name, bool detached) {
  detached_ = detached;
  if (CvelThreadLibrary::EnsureInitialized() != cvel::kOk) {
    return;
  }
  // The name is in place before the thread exists, so the new thread reads it without a race.
  std::snprintf(name_, sizeof(name_), "%s", name != nullptr ? name : "Unnamed");
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setdetachstate(&attributes,
                              detached ? PTHREAD_CREATE_DETACHED : PTHREAD_CREATE_JOINABLE);
  const int rc = pthread_create(&id_, &attributes, &CvelThread::StartRoutine, this);
  pthread_attr_destroy(&attributes);
  if (rc != 0) {
    name_[0] = '\0';
    return;
  }
  released_.store(detached);
  state_.store(kStateCreated);
}

CvelThread::~CvelThread() {
  if (state_.load() == kStateNotInitialized || released_.exchange(true)) {
    return;
  }
  // A thread that was never started waits on the start event, which dies with this object:
  // wake it to end without running the body, and reap it.
  int expected = kStateCreated;
  if (state_.compare_exchange_strong(expected, kStateFinished)) {
    abandoned_.store(true);
    start_event_.Signal();
    pthread_join(id_, nullptr);
    return;
  }
  // A body that has returned leaves only a few instructions to run, so reaping it does not wait
  // on Run; anything else (still running, or terminated) is left to finish on its own.
  if (body_returned_.load()) {
    pthread_join(id_, nullptr);
  } else {
    pthread_detach(id_);
  }
}

void* CvelThread::StartRoutine(void* arg) {
  auto* self = static_cast<CvelThread*>(arg);
  CvelErrorManager::RegisterThread();
  CvelThreadLibrary::SetThreadName(self->name_);
  self->start_event_.Wait();
  if (self->abandoned_.load()) {
    CvelThreadLibrary::SetThreadName(nullptr);
    CvelErrorManager::UnregisterThread();
    return nullptr;
  }
  Q7_TRACE(kUnit, fw::kTraceDetail, "thread \"%s\" running", self->name_);
  self->Run();
  Q7_TRACE(kUnit, fw::kTraceDetail, "thread \"%s\" finished", self->name_);
  // The name key points into the object, which may go away once the state says finished.
  CvelThreadLibrary::SetThreadName(nullptr);
  self->body_returned_.store(true);
  self->state_.store(kStateFinished);  // the object may be destroyed from here on
  CvelErrorManager::UnregisterThread();
  return nullptr;
}

long CvelThread::GetID(unsigned long* id) const {
  if (state_.load() == kStateNotInitialized) {
    return Fail(cvel::kThreadBadState, "CvelThread::GetID()");
  }
  *id = id_;
  return cvel::kOk;
}

long CvelThread::Start() {
  int expected = kStateCreated;
  if (!state_.compare_exchange_strong(expected, kStateRunning)) {
    return Fail(cvel::kThreadBadState, "CvelThread::Start()");
  }
  return start_event_.Signal();
}

long CvelThread::SetPriority(TThreadPriority) {
  const int state = state_.load();
  if (state == kStateFinished || state == kStateNotInitialized) {
    return Fail(cvel::kThreadBadState, "CvelThread::SetPriority()");
  }
  return Fail(cvel::kPriorityUnsupported, "CvelThread::SetPriority()");
}

long CvelThread::GetPriority(TThreadPriority*) {
  const int state = state_.load();
  if (state == kStateFinished || state == kStateNotInitialized) {
    return Fail(cvel::kThreadBadState, "CvelThread::GetPriority()");
  }
  return Fail(cvel::kPriorityUnsupported, "CvelThread::GetPriority()");
}

long CvelThread::Join() {
  const int state = state_.load();
  if (state == kStateFinished) {
    return cvel::kOk;
  }
  if (state == kStateNotInitialized) {
    return Fail(cvel::kThreadBadState, "CvelThread::Join()");
  }
  // A detached or already joined handle may name a thread that is gone: never pass it on.
  if (released_.load()) {
    return Fail(cvel::kJoinFailed, "CvelThread::Join()");
  }
  // pthread_join need not detect a self-join (POSIX says "may"), so the check comes first.
  const int rc = pthread_equal(pthread_self(), id_) ? EDEADLK : pthread_join(id_, nullptr);
  if (rc == EDEADLK) {
    return Fail(cvel::kJoinDeadlock, "CvelThread::Join()");
  }
  if (rc != 0) {
    return Fail(cvel::kJoinFailed, "CvelThread::Join()");
  }
  released_.store(true);
  return cvel::kOk;
}

long CvelThread::Detach() {
  const int state = state_.load();
  if (state == kStateFinished) {
    return cvel::kOk;
  }
  if (state == kStateNotInitialized) {
    return Fail(cvel::kThreadBadState, "CvelThread::Detach()");
  }
  if (released_.exchange(true) || pthread_detach(id_) != 0) {
    return Fail(cvel::kDetachFailed, "CvelThread::Detach()");
  }
  return cvel::kOk;
}

long CvelThread::Terminate() {
  if (state_.load() != kStateRunning) {
    return Fail(cvel::kThreadBadState, "CvelThread::Terminate()");
  }
  const int rc = pthread_cancel(id_);
  state_.store(kStateFinished);
  if (rc != 0) {
    return Fail(cvel::kTerminateFailed, "CvelThread::Terminate()");
  }
  return cvel::kOk;
}

long CvelThread::GiveWay() {
  if (state_.load() != kStateRunning) {
    return Fail(cvel::kThreadBadState, "CvelThread::GiveWay()");
  }
  if (!pthread_equal(pthread_self(), id_)) {
    return Fail(cvel::kGiveWayWrongThread, "CvelThread::GiveWay()");
  }
  sched_yield();
  return cvel::kOk;
}
