#pragma once

// StateFile: the agent's state that outlives a restart, kept in "<base>/q7state.properties" as
// one "LastHistoricalQueryTime.<table>=<seconds>" line per table (the time of the last
// historical query of that table, seconds since 1970).
//
// Lines with other keys are kept and written back unchanged, so the file can carry state this
// class does not know. save() replaces the file through a temporary file and a rename.
//
// Thread safety: one thread at a time; the analyzer's tree lock serialises use.

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace history {

class StateFile {
 public:
  // path: the state file; nothing is read until load().
  explicit StateFile(std::string path);

  // Replaces what is held with the file's contents. A missing file reads as empty; a line with
  // an unreadable time is skipped and traced. False, traced, when the file cannot be read.
  bool load();
  // Writes what is held. False, traced, when the file could not be replaced (it then keeps its
  // previous contents).
  bool save() const;

  // table: a table name without '=' or line breaks.
  std::optional<int64_t> getLastHistoricalQueryTime(std::string_view table) const;
  void setLastHistoricalQueryTime(std::string_view table, int64_t seconds);

 private:
  const std::string path_;
  std::map<std::string, int64_t, std::less<>> last_query_;  // table -> seconds since 1970
  std::vector<std::string> other_lines_;                    // lines of other keys, in file order
};

}  // namespace history
