#include "tama/service_monitor.h"

#include <signal.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "framework/trace.h"

namespace {

constexpr char kUnit[] = "tama";
constexpr std::size_t kPidTextBytes = 32;

}  // namespace

ServiceMonitor::ServiceMonitor(const char* pidFile, const char* startPath, char* const* startArgv,
                               const char* stopPath, char* const* stopArgv, char* const* envp,
                               long interval)
    : pidFile(pidFile),
      startPath(startPath),
      startArgv(startArgv),
      stopPath(stopPath),
      stopArgv(stopArgv),
      envp(envp),
      interval(interval),
      wakeUp(std::make_unique<CvelEvent>(kEventManualReset, false)) {}

ServiceMonitor::~ServiceMonitor() = default;

void ServiceMonitor::startMonitoring() {
  running.store(true);
  pthread_attr_t attr;
  pthread_attr_init(&attr);
  pthread_attr_setscope(&attr, PTHREAD_SCOPE_SYSTEM);
  // Not checked, as before: a monitor that cannot start simply never polls.
  started = pthread_create(&thread, &attr, &ServiceMonitor::ServiceMonitorTask, this) == 0;
  pthread_attr_destroy(&attr);
}

void ServiceMonitor::stopMonitoring() {
  running.store(false);
  wakeUp->Signal();
  if (started) {
    pthread_join(thread, nullptr);
    started = false;
  }
}

void ServiceMonitor::wait() {
  polls.fetch_add(1);
  Q7_TRACE(kUnit, fw::kTraceDetail, "Waiting %d secs to poll process status",
           static_cast<int>(interval));
  wakeUp->Wait(interval * 1000);
  wakeUp->Reset();
}

long ServiceMonitor::getPID() const {
  if (pidFile == nullptr) {
    return 0;
  }
  FILE* f = std::fopen(pidFile, "r");
  if (f == nullptr) {
    return 0;
  }
  char text[kPidTextBytes + 1] = {};
  const std::size_t got = std::fread(text, 1, kPidTextBytes, f);
  text[got] = '\0';
  std::fclose(f);
  return std::strtol(text, nullptr, 10);
}

void* ServiceMonitor::ServiceMonitorTask(void* self) {
  fw::SetThreadName("ServiceMonitor");
  static_cast<ServiceMonitor*>(self)->run();
  return nullptr;
}

void ServiceMonitor::runCommand(const char* program, char* const* argv) {
  const pid_t child = fork();
  if (child == 0) {
    if (envp != nullptr) {
      execve(program, argv, envp);
    } else {
      execv(program, argv);
    }
    // The child goes on as a copy of the monitor: it ends only through the loop's own exits.
    Q7_TRACE(kUnit, fw::kTraceError, "Should never reach this point!!!");
  }
  int status = 0;
  if (waitpid(child, &status, 0) < 0) {
    Q7_TRACE(kUnit, fw::kTraceError, "Error waiting for pid %d\n", static_cast<int>(child));
  } else if (status != 0) {
    Q7_TRACE(kUnit, fw::kTraceError, "Got error %d from %s\n", status, program);
  }
}

void ServiceMonitor::run() {
  while (running.load()) {
    const long pid = getPID();
    if (pid != 0 && kill(static_cast<pid_t>(pid), 0) == 0) {
      wait();
      continue;
    }
    Q7_TRACE(kUnit, fw::kTraceInfo, "Starting process with command %s", startPath);
    ++starts;
    runCommand(startPath, startArgv);
    wait();
  }
  // A missing pid file gives 0, and kill(0, 0) tests the agent's own process group, which
  // succeeds: the stop command then runs anyway.
  const long pid = getPID();
  if (kill(static_cast<pid_t>(pid), 0) == 0) {
    Q7_TRACE(kUnit, fw::kTraceInfo, "Stopping process with command %s", stopPath);
    runCommand(stopPath, stopArgv);
  }
}

namespace tama {
namespace {

// Owns the strings and the null-terminated vectors the ServiceMonitor borrows.
class ServiceMonitorAdapter : public CollectorMonitor {
 public:
  explicit ServiceMonitorAdapter(const CollectorMonitorSpec& settings)
      : pidFile(settings.pid_file),
        startArgs(settings.start_argv),
        stopArgs(settings.stop_argv),
        envArgs(settings.env),
        startArgv(Vector(startArgs)),
        stopArgv(Vector(stopArgs)),
        envp(Vector(envArgs)),
        monitor(pidFile.c_str(), startArgs.empty() ? "" : startArgs[0].c_str(), startArgv.data(),
                stopArgs.empty() ? "" : stopArgs[0].c_str(), stopArgv.data(),
                envArgs.empty() ? nullptr : envp.data(), settings.poll_seconds) {}

  int start() override {
    monitor.startMonitoring();
    return 0;
  }
  int stop() override {
    monitor.stopMonitoring();
    return 0;
  }
  long starts() const override { return monitor.startsDone(); }

 private:
  static std::vector<char*> Vector(std::vector<std::string>& texts) {
    std::vector<char*> v;
    for (std::string& t : texts) {
      v.push_back(t.data());
    }
    v.push_back(nullptr);
    return v;
  }

  // Declared before the monitor, which borrows them.
  std::string pidFile;
  std::vector<std::string> startArgs;
  std::vector<std::string> stopArgs;
  std::vector<std::string> envArgs;
  std::vector<char*> startArgv;
  std::vector<char*> stopArgv;
  std::vector<char*> envp;
  ServiceMonitor monitor;
};

}  // namespace

std::unique_ptr<CollectorMonitor> makeServiceMonitor(const CollectorMonitorSpec& settings) {
  return std::make_unique<ServiceMonitorAdapter>(settings);
}

}  // namespace tama
