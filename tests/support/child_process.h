#pragma once

// Test helper: another program run as a child of the test (nginx, tcpdump, tshark, curl,
// python3), with its standard output and error in files.
//
// Children start with SIGINT and SIGTERM at their defaults and unblocked, whatever the test
// runner inherited, so that the signals a test sends them work.

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

namespace q7test {

class ChildProcess {
 public:
  // Starts argv[0] (a path) with the arguments after it and this process's environment.
  // Standard output goes to out_path, standard error to err_path (the same file when equal).
  // started() tells whether the program could be run at all.
  ChildProcess(const std::vector<std::string>& argv, const std::string& out_path,
               const std::string& err_path);
  ~ChildProcess();  // kills the child (SIGKILL) and reaps it when it still runs
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  bool started() const { return pid_ > 0; }
  pid_t pid() const { return pid_; }
  void signal(int sig) const;
  // True while the child has not exited; reaps it when it has.
  bool running();
  // Waits for the exit; the wait status, or nullopt after the timeout.
  std::optional<int> wait(std::chrono::milliseconds timeout);

 private:
  pid_t pid_ = -1;
  std::optional<int> status_;  // set once reaped
};

// Runs a program to its end (at most timeout; killed after it). Returns the exit code, or -1
// when it could not run, was killed by a signal or timed out. Its standard output and error are
// read from the files out_path and err_path into *out and *err (either may be null).
int RunToEnd(const std::vector<std::string>& argv, const std::string& out_path,
             const std::string& err_path, std::string* out, std::string* err,
             std::chrono::milliseconds timeout = std::chrono::seconds(30));

}  // namespace q7test
