#pragma once

// What the table queries share beyond the table list (rows/analyzer_tables.h): the history
// row cap and the current-status conversions.

#include "core/analyzer/rows/analyzer_tables.h"
#include "core/layouts/table_layouts.h"

// Largest number of historical rows one query loads.
inline constexpr int MAX_ROWS = 25000;

// A current-status row from an over-time row: every column of the same name, aggby left out.
#define Q7_DECLARE_CONVERSION(cs, ot, COLUMNS) \
  void q7_convert_##ot##_to_##cs(const kq7_q7##ot##_data_t& from, kq7_q7##cs##_data_t& to);
Q7_ANALYZER_TABLES(Q7_NO_OVER_TIME, Q7_NO_SUMMARY, Q7_DECLARE_CONVERSION, Q7_NO_INSTANCE)
#undef Q7_DECLARE_CONVERSION
