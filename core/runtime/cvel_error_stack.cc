#include "core/runtime/cvel_error_stack.h"

#include <pthread.h>

#include <atomic>
#include <cstring>
#include <new>

#include "core/runtime/cvel_status.h"
#include "core/runtime/cvel_thread_library.h"

CvelErrorStack::CvelErrorStack() {
  for (const char*& name : functions_) {
    name = nullptr;
  }
  functions_[0] = "Error code not set.";
}

long CvelErrorStack::SetErrorCode(long code, const char* location) {
  error_code_ = code;
  first_ = last_;
  functions_[last_] = location;
  return cvel::kOk;
}

long CvelErrorStack::AddFunction(const char* name) {
  last_ = (last_ + 1) % kRingSize;
  functions_[last_] = name;
  if (last_ == first_) {
    first_ = (first_ + 1) % kRingSize;
    return cvel::kErrorStackWrapped;
  }
  return cvel::kOk;
}

long CvelErrorStack::GetStackDump(char* buffer, int size) const {
  if (buffer == nullptr || size <= 0) {
    return cvel::kOk;
  }
  buffer[0] = '\0';
  int used = 0;
  for (int i = first_;; i = (i + 1) % kRingSize) {
    const char* name = functions_[i] != nullptr ? functions_[i] : "";
    const int length = static_cast<int>(std::strlen(name)) + 1;  // with its newline
    if (used + length >= size) {
      break;  // keep room for the terminator
    }
    std::memcpy(buffer + used, name, length - 1);
    buffer[used + length - 1] = '\n';
    used += length;
    buffer[used] = '\0';
    if (i == last_) {
      break;
    }
  }
  return cvel::kOk;
}

const char* CvelErrorStack::GetFirstFunction() {
  cursor_ = first_;
  return functions_[cursor_];
}

const char* CvelErrorStack::GetNextFunction() {
  if (cursor_ == last_) {
    cursor_ = first_;
    return nullptr;
  }
  cursor_ = (cursor_ + 1) % kRingSize;
  return functions_[cursor_];
}

int CvelErrorStack::GetStackSize() const {
  return last_ > first_ ? last_ - first_ + 1 : last_ - first_ + kRingSize + 1;
}

namespace {

// Written once during the library's initialisation, before the library publishes itself.
pthread_key_t g_stack_key;

// The calling thread's stack, or null with *rc set to -204 or -203.
CvelErrorStack* CurrentStack(long* rc) {
  if (CvelThreadLibrary::EnsureInitialized() != cvel::kOk) {
    *rc = cvel::kErrorManagerInitFailed;
    return nullptr;
  }
  auto* stack = static_cast<CvelErrorStack*>(pthread_getspecific(g_stack_key));
  *rc = stack != nullptr ? cvel::kOk : cvel::kErrorStackMissing;
  return stack;
}

}  // namespace

long CvelErrorManager::InitializeFromLibrary() {
  if (pthread_key_create(&g_stack_key, nullptr) != 0) {
    return cvel::kErrorManagerInitFailed;
  }
  auto* stack = new (std::nothrow) CvelErrorStack();
  if (stack == nullptr || pthread_setspecific(g_stack_key, stack) != 0) {
    delete stack;
    return cvel::kErrorStackStoreFailed;
  }
  return cvel::kOk;
}

long CvelErrorManager::Initialize() {
  return CvelThreadLibrary::EnsureInitialized() == cvel::kOk ? cvel::kOk
                                                             : cvel::kErrorManagerInitFailed;
}

long CvelErrorManager::SetError(long code, const char* location) {
  long rc;
  CvelErrorStack* stack = CurrentStack(&rc);
  return stack != nullptr ? stack->SetErrorCode(code, location) : rc;
}

long CvelErrorManager::AddFunction(const char* name) {
  long rc;
  CvelErrorStack* stack = CurrentStack(&rc);
  return stack != nullptr ? stack->AddFunction(name) : rc;
}

long CvelErrorManager::GetError(long* code) {
  long rc;
  CvelErrorStack* stack = CurrentStack(&rc);
  if (stack != nullptr) {
    *code = stack->GetErrorCode();
  }
  return rc;
}

long CvelErrorManager::GetStackDump(char* buffer, int size) {
  long rc;
  CvelErrorStack* stack = CurrentStack(&rc);
  return stack != nullptr ? stack->GetStackDump(buffer, size) : rc;
}

long CvelErrorManager::GetStack(CvelErrorStack& copy) {
  long rc;
  CvelErrorStack* stack = CurrentStack(&rc);
  if (stack != nullptr) {
    copy = *stack;
  }
  return rc;
}

long CvelErrorManager::RegisterThread() {
  if (CvelThreadLibrary::EnsureInitialized() != cvel::kOk) {
    return cvel::kErrorManagerInitFailed;
  }
  if (pthread_getspecific(g_stack_key) != nullptr) {
    return cvel::kErrorStackExists;
  }
  auto* stack = new (std::nothrow) CvelErrorStack();
  if (stack == nullptr || pthread_setspecific(g_stack_key, stack) != 0) {
    delete stack;
    return cvel::kErrorStackStoreFailed;
  }
  return cvel::kOk;
}

long CvelErrorManager::UnregisterThread() {
  long rc;
  CvelErrorStack* stack = CurrentStack(&rc);
  if (stack == nullptr) {
    return rc;
  }
  if (pthread_setspecific(g_stack_key, nullptr) != 0) {
    return cvel::kErrorStackClearFailed;
  }
  delete stack;
  return cvel::kOk;
}
