#pragma once

// File mode: writes a fixed number of records to one file (or standard output) in one go, and
// optionally the ground truth as JSON beside it.

#include <cstdint>
#include <string>

#include "collector/sm3gen/record_stream.h"
#include "collector/sm3gen/traffic_model.h"

namespace sm3gen {

struct FileJob {
  std::string out_path;    // "-" for standard output
  std::string truth_path;  // empty: no truth; "-" for standard output
  bool append = false;     // append to out_path instead of replacing it
  int64_t records = 1000;  // complete records to write
  bool truncate_tail = false;
  ModelOptions model;
  StreamOptions stream;
};

// Runs the job. Returns true on success; on an I/O error returns false with *error naming the
// file and the reason. The truth's byte count is what this run wrote, so with append it is the
// growth of the file.
bool RunFileMode(const FileJob& job, std::string* error);

}  // namespace sm3gen
