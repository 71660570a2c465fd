#include "tama/signal_manager.h"

#include <signal.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "framework/agent_runtime.h"
#include "framework/trace.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/asan_interface.h>
#endif

namespace {

constexpr char kUnit[] = "tama";

// Cancellation unwinds the manager thread's stack without AddressSanitizer noticing, which then
// reports the stale stack poisoning when the thread is destroyed; clear it on the way out.
void onCancel(void*) {
#if defined(__SANITIZE_ADDRESS__)
  __asan_handle_no_return();
#endif
}

const char* errorText(int rc) {
  const char* text = std::strerror(rc);
  return text != nullptr ? text : "Unknown error";
}

// A fatal set-up failure: the message only when the error class is on, the exit either way.
[[noreturn]] void fatal(const char* fmt, int rc) {
  if (fw::TraceEnabled(kUnit, fw::kTraceError)) {
    fw::TracePrintf(kUnit, fw::kTraceError, "startManagerThread", fmt, rc, errorText(rc));
    fw::TraceFlush();
  }
  std::exit(-1);
}

}  // namespace

SignalManager::SignalManager() {
  blockSignals();
  startManagerThread();
}

SignalManager::~SignalManager() {
  Q7_TRACE(kUnit, fw::kTraceDetail, "Shutdown commencing.");
  stopManagerThread();
}

void SignalManager::blockSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

void SignalManager::startManagerThread() {
  pthread_attr_t attr;
  int rc = pthread_attr_init(&attr);
  if (rc != 0) {
    fatal(
        "Error initializing signal manager thread attribute object. Return code = %d; %s.  Use "
        "the return code and message to investigate the failure.  Agent is terminating.",
        rc);
  }
  rc = pthread_attr_setdetachstate(&attr, PTHREAD_CREATE_JOINABLE);
  if (rc != 0) {
    Q7_TRACE(kUnit, fw::kTraceDetail,
             "Error making signal manager thread attribute object joinable. Return code = %d; "
             "%s.  Continuing.",
             rc, errorText(rc));
  }
  rc = pthread_create(&managerThread_, &attr, managerThread, nullptr);
  if (rc != 0) {
    fatal(
        "Error starting signal manager thread.  Return code = %d; %s.  Use the return code and "
        "message to investigate the failure.  Agent is terminating.",
        rc);
  }
  started_ = true;
  rc = pthread_attr_destroy(&attr);
  if (rc != 0) {
    fatal(
        "Error destroying signal manager thread attribute object. Return code = %d; %s.  Use "
        "the return code and message to investigate the failure.  Agent is terminating.",
        rc);
  }
}

void SignalManager::stopManagerThread() {
  if (!started_ || pthread_equal(pthread_self(), managerThread_)) {
    return;
  }
  int rc = pthread_cancel(managerThread_);
  if (rc != 0) {
    // ESRCH: the thread already ended after its signal; it still has to be joined.
    Q7_TRACE(kUnit, fw::kTraceDetail, "Error canceling manager thread. Return code = %d; %s", rc,
             errorText(rc));
  } else {
    Q7_TRACE(kUnit, fw::kTraceDetail, "Termination pending cancellation of manager thread.");
  }
  rc = pthread_join(managerThread_, nullptr);
  if (rc != 0) {
    Q7_TRACE(kUnit, fw::kTraceError, "Error joining with manager thread.  Return code = %d; %s", rc,
             errorText(rc));
  } else {
    Q7_TRACE(kUnit, fw::kTraceDetail, "Manager thread terminated.");
  }
  started_ = false;
}

void SignalManager::joinManagerThreadForTesting() {
  if (started_) {
    pthread_join(managerThread_, nullptr);
    started_ = false;
  }
}

void SignalManager::waitForSignal() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  Q7_TRACE(kUnit, fw::kTraceDetail, "Manager thread waiting for a signal.");
  for (;;) {
    int sig = 0;
    const int rc = sigwait(&set, &sig);
    if (rc != 0) {
      Q7_TRACE(kUnit, fw::kTraceError, "Error while manager waiting for a signal. errno = %d; %s",
               rc, errorText(rc));
      continue;
    }
    if (sig == SIGTERM || sig == SIGINT) {
      Q7_TRACE(kUnit, fw::kTraceDetail, "Stop signal received.");
      break;
    }
    Q7_TRACE(kUnit, fw::kTraceError, "Manager received unexpected signal.  Signal = %d", sig);
  }
}

void* managerThread(void* /*arg*/) {
  fw::SetThreadName("SignalManager");
  Q7_TRACE(kUnit, fw::kTraceDetail, "Log manager thread successfully started.");
  pthread_cleanup_push(onCancel, nullptr);
  SignalManager::waitForSignal();
  pthread_cleanup_pop(0);
  Q7_TRACE(kUnit, fw::kTraceInfo, "Termination signal received.  Exiting.");
  fw::RequestShutdown(1);
  return nullptr;
}
