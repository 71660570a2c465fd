#pragma once

// JSON replies of the HTTP API: every answer, errors included, is a JSON body.
//
// Thread safety: pure functions on the response they are given.

#include <httplib.h>

#include <nlohmann/json.hpp>
#include <string>
#include <utility>

namespace fw {

// Table rows and echoed request text need not be valid UTF-8; a strict dump would throw.
template <typename Json>
void ReplyJson(httplib::Response& res, int status, const Json& body) {
  res.status = status;
  res.set_content(body.dump(2, ' ', false, Json::error_handler_t::replace) + "\n",
                  "application/json");
}

// A body already written as JSON text, moved into the reply: samples run to megabytes.
inline void ReplyJsonText(httplib::Response& res, int status, std::string body) {
  res.status = status;
  res.set_content("", 0, "application/json");
  res.body = std::move(body);
}

// {"error": message} with the status.
inline void ReplyError(httplib::Response& res, int status, const std::string& message) {
  ReplyJson(res, status, nlohmann::json{{"error", message}});
}

}  // namespace fw
