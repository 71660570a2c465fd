#pragma once

// The writer process's main loop: reads the FIFO and hands the bytes to a RecordAppender
// until SIGINT or SIGTERM. The FIFO is opened for reading and writing, so it stays open while
// capture processes come and go (no end-of-file, no busy loop) and a capture process can open
// it for writing whenever it starts.

#include <memory>
#include <string>

#include "collector/common/live_file.h"
#include "collector/common/unique_fd.h"

namespace collector {

struct WriterOptions {
  std::string fifo;        // created when missing
  LiveFileOptions file;    // data directory, stem and rollover
  std::string truth_path;  // empty: none
};

class RecordAppender;

class Writer {
 public:
  explicit Writer(WriterOptions options);
  ~Writer();
  Writer(const Writer&) = delete;
  Writer& operator=(const Writer&) = delete;

  // Opens the FIFO and the live file. False with *error when the writer cannot run.
  bool Open(std::string* error);

  // Runs until a stop is requested (InstallStopHandlers must have run), then writes the
  // complete records already in the FIFO and the truth. Errors while running are reported on
  // standard error and the loop goes on.
  void Run();

 private:
  WriterOptions options_;
  UniqueFd fifo_;
  std::unique_ptr<RecordAppender> appender_;
};

}  // namespace collector
