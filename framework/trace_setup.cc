#include "framework/trace_setup.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "framework/environment.h"
#include "framework/mutex.h"
#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

constinit Mutex g_mutex;
std::string g_destination GUARDED_BY(g_mutex) = "-";

}  // namespace

int StartTracing(std::string* error) {
  int status = kOk;
  std::string masks;
  if (GetEnv("Q7_TRACE", &masks)) {
    std::string why;
    if (TraceConfigure(masks, &why) != kOk) {
      *error = "Q7_TRACE ignored: " + why;
      status = kParseError;
    }
  }
  std::string path;
  if (!GetEnv("Q7_TRACE_FILE", &path) || path.empty()) {
    std::string home;
    if (GetHomeDirectory(&home) != kOk) {
      *error = "no home directory for the trace file; tracing to standard error";
      return kNotFound;
    }
    const std::string logs = home + "logs/";
    if (::mkdir(logs.c_str(), 0755) != 0 && errno != EEXIST) {
      *error =
          "cannot create " + logs + ": " + std::strerror(errno) + "; tracing to standard error";
      return kIoError;
    }
    path = logs + "q7agent.log";
  }
  std::string why;
  if (TraceOpen(path, kTraceFileMaxBytes, kTraceFileCount, &why) != kOk) {
    *error = why + "; tracing to standard error";
    return kIoError;
  }
  MutexLock lock(g_mutex);
  g_destination = path;
  return status;
}

std::string TraceDestination() {
  MutexLock lock(g_mutex);
  return g_destination;
}

}  // namespace fw
