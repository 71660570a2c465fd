#pragma once

// The follower's state file: where reading of one access log stopped, kept across restarts so
// that a restarted sm3logs neither skips nor repeats a line.
//
// The file is a few "key value" lines of text, so an operator can read it:
//
//   q7-follow-state 1
//   path /var/log/nginx/access.log
//   dev 64769
//   ino 1310745
//   offset 52331
//   head 64 5c6f0b1a2e3d4f56
//
// It is replaced atomically (temporary file in the same directory, fsync, rename, fsync of the
// directory; mode 0600), so a reader sees the old or the new position, never a mix. A file that
// does not parse is renamed to "<path>.bad" and otherwise ignored: a lost position costs a
// re-read or a gap, a refusal to start would cost the whole collector.
//
// Thread safety: the functions keep no state; concurrent calls on one path are not supported.

#include <cstdint>
#include <string>
#include <string_view>

namespace accesslog {

// Bytes at the start of a file whose hash tells a file apart from a later one that reuses its
// inode number (logrotate's "create" after the old file was deleted) or that replaced its
// contents in place.
inline constexpr size_t kHeadBytes = 64;

// Where reading of one file stopped.
struct FilePosition {
  uint64_t dev = 0;  // st_dev of the file
  uint64_t ino = 0;  // st_ino of the file
  // Bytes of the file fully consumed: the start of the first line not yet handed over.
  uint64_t offset = 0;
  // How many leading bytes head_hash covers: min(kHeadBytes, offset), since only bytes already
  // consumed are known not to change under us.
  uint32_t head_len = 0;
  uint64_t head_hash = 0;  // HashHead of the first head_len bytes

  bool operator==(const FilePosition&) const = default;
};

struct FollowState {
  std::string log_path;  // the followed path; a position saved for another path is not used
  FilePosition position;
};

// FNV-1a 64 of bytes: fast, and plenty to tell two log heads apart (timestamps differ).
uint64_t HashHead(std::string_view bytes);

// The text of a state file, and its reverse. Parsing is strict (every key once, nothing
// else); false with *error naming the problem.
std::string FormatFollowState(const FollowState& state);
bool ParseFollowState(std::string_view text, FollowState* state, std::string* error);

enum class StateLoad {
  kLoaded,    // *state holds the saved position
  kMissing,   // no state file: a first start
  kSetAside,  // it did not parse and was renamed to "<path>.bad"; *error says why
  kFailed,    // it could not be read (permissions, I/O); *error says why
};

// Reads the state file at path. *state is written only for kLoaded.
StateLoad LoadFollowState(const std::string& path, FollowState* state, std::string* error);

// Replaces the state file at path atomically (see above). False with *error on failure, in
// which case the previous file, if any, is left as it was.
bool SaveFollowState(const std::string& path, const FollowState& state, std::string* error);

}  // namespace accesslog
