#pragma once

// From an access-log line to the exchange the collector records: the client as logged, the
// server address and port the log cannot give (from the command line), the URL host from the
// virtual host or a fixed name, and the times. A log line is written when the request ended
// (nginx) or stamps its start (Apache's %t); the request time gives the other end. The server
// time is the upstream time where logged, else the whole request time; the network time is
// what is left. A log says nothing of packets, request bytes or content types: packets and
// request bytes stay 0, and the content type comes from the URL's extension (ObjectTypeOf), so
// page views form as they do for a capture.
//
// Thread safety: pure functions.

#include <cstdint>
#include <string>
#include <string_view>

#include "collector/accesslog/log_format.h"
#include "collector/capture/http_exchange.h"

namespace accesslog {

// What the log does not say, for every line.
struct ServerSide {
  std::string host;            // URL host name when the log has no virtual host; may be empty
  capture::IpAddress address;  // the server's address
  uint16_t port = 0;           // the server's port (0: not known)
};

// The content type a URL's extension stands for: "text/html" for a page (no extension, .html,
// .php and every extension not listed as an object), "audio/*" or "video/*" for media, and
// "application/octet-stream" for other objects (.css .js .png ...; see the README).
std::string_view ContentTypeOf(std::string_view target);

// Fills *exchange (overwriting it) from entry.
void ToExchange(const LogEntry& entry, const ServerSide& server, capture::HttpExchange* exchange);

}  // namespace accesslog
