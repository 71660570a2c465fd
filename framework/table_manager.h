#pragma once

// The interfaces through which the framework reaches a table's code: one manager object per
// table, and one agent object per request that the manager creates.
//
// Thread safety: a manager is called from any framework thread and must be thread-safe; an
// agent object is used by one thread at a time.

#include <memory>

#include "framework/request.h"

namespace fw {

// Serves one request on one table.
class TableAgent {
 public:
  virtual ~TableAgent() = default;

  // A situation on the table starts (request type 4); the agent object lives until
  // TakeSampleDestructor.
  virtual void TakeSampleConstructor() = 0;
  // Takes one sample: the rows go to the request through the agent object's AddData.
  virtual void TakeSample() = 0;
  // The situation stops; nothing is asked of the object afterwards.
  virtual void TakeSampleDestructor() = 0;
};

// A table's manager: receives the framework's events for the table and creates its agent
// objects.
class TableManager {
 public:
  virtual ~TableManager() = default;

  // Creates the agent object that serves *request. *request and this manager must outlive it.
  virtual std::unique_ptr<TableAgent> CreateAgent(Request* request) = 0;

  // An event for the table arrived for *request (a started situation).
  virtual void EventArrived(Request& request) = 0;
  // count rows of the table's row layout at *rows belong to the event announced for *request.
  // *rows is only valid during the call.
  virtual void AddDataToEvent(Request& request, const void* rows, int count) = 0;
};

}  // namespace fw
