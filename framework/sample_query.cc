#include "framework/sample_query.h"

#include <array>
#include <cctype>
#include <charconv>
#include <cstdint>
#include <utility>

#include "framework/row_filter.h"
#include "framework/status.h"

namespace fw {
namespace {

// The same rule the row filter applies: optional blanks around a decimal that fits 64 bits.
bool IsWholeNumber(std::string_view text) {
  const auto first = text.find_first_not_of(' ');
  const auto last = text.find_last_not_of(' ');
  if (first == std::string_view::npos) {
    return false;
  }
  text = text.substr(first, last - first + 1);
  std::int64_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  return error == std::errc() && end == text.data() + text.size();
}

std::string CsvField(std::string_view text) {
  if (text.find_first_of(",\"\r\n") == std::string_view::npos) {
    return std::string(text);
  }
  std::string quoted = "\"";
  for (char c : text) {
    quoted += c;
    if (c == '"') {
      quoted += '"';
    }
  }
  quoted += '"';
  return quoted;
}

}  // namespace

int ParseWhere(std::string_view text, std::span<const ColumnInfo> columns, Condition* condition,
               std::string* error) {
  const auto first = text.find(' ');
  const auto second = first == std::string_view::npos ? first : text.find(' ', first + 1);
  if (second == std::string_view::npos) {
    *error = "where \"" + std::string(text) + "\" is not COLUMN OP VALUE";
    return kInvalidArgument;
  }
  const std::string_view column_name = text.substr(0, first);
  const std::string_view op_name = text.substr(first + 1, second - first - 1);
  const std::string_view value = text.substr(second + 1);

  const ColumnInfo* column = FindColumn(columns, column_name);
  if (column == nullptr) {
    *error = "where: unknown column \"" + std::string(column_name) + "\"";
    return kInvalidArgument;
  }
  ConditionOp op = ConditionOp::kEQ;
  if (!ParseConditionOp(op_name, &op)) {
    *error = "where: unknown operator \"" + std::string(op_name) + "\" (EQ NE LT LE GT GE)";
    return kInvalidArgument;
  }
  if (!IsTextColumn(*column) && !IsWholeNumber(value)) {
    *error = "where: " + std::string(column->name) + " is an integer column, \"" +
             std::string(value) + "\" is not a whole number";
    return kInvalidArgument;
  }
  *condition = Condition{column->name, op, std::string(value), -1};
  return kOk;
}

int ParseLimit(std::string_view text, std::size_t* limit, std::string* error) {
  std::size_t value = 0;
  const auto [end, parse_error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || parse_error != std::errc() || end != text.data() + text.size()) {
    *error = "limit \"" + std::string(text) + "\" is not a non-negative whole number";
    return kInvalidArgument;
  }
  *limit = value;
  return kOk;
}

int ParseSampleFormat(std::string_view text, SampleFormat* format, std::string* error) {
  if (text == "json") {
    *format = SampleFormat::kJson;
  } else if (text == "csv") {
    *format = SampleFormat::kCsv;
  } else {
    *error = "format \"" + std::string(text) + "\" is neither json nor csv";
    return kInvalidArgument;
  }
  return kOk;
}

nlohmann::ordered_json SampleToJson(const Sample& sample) {
  nlohmann::ordered_json rows = nlohmann::ordered_json::array();
  for (int i = 0; i < sample.row_count(); ++i) {
    const void* row = sample.row(i);
    nlohmann::ordered_json object = nlohmann::ordered_json::object();
    for (const ColumnInfo& column : sample.table->columns) {
      if (IsTextColumn(column)) {
        object[column.name] = std::string(ColumnText(row, column));
      } else {
        object[column.name] = ColumnInteger(row, column);
      }
    }
    rows.push_back(std::move(object));
  }
  nlohmann::ordered_json body;
  body["table"] = sample.table->name;
  body["rows"] = std::move(rows);
  return body;
}

std::string SampleToCsv(const Sample& sample) {
  std::string out;
  const auto& columns = sample.table->columns;
  for (std::size_t c = 0; c < columns.size(); ++c) {
    out += (c == 0 ? "" : ",") + CsvField(columns[c].name);
  }
  out += '\n';
  for (int i = 0; i < sample.row_count(); ++i) {
    const void* row = sample.row(i);
    for (std::size_t c = 0; c < columns.size(); ++c) {
      if (c != 0) {
        out += ',';
      }
      out += IsTextColumn(columns[c]) ? CsvField(ColumnText(row, columns[c]))
                                      : std::to_string(ColumnInteger(row, columns[c]));
    }
    out += '\n';
  }
  return out;
}

}  // namespace fw
