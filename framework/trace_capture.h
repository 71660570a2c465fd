#pragma once

// Test helper: while alive, every trace record is also kept in memory (formatted as in the
// trace file, without the time stamp), and the masks are set to the given ones. The previous
// masks come back on destruction. One capture at a time.

#include <string>
#include <string_view>
#include <vector>

namespace fw {

class TraceCapture {
 public:
  explicit TraceCapture(std::string_view masks = "*=ALL");
  ~TraceCapture();
  TraceCapture(const TraceCapture&) = delete;
  TraceCapture& operator=(const TraceCapture&) = delete;

  // The records so far: "[thread] unit CLASS func: text".
  std::vector<std::string> lines() const;
  // True when some record contains text.
  bool contains(std::string_view text) const;
  // How many records contain text.
  int count(std::string_view text) const;
  void clear();

 private:
  std::string previous_masks_;  // TraceMasksText() before this capture, restored on destruction
};

}  // namespace fw
