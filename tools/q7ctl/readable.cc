#include "tools/q7ctl/readable.h"

#include <cstdio>
#include <string_view>

namespace q7ctl {

std::optional<std::string> ReadableTimestamp(const std::string& text) {
  if (text.size() != 16 || text.find_first_not_of("0123456789") != std::string::npos ||
      (text[0] != '0' && text[0] != '1')) {
    return std::nullopt;
  }
  const auto number = [&text](std::size_t at, std::size_t n) {
    return std::stoi(text.substr(at, n));
  };
  const int year = 1900 + number(0, 3);
  const int month = number(3, 2);
  const int day = number(5, 2);
  const int hour = number(7, 2);
  const int minute = number(9, 2);
  const int second = number(11, 2);
  if (month < 1 || month > 12 || day < 1 || day > 31 || hour < 0 || hour > 23 || minute < 0 ||
      minute > 59 || second < 0 || second > 60) {
    return std::nullopt;  // a zero stamp, or anything else that is no time
  }
  char out[80];  // room for any int, so the compiler need not prove the ranges
  std::snprintf(out, sizeof(out), "%04d-%02d-%02d %02d:%02d:%02d", year, month, day, hour, minute,
                second);
  return std::string(out);
}

std::string ReadablePercent(long long thousandths) {
  const bool negative = thousandths < 0;
  const unsigned long long magnitude = negative
                                           ? 0ULL - static_cast<unsigned long long>(thousandths)
                                           : static_cast<unsigned long long>(thousandths);
  // Rounded to a tenth of a percent: 100 thousandths.
  const unsigned long long tenths = (magnitude + 50) / 100;
  char out[32];
  if (tenths % 10 == 0) {
    std::snprintf(out, sizeof(out), "%s%llu%%", negative ? "-" : "", tenths / 10);
  } else {
    std::snprintf(out, sizeof(out), "%s%llu.%llu%%", negative ? "-" : "", tenths / 10, tenths % 10);
  }
  return out;
}

bool IsTimestampColumn(const std::string& column) {
  return column == "timestamp" || column == "sampletime" || column == "msgdattime" ||
         column == "sdate_time";
}

bool IsPercentColumn(const std::string& column) {
  static constexpr std::string_view kPercents[] = {"pcfail", "pcslow", "pcgood", "pcavail"};
  for (const std::string_view name : kPercents) {
    if (column == name) {
      return true;
    }
  }
  // pct1xx ... pct5xx, pct403, pct404, pct500
  return column.size() == 6 && column.compare(0, 3, "pct") == 0;
}

Json ReadableRows(const Json& rows) {
  Json out = rows;
  for (Json& row : out) {
    if (!row.is_object()) {
      continue;
    }
    for (auto& [column, value] : row.items()) {
      if (value.is_string() && IsTimestampColumn(column)) {
        if (const auto readable = ReadableTimestamp(value.get<std::string>())) {
          value = *readable;
        }
      } else if (value.is_number_integer() && IsPercentColumn(column)) {
        value = ReadablePercent(value.get<long long>());
      }
    }
  }
  return out;
}

}  // namespace q7ctl
