#pragma once

// Cutting records out of a chunk of data-file text.
//
// A chunk is a NUL-terminated buffer the caller owns, read from a data file at the last processed
// offset. Records are taken one after another; a pass reports how many bytes it consumed, and the
// caller advances its file offset by exactly that much. Bytes skipped before a header tag are
// passed over by the cursor but not counted as consumed, so the next pass starts that many bytes
// early: a record whose header lies wholly in that stretch is seen again. A record whose trailer
// is not in the chunk yet stops the pass unconsumed and is read again, whole, on a later pass.
//
// Thread safety: no shared state; each call works on the caller's buffer.

#include <memory>

// Read size of a data-file monitor. A chunk of exactly this length may have been cut by the
// read, so messages about a missing header or trailer use a softer wording for it.
inline constexpr long MAX_BUFFER = 32768;

// Finds the earliest header tag of the four record kinds in the NUL-terminated buffer and its
// trailer after it. Returns 0 with the positions, tag lengths and record type filled; 1 when no
// header occurs (nothing filled); 2 when the header occurs but its trailer does not.
int findHeader(char* buffer, char** headerStart, char** trailerStart, int* headerLength,
               int* trailerLength, int* recordType, bool fullBuffer);

// Takes the next record at *cursor. Returns a new NUL-terminated copy of its content (between
// the tags), or null when there is no complete record. On success *cursor moves past the record
// and the line ends that follow it, and *remaining drops and *consumed is set by the record's
// length (tags, content and line ends; bytes skipped before the header are not counted). *consumed
// is 0 when null is returned.
std::unique_ptr<char[]> getSM3Line(char** cursor, long* remaining, bool fullBuffer, long* consumed,
                                   int* recordType);

// What a pass over a chunk hands each record to (the data file monitor).
class CSM3RecordSink {
 public:
  virtual ~CSM3RecordSink() = default;
  // Called for each complete record with its content and record type. The content lies in the
  // chunk, ended by a NUL for this call only; the sink may modify it, but no further than its
  // NUL, and must not keep it. Returning false stops the pass at
  // this record, which is then not consumed (a record dropped at shutdown is read again at the
  // next start).
  virtual bool processSM3Line(char* line, int recordType) = 0;
};

// Hands every complete record of chunk[0, length) to sink in order and returns the bytes
// consumed. chunk must be writable and NUL-terminated at chunk[length]. A NUL byte inside the
// chunk is read as a blank, so that a stray NUL in a data file cannot hide the records after it.
long processDPXContents(char* chunk, long length, bool fullBuffer, CSM3RecordSink& sink);

namespace sm3_internal {

// findHeader without its messages. With result 2 the header position, tag lengths and type are
// filled and *trailerStart is null.
int findHeaderQuiet(char* buffer, char** headerStart, char** trailerStart, int* headerLength,
                    int* trailerLength, int* recordType);

// The same as a plain substring search of every tag over the whole buffer, for tests that
// compare it with the fast search.
int findHeaderLiteral(char* buffer, char** headerStart, char** trailerStart, int* headerLength,
                      int* trailerLength, int* recordType);

}  // namespace sm3_internal
