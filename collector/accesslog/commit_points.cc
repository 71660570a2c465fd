#include "collector/accesslog/commit_points.h"

namespace accesslog {

void CommitPoints::Reached(uint64_t lines, const FilePosition& position) {
  if (position.ino == 0 || (!points_.empty() && points_.back().second == position)) {
    return;
  }
  if (points_.size() == kMaxPoints) {
    points_.pop_front();
  }
  points_.emplace_back(lines, position);
}

std::optional<FilePosition> CommitPoints::TakeSafe(uint64_t oldest_held) {
  std::optional<FilePosition> safe;
  // Lines 1..lines are written when every held line is later than them.
  while (!points_.empty() && points_.front().first < oldest_held) {
    safe = points_.front().second;
    points_.pop_front();
  }
  return safe;
}

}  // namespace accesslog
