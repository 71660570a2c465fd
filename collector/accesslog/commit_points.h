#pragma once

// CommitPoints: which follower position may be saved while lines already read are still held
// in open page views. A position is safe once every line before it has its record written;
// saving a later one would skip the held lines after a crash, saving none would repeat
// everything since the last save.
//
// The reader notes the follower's position with the number of lines handed over so far after
// each poll; whoever holds records says which line is the oldest still held; the latest noted
// position whose lines are all older than that is the one to save.
//
// Thread safety: none; the reading thread owns it.

#include <cstdint>
#include <deque>
#include <optional>
#include <utility>

#include "collector/accesslog/follow_state.h"

namespace accesslog {

class CommitPoints {
 public:
  // Positions kept at most; beyond, the oldest go (a later save may then have to wait for the
  // next point, never skip a line).
  static constexpr size_t kMaxPoints = 4096;

  // The follower stood at `position` after handing over `lines` lines in all (lines numbered
  // from 1). Positions with no file (ino 0) and repeats of the last one are ignored.
  void Reached(uint64_t lines, const FilePosition& position);

  // The latest position all of whose lines are written, when the oldest line whose record is
  // still held is number `oldest_held` (UINT64_MAX: nothing is held); the points up to it are
  // dropped. nullopt when no noted position is safe yet.
  std::optional<FilePosition> TakeSafe(uint64_t oldest_held);

  size_t size() const { return points_.size(); }

 private:
  std::deque<std::pair<uint64_t, FilePosition>> points_;  // oldest first, lines increasing
};

}  // namespace accesslog
