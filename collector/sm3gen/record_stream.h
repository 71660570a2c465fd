#pragma once

// RecordStream: turns the traffic model's records into the bytes of a .sm3 stream and keeps
// the ground truth of what it emitted. It adds what a real collector's files contain besides
// clean records: the chosen line ends, blocks of junk bytes before some records, and a record
// cut off in its middle at the end. It appends to caller-owned buffers and never touches a
// file, so a file writer and a live writer can share it.
//
// The records themselves do not depend on the line ends, junk or tail chosen: those draw from
// a random source of their own.
//
// Thread safety: none.

#include <cstdint>
#include <string>

#include "collector/sm3gen/ground_truth.h"
#include "collector/sm3gen/random.h"
#include "collector/sm3gen/traffic_model.h"

namespace sm3gen {

enum class LineEnd {
  kLf,     // "\n"
  kCrLf,   // "\r\n"
  kMixed,  // either, chosen per record
};

struct StreamOptions {
  LineEnd line_end = LineEnd::kLf;
  int64_t junk_every = 0;  // a junk block before every Nth record (counting from 1); 0 = never
};

class RecordStream {
 public:
  RecordStream(const ModelOptions& model, const StreamOptions& stream);

  RecordStream(const RecordStream&) = delete;
  RecordStream& operator=(const RecordStream&) = delete;

  // Appends the next record with its line end to *out, preceded by a junk block when one is
  // due, and adds it to the truth.
  void AppendRecord(std::string* out);

  // Appends one more record cut in its middle: its header tag and part of its fields, with
  // neither trailer nor line end. The truth notes the tail but does not count the record.
  void AppendTruncatedRecord(std::string* out);

  const GroundTruth& truth() const { return truth_; }
  const TrafficModel& model() const { return model_; }

 private:
  // Appends a junk block when the record about to be written is due one.
  void MaybeAppendJunk(std::string* out);

  TrafficModel model_;
  StreamOptions options_;
  Random rng_;  // line ends, junk and the cut; never the records
  GroundTruth truth_;
  int64_t started_ = 0;  // records begun, the cut-off one included
};

}  // namespace sm3gen
