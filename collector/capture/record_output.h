#pragma once

// Record outputs of sm3capture: a file (or standard output), or the writer process's FIFO as
// `sm3gen --live` feeds it. Either way only whole records, one a line, reach the reader.
//
// FifoOutput waits for a reader without blocking the capture: records queue in memory (at
// most max_queued_bytes; beyond that they are counted lost, as traffic the collector could not
// keep), and go out as the FIFO takes them. When the reader goes away in the middle of a
// record, the rest of that record is dropped (the writer discards a partial record) and the
// records queued after it wait for the next reader.
//
// Thread safety: none; the capture thread owns an output.

#include <chrono>
#include <cstdint>
#include <deque>
#include <memory>
#include <string>

#include "collector/capture/capture_stats.h"
#include "collector/capture/record_sink.h"
#include "collector/common/unique_fd.h"

namespace capture {

class RecordOutput : public RecordSink {
 public:
  // Moves queued bytes on without waiting long; false with *error on a failure to report.
  virtual bool Pump(std::string* error) = 0;
  // Writes what is left, waiting at most until deadline; false with *error on failure.
  virtual bool Finish(std::chrono::steady_clock::time_point deadline, std::string* error) = 0;
  // True while so much waits that a producer who can wait (a file being read) should: then
  // WaitForRoom blocks up to timeout for the reader to take some.
  virtual bool Backlogged() const { return false; }
  virtual void WaitForRoom(std::chrono::milliseconds) {}
  // True when every record written so far has left the process (to the file, or into the
  // FIFO): a producer may then count them as delivered.
  virtual bool Drained() const = 0;
};

class FileOutput : public RecordOutput {
 public:
  // stats must outlive the output.
  explicit FileOutput(CaptureStats* stats) : stats_(stats) {}
  // path "-" is standard output.
  bool Open(const std::string& path, std::string* error);

  void Write(const sm3gen::Record& record) override;
  bool Pump(std::string* error) override;
  bool Finish(std::chrono::steady_clock::time_point deadline, std::string* error) override;
  bool Drained() const override { return buffer_.empty(); }

 private:
  bool WriteAll(std::string* error);

  CaptureStats* const stats_;
  collector::UniqueFd fd_;
  bool borrowed_ = false;  // standard output: not ours to close
  std::string path_;
  std::string buffer_;
  std::string failure_;  // a write error, reported at the next Pump
};

class FifoOutput : public RecordOutput {
 public:
  static constexpr size_t kDefaultMaxQueued = 16u << 20;

  FifoOutput(CaptureStats* stats, size_t max_queued_bytes = kDefaultMaxQueued)
      : stats_(stats), max_queued_(max_queued_bytes) {}
  ~FifoOutput() override;
  // Makes sure path is a FIFO (creating it) and connects if a reader is there.
  bool Open(const std::string& path, std::string* error);

  void Write(const sm3gen::Record& record) override;
  bool Pump(std::string* error) override;
  bool Finish(std::chrono::steady_clock::time_point deadline, std::string* error) override;

  bool Backlogged() const override { return bytes_.size() - begun_ >= max_queued_ / 2; }
  void WaitForRoom(std::chrono::milliseconds timeout) override;
  bool Drained() const override { return sent_ == bytes_.size(); }

  bool connected() const { return fd_.valid(); }

 private:
  bool TryConnect(std::string* error);

  CaptureStats* const stats_;
  const size_t max_queued_;
  std::string path_;
  collector::UniqueFd fd_;
  std::string bytes_;        // queued records, whole, one a line
  size_t sent_ = 0;          // bytes of bytes_ the FIFO has taken
  size_t begun_ = 0;         // start of the first record not wholly taken
  std::deque<size_t> ends_;  // offset in bytes_ just past each queued record
  std::chrono::steady_clock::time_point next_connect_{};
};

// The output a collector program was asked for: a file (out_path, "-" for standard output) or
// the writer's FIFO (fifo_path); exactly one is non-empty. nullptr with *error when it cannot be
// opened. stats must outlive the output.
std::unique_ptr<RecordOutput> OpenRecordOutput(const std::string& out_path,
                                               const std::string& fifo_path, CaptureStats* stats,
                                               std::string* error);

// Pump, then, when the producer can wait (wait), keep pumping while the output is backlogged
// and no stop was requested. False with *error when the output failed.
bool PumpOutput(RecordOutput* output, bool wait, std::string* error);

}  // namespace capture
