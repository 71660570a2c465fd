#pragma once

// HistoryStore: the per-interval history files of the over-time tables, and the reading side of
// the instance files, in one directory (the agent's "<base>/odi/dpx/").
//
// The store keeps fixed-size byte records and knows nothing of the rows inside them: the caller
// passes the record size with every call and converts rows to and from records. A file holds
// whole records back to back; its row count is its size over the record size. Bytes past the
// last whole record (a record cut by a crash while an instance file was appended) are never
// returned and are traced as an error. A missing file is an empty interval.
//
// Interval files are replaced through a temporary file and a rename, so a file under its final
// name is always complete.
//
// Thread safety: the store holds no mutable state but the generation, so reads may run on any
// thread at any time and see either the old or the new contents of a file being replaced. Two saves
// of the same interval and stem must not overlap (they share a temporary name), nor a save with a
// cleanup that could remove its temporary file; the analyzer's tree lock serialises all writers.

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace history {

class HistoryStore {
 public:
  // directory: the history directory, with or without a trailing '/'. It is created on the
  // first write if missing; nothing is touched by the constructor.
  explicit HistoryStore(std::string directory);

  HistoryStore(const HistoryStore&) = delete;
  HistoryStore& operator=(const HistoryStore&) = delete;

  const std::string& directory() const { return directory_; }
  // The full path of the file of one interval and stem.
  std::string pathOf(int64_t interval, std::string_view stem) const;

  // Replaces the file of `interval` (start, seconds since 1970, not negative) and `stem` with
  // `count` records of `record_size` bytes read from `records` (which must hold that many;
  // it may be null when count is 0). With no records the file is removed, since a missing file
  // reads as empty. False, with the path and reason traced, when the file could not be
  // written; the previous contents then stay in place.
  bool saveInterval(int64_t interval, std::string_view stem, const void* records,
                    size_t record_size, size_t count) const;
  // The same with the records made a stretch at a time, so a large interval is never copied
  // whole: fill(first, n, out) writes records first..first+n-1 (n at most kPieceRecords) to out,
  // which it finds zeroed.
  static constexpr size_t kPieceRecords = 1024;
  using RecordFill = std::function<void(size_t first, size_t n, void* out)>;
  bool saveIntervalInPieces(int64_t interval, std::string_view stem, size_t record_size,
                            size_t count, const RecordFill& fill) const;

  // Whole records in the files of the `intervals` interval starts last_interval,
  // last_interval - interval_seconds, ... (starts below 0 are skipped).
  size_t countRows(std::string_view stem, int64_t last_interval, int intervals,
                   int64_t interval_seconds, size_t record_size) const;

  // Copies the records of the same intervals as countRows, newest interval first and each file
  // in its own order, into `out` until `max_rows` records are copied. `out` must have room for
  // max_rows * record_size bytes. Returns the number of records copied.
  size_t loadRows(std::string_view stem, int64_t last_interval, int intervals,
                  int64_t interval_seconds, size_t record_size, size_t max_rows, void* out) const;

  // The whole records of one interval, back to back; empty when the file is missing or
  // unreadable. A file that is not a whole number of records (damaged: interval files are
  // replaced whole) is set aside as "<name>.bad", traced, and reads as empty.
  std::vector<std::byte> loadInterval(int64_t interval, std::string_view stem,
                                      size_t record_size) const;

  // Removes the files of this store, of every stem, whose interval starts before
  // now - summary_seconds, with the temporary files left by a crash under the same rule. No
  // other file is touched (other names, other format versions, directories). Returns the number
  // of files removed; each removal is traced at detail level.
  int cleanupOldFiles(int64_t now, int64_t summary_seconds) const;

  // Removes the files of every stem whose interval starts after last_kept: what a run wrote
  // after its last checkpoint, which a recovery replays. Returns the number removed.
  int removeIntervalsAfter(int64_t last_kept) const;
  // Cuts the file of interval and stem back to bytes when it is longer (an instance file
  // appended to after a checkpoint). A missing file is fine when bytes is 0. False, traced,
  // when it could not be examined or cut.
  bool truncateInterval(int64_t interval, std::string_view stem, off_t bytes) const;

  // A count of the changes every store of the process has made to its files (saves, removals),
  // advanced once a change is in place: what was read after seeing one value reflects every
  // change counted up to it, so a reader keeping what it derived from the files can tell when
  // it may be stale.
  static uint64_t generation();
  // Seconds every store of the process has spent writing interval files.
  static double writeSeconds();

 private:
  // Removes the store's regular files whose interval start remove() accepts; traced as where.
  int removeFiles(const std::function<bool(int64_t)>& remove, const char* where) const;

  std::string directory_;  // history directory, without a trailing '/'
};

}  // namespace history
