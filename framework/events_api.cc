#include "framework/events_api.h"

#include <httplib.h>

#include <chrono>
#include <cstddef>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "framework/events.h"
#include "framework/http_json.h"
#include "framework/mutex.h"
#include "framework/sample_query.h"
#include "framework/status.h"
#include "framework/table_sample.h"
#include "framework/tables.h"
#include "framework/trace.h"

namespace fw {
namespace {

using namespace std::chrono_literals;

constexpr char kUnit[] = "http";
// How long a stream waits for a row before it looks whether it should end.
constexpr auto kStreamPoll = 200ms;
// A comment line this often finds clients that went away while no rows came.
constexpr auto kStreamHeartbeat = 15s;

// How long a stop waits for open streams to write their end before the server closes sockets.
constexpr auto kStreamEndWait = 1s;

// The streams of one server.
struct StreamControl {
  Mutex mutex;
  CondVar ended;  // notified when a stream goes away
  bool ending GUARDED_BY(mutex) = false;
  int open GUARDED_BY(mutex) = 0;
  std::vector<std::weak_ptr<EventSubscription>> subscriptions GUARDED_BY(mutex);
};

// The stream controls by server, so EndEventStreams finds them without the server's help.
struct Controls {
  Mutex mutex;
  std::map<const httplib::Server*, std::shared_ptr<StreamControl>> by_server GUARDED_BY(mutex);
};

Controls& TheControls() {
  static Controls controls;
  return controls;
}

// Rows and their text need not be valid UTF-8; a strict dump would throw.
std::string Dump(const nlohmann::ordered_json& body, int indent) {
  return body.dump(indent, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
}

// The row as a table sample shows it; nullopt when its table is not registered or the row is
// not of the table's size.
std::optional<nlohmann::ordered_json> RowToJson(const EventRow& row) {
  if (!row.json.is_null()) {
    return row.json;
  }
  Sample sample;
  sample.table = FindTable(row.table);
  if (sample.table == nullptr || sample.table->row_size != row.bytes.size()) {
    return std::nullopt;
  }
  sample.rows = row.bytes;
  return SampleToJson(sample)["rows"][0];
}

void ServeEvents(const httplib::Request& req, httplib::Response& res) {
  if (req.get_param_value_count("limit") > 1) {
    ReplyError(res, 400, "limit given more than once");
    return;
  }
  std::optional<std::size_t> limit;
  if (req.has_param("limit")) {
    std::size_t value = 0;
    std::string error;
    if (ParseLimit(req.get_param_value("limit"), &value, &error) != kOk) {
      ReplyError(res, 400, error);
      return;
    }
    limit = value;
  }
  std::vector<EventRow> rows = ListAllEventRows();
  if (limit.has_value() && *limit < rows.size()) {
    rows.erase(rows.begin(), rows.end() - static_cast<std::ptrdiff_t>(*limit));
  }
  nlohmann::ordered_json events = nlohmann::ordered_json::array();
  for (const EventRow& row : rows) {
    if (auto json = RowToJson(row)) {
      events.push_back(std::move(*json));
    }
  }
  ReplyJson(res, 200, nlohmann::ordered_json{{"events", std::move(events)}});
}

void ServeStream(const std::shared_ptr<StreamControl>& control, httplib::Response& res) {
  // Subscribe before answering, so no row pushed from here on is missed.
  std::shared_ptr<EventSubscription> subscription;
  {
    MutexLock lock(control->mutex);
    if (control->ending) {
      ReplyError(res, 503, "the server is stopping");
      return;
    }
    if (control->open >= kMaxEventStreams) {
      ReplyError(res, 503,
                 "too many event streams open (at most " + std::to_string(kMaxEventStreams) + ")");
      return;
    }
    subscription = SubscribeEvents();
    ++control->open;
    std::erase_if(control->subscriptions, [](const auto& weak) { return weak.expired(); });
    control->subscriptions.push_back(subscription);
  }
  Q7_TRACE(kUnit, kTraceDetail, "event stream opened");
  res.set_header("Cache-Control", "no-cache");
  auto last_write =
      std::make_shared<std::chrono::steady_clock::time_point>(std::chrono::steady_clock::now());
  res.set_chunked_content_provider(
      "text/event-stream",
      [subscription, last_write](std::size_t /*offset*/, httplib::DataSink& sink) {
        EventRow row;
        std::string chunk;
        if (subscription->Next(&row, kStreamPoll)) {
          if (auto json = RowToJson(row)) {
            // Alert changes are named, so a browser's EventSource can listen for them apart.
            chunk = (row.json.is_null() ? "" : "event: " + row.table + "\n") +
                    "data: " + Dump(*json, -1) + "\n\n";
          }
        } else if (subscription->closed()) {
          sink.done();
          return true;
        } else if (std::chrono::steady_clock::now() - *last_write >= kStreamHeartbeat) {
          chunk = ": keep-alive\n\n";
        }
        if (chunk.empty()) {
          return sink.is_writable();
        }
        *last_write = std::chrono::steady_clock::now();
        return sink.write(chunk.data(), chunk.size());
      },
      // Runs when the response goes away, however the stream ended.
      [control, subscription](bool /*success*/) {
        subscription->Close();
        {
          MutexLock lock(control->mutex);
          --control->open;
        }
        control->ended.NotifyAll();
        Q7_TRACE(kUnit, kTraceDetail, "event stream closed");
      });
}

}  // namespace

void InstallEventRoutes(httplib::Server& server) {
  auto control = std::make_shared<StreamControl>();
  {
    Controls& controls = TheControls();
    MutexLock lock(controls.mutex);
    controls.by_server[&server] = control;
  }
  server.Get("/api/v1/events", ServeEvents);
  server.Get("/api/v1/events/stream", [control](const httplib::Request&, httplib::Response& res) {
    ServeStream(control, res);
  });
}

void EndEventStreams(httplib::Server& server) {
  std::shared_ptr<StreamControl> control;
  {
    Controls& controls = TheControls();
    MutexLock lock(controls.mutex);
    const auto it = controls.by_server.find(&server);
    if (it == controls.by_server.end()) {
      return;
    }
    control = std::move(it->second);
    controls.by_server.erase(it);
  }
  MutexLock lock(control->mutex);
  control->ending = true;
  for (const auto& weak : control->subscriptions) {
    if (auto subscription = weak.lock()) {
      subscription->Close();
    }
  }
  control->subscriptions.clear();
  // Each stream, woken by its closed subscription, writes the end of its chunked reply; the
  // server's stop would otherwise shut the socket under a stream about to end cleanly. A client
  // that does not read is not waited for beyond the bound.
  control->ended.WaitFor(control->mutex, kStreamEndWait,
                         [&control]() REQUIRES(control->mutex) { return control->open == 0; });
}

}  // namespace fw
