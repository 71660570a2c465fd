#pragma once

// Start-up of the trace facility for a framework process: masks from Q7_TRACE, destination
// from Q7_TRACE_FILE (default <home>logs/q7agent.log; "-" is standard error), size-based
// rotation. Runs on the main thread before any other thread exists (spdlog's synchronous
// logger creates none).

#include <string>

namespace fw {

inline constexpr std::size_t kTraceFileMaxBytes = 10 * 1024 * 1024;
inline constexpr std::size_t kTraceFileCount = 5;

// Returns kOk, or a status with *error set; on failure records go to standard error and a bad
// Q7_TRACE leaves the default masks, so the process can always trace.
int StartTracing(std::string* error);

// The trace destination chosen by StartTracing ("-" for standard error).
std::string TraceDestination();

}  // namespace fw
