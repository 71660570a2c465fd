#pragma once

// Test fixture plumbing for end-to-end tests: a temporary home under /tmp (no '.' in its
// path) and the real q7agent binary started in it as a child process.

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "tests/support/scratch_dir.h"

namespace q7test {

// A temporary home from mkdtemp (see ScratchDir), its path with a trailing '/'.
class TempHome {
 public:
  TempHome() : path_(scratch_.path() + "/") {}

  const std::string& path() const { return path_; }
  // Writes a file below the home, creating its directory.
  void writeFile(const std::string& relative, const std::string& content) const {
    scratch_.write(relative, content);
  }

 private:
  ScratchDir scratch_;
  std::string path_;
};

// The host's short agent name, as the agent derives it (24 characters, cut at '.').
std::string shortHostName();

// Reads a whole file; empty when it cannot be read.
std::string readFile(const std::string& path);

// True when path is an existing directory.
bool isDirectory(const std::string& path);

// A running q7agent child process.
class AgentProcess {
 public:
  // Starts the binary with extra arguments and the environment of this process plus env.
  AgentProcess(const std::vector<std::string>& args, const std::map<std::string, std::string>& env);
  ~AgentProcess();  // kills the process when it still runs
  AgentProcess(const AgentProcess&) = delete;
  AgentProcess& operator=(const AgentProcess&) = delete;

  pid_t pid() const { return pid_; }
  void signal(int sig) const;
  // Waits for the exit; returns the wait status, or nullopt after the timeout.
  std::optional<int> wait(std::chrono::milliseconds timeout);

 private:
  pid_t pid_ = -1;
  bool reaped_ = false;
};

// Polls a condition until it holds or the timeout passes.
bool waitFor(const std::function<bool()>& condition, std::chrono::milliseconds timeout);

// Runs another program to completion; its standard output and error go to *output.
int runProgram(const std::string& program, const std::vector<std::string>& args,
               const std::map<std::string, std::string>& env, std::string* output);

// Runs the binary to completion and returns its exit status and standard output.
int runToCompletion(const std::vector<std::string>& args,
                    const std::map<std::string, std::string>& env, std::string* output);

}  // namespace q7test
