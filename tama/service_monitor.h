#pragma once

// ServiceMonitor: keeps one collector process alive. Its thread polls the process named by a
// pid file; whenever that process is not alive it runs the start command (a control-script call
// that launches the process and returns), then pauses for the poll interval. At shutdown it runs
// the stop command once if the process is still alive.
//
// Ownership: the pid file path, programs, argument vectors and environment are the caller's
// and must outlive the monitor. The monitor owns its wake-up event. The destructor neither stops
// nor joins the thread: call stopMonitoring first.
//
// Thread safety: startMonitoring and stopMonitoring from the owner's thread (once each, in that
// order); the rest runs on the monitor thread. The running flag is written by the owner and read
// by the thread; the wake-up event makes the change seen at once.

#include <pthread.h>

#include <atomic>
#include <memory>

#include "core/runtime/cvel_event.h"
#include "tama/collector_monitor.h"

class ServiceMonitor {
 public:
  // pidFile may be null (the process then always counts as not running). envp null: the
  // commands inherit the agent's environment (plain execv). interval in seconds.
  ServiceMonitor(const char* pidFile, const char* startPath, char* const* startArgv,
                 const char* stopPath, char* const* stopArgv, char* const* envp, long interval);
  ~ServiceMonitor();
  ServiceMonitor(const ServiceMonitor&) = delete;
  ServiceMonitor& operator=(const ServiceMonitor&) = delete;

  // Sets the running flag and starts the monitor thread.
  void startMonitoring();
  // Clears the running flag, wakes the thread and waits for it without limit.
  void stopMonitoring();

  // One poll pause: interval seconds, or until stopMonitoring signals the wake-up event.
  void wait();
  // The pid the pid file names; 0 when there is no file or no number in it.
  long getPID() const;
  // Polls done so far, each now followed by its pause; from any thread (tests wait on it).
  long pollsDone() const { return polls.load(); }
  // Start commands run so far; from any thread (/metrics reports the restarts).
  long startsDone() const { return starts.load(); }

 private:
  static void* ServiceMonitorTask(void* self);
  void run();
  // Forks and execs program with argv (and envp), waits for it and traces a failure.
  void runCommand(const char* program, char* const* argv);

  const char* const pidFile;
  const char* const startPath;
  char* const* const startArgv;
  const char* const stopPath;
  char* const* const stopArgv;
  char* const* const envp;
  const long interval;                // seconds
  std::atomic<bool> running{false};   // set by startMonitoring, cleared by stopMonitoring
  std::atomic<long> polls{0};         // counted by the monitor thread as each pause begins
  std::atomic<long> starts{0};        // counted by the monitor thread before each start command
  pthread_t thread{};                 // valid once started
  bool started = false;               // owner's thread only
  std::unique_ptr<CvelEvent> wakeUp;  // manual-reset, not signalled at first
};

namespace tama {

// A collector monitor for start-up: a ServiceMonitor over the given commands (copied and kept
// alive by the returned object).
std::unique_ptr<CollectorMonitor> makeServiceMonitor(const CollectorMonitorSpec& settings);

}  // namespace tama
