#pragma once

// SignalManager turns SIGINT and SIGTERM into an orderly framework shutdown.
//
// The constructor blocks both signals in the calling thread and starts the manager thread,
// which consumes them synchronously with sigwait; no handler is ever installed. It must be
// constructed before any other thread exists, so that every later thread inherits the mask and
// only the manager thread sees the signals. Other signals (SIGHUP, SIGUSR1, ...) keep their
// default actions. After the first stop signal the manager thread asks the framework main loop
// to return and ends; a second signal then stays blocked and pending.
//
// Ownership: start-up creates one with new and never destroys it (the process ends with the
// thread already finished). The destructor, for completeness and for tests, cancels and joins
// the manager thread.

#include <pthread.h>

class SignalManager {
 public:
  SignalManager();
  ~SignalManager();
  SignalManager(const SignalManager&) = delete;
  SignalManager& operator=(const SignalManager&) = delete;

  // Creates the joinable manager thread; a failure other than "joinable" ends the process with
  // exit status -1.
  void startManagerThread();
  // Cancels and joins the manager thread; does nothing when called on that thread.
  void stopManagerThread();

  // Joins the manager thread without cancelling it, once it has ended on its own after a stop
  // signal (tests only: the agent leaves it unjoined).
  void joinManagerThreadForTesting();
  // The manager thread, for signals aimed at it alone (tests).
  pthread_t managerThreadForTesting() const { return managerThread_; }

  // Blocks SIGINT and SIGTERM in the calling thread.
  static void blockSignals();
  // Waits until SIGINT or SIGTERM arrives; sigwait errors and other signals wait again.
  static void waitForSignal();

 private:
  pthread_t managerThread_{};  // valid once startManagerThread succeeded
  bool started_ = false;
};

// The manager thread's body: waits for a stop signal, then requests framework shutdown.
void* managerThread(void* arg);
