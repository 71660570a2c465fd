#include "collector/common/process.h"

#include <errno.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>

namespace collector {
namespace {

std::atomic<bool> g_stop{false};

void OnStopSignal(int) {
  g_stop.store(true);
}

void UnblockStopSignals() {
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGINT);
  sigaddset(&stop, SIGTERM);
  sigprocmask(SIG_UNBLOCK, &stop, nullptr);
}

}  // namespace

void RestoreStopSignals() {
  signal(SIGINT, SIG_DFL);
  signal(SIGTERM, SIG_DFL);
  UnblockStopSignals();
}

void InstallStopHandlers() {
  struct sigaction action {};
  action.sa_handler = OnStopSignal;
  sigemptyset(&action.sa_mask);
  action.sa_flags = 0;  // no SA_RESTART: blocking calls return EINTR
  sigaction(SIGINT, &action, nullptr);
  sigaction(SIGTERM, &action, nullptr);
  signal(SIGPIPE, SIG_IGN);
  UnblockStopSignals();
}

bool StopRequested() {
  return g_stop.load();
}

PidFile::~PidFile() {
  if (path_.empty()) {
    return;
  }
  std::ifstream in(path_);
  long pid = 0;
  if (in >> pid && pid == static_cast<long>(::getpid())) {
    ::unlink(path_.c_str());
  }
}

bool PidFile::Write(const std::string& path, std::string* error) {
  if (path.empty()) {
    return true;
  }
  const std::string temp = path + ".tmp" + std::to_string(::getpid());
  {
    std::ofstream out(temp, std::ios::trunc);
    out << ::getpid() << "\n";
    out.close();
    if (!out) {
      *error = ErrnoText(temp);
      ::unlink(temp.c_str());
      return false;
    }
  }
  if (::rename(temp.c_str(), path.c_str()) != 0) {
    *error = ErrnoText(path);
    ::unlink(temp.c_str());
    return false;
  }
  path_ = path;
  return true;
}

bool EnsureFifo(const std::string& path, std::string* error) {
  struct stat st {};
  if (::stat(path.c_str(), &st) == 0) {
    if (S_ISFIFO(st.st_mode)) {
      return true;
    }
    *error = path + ": exists and is not a FIFO";
    return false;
  }
  // Either process may come first; losing a race to the other one is fine.
  if (::mkfifo(path.c_str(), 0600) != 0 && errno != EEXIST) {
    *error = ErrnoText(path);
    return false;
  }
  return true;
}

std::string ErrnoText(const std::string& what) {
  return what + ": " + ::strerror(errno);
}

}  // namespace collector
