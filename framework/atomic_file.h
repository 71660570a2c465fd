#pragma once

// ReplaceFile: gives a file new contents so that a reader, a crash or a power cut finds either
// the old contents or all of the new, never a mix or an empty file. It is the one way the agent
// rewrites its own files (history, the state file, patterns, situations, the address file,
// "DPXLastFile").
//
// The steps: a temporary file in the same directory (created with its parent directories when
// they are missing), the contents written whole, the mode set, fsync, rename over the path,
// fsync of the directory so the rename itself survives a power cut. On failure the temporary
// file is removed and the old file is left as it was.
//
// Crash tests set Q7_KILL_DURING_WRITE to a fragment of a path: the process then kills itself
// with SIGKILL half-way through writing the first piece of any replacement of a file whose path
// holds it.
//
// Thread safety: a plain function. Concurrent replacements of one path each leave a whole file
// when every caller lets ReplaceFile name the temporary file (the last rename wins); callers
// that give a fixed temporary name must not race on it.

#include <sys/stat.h>
#include <sys/types.h>
#include <time.h>

#include <functional>
#include <string>
#include <string_view>

namespace fw {

struct ReplaceOptions {
  mode_t mode = 0644;
  // The temporary file's path; empty: path + ".tmp.XXXXXX", made unique. A fixed name lets a
  // directory's owner recognise, and clean up, what a crash left behind.
  std::string temp_path;
};

// Where a replacement failed, for callers whose traces name the step.
enum class ReplaceStep { kNone, kCreate, kWrite, kRename };

struct ReplaceResult {
  ReplaceStep failed = ReplaceStep::kNone;
  int error_number = 0;         // errno of the failing call; also left in errno
  struct timespec modified {};  // the new file's modification time, when it was written
};

// Replaces the contents of the file at path (see above). Returns kOk, or kIoError with the
// failing step and errno in *result and "cannot write PATH: REASON" in *error (either may be
// null).
int ReplaceFile(const std::string& path, std::string_view contents,
                const ReplaceOptions& options = {}, ReplaceResult* result = nullptr,
                std::string* error = nullptr);

// Hands each piece of new contents to the file; false when the write failed (errno set).
using ContentSink = std::function<bool(std::string_view piece)>;

// The same replacement with contents produced in pieces, so that a large file never has to be
// held whole in memory: produce(sink) calls sink for each piece in order and returns false when
// a piece could not be written (or it could not make one; errno then says why).
int ReplaceFileInPieces(const std::string& path,
                        const std::function<bool(const ContentSink&)>& produce,
                        const ReplaceOptions& options = {}, ReplaceResult* result = nullptr,
                        std::string* error = nullptr);

// Moves a file that failed to load out of the way, to path + ".bad" (replacing an older one),
// so that the agent starts without it and an operator can still look at it. Returns the new
// path, or "" with errno set when the rename failed.
std::string SetFileAside(const std::string& path);

}  // namespace fw
