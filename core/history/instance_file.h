#pragma once

// InstanceFile: appends the instance records of one stem ("q7txins", "q7subtxins") to the file
// of the interval each record belongs to, "<interval start>_1_<stem>.dat" in the history
// directory, where HistoryStore::countRows and loadRows read them.
//
// Records are collected in memory and written when flush() is called, when the buffer fills,
// when a record of another interval arrives (the current file is then written and closed and
// the other interval's file opened for append) and on destruction. Written records survive a
// crash of the process; no fsync is made, so a power loss may take the latest ones.
//
// A file only ever grows by whole records: a write that fails part way is cut back, and a file
// found ending in part of a record (a crash during a write) is cut back to its whole records
// when it is opened, so records appended later stay aligned for the readers.
//
// Thread safety: one thread at a time; the analyzer's tree lock serialises use. At most one
// InstanceFile per directory and stem may exist.

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "framework/file_io.h"

namespace history {

class InstanceFile {
 public:
  // directory: the history directory (created on the first write if missing). record_size:
  // bytes per record, more than 0. No file is opened until the first append.
  InstanceFile(std::string directory, std::string stem, size_t record_size);
  // Writes what is buffered, then closes the file.
  ~InstanceFile();

  InstanceFile(const InstanceFile&) = delete;
  InstanceFile& operator=(const InstanceFile&) = delete;

  // Queues one record of record_size bytes (copied; `record` need only live for the call) for
  // the file of `interval` (start, seconds since 1970, not negative). False when the record,
  // or records written because of it, could not be stored; they are dropped, counted and
  // traced.
  bool append(int64_t interval, const void* record);

  // Writes the buffered records to the open file. False when some were dropped.
  bool flush();

  // The interval whose file is open, or -1.
  int64_t interval() const { return interval_; }
  // Records dropped because a file could not be opened or written, since construction.
  uint64_t droppedRecords() const { return dropped_; }

 private:
  // Flushes the current file and opens the file of `interval` for append.
  bool switchTo(int64_t interval);

  const std::string directory_;  // without a trailing '/'
  const std::string stem_;
  const size_t record_size_;        // bytes per record
  int64_t interval_ = -1;           // interval start of the open file, -1 before the first
  fw::UniqueFd fd_;                 // the open file (O_APPEND); invalid when opening failed
  off_t committed_ = 0;             // bytes of the open file known to be whole records
  std::vector<std::byte> pending_;  // whole records not yet written
  uint64_t dropped_ = 0;            // records lost to failed opens or writes
};

}  // namespace history
