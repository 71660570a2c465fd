#include "core/runtime/cvel_mutex.h"

#include <cerrno>

#include "core/runtime/cvel_error_stack.h"
#include "core/runtime/cvel_status.h"
#include "core/runtime/cvel_thread_library.h"

namespace {

long Fail(long code, const char* location) {
  CvelErrorManager::SetError(code, location);
  return code;
}

}  // namespace

CvelMutex::CvelMutex() {
  if (CvelThreadLibrary::EnsureInitialized() != cvel::kOk) {
    return;
  }
  initialized_ = pthread_mutex_init(&mutex_, nullptr) == 0;
}

CvelMutex::~CvelMutex() {
  if (initialized_) {
    pthread_mutex_destroy(&mutex_);
  }
}

long CvelMutex::Lock() {
  if (!initialized_) {
    return Fail(cvel::kMutexNotInitialized, "CvelMutex::Lock()");
  }
  if (pthread_mutex_lock(&mutex_) != 0) {
    return Fail(cvel::kMutexLockFailed, "CvelMutex::Lock()");
  }
  return cvel::kOk;
}

long CvelMutex::Unlock() {
  if (!initialized_) {
    return Fail(cvel::kMutexNotInitialized, "CvelMutex::Unlock()");
  }
  if (pthread_mutex_unlock(&mutex_) != 0) {
    return Fail(cvel::kMutexUnlockFailed, "CvelMutex::Unlock()");
  }
  return cvel::kOk;
}

long CvelMutex::TryLock() {
  if (!initialized_) {
    return Fail(cvel::kMutexNotInitialized, "CvelMutex::TryLock()");
  }
  const int rc = pthread_mutex_trylock(&mutex_);
  if (rc == EBUSY) {
    return Fail(cvel::kMutexBusy, "CvelMutex::TryLock()");
  }
  if (rc != 0) {
    return Fail(cvel::kMutexLockFailed, "CvelMutex::TryLock()");
  }
  return cvel::kOk;
}
