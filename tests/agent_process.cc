#include "tests/agent_process.h"

#include <signal.h>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

namespace q7test {

std::string shortHostName() {
  struct utsname u {};
  ::uname(&u);
  std::string name = std::string(u.nodename).substr(0, 24);
  return name.substr(0, name.find('.'));
}

std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

bool isDirectory(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

namespace {

pid_t spawn(const std::string& program, const std::vector<std::string>& args,
            const std::map<std::string, std::string>& env, int stdout_fd,
            bool with_stderr = false) {
  std::vector<std::string> argv_s{program};
  argv_s.insert(argv_s.end(), args.begin(), args.end());
  const pid_t pid = ::fork();
  if (pid == 0) {
    for (const auto& [name, value] : env) {
      ::setenv(name.c_str(), value.c_str(), 1);
    }
    if (stdout_fd >= 0) {
      ::dup2(stdout_fd, STDOUT_FILENO);
      if (with_stderr) {
        ::dup2(stdout_fd, STDERR_FILENO);
      }
    }
    std::vector<char*> argv;
    for (auto& a : argv_s) {
      argv.push_back(a.data());
    }
    argv.push_back(nullptr);
    ::execv(argv[0], argv.data());
    ::_exit(127);
  }
  return pid;
}

}  // namespace

AgentProcess::AgentProcess(const std::vector<std::string>& args,
                           const std::map<std::string, std::string>& env)
    : pid_(spawn(Q7AGENT_PATH, args, env, -1)) {}

AgentProcess::~AgentProcess() {
  if (pid_ > 0 && !reaped_) {
    ::kill(pid_, SIGKILL);
    int status = 0;
    ::waitpid(pid_, &status, 0);
  }
}

void AgentProcess::signal(int sig) const {
  ::kill(pid_, sig);
}

std::optional<int> AgentProcess::wait(std::chrono::milliseconds timeout) {
  std::optional<int> result;
  waitFor(
      [&] {
        int status = 0;
        if (::waitpid(pid_, &status, WNOHANG) == pid_) {
          result = status;
          reaped_ = true;
          return true;
        }
        return false;
      },
      timeout);
  return result;
}

bool waitFor(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!condition()) {
    if (std::chrono::steady_clock::now() >= deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return true;
}

namespace {

int RunAndCollect(const std::string& program, const std::vector<std::string>& args,
                  const std::map<std::string, std::string>& env, std::string* output,
                  bool with_stderr) {
  int fds[2];
  if (::pipe(fds) != 0) {
    return -1;
  }
  const pid_t pid = spawn(program, args, env, fds[1], with_stderr);
  ::close(fds[1]);
  char buf[4096];
  ssize_t n;
  while ((n = ::read(fds[0], buf, sizeof(buf))) > 0) {
    output->append(buf, static_cast<std::size_t>(n));
  }
  ::close(fds[0]);
  int status = 0;
  ::waitpid(pid, &status, 0);
  return status;
}

}  // namespace

int runToCompletion(const std::vector<std::string>& args,
                    const std::map<std::string, std::string>& env, std::string* output) {
  return RunAndCollect(Q7AGENT_PATH, args, env, output, false);
}

int runProgram(const std::string& program, const std::vector<std::string>& args,
               const std::map<std::string, std::string>& env, std::string* output) {
  return RunAndCollect(program, args, env, output, true);
}

}  // namespace q7test
