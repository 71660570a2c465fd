#include "q7tema/table_base.h"

#include <string>

#include "framework/row_filter.h"
#include "framework/trace.h"

namespace q7tema {
namespace {

constexpr char kUnit[] = "tables";

}  // namespace

int FillColumnInfo(std::span<const fw::ColumnInfo> columns, fw::ColumnInfo* info, int index) {
  if (info == nullptr) {
    return fw::kInvalidArgument;
  }
  const int count = static_cast<int>(columns.size());
  if (index < 0 || index > count) {
    return fw::kBadColumnIndex;
  }
  // One past the last column is not refused; it describes nothing.
  *info = index == count ? fw::ColumnInfo{} : columns[static_cast<std::size_t>(index)];
  return fw::kOk;
}

void PrintRow(const void* row, std::span<const fw::ColumnInfo> columns) {
  if (!fw::TraceEnabled(kUnit, fw::kTraceDetail)) {
    return;
  }
  const char* bytes = static_cast<const char*>(row);
  for (const fw::ColumnInfo& column : columns) {
    if (fw::IsTextColumn(column)) {
      fw::TracePrintf(kUnit, fw::kTraceDetail, "PrintSelf", "\t\t%s=\"%.*s\"\n", column.name,
                      column.width, bytes + column.offset);
    } else {
      fw::TracePrintf(kUnit, fw::kTraceDetail, "PrintSelf", "\t\t%s=%d\n", column.name,
                      static_cast<int>(fw::ColumnInteger(row, column)));
    }
  }
}

bool RowIsException(std::string_view table, const void* row,
                    std::span<const fw::ColumnInfo> columns, const fw::Condition& condition) {
  const fw::ColumnInfo* column = fw::FindColumn(columns, condition.column);
  if (column == nullptr) {
    Q7_TRACE(kUnit, fw::kTraceError, "%s has no column \"%s\"", std::string(table).c_str(),
             condition.column.c_str());
    return true;
  }
  return fw::RowFailsCondition(row, *column, condition);
}

}  // namespace q7tema
