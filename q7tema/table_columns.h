#pragma once

// Each row layout's name and column descriptions, built from table_layouts.h: the offsets are
// the row struct's own (offsetof), so the descriptions cannot drift from the rows.
//
//   q7tema::TableLayout<kq7_q7appot_data_t>::kName     "Q7APPOT"
//   q7tema::TableLayout<kq7_q7appot_data_t>::kLowerName "q7appot"
//   q7tema::TableLayout<kq7_q7appot_data_t>::kColumns  std::array<fw::ColumnInfo, N>
//   kq7_q7appot_columns                                 the same array
//
// Header-only constants; safe from any thread.

#include <array>
#include <cstddef>
#include <string_view>

#include "core/layouts/table_layouts.h"
#include "framework/tables.h"

namespace q7tema {

static_assert(kColumnString == fw::kColumnTypeString && kColumnInteger == fw::kColumnTypeInt32 &&
              kColumnShort == fw::kColumnTypeInt16 && kColumnLongText == fw::kColumnTypeLongText);

// Specialised below for every row type of table_layouts.h.
template <typename Row>
struct TableLayout;

#define Q7_COLUMN_TYPE_S ::q7tema::kColumnString
#define Q7_COLUMN_TYPE_X ::q7tema::kColumnLongText
#define Q7_COLUMN_TYPE_I ::q7tema::kColumnInteger
#define Q7_COLUMN_TYPE_H ::q7tema::kColumnShort
#define Q7_COLUMN_INFO(kind, name, width) \
  ::fw::ColumnInfo{#name, Q7_COLUMN_TYPE_##kind, width, static_cast<int>(offsetof(Row, name))},
#define Q7_TABLE_LAYOUT(lower, exported, COLUMNS)                                                \
  template <>                                                                                    \
  struct TableLayout<::kq7_##lower##_data_t> {                                                   \
    using Row = ::kq7_##lower##_data_t;                                                          \
    static constexpr std::string_view kName = exported;                                          \
    static constexpr std::string_view kLowerName = #lower;                                       \
    static constexpr auto kColumns = std::to_array<::fw::ColumnInfo>({COLUMNS(Q7_COLUMN_INFO)}); \
  };

Q7_EXPORTED_TABLES(Q7_TABLE_LAYOUT)
Q7_UNEXPORTED_LAYOUTS(Q7_TABLE_LAYOUT)

#undef Q7_TABLE_LAYOUT
#undef Q7_COLUMN_INFO
#undef Q7_COLUMN_TYPE_H
#undef Q7_COLUMN_TYPE_I
#undef Q7_COLUMN_TYPE_X
#undef Q7_COLUMN_TYPE_S

}  // namespace q7tema

#define Q7_COLUMNS_NAME(lower, exported, COLUMNS)      \
  inline constexpr const auto& kq7_##lower##_columns = \
      q7tema::TableLayout<kq7_##lower##_data_t>::kColumns;

Q7_EXPORTED_TABLES(Q7_COLUMNS_NAME)
Q7_UNEXPORTED_LAYOUTS(Q7_COLUMNS_NAME)

#undef Q7_COLUMNS_NAME
