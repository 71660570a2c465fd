#include "tests/support/child_process.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>

#include "tests/support/test_util.h"

extern char** environ;

namespace q7test {

ChildProcess::ChildProcess(const std::vector<std::string>& argv, const std::string& out_path,
                           const std::string& err_path) {
  std::vector<std::string> args = argv;
  std::vector<char*> pointers;
  for (std::string& arg : args) {
    pointers.push_back(arg.data());
  }
  pointers.push_back(nullptr);

  posix_spawn_file_actions_t files;
  posix_spawn_file_actions_init(&files);
  posix_spawn_file_actions_addopen(&files, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&files, STDOUT_FILENO, out_path.c_str(),
                                   O_WRONLY | O_CREAT | O_TRUNC, 0644);
  if (err_path == out_path) {
    posix_spawn_file_actions_adddup2(&files, STDOUT_FILENO, STDERR_FILENO);
  } else {
    posix_spawn_file_actions_addopen(&files, STDERR_FILENO, err_path.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0644);
  }
  posix_spawnattr_t attr;
  posix_spawnattr_init(&attr);
  sigset_t none;
  sigemptyset(&none);
  sigset_t defaults;
  sigemptyset(&defaults);
  sigaddset(&defaults, SIGINT);
  sigaddset(&defaults, SIGTERM);
  sigaddset(&defaults, SIGPIPE);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setsigdefault(&attr, &defaults);
  posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  pid_t child = -1;
  if (posix_spawn(&child, pointers[0], &files, &attr, pointers.data(), environ) == 0) {
    pid_ = child;
  }
  posix_spawnattr_destroy(&attr);
  posix_spawn_file_actions_destroy(&files);
}

ChildProcess::~ChildProcess() {
  if (running()) {
    ::kill(pid_, SIGKILL);
    int status = 0;
    ::waitpid(pid_, &status, 0);
  }
}

void ChildProcess::signal(int sig) const {
  if (pid_ > 0) {
    ::kill(pid_, sig);
  }
}

bool ChildProcess::running() {
  if (pid_ <= 0 || status_.has_value()) {
    return false;
  }
  int status = 0;
  if (::waitpid(pid_, &status, WNOHANG) == pid_) {
    status_ = status;
    return false;
  }
  return true;
}

std::optional<int> ChildProcess::wait(std::chrono::milliseconds timeout) {
  if (!PollUntil([&] { return !running(); }, timeout)) {
    return std::nullopt;
  }
  return status_;
}

int RunToEnd(const std::vector<std::string>& argv, const std::string& out_path,
             const std::string& err_path, std::string* out, std::string* err,
             std::chrono::milliseconds timeout) {
  int code = -1;
  {
    ChildProcess child(argv, out_path, err_path);
    if (const auto status = child.wait(timeout); status && WIFEXITED(*status)) {
      code = WEXITSTATUS(*status);
    }
  }
  if (out != nullptr) {
    *out = FileText(out_path);
  }
  if (err != nullptr) {
    *err = FileText(err_path);
  }
  return code;
}

}  // namespace q7test
