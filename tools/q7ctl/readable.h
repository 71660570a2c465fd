#pragma once

// q7ctl's readable forms of the agent's raw values, for people at a terminal:
//   - framework timestamps ("CYYMMDDHHMMSSmmm", the agent's local time: "1261124094000000" is
//     2026-11-24 09:40:00) become "2026-11-24 09:40:00";
//   - percentages kept in thousandths of a percent (pcfail, pcslow, pcgood, pcavail, pct1xx ...
//     pct500: 100000 is 100 %) become "12.5%".
// Values of other columns, and values that are not of the form their column promises, are kept
// as they are. --raw (or JSON output, which is for programs) skips all of it.
//
// Thread safety: pure functions.

#include <optional>
#include <string>

#include "tools/q7ctl/format.h"

namespace q7ctl {

// "2026-11-24 09:40:00" from a framework timestamp; nullopt when text is not one.
std::optional<std::string> ReadableTimestamp(const std::string& text);

// "12.5%" from thousandths of a percent: one decimal, none when whole.
std::string ReadablePercent(long long thousandths);

// True for the columns whose values are timestamps, and for those in thousandths of a percent.
bool IsTimestampColumn(const std::string& column);
bool IsPercentColumn(const std::string& column);

// rows (an array of objects) with every timestamp and percentage in its readable form.
Json ReadableRows(const Json& rows);

}  // namespace q7ctl
