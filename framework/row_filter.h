#pragma once

// Reading a row's columns through their descriptions, and testing them against a request's
// filter conditions. Rows are raw bytes laid out as the table's columns say.
//
// Thread safety: pure functions of their arguments.

#include <cstdint>
#include <cstring>
#include <string_view>

#include "framework/request.h"
#include "framework/tables.h"

namespace fw {

// Inline, these three: writing a sample's answer calls them for every value.

// True for the string and long-text types.
inline bool IsTextColumn(const ColumnInfo& column) {
  return column.type == kColumnTypeString || column.type == kColumnTypeLongText;
}

// A text column's value without its padding: up to the first NUL within the width, trailing
// blanks dropped. The view points into *row.
inline std::string_view ColumnText(const void* row, const ColumnInfo& column) {
  const char* text = static_cast<const char*>(row) + column.offset;
  std::size_t size = strnlen(text, static_cast<std::size_t>(column.width));
  while (size > 0 && text[size - 1] == ' ') {
    --size;
  }
  return {text, size};
}

// An integer column's value (a 16-bit column widened).
inline std::int32_t ColumnInteger(const void* row, const ColumnInfo& column) {
  const char* at = static_cast<const char*>(row) + column.offset;
  if (column.type == kColumnTypeInt16) {
    std::int16_t value = 0;
    std::memcpy(&value, at, sizeof(value));
    return value;
  }
  std::int32_t value = 0;
  std::memcpy(&value, at, sizeof(value));
  return value;
}

// True when the row's column does NOT satisfy the condition (the row is an exception to it).
// Text compares byte-wise without padding on either side; integers compare numerically, and an
// integer condition whose value is not a whole number holds for no row (traced).
bool RowFailsCondition(const void* row, const ColumnInfo& column, const Condition& condition);

}  // namespace fw
