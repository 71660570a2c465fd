#pragma once

// A supervised collector process as the agent sees it: started before the framework's main
// loop and stopped after it. ServiceMonitor is the process's kind; tests use fakes.
//
// Thread safety: start and stop from the thread that owns the monitor; starts from any thread.

#include <string>
#include <vector>

namespace tama {

// One supervised collector process, as start-up and shutdown see it.
class CollectorMonitor {
 public:
  virtual ~CollectorMonitor() = default;
  // Starts supervising; returns 0 or a negative status.
  virtual int start() = 0;
  // Stops supervising and waits for the supervision thread; that thread runs the stop command
  // when the process is still alive.
  virtual int stop() = 0;
  // Times the process has been started so far; any thread.
  virtual long starts() const = 0;
};

// What a collector monitor is created with.
struct CollectorMonitorSpec {
  std::string pid_file;                 // the process's pid file
  std::vector<std::string> start_argv;  // {"/bin/sh", script, "start", which}
  std::vector<std::string> stop_argv;   // {"/bin/sh", script, "stop", which}
  std::vector<std::string> env;         // {"PATH=/bin:/sbin:/usr/bin:/usr/sbin"}
  int poll_seconds = 60;
};

}  // namespace tama
