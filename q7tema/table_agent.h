#pragma once

// The agent object of a table (kq7_<table>_agent): serves one request. The manager creates one
// per request.
//
// Thread safety: used by one thread at a time (see fw::TableAgent).

#include <string>

#include "framework/trace.h"
#include "q7tema/table_base.h"

namespace q7tema {

template <typename Row>
class TableAgent : public TableBase<Row> {
 public:
  using Layout = typename TableBase<Row>::Layout;
  using TableBase<Row>::TableBase;

  void TakeSampleConstructor() override {
    Q7_TRACE("tables", fw::kTraceDetail, "%s", std::string(Layout::kName).c_str());
  }

  // Adds no rows: the analyzer does not hand its rows to the tables' agent objects yet, so every
  // sample is empty.
  void TakeSample() override {
    Q7_TRACE("tables", fw::kTraceDetail, "%s: no rows", std::string(Layout::kName).c_str());
  }

  void TakeSampleDestructor() override {
    Q7_TRACE("tables", fw::kTraceDetail, "%s", std::string(Layout::kName).c_str());
  }
};

}  // namespace q7tema
