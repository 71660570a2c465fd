#pragma once

// Reading a row's columns through their descriptions, and testing them against a request's
// filter conditions. Rows are raw bytes laid out as the table's columns say.
//
// Thread safety: pure functions of their arguments.

#include <cstdint>
#include <string_view>

#include "framework/request.h"
#include "framework/tables.h"

namespace fw {

// True for the string and long-text types.
bool IsTextColumn(const ColumnInfo& column);

// A text column's value without its padding: up to the first NUL within the width, trailing
// blanks dropped. The view points into *row.
std::string_view ColumnText(const void* row, const ColumnInfo& column);

// An integer column's value (a 16-bit column widened).
std::int32_t ColumnInteger(const void* row, const ColumnInfo& column);

// True when the row's column does NOT satisfy the condition (the row is an exception to it).
// Text compares byte-wise without padding on either side; integers compare numerically, and an
// integer condition whose value is not a whole number holds for no row (traced).
bool RowFailsCondition(const void* row, const ColumnInfo& column, const Condition& condition);

}  // namespace fw
