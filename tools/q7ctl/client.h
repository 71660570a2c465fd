#pragma once

// The agent's HTTP API as q7ctl uses it: request targets, request bodies, and a client that
// turns every reply into either JSON or one message fit for the operator.
//
// The client is used from one thread; it owns one cpp-httplib connection to the agent.

#include <functional>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

namespace httplib {
class Client;
}

namespace q7ctl {

using Json = nlohmann::ordered_json;

// Outcome of a call: ok, or the message for the operator, e.g. "no such table (HTTP 404)".
class Result {
 public:
  static Result Ok() { return Result(""); }
  static Result Error(std::string message) { return Result(std::move(message)); }

  bool ok() const { return message_.empty(); }
  const std::string& message() const { return message_; }

 private:
  explicit Result(std::string message) : message_(std::move(message)) {}

  std::string message_;  // empty when ok
};

// Percent-encodes text for a URL query value or path segment: everything but RFC 3986's
// unreserved characters is escaped, so '+', '&', '=', '/' and blanks survive the trip.
std::string UrlEncode(const std::string& text);

// GET target of one sample: "/api/v1/tables/T?where=...&where=...&limit=N". Each where text is
// "COLUMN OP VALUE", passed on as it is (the agent checks it). limit is omitted when nullopt.
std::string SampleTarget(const std::string& table, const std::vector<std::string>& wheres,
                         std::optional<long> limit);

// GET target of the latency figures: "/api/v1/latency?by=BY&window=WINDOW&where=...".
std::string LatencyTarget(const std::string& by, const std::string& window,
                          const std::vector<std::string>& wheres);

// Target of one situation: "/api/v1/situations/NAME".
std::string SituationTarget(const std::string& name);

// One "COLUMN=VALUE" word of `situation start` as an EQ condition
// {"column": COLUMN, "op": "EQ", "value": VALUE}. Splits at the first '=', so the value may hold
// '='. Fails without '=' or with an empty column.
bool ParseCondition(const std::string& word, Json* condition, std::string* error);

// The PUT body that starts a situation: {"table": ..., "conditions": [...]}, conditions in the
// order given (a pattern table reads complete sets of conditions in order).
Json SituationBody(const std::string& table, const Json& conditions);

// Splits a server-sent event stream into the data of each event. Feed it the bytes as they
// come, in chunks of any size: it returns the events a chunk completed. An event ends at a
// blank line; its "data:" lines are joined by '\n'; comments (":...") and other fields are
// skipped. Lines may end in LF or CRLF.
class SseParser {
 public:
  std::vector<std::string> Feed(const std::string& chunk);

 private:
  std::string pending_;  // bytes after the last complete line
  std::string data_;     // data lines of the event being read
  bool has_data_ = false;
};

// A client of one agent.
class ApiClient {
 public:
  // url: "http://host:port" or "https://host:port". When token is not empty it is sent as
  // "Authorization: Bearer <token>" on every request. ca_certificate: the PEM file that HTTPS
  // verifies the agent's certificate against (empty: the system's CAs); the host name or
  // address must match the certificate either way.
  ApiClient(const std::string& url, std::string token, const std::string& ca_certificate = "");
  ~ApiClient();

  ApiClient(const ApiClient&) = delete;
  ApiClient& operator=(const ApiClient&) = delete;

  // One request; on success *reply holds the reply's JSON (null for an empty body). A 4xx/5xx
  // reply becomes "<error> (HTTP <status>)" with the text of its {"error": ...}; a failed
  // connection names the URL and hints that the agent may not be running.
  Result Get(const std::string& target, Json* reply);
  Result Put(const std::string& target, const Json& body, Json* reply);
  Result Delete(const std::string& target, Json* reply);

  // Reads a server-sent event stream, calling on_event with each event's JSON data until the
  // server ends the stream (then an error: a stream ends only when the agent stops) or
  // on_event returns false (then ok). Events whose data is not JSON are skipped.
  Result Stream(const std::string& target, const std::function<bool(const Json&)>& on_event);

 private:
  const std::string url_;
  const std::string token_;
  std::unique_ptr<httplib::Client> http_;  // null when url_ is not an http(s)://host:port URL
};

}  // namespace q7ctl
