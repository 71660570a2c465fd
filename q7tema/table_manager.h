#pragma once

// The manager of a table (kq7_<table>_manager): one per table, owned by the framework's table
// registry. It receives the framework's events for the table and creates the agent object of
// each request.
//
// Thread safety: stateless, so callable from any thread.

#include <memory>
#include <string>

#include "framework/table_manager.h"
#include "framework/trace.h"
#include "q7tema/table_agent.h"

namespace q7tema {

template <typename Row>
class TableManager : public fw::TableManager {
 public:
  using Layout = TableLayout<Row>;

  std::unique_ptr<fw::TableAgent> CreateAgent(fw::Request* request) override {
    return std::make_unique<TableAgent<Row>>(request, this);
  }

  // Events are only traced: no table of this agent reacts to them yet.
  void EventArrived(fw::Request& request) override {
    Q7_TRACE("tables", fw::kTraceDetail, "%s: event for situation %s",
             std::string(Layout::kName).c_str(), request.situation.value_or("(none)").c_str());
  }

  void AddDataToEvent(fw::Request& request, const void* /*rows*/, int count) override {
    Q7_TRACE("tables", fw::kTraceDetail, "%s: %d rows for situation %s",
             std::string(Layout::kName).c_str(), count,
             request.situation.value_or("(none)").c_str());
  }
};

}  // namespace q7tema
