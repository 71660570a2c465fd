#pragma once

// LogFollower: reads the lines appended to one web server access log, across the ways logs are
// rotated, and remembers how far it got so that a restart neither skips nor repeats a line.
//
// The follower never waits: each Poll() reads what is there and returns. What it survives:
//
// - Rename rotation (access.log -> access.log.1, then a new access.log). The old file stays
//   open by descriptor and is read to its end, including lines the server writes to it after
//   the rename and before it reopens its log. The follower moves on to the new file (from
//   offset 0) once the new file holds data, or once the old file has given nothing for
//   rotate_wait_polls polls while the new one stays empty: a server that reopened its log
//   writes to the new file only. A line written to the old file after the move is lost (a
//   worker process that had not reopened yet while another already wrote to the new file).
//   A rotation is noticed by the path naming another (st_dev, st_ino) than the open
//   descriptor.
// - copytruncate: the file shrinks below the position, or its first bytes change (truncated
//   and written again between two polls). Reading starts again at 0 and it is counted.
// - The file missing (between the rename and the create, or not there yet): nothing happens;
//   the next Poll tries again, and a file that appears is read from 0, since all of it is new.
// - Restarts. Commit() saves the position of the lines handed over so far (see
//   follow_state.h). Start() then resumes that file at that offset when the file at the path
//   is still it (same inode, first bytes unchanged, at least as big). When the path names
//   another file, the log was rotated while we were stopped: the saved file is looked for
//   under path + rotated_suffix (".1", the usual first rotated name), finished from the
//   offset, and then the new file is read from 0. When it is not there either (rotated twice,
//   or compressed) the current file is read from 0: the lines between the saved offset and the
//   end of the lost file are gone, the rest is neither skipped nor repeated. A copytruncate
//   while stopped loses the same way the lines that only reached the copy.
// - A state file that does not parse: set aside as "<state>.bad", reported by TakeNotes(),
//   and the follower starts as if there were none.
//
// With no usable saved position the follower starts at the end of an existing file (at the
// start of its last, unfinished line), so that a first start does not replay months of log;
// from_start reads the file from 0 instead.
//
// Lines longer than max_line_bytes are skipped and counted (stats().long_lines), never
// buffered whole: an access log line that long is not one a parser could use, and cutting it
// would hand the parser a line that looks whole but is not.
//
// Thread safety: none; one thread owns an instance.

#include <sys/stat.h>

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "collector/accesslog/follow_state.h"
#include "collector/common/unique_fd.h"

namespace accesslog {

struct FollowOptions {
  // Where the position is kept; empty: positions are not kept across runs.
  std::string state_path;
  // With no usable saved position, read an existing file from 0 rather than from its end.
  bool from_start = false;
  // Read the file once from 0 to its end, with no state file and no rotation handling: for
  // "sm3logs --read FILE". Start() fails when the file cannot be opened; a last line without
  // '\n' is handed over as it is; at_end() says when the file is done.
  bool one_shot = false;
  // Longest line handed over, in bytes without its '\n'.
  size_t max_line_bytes = 1 << 20;
  // Bytes one Poll() reads at most, so a caller's loop stays responsive on a big backlog.
  size_t max_poll_bytes = 16 << 20;
  // Quiet polls of a renamed file after which an empty new file takes over (see above).
  int rotate_wait_polls = 5;
  // Name of the first rotated file, appended to the path.
  std::string rotated_suffix = ".1";
};

// Counters since construction.
struct FollowStats {
  uint64_t bytes_read = 0;   // bytes read from log files
  uint64_t lines = 0;        // lines handed over
  uint64_t rotations = 0;    // moves from a renamed file to the new file at the path
  uint64_t truncations = 0;  // restarts at 0 because the file shrank or its head changed
  uint64_t long_lines = 0;   // lines over max_line_bytes, skipped
  // Last lines without '\n' handed over when leaving a file for good (rotated, or one_shot).
  uint64_t unterminated_lines = 0;
  uint64_t state_set_aside = 0;  // state files that did not parse, renamed to ".bad"
  uint64_t commits = 0;          // state files written
};

class LogFollower {
 public:
  // Called for each line, in file order, without its '\n' (a '\r' before it stays). The view is
  // valid during the call only. It must not call back into the follower.
  using LineFn = std::function<void(std::string_view line)>;

  LogFollower(std::string path, FollowOptions options);
  LogFollower(const LogFollower&) = delete;
  LogFollower& operator=(const LogFollower&) = delete;

  // Loads the saved position and opens the file it leads to. A missing file is not an error
  // (the follower waits for it) except in one_shot mode. False with *error when the state file
  // cannot be read, or the log exists but cannot be opened; the follower is then of no use.
  // Call once, before anything else.
  bool Start(std::string* error);

