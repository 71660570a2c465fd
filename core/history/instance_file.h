#pragma once

// InstanceFile: appends the instance records of one stem ("q7txins", "q7subtxins") to the file
// of the interval each record belongs to, "<interval start>_1_<stem>.dat" in the history
// directory, where HistoryStore::countRows and loadRows read them.
//
// Records are collected in memory and written when flush() is called, when the buffer fills
// and on destruction; each write opens the interval's file for append. Written records survive
// a crash of the process; no fsync is made, so a power loss may take the latest ones.
//
// A record that cannot be written (a full disk, a file that cannot be opened) is not dropped:
// it is held, in order, and written at the next flush that succeeds. Only beyond
// kMaxHeldBytes are new records dropped, counted and traced. The analyzer takes no checkpoint
// while records are held, since a checkpoint says what the files hold.
//
// A file only ever grows by whole records: a write that fails part way is cut back, and a file
// found ending in part of a record (a crash during a write) is cut back to its whole records
// before it is appended to, so records appended later stay aligned for the readers.
//
// Thread safety: one thread at a time; the analyzer's tree lock serialises use. At most one
// InstanceFile per directory and stem may exist.

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace history {

class InstanceFile {
 public:
  // The most held back after failed writes before new records are dropped.
  static constexpr size_t kMaxHeldBytes = 64u << 20;

  // directory: the history directory (created on the first write if missing). record_size:
  // bytes per record, more than 0. No file is opened until the first write.
  InstanceFile(std::string directory, std::string stem, size_t record_size);
  // Writes what it can of what is held.
  ~InstanceFile();

  InstanceFile(const InstanceFile&) = delete;
  InstanceFile& operator=(const InstanceFile&) = delete;

  // Queues one record of record_size bytes (copied; `record` need only live for the call) for
  // the file of `interval` (start, seconds since 1970, not negative). False when it had to be
  // dropped (too much held back, or a negative interval), or a write it caused failed (the
  // records are then held).
  bool append(int64_t interval, const void* record);

  // Writes every record queued or held, oldest first. False when some remain held (traced once
  // until a write succeeds again).
  bool flush();

  // The interval of the last record appended, or -1.
  int64_t interval() const { return interval_; }
  // Records dropped since construction.
  uint64_t droppedRecords() const { return dropped_; }
  // Records queued or held, not yet in any file.
  size_t heldRecords() const { return held_bytes_ / record_size_; }

 private:
  // The records of one interval waiting to be written.
  struct Pending {
    int64_t interval;
    std::vector<std::byte> bytes;
  };
  // Appends pending's records to its interval's file; false (errno set, file as before) when
  // it could not.
  bool write(const Pending& pending, std::string* path) const;

  const std::string directory_;  // without a trailing '/'
  const std::string stem_;
  const size_t record_size_;      // bytes per record
  int64_t interval_ = -1;         // interval of the last record appended
  std::vector<Pending> pending_;  // oldest first; the last is the one being filled
  size_t held_bytes_ = 0;         // bytes in pending_
  uint64_t dropped_ = 0;          // records lost to a full holding area
  bool failing_ = false;          // the last write failed: traced, not traced again until one works
};

}  // namespace history
