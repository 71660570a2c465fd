#pragma once

// CheckpointWriter: writes checkpoints on a thread of its own. The analyzer copies its rows
// under the tree lock (a memory copy) and goes back to processing while this thread encodes,
// writes and syncs the file: at a few hundred thousand rows that takes seconds, which must
// not stall ingestion or table queries.
//
// One checkpoint at a time: start() refuses a job while the previous one is still being
// written or its result has not been taken, and the caller tries again at its next chance.
// A job whose file cannot be written leaves the previous checkpoint in place (CheckpointFile).
// Should the thread fail to start, the job is written on the caller's thread instead.
//
// Ownership: the writer owns the jobs handed to it; the CheckpointFile must outlive it.
// Thread safety: every public member is for one thread, the owner's (the analyzer's); the
// writing thread shares only job_, result_ and stopping_, under mutex_. The destructor
// finishes the write in progress before it returns.

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "core/history/checkpoint_file.h"
#include "framework/mutex.h"
#include "framework/thread_annotations.h"

namespace history {

// Copies sections' records out of whatever their fill functions read (the analyzer's trees),
// so that they can be written after the lock on those is given up.
std::vector<LoadedSection> CopySections(const std::vector<RecordSection>& sections);
// Sections to save that read from copied ones, which must outlive them.
std::vector<RecordSection> SectionsOf(const std::vector<LoadedSection>& copied);

struct CheckpointJob {
  uint64_t sequence = 0;  // the caller's number for it, given back in its result
  std::string description;
  std::vector<LoadedSection> sections;
};

struct CheckpointResult {
  uint64_t sequence = 0;
  bool written = false;  // false: traced by CheckpointFile, the previous checkpoint stays
  uint64_t bytes = 0;    // the records' bytes
  std::chrono::milliseconds took{0};
};

class CheckpointWriter {
 public:
  explicit CheckpointWriter(const CheckpointFile& file);
  ~CheckpointWriter();

  CheckpointWriter(const CheckpointWriter&) = delete;
  CheckpointWriter& operator=(const CheckpointWriter&) = delete;

  // A job is being written, or its result has not been taken yet.
  bool busy() const;
  // Hands a job over; false (the job is dropped) while busy.
  bool start(CheckpointJob job);
  // The result of the job handed over last, once it is written; taken by this call.
  std::optional<CheckpointResult> finished();
  // As finished, but waits for the job being written; nothing when none was handed over.
  std::optional<CheckpointResult> wait();

 private:
  void run();
  static CheckpointResult write(const CheckpointFile& file, const CheckpointJob& job);

  const CheckpointFile& file_;
  mutable fw::Mutex mutex_;
  fw::CondVar changed_;
  std::optional<CheckpointJob> job_ GUARDED_BY(mutex_);  // handed over, not written yet
  std::optional<CheckpointResult> result_ GUARDED_BY(mutex_);
  bool writing_ GUARDED_BY(mutex_) = false;
  bool stopping_ GUARDED_BY(mutex_) = false;
  std::thread thread_;  // started with the first job; owner's thread only
};

}  // namespace history
