#pragma once

// Which columns `q7ctl sample` shows. The tables carry 5 to 57 columns, most of them counters an
// operator rarely reads; at a terminal each table gets a default set (its keys, then the figures
// that tell whether it is doing well, most telling first), which the table output trims from the
// right to fit 120 characters. --columns picks others, --all shows every column.
//
// Thread safety: pure functions.

#include <string>
#include <vector>

#include "tools/q7ctl/format.h"

namespace q7ctl {

// Width that the default table output fits.
inline constexpr std::size_t kDefaultLineWidth = 120;

// The default set of table's columns, most telling first; empty for a table without one (every
// column is then shown). Table names are matched without regard to case.
std::vector<std::string> DefaultColumns(const std::string& table);

// rows keeping only `columns`, in that order, each named as the rows name it (names match
// without regard to case). A name that no row has is added to *unknown and left out; rows that
// lack a column a later row has simply lack it.
Json SelectColumns(const Json& rows, const std::vector<std::string>& columns,
                   std::vector<std::string>* unknown);

}  // namespace q7ctl
