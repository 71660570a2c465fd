#pragma once

// Data events of event tables (agent messages): for every event table, a ring of its last 1000
// rows, and subscriptions that receive each row pushed after they were taken (for streaming).
//
// The rings are keyed by table name (matched in any case) and exist from process start: rows
// may be pushed before the table is registered, since "RT_AGENT_STARTED" is sent before the
// agent loader runs. Rows are kept as raw bytes of the table's row layout; readers describe
// them with the table's registered columns.
//
// Thread safety: every function and every EventSubscription member may be called from any
// thread.

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <string_view>
#include <vector>

#include "framework/mutex.h"

namespace fw {

// Rows kept per event table, and rows a subscription buffers before it drops the oldest.
inline constexpr std::size_t kEventRingCapacity = 1000;

// One pushed row, or an event that is no table's row (an alert change) as JSON.
struct EventRow {
  std::string table;             // the table's name as pushed ("Q7AGNTMSGS"), or the stream's
  std::uint64_t sequence = 0;    // order of pushes over all tables, from 1
  std::vector<std::byte> bytes;  // one row of the table's layout; empty for a JSON event
  nlohmann::ordered_json json;   // the event of a JSON stream; null for a row
};

// Copies count rows of row_size bytes at rows into the ring of table, evicting the oldest rows
// beyond kEventRingCapacity, and hands each to every open subscription. Returns kOk, or
// kInvalidArgument (and keeps nothing) for an empty table name, null rows, a zero row size or
// a count below 1.
int PushEventRows(std::string_view table, const void* rows, std::size_t row_size, int count);

// The name of the JSON stream of alert changes (alert_sampler.h).
inline constexpr char kAlertEventStream[] = "alerts";

// Keeps an event that is no table's row (a JSON object) in the ring of `stream` and hands it to
// every open subscription, numbered with the rows. kInvalidArgument for an empty stream name or
// an event that is not an object.
int PushEventJson(std::string_view stream, nlohmann::ordered_json event);

// The rows kept for table, oldest first; empty for a table that never had an event.
std::vector<EventRow> ListEventRows(std::string_view table);

// The rows kept for every table, oldest first (by sequence).
std::vector<EventRow> ListAllEventRows();

// Receives the rows pushed after it was created, until closed or destroyed (the pushers hold
// it only weakly). Rows wait in the subscription until taken; when kEventRingCapacity are
// waiting, the oldest is dropped.
class EventSubscription {
 public:
  EventSubscription(const EventSubscription&) = delete;
  EventSubscription& operator=(const EventSubscription&) = delete;

  // Waits up to timeout for a row. Returns true and fills *row with the oldest waiting row;
  // false after the timeout, or at once when the subscription is closed.
  bool Next(EventRow* row, std::chrono::milliseconds timeout);

  // Ends the subscription: Next returns false from now on, waking a waiting caller.
  void Close();
  bool closed() const;

 private:
  friend std::shared_ptr<EventSubscription> SubscribeEvents();
  friend int PushEventRows(std::string_view, const void*, std::size_t, int);
  friend int PushEventJson(std::string_view, nlohmann::ordered_json);
  EventSubscription() = default;
  void Deliver(const EventRow& row);

  mutable Mutex mutex_;
  CondVar ready_;
  std::deque<EventRow> waiting_ GUARDED_BY(mutex_);
  bool closed_ GUARDED_BY(mutex_) = false;
};

// Opens a subscription to rows of every table pushed from now on.
std::shared_ptr<EventSubscription> SubscribeEvents();

// Forgets every ring (tests only). Open subscriptions stay open.
void ResetEventsForTesting();

}  // namespace fw
