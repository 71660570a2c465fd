#pragma once

// The agent object of a table (kq7_<table>_agent): serves one request. The manager creates one
// per request.
//
// Thread safety: used by one thread at a time (see fw::TableAgent).

#include <cctype>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "framework/request.h"
#include "framework/trace.h"
#include "q7tema/row_query.h"
#include "q7tema/table_base.h"

namespace q7tema {

// True for the columns whose condition values the type-1 constructor also traces.
inline bool IsTracedValueColumn(std::string_view column) {
  std::string lower(column);
  for (char& c : lower) {
    c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  }
  return lower == "oatime" || lower == "pcgood";
}

// The request type whose conditions the constructor traces.
inline constexpr int kTracedConditionsRequestType = 1;

template <typename Row>
class TableAgent : public TableBase<Row> {
 public:
  using Layout = typename TableBase<Row>::Layout;
  using TableBase<Row>::TableBase;

  void TakeSampleConstructor() override {
    const std::string tag = "k" + std::string(Layout::kLowerName) + "::";
    Q7_TRACE("tables", fw::kTraceDetail, "%s TakeSampleConstructor", tag.c_str());
    const fw::Request& request = *this->request();
    if (request.type != kTracedConditionsRequestType) {
      return;
    }
    for (const fw::Condition& condition : request.conditions) {
      Q7_TRACE("tables", fw::kTraceDetail, "%s Column Name=%s", tag.c_str(),
               condition.column.c_str());
      if (IsTracedValueColumn(condition.column)) {
        const std::string value =
            condition.value_length < 0
                ? condition.value
                : condition.value.substr(0, static_cast<std::size_t>(condition.value_length));
        Q7_TRACE("tables", fw::kTraceDetail, "%s Column Value=%d", tag.c_str(),
                 std::atoi(value.c_str()));
      }
    }
  }

  // Hands over the rows of the query registered for Row (SetRowQuery); none without one.
  void TakeSample() override {
    const LimitedRowQuery<Row> query = LimitedRowQueryFor<Row>();
    if (!query) {
      Q7_TRACE("tables", fw::kTraceDetail, "%s: no row query, no rows",
               std::string(Layout::kName).c_str());
      return;
    }
    // The framework filters after the query, so only without conditions are the query's first
    // rows the ones kept.
    const fw::Request& request = *this->request();
    const std::size_t limit = request.conditions.empty() ? request.row_limit : fw::kNoRowLimit;
    int count = 0;
    const std::unique_ptr<Row[]> rows(query(request.type, limit, &count));
    const int added = rows != nullptr && count >= 1 ? count : 0;
    if (added > 0) {
      this->AddData(rows.get(), added);
    }
    Q7_TRACE("tables", fw::kTraceDetail, "%s: %d rows", std::string(Layout::kName).c_str(), added);
  }

  void TakeSampleDestructor() override {
    Q7_TRACE("tables", fw::kTraceDetail, "k%s:: TakeSampleDestructor",
             std::string(Layout::kLowerName).c_str());
  }
};

}  // namespace q7tema
