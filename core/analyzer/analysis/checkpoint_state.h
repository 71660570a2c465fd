#pragma once

// CheckpointState: what a checkpoint holds besides the current interval's rows: the interval,
// the read position that produced the rows, the instance files' lengths, the patterns' counters
// and the little state processing carries from one record to the next. Kept as the checkpoint
// file's description, in JSON, so that an operator can read it.
//
// Thread safety: a plain value.

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "core/analyzer/intake/read_position.h"
#include "core/analyzer/situation_controller.h"

struct InstanceFileLength {
  std::string stem;
  int64_t interval = 0;
  int64_t bytes = 0;
};

struct CheckpointState {
  uint64_t sequence = 0;  // counts the checkpoints of this agent's home
  int64_t interval = 0;   // start of the interval the rows belong to
  int64_t written = 0;    // when it was taken, seconds since 1970
  ReadPosition position;
  int instanceLevel = 0;  // of the last page, which the objects after it take
  int32_t oldTransactions = 0;
  int32_t transactionsReceived = 0;
  std::vector<InstanceFileLength> instanceFiles;
  std::vector<PatternCounter> patterns;

  std::string encode() const;
  // False with *why when text is not a whole, sensible description.
  static bool decode(std::string_view text, CheckpointState* state, std::string* why);
};
