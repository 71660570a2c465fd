#pragma once

// Live mode: sm3gen as the collector's capture process. Records are emitted at a steady rate
// with time stamps of the current time, into the FIFO the writer process reads, or straight
// into a data directory with the writer's rollover.
//
// Traffic goes on whether or not anyone writes it down: while no writer has the FIFO open, or
// the FIFO stays full, the records that fall due are counted as lost, so time stamps always
// follow the clock. Only whole records go into the FIFO; if the writer vanishes in the middle
// of one, the rest of it is dropped with the writer's pipe.

#include <cstdint>
#include <string>

#include "collector/common/live_file.h"
#include "collector/sm3gen/traffic_model.h"

namespace sm3gen {

struct LiveJob {
  ModelOptions model;                  // rate = records per second of wall time; start is now
  std::string fifo;                    // write into this FIFO (created when missing), or
  collector::LiveFileOptions out_dir;  // with dir set: into this data directory instead
  std::string truth_path;              // empty: none; else the truth of records written
  int64_t records = 0;                 // stop after this many records written; 0 = never
};

struct LiveStats {
  int64_t written = 0;  // records that reached the FIFO or file whole
  int64_t lost = 0;     // records that fell due while nobody could take them
};

// Runs until the record limit or a stop request (collector::InstallStopHandlers must have
// run), ending at a record boundary. False with *error when it cannot start or an output file
// fails.
bool RunLiveMode(const LiveJob& job, LiveStats* stats, std::string* error);

}  // namespace sm3gen
