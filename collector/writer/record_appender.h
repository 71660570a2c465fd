#pragma once

// RecordAppender: the writer's path from raw bytes to the data directory. It cuts complete
// records out of the bytes (RecordCutter), appends them to the live file with its rollover
// (LiveFile) and keeps the ground truth of what reached the files, in sm3gen's JSON shape, so
// tests can compare an agent's tables with it. The truth is replaced atomically (temporary
// file and rename) so a reader never sees half of it.
//
// Thread safety: none; the writer's main loop owns the instance.

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

#include "collector/common/live_file.h"
#include "collector/sm3gen/ground_truth.h"
#include "collector/writer/record_cutter.h"

namespace collector {

class RecordAppender {
 public:
  using Clock = LiveFile::Clock;

  // truth_path empty: no truth is written.
  RecordAppender(LiveFileOptions file, std::string truth_path);
  RecordAppender(const RecordAppender&) = delete;
  RecordAppender& operator=(const RecordAppender&) = delete;

  bool Open(Clock::time_point now, std::string* error);

  // Appends the records these bytes complete and writes them out before returning. On a write
  // error the batch is lost (*error says how much) and later calls go on.
  bool Feed(std::string_view bytes, Clock::time_point now, std::string* error);

  // Rolls an old live file; rewrites the truth when it changed and truth_every has passed.
  bool Tick(Clock::time_point now, std::string* error);

  // End of input: a record that lacks only its line end is kept, a partial one dropped; then
  // the truth is written.
  bool Finish(Clock::time_point now, std::string* error);

  // Writes the truth now (no-op without a truth path).
  bool WriteTruth(std::string* error);

  const sm3gen::GroundTruth& truth() const { return truth_; }
  const RecordCutter& cutter() const { return cutter_; }
  const LiveFile& file() const { return file_; }
  // Complete records whose fields could not be read back: written, but not in the truth.
  int64_t unreadable() const { return unreadable_; }

  static constexpr std::chrono::seconds kTruthEvery{1};

 private:
  bool Append(std::string_view record, Clock::time_point now, std::string* error);

  RecordCutter cutter_;
  LiveFile file_;
  std::string truth_path_;
  sm3gen::GroundTruth truth_{0};  // the writer never knows the generator's seed
  int64_t unreadable_ = 0;
  bool truth_dirty_ = false;
  Clock::time_point truth_written_{};
};

}  // namespace collector