  // Hands over, through on_line, the complete lines appended since the last Poll, following
  // a rotation or truncation first if one happened. A line still being written stays unread
  // until its '\n' arrives. False with *error on an I/O failure; lines handed over before it
  // count, the position stays consistent, and the next Poll retries.
  bool Poll(const LineFn& on_line, std::string* error);

  // Saves the position after the last line handed over. Call once the caller has consumed the
  // lines (written their records); lines handed over after the last Commit are read again
  // after a restart. Does nothing without a state path, while no file is open, or when the
  // position did not move. False with *error when the state file cannot be written.
  bool Commit(std::string* error);
  // Saves an earlier position() of this follower (one whose lines have all been consumed while
  // later ones have not). The same no-ops as Commit; at.ino == 0 (no file was open) too.
  bool CommitAt(const FilePosition& at, std::string* error);

  // Non-fatal events worth a trace line (a state file set aside, where a restart resumed, a
  // rotation or truncation followed), oldest first; clears them.
  std::vector<std::string> TakeNotes();

  // False when the last Poll stopped at max_poll_bytes with more to read.
  bool caught_up() const { return caught_up_; }
  // one_shot: the whole file has been handed over.
  bool at_end() const { return at_end_; }
  const FollowStats& stats() const { return stats_; }
  // The position Commit would save; offset 0 and ino 0 while no file is open.
  FilePosition position() const;

 private:
  enum class ReadResult { kEnd, kBudget, kError };

  bool StartOneShot(std::string* error);
  // Opens path at the saved offset when it is the saved file (same inode and head) and still
  // holds that offset; *opened says whether it was. False with *error only on an I/O failure.
  bool OpenIfSaved(const std::string& path, const FilePosition& saved, bool* opened,
                   std::string* error);
  // Opens the file at path_ at offset 0, or at the start of its last line when at_end. True
  // with nothing open when nothing is at the path.
  bool OpenPath(bool at_end, std::string* error);
  void Adopt(collector::UniqueFd fd, const struct stat& st, uint64_t offset);
  // Positions the open file of size bytes at the start of its last line, or at its end
  // (skipping what follows) when that line is already over max_line_bytes.
  bool LastLineStart(uint64_t size, uint64_t* offset, std::string* error);

  // Restarts at 0 when the open file shrank below the position or its head changed.
  bool CheckTruncation(std::string* error);
  // Reads from the open file until its end or until *budget bytes were read.
  ReadResult ReadAvailable(const LineFn& on_line, size_t* budget, std::string* error);
  // Splits bytes read at file offset `at` into lines.
  void TakeBytes(std::string_view bytes, uint64_t at, const LineFn& on_line);
  void Emit(std::string_view line, const LineFn& on_line);
  // Hands over or counts what is left of a file being left for good.
  void FlushTail(const LineFn& on_line);
  // At the end of the open file: when the path names another file and the open one is done
  // (see the class comment), reads the open one a last time, hands over its tail and moves to
  // the new file at 0. Sets *switched when it did.
  bool FollowRotation(const LineFn& on_line, uint64_t read_this_poll, size_t* budget,
                      bool* switched, std::string* error);
  // Hashes the first min(kHeadBytes, consumed_) bytes once they are all consumed.
  bool UpdateHead(std::string* error);
  bool HeadChanged(bool* changed, std::string* error);
  void ResetReading(uint64_t offset);
  void Note(std::string text);

  const std::string path_;
  const FollowOptions options_;

  collector::UniqueFd fd_;  // the file being read; may no longer be the one at path_
  uint64_t dev_ = 0;        // st_dev of fd_
  uint64_t ino_ = 0;        // st_ino of fd_
  // Bytes of fd_'s file fully consumed: the start of the first line not yet handed over.
  uint64_t consumed_ = 0;
  uint64_t read_offset_ = 0;  // file offset of the next read
  // The unfinished line from consumed_ to read_offset_, unless skipping_; at most
  // max_line_bytes.
  std::string partial_;
  // The line from consumed_ is over max_line_bytes; bytes are dropped until its '\n'.
  bool skipping_ = false;
  uint32_t head_len_ = 0;  // leading bytes of fd_'s file covered by head_hash_
  uint64_t head_hash_ = 0;
  // Polls in a row in which fd_ gave nothing while the path named another, empty file.
  int quiet_polls_ = 0;

  std::vector<char> chunk_;  // read buffer
  bool caught_up_ = true;
  bool at_end_ = false;
  FilePosition last_saved_;
  bool saved_once_ = false;
  FollowStats stats_;
  std::vector<std::string> notes_;
};

}  // namespace accesslog
