#pragma once

// CMisc: small timing and file-system helpers shared by the analysis and intake code.
//
// Failures are reported through results only (mkdirs 0/1, truncateFile 0/1/2, getFileSize64
// true/false); nothing is traced here.
//
// Thread safety: every function may be called from any thread.

#include <atomic>
#include <functional>

class CMisc {
 public:
  CMisc() = delete;

  // Sleeps ms milliseconds.
  static void sleep(unsigned long ms);

  // Sleeps ms % 200 milliseconds, then up to ms / 200 steps of 200 ms, checking *stop before
  // each step and returning early once it is true. This is how worker threads sleep while
  // staying responsive to a shutdown request set by another thread. A null stop never stops.
  // *stop must stay alive for the call.
  static void napWhileBoolFalse(unsigned long ms, const std::atomic<bool>* stop);
  // The same, with each sleep handed to `sleeper` (milliseconds), so tests can see the steps.
  static void napWhileBoolFalse(unsigned long ms, const std::atomic<bool>* stop,
                                const std::function<void(unsigned long)>& sleeper);

  // Creates one directory; returns the mkdir(2) result.
  static int mkdir(const char* path, int mode);
  // Creates a directory and every missing parent with mode 0755. Backslashes count as '/'.
  // Returns 0 when the directory exists afterwards, 1 at the first creation that failed
  // (errno from that mkdir).
  static int mkdirs(const char* path);
  // Returns 1 for a null path, 2 when truncation fails, 0 on success.
  static int truncateFile(const char* path, unsigned long length);
  // True with *size set, or false when the file cannot be examined.
  static bool getFileSize64(const char* path, long long* size);
};
