#include "core/runtime/cvel_event.h"

#include <cerrno>
#include <ctime>

#include "core/runtime/cvel_error_stack.h"
#include "core/runtime/cvel_status.h"

namespace {

long Fail(long code, const char* location) {
  CvelErrorManager::SetError(code, location);
  return code;
}

}  // namespace

CvelEvent::CvelEvent() : CvelEvent(kEventManualReset, false) {}

CvelEvent::CvelEvent(TEventMode mode, bool initially_signalled)
    : mode_(mode), signalled_(initially_signalled) {
  initialized_ = mutex_.IsInitialized() && pthread_cond_init(&condition_, nullptr) == 0;
}

CvelEvent::~CvelEvent() {
  if (initialized_) {
    pthread_cond_destroy(&condition_);
  }
}

long CvelEvent::Wait() {
  return WaitUntil(nullptr, "CvelEvent::Wait()");
}

long CvelEvent::Wait(long milliseconds) {
  // Whole seconds only: the sub-second part of now is dropped on purpose.
  struct timespec deadline;
  deadline.tv_sec = std::time(nullptr) + milliseconds / 1000;
  deadline.tv_nsec = (milliseconds % 1000) * 1000000L;
  return WaitUntil(&deadline, "CvelEvent::Wait(long)");
}

long CvelEvent::WaitUntil(const struct timespec* deadline, const char* location) {
  if (!initialized_) {
    return Fail(cvel::kEventNotInitialized, location);
  }
  CvelMutexLock lock(mutex_);
  if (signalled_) {
    if (mode_ == kEventAutoReset) {
      signalled_ = false;
    }
    return cvel::kOk;
  }
  const int rc = deadline == nullptr
                     ? pthread_cond_wait(&condition_, &mutex_.mutex_)
                     : pthread_cond_timedwait(&condition_, &mutex_.mutex_, deadline);
  if (rc == ETIMEDOUT) {
    return Fail(cvel::kEventTimeout, location);
  }
  if (rc != 0) {
    return Fail(cvel::kEventWaitFailed, location);
  }
  return cvel::kOk;
}

long CvelEvent::Signal() {
  return Wake(mode_ != kEventAutoReset, "CvelEvent::Signal()");
}

long CvelEvent::Pulse() {
  return Wake(false, "CvelEvent::SignalAll()");
}

long CvelEvent::Wake(bool set_flag, const char* location) {
  if (!initialized_) {
    return Fail(cvel::kEventNotInitialized, location);
  }
  CvelMutexLock lock(mutex_);
  const int rc = mode_ == kEventAutoReset ? pthread_cond_signal(&condition_)
                                          : pthread_cond_broadcast(&condition_);
  signalled_ = set_flag;
  if (rc != 0) {
    return Fail(cvel::kEventSignalFailed, location);
  }
  return cvel::kOk;
}

long CvelEvent::Reset() {
  if (!initialized_) {
    return Fail(cvel::kEventNotInitialized, "CvelEvent::Reset()");
  }
  CvelMutexLock lock(mutex_);
  signalled_ = false;
  return cvel::kOk;
}
