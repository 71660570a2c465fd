#pragma once

// LiveFile: the collector's live data file and its rollover, as the agent expects them. Records
// are appended to <dir>/<stem>.sm3; when the next record would take the file past roll_bytes,
// or the file has held data for roll_seconds, it is renamed to <stem>-NNNN.sm3 (NNNN counts on
// from the highest number already in the directory) and a new, empty live file is created at
// once: while the live name is missing the agent re-reads the renamed file on every look.
//
// Only whole records are passed in, so a record never spans two files. Appended bytes are
// gathered per batch and written with write(2) on Flush; nothing else buffers them.
//
// Thread safety: none; one thread owns an instance.

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

#include "collector/common/unique_fd.h"

namespace collector {

struct LiveFileOptions {
  std::string dir;                    // data directory; created if missing
  std::string stem = "traffic";       // live file is <stem>.sm3
  uint64_t roll_bytes = 64ull << 20;  // roll before exceeding this size; 0 = never
  int64_t roll_seconds = 3600;        // roll a file holding data this long; 0 = never
};

class LiveFile {
 public:
  using Clock = std::chrono::steady_clock;

  explicit LiveFile(LiveFileOptions options);
  LiveFile(const LiveFile&) = delete;
  LiveFile& operator=(const LiveFile&) = delete;

  // Opens (or creates) the live file and appends to what it holds. now starts its age.
  bool Open(Clock::time_point now, std::string* error);

  // Adds one complete record (with its line end) to the batch, rolling first when it would
  // make the file too big. A record larger than roll_bytes gets a file of its own.
  bool Append(std::string_view record, Clock::time_point now, std::string* error);

  // Writes the batch. On a failed or short write the file is cut back to its last whole
  // record and the batch is dropped (the error says so).
  bool Flush(std::string* error);

  // Rolls a live file that has held data for roll_seconds. Call a few times a second.
  bool Tick(Clock::time_point now, std::string* error);

  std::string live_path() const;
  // Bytes in the live file including the unwritten batch.
  uint64_t size() const { return size_ + batch_.size(); }
  // Files renamed by this instance.
  int64_t rolled() const { return rolled_; }

 private:
  bool Roll(Clock::time_point now, std::string* error);
  // The highest NNNN among <stem>-NNNN.sm3 in the directory, 0 when none.
  int64_t HighestNumber() const;

  LiveFileOptions options_;
  UniqueFd fd_;
  uint64_t size_ = 0;          // bytes written to the live file
  std::string batch_;          // whole records not yet written
  Clock::time_point since_{};  // when the live file first held data
  int64_t next_number_ = 1;    // NNNN of the next rename
  int64_t rolled_ = 0;
};

}  // namespace collector
