#pragma once

// What the fuzz targets share: failing a check, quiet traces, one scratch directory per process
// and writing an input to a file.
//
// Thread safety: the fuzz targets run on one thread.

#include <stdlib.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <system_error>

#include "framework/trace.h"

namespace fuzzing {

// Error traces are written whatever the masks say: they go to log_path, the rest nowhere.
inline void QuietTraces(const char* log_path) {
  std::string error;
  fw::TraceOpen(log_path, 1 << 20, 1, &error);
  fw::TraceConfigure("*=NONE", &error);
}

// The scratch directory's path; empty until ScratchDirectory creates it. A plain array, so that
// it outlives the static destructors the exit handler runs among.
inline char* ScratchPath() {
  static char path[32] = {};
  return path;
}

inline void RemoveScratch() {
  if (ScratchPath()[0] != '\0') {
    std::error_code ec;
    std::filesystem::remove_all(ScratchPath(), ec);
  }
}

// Reports a broken property of target and aborts, which libFuzzer records as a finding.
[[noreturn]] inline void Fail(const char* target, const char* what) {
  std::fprintf(stderr, "%s: %s\n", target, what);
  RemoveScratch();
  std::abort();
}

// The process's scratch directory, created on first use and removed at exit and by Fail (a
// sanitizer's report leaves it). On tmpfs where there is one: saves sync their files, and a disk
// would make that most of every run.
inline std::string ScratchDirectory() {
  char* path = ScratchPath();
  if (path[0] == '\0') {
    std::snprintf(path, 32, "%s/q7fuzzXXXXXX", access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp");
    if (mkdtemp(path) == nullptr) {
      std::perror("fuzz scratch directory");
      std::abort();
    }
    std::atexit(RemoveScratch);
  }
  return path;
}

// Replaces path's contents with the input; aborts when that fails, since nothing after it
// would mean anything.
inline void WriteWholeFile(const std::string& path, const uint8_t* data, size_t size) {
  std::FILE* f = std::fopen(path.c_str(), "wb");
  if (f == nullptr || std::fwrite(data, 1, size, f) != size || std::fclose(f) != 0) {
    std::perror(path.c_str());
    std::abort();
  }
}

}  // namespace fuzzing
