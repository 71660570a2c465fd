#include "core/runtime/cvel_thread_library.h"

#include <pthread.h>
#include <sched.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <type_traits>

#include "core/runtime/cvel_error_stack.h"
#include "core/runtime/cvel_status.h"
#include "core/runtime/cvel_thread.h"
#include "framework/mutex.h"
#include "framework/trace.h"

static_assert(std::is_same_v<pthread_t, unsigned long>,
              "thread ids are handed out as unsigned long");
static_assert(sizeof(pthread_key_t) <= sizeof(unsigned), "keys are handed out as unsigned");

namespace {

// Serialises initialisation; constant-initialised, so that it is usable during static
// initialisation (CLOG's mutex is constructed then).
constinit fw::Mutex g_init_mutex;
// Set at the start of initialisation, as the library's own flag; guarded by g_init_mutex for
// writes, read without it.
std::atomic<bool> g_initialized{false};
// Set once initialisation has completed successfully; the fast path of EnsureInitialized.
std::atomic<bool> g_ready{false};
// Written once under g_init_mutex before g_ready is published.
pthread_key_t g_name_key;

char kMainThreadName[] = "Main Thread";

long Fail(long code, const char* location) {
  CvelErrorManager::SetError(code, location);
  return code;
}

long InitializeLocked() REQUIRES(g_init_mutex) {
  g_initialized.store(true);
  if (pthread_key_create(&g_name_key, nullptr) != 0) {
    return cvel::kKeyCreateFailed;
  }
  pthread_setspecific(g_name_key, kMainThreadName);
  fw::SetThreadName(kMainThreadName);
  const long rc = CvelErrorManager::InitializeFromLibrary();
  if (rc != cvel::kOk) {
    return rc;
  }
  g_ready.store(true, std::memory_order_release);
  return cvel::kOk;
}

}  // namespace

long CvelThreadLibrary::Initialize() {
  long rc;
  {
    fw::MutexLock lock(g_init_mutex);
    rc = g_initialized.load() ? cvel::kLibraryAlreadyInitialized : InitializeLocked();
  }
  // Recorded outside the lock: recording needs the library.
  if (rc == cvel::kLibraryAlreadyInitialized) {
    return Fail(rc, "CvelThreadLibrary::Initialize()");
  }
  return rc;
}

bool CvelThreadLibrary::IsInitialized() {
  return g_initialized.load();
}

long CvelThreadLibrary::EnsureInitialized() {
  if (g_ready.load(std::memory_order_acquire)) {
    return cvel::kOk;
  }
  fw::MutexLock lock(g_init_mutex);
  if (g_initialized.load()) {
    return g_ready.load() ? cvel::kOk : cvel::kLibraryNotInitialized;
  }
  return InitializeLocked() == cvel::kOk ? cvel::kOk : cvel::kLibraryNotInitialized;
}

long CvelThreadLibrary::CreateNewKey(unsigned* key) {
  if (EnsureInitialized() != cvel::kOk) {
    return cvel::kLibraryNotInitialized;
  }
  pthread_key_t created;
  if (pthread_key_create(&created, nullptr) != 0) {
    return Fail(cvel::kKeyCreateFailed, "CvelThreadLibrary::CreateNewKey()");
  }
  *key = created;
  return cvel::kOk;
}

long CvelThreadLibrary::SetKeyValue(unsigned key, void* value) {
  if (EnsureInitialized() != cvel::kOk) {
    return cvel::kLibraryNotInitialized;
  }
  const int rc = pthread_setspecific(key, value);
  if (rc == EINVAL) {
    return Fail(cvel::kKeyInvalid, "CvelThreadLibrary::SetKeyValue()");
  }
  if (rc != 0) {
    return Fail(cvel::kKeySetFailed, "CvelThreadLibrary::SetKeyValue()");
  }
  return cvel::kOk;
}

long CvelThreadLibrary::GetKeyValue(unsigned key, void** value) {
  if (EnsureInitialized() != cvel::kOk) {
    return cvel::kLibraryNotInitialized;
  }
  *value = pthread_getspecific(key);
  return cvel::kOk;
}

long CvelThreadLibrary::JoinAll(CvelThread** threads, int n) {
  for (int i = 0; i < n; ++i) {
    const long rc = threads[i]->Join();
    if (rc != cvel::kOk) {
      CvelErrorManager::AddFunction("CvelThreadLibrary::JoinAll()");
      return rc;
    }
  }
  return cvel::kOk;
}

long CvelThreadLibrary::GetCurrentThreadName(char* name) {
  if (EnsureInitialized() != cvel::kOk) {
    return cvel::kLibraryNotInitialized;
  }
  const char* current = static_cast<const char*>(pthread_getspecific(g_name_key));
  if (current == nullptr) {
    return Fail(cvel::kThreadHasNoName, "CvelThreadLibrary::GetCurrentThreadName()");
  }
  std::snprintf(name, kNameSize, "%s", current);
  return cvel::kOk;
}

long CvelThreadLibrary::GetCurrentThreadID(unsigned long* id) {
  if (EnsureInitialized() != cvel::kOk) {
    return cvel::kLibraryNotInitialized;
  }
  *id = pthread_self();
  return cvel::kOk;
}

bool CvelThreadLibrary::SameThreadIDs(unsigned long a, unsigned long b) {
  return pthread_equal(a, b) != 0;
}

long CvelThreadLibrary::GiveWay() {
  if (EnsureInitialized() != cvel::kOk) {
    return cvel::kLibraryNotInitialized;
  }
  sched_yield();
  return cvel::kOk;
}

char* CvelThreadLibrary::GetThreadName() {
  if (EnsureInitialized() != cvel::kOk) {
    return nullptr;
  }
  return static_cast<char*>(pthread_getspecific(g_name_key));
}

long CvelThreadLibrary::SetThreadName(char* name) {
  if (EnsureInitialized() != cvel::kOk) {
    return cvel::kLibraryNotInitialized;
  }
  if (pthread_setspecific(g_name_key, name) != 0) {
    return Fail(cvel::kKeySetFailed, "CvelThreadLibrary::SetThreadName()");
  }
  fw::SetThreadName(name);
  return cvel::kOk;
}
