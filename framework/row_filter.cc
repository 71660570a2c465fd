#include "framework/row_filter.h"

#include <algorithm>
#include <charconv>
#include <compare>
#include <cstring>
#include <string>

#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "tables";

std::string_view WithoutTrailingPadding(std::string_view text) {
  const auto end = text.find_last_not_of(std::string_view(" \0", 2));
  return text.substr(0, end == std::string_view::npos ? 0 : end + 1);
}

bool Holds(ConditionOp op, std::strong_ordering order) {
  switch (op) {
    case ConditionOp::kEQ:
      return order == 0;
    case ConditionOp::kNE:
      return order != 0;
    case ConditionOp::kLT:
      return order < 0;
    case ConditionOp::kLE:
      return order <= 0;
    case ConditionOp::kGT:
      return order > 0;
    case ConditionOp::kGE:
      return order >= 0;
  }
  return false;
}

std::string_view ConditionValue(const Condition& condition) {
  const std::string_view value = condition.value;
  return condition.value_length < 0
             ? value
             : value.substr(0, static_cast<std::size_t>(condition.value_length));
}

}  // namespace

bool RowFailsCondition(const void* row, const ColumnInfo& column, const Condition& condition) {
  const std::string_view value = WithoutTrailingPadding(ConditionValue(condition));
  if (IsTextColumn(column)) {
    return !Holds(condition.op, ColumnText(row, column) <=> value);
  }
  const std::string_view digits =
      value.substr(std::min(value.find_first_not_of(' '), value.size()));
  std::int64_t wanted = 0;
  const auto [end, error] = std::from_chars(digits.data(), digits.data() + digits.size(), wanted);
  if (digits.empty() || error != std::errc() || end != digits.data() + digits.size()) {
    Q7_TRACE(kUnit, kTraceError, "condition %s %s \"%s\": not a whole number", column.name,
             std::string(ConditionOpName(condition.op)).c_str(), std::string(value).c_str());
    return true;
  }
  return !Holds(condition.op, std::int64_t{ColumnInteger(row, column)} <=> wanted);
}

}  // namespace fw
