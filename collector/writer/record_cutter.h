#pragma once

// RecordCutter: finds complete collector records in a byte stream that arrives in pieces of
// any size (reads from the FIFO). A record is a header tag (<hpage>, <hobj>, <audio>,
// <video>), one line of fields free of '<', the matching trailer tag and its line end ("\n" or
// "\r\n"). Only complete records are handed out; a record still arriving waits in the buffer
// for its rest. Bytes outside records, and a record cut off by a new header (its producer died
// mid-write), are dropped and counted, so the files hold nothing but whole records.
//
// Thread safety: none; one thread owns an instance.

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

namespace collector {

class RecordCutter {
 public:
  // Called with each complete record, line end included. The view is valid only during the
  // call.
  using Emit = std::function<void(std::string_view record)>;

  // Records longer than this are corrupt; their bytes are dropped.
  static constexpr size_t kMaxRecord = 64 * 1024;

  RecordCutter() = default;
  RecordCutter(const RecordCutter&) = delete;
  RecordCutter& operator=(const RecordCutter&) = delete;

  // Adds bytes and emits every record they complete, in stream order.
  void Feed(std::string_view bytes, const Emit& emit);

  // End of input: emits a last record that lacks only its line end (given "\n"), drops
  // anything else left. Returns the bytes dropped by this call.
  uint64_t Finish(const Emit& emit);

  // Bytes waiting for the rest of their record.
  size_t pending() const { return buffer_.size() - start_; }
  int64_t records() const { return records_; }
  // Bytes dropped so far: junk between records, cut-off and oversized records.
  uint64_t dropped_bytes() const { return dropped_; }

 private:
  enum class Scan { kRecord, kNeedMore, kDropped };
  // Examines the buffer from start_: emits one record, or drops junk, or needs more bytes.
  Scan Step(const Emit& emit, bool at_end);
  void Drop(size_t count);

  std::string buffer_;
  size_t start_ = 0;  // bytes of buffer_ already consumed
  int64_t records_ = 0;
  uint64_t dropped_ = 0;
};

}  // namespace collector
